#pragma once
// What the fuzz targets share: the input of the run under way, for the fakes
// linked into a target that answer from it; exact-size heap copies, so that
// the address sanitizer sees a read one byte too far; and a sink that reads
// every byte the code under test claims to hand over.
#include <fuzzer/FuzzedDataProvider.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace fuzz {

inline FuzzedDataProvider*& input() {
  static FuzzedDataProvider* current = nullptr;
  return current;
}

// Makes `in` the input the fakes answer from, for the scope's lifetime.
struct CurrentInput {
  explicit CurrentInput(FuzzedDataProvider& in) { input() = &in; }
  ~CurrentInput() { input() = nullptr; }
};

// A heap copy of exactly text.size() + 1 bytes, NUL-terminated.
inline std::unique_ptr<char[]> terminated(const std::string& text) {
  std::unique_ptr<char[]> buf(new char[text.size() + 1]);
  memcpy(buf.get(), text.data(), text.size());
  buf[text.size()] = '\0';
  return buf;
}

inline void touch(const uint8_t* p, size_t n) {
  static volatile uint8_t sink;
  if (n != 0 && p == nullptr) abort();
  for (size_t i = 0; i < n; ++i) sink = static_cast<uint8_t>(sink ^ p[i]);
}

}  // namespace fuzz

// The AT tokenizer over arbitrary response lines: a line is split into a
// field-kind script and a text, and the fields are taken apart as a handler
// would, checking that every cursor and token stays inside the line.
#include <at_tok.h>

#include "fuzz_util.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FuzzedDataProvider in(data, size);
  const uint8_t script = in.ConsumeIntegral<uint8_t>();
  const bool start = in.ConsumeBool();
  const std::string text = in.ConsumeRemainingBytesAsString();
  // The line as the reader hands it out: a heap copy, NUL-terminated.
  const std::unique_ptr<char[]> line = fuzz::terminated(text);
  const size_t len = strlen(line.get());
  const auto inside = [&](const char* p) { return p >= line.get() && p <= line.get() + text.size(); };

  char* cur = line.get();
  if (start && at_tok_start(&cur) < 0) {
    if (cur != nullptr) abort();  // a failed start leaves no cursor
    return 0;
  }
  // Up to eight fields; the bits of `script` choose int or string.
  for (int i = 0; i < 8 && cur != nullptr; ++i) {
    if (!inside(cur)) abort();
    if ((script >> i) & 1) {
      int32_t v = 0;
      (void)at_tok_nextint(&cur, &v);
    } else {
      char* s = nullptr;
      if (at_tok_nextstr(&cur, &s) != 0) abort();
      if (s == nullptr || !inside(s)) abort();
      if (strlen(s) > len) abort();
    }
  }
  // Every call on a spent cursor fails cleanly.
  if (cur == nullptr) {
    int32_t v = 0;
    char* s = nullptr;
    if (at_tok_nextint(&cur, &v) != -1 || at_tok_nextstr(&cur, &s) != -1) abort();
  }
  return 0;
}

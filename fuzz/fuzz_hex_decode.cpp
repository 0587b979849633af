// hexDecode over arbitrary text, lengths and output sizes, checked against
// a plain reference and round-tripped through hexEncode.
#include "async_cmd.h"
#include "fuzz_util.h"

namespace {

int nibble(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FuzzedDataProvider in(data, size);
  const size_t outSize = in.ConsumeIntegralInRange<size_t>(0, 300);
  const int32_t extra = in.ConsumeIntegralInRange<int32_t>(-3, 3);
  const std::string text = in.ConsumeRemainingBytesAsString();
  const std::unique_ptr<char[]> buf = fuzz::terminated(text);
  // n may claim fewer characters than there are, never more than the text
  // has (the callers bound it with strnlen), or be negative.
  int32_t n = static_cast<int32_t>(text.size()) + (extra > 0 ? -extra : extra);
  if (extra == 3) n = -1;

  std::vector<uint8_t> out(outSize + 1, 0xA5);  // one guard byte past outSize
  int32_t got = hexDecode(buf.get(), n, outSize ? out.data() : nullptr, outSize);
  if (out[outSize] != 0xA5) abort();  // wrote past outSize

  bool valid = n >= 0 && n % 2 == 0 && static_cast<size_t>(n / 2) <= outSize;
  for (int32_t i = 0; valid && i < n; ++i) valid = nibble(buf[i]) >= 0;
  if (!valid) {
    if (got != -1) abort();
    return 0;
  }
  if (got != n / 2) abort();
  for (int32_t i = 0; i < got; ++i) {
    if (out[i] != ((nibble(buf[2 * i]) << 4) | nibble(buf[2 * i + 1]))) abort();
  }
  // Back to text: the upper-case form of the same characters.
  std::vector<char> again(static_cast<size_t>(n) + 1);
  if (hexEncode(out.data(), got, again.data(), again.size()) != n) abort();
  for (int32_t i = 0; i < n; ++i) {
    if (nibble(again[i]) != nibble(buf[i])) abort();
  }
  // One byte short of room for the terminator is refused.
  if (hexEncode(out.data(), got, again.data(), again.size() - 1) != -1) abort();
  return 0;
}

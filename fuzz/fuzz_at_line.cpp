// The port reader's line cutter and classifier over arbitrary byte streams
// cut into arbitrary read sizes: over-long lines, prompts, NULs, CR/LF runs
// and SMS-type pairs, with and without a command waiting for its answer.
#include <at_line.h>
#include <atchannel.h>
#include <host/log_capture.h>

#include "fuzz_util.h"

namespace {

struct Stream {
  FuzzedDataProvider* in;
  int reads = 0;
};

// Each read hands out a chunk of a size the input chooses; now and then a
// read fails or reports end of file, as a port may.
int32_t readChunk(void* arg, char* dest, int32_t max_len) {
  Stream* s = static_cast<Stream*>(arg);
  if (max_len <= 0) abort();  // the reader always leaves room to read into
  if (s->in->remaining_bytes() == 0) return 0;
  ++s->reads;
  const uint8_t op = s->in->ConsumeIntegral<uint8_t>();
  if (op == 0xFF) return -1;
  if (op == 0xFE) return 0;
  // Chunks of up to 64 bytes, or (op odd) up to the whole room: over-long
  // lines need big reads to be reached in a short input.
  size_t want = (op & 1) ? static_cast<size_t>(max_len) : (op >> 2) + 1u;
  if (want > static_cast<size_t>(max_len)) want = static_cast<size_t>(max_len);
  std::string chunk = s->in->ConsumeBytesAsString(want);
  if ((op & 2) && !chunk.empty() && (op & 1)) {
    // Stretch a short chunk to fill the room with its last byte: a cheap way
    // to make lines of thousands of bytes from a few input bytes.
    chunk.resize(want, chunk.back());
  }
  memcpy(dest, chunk.data(), chunk.size());
  return static_cast<int32_t>(chunk.size());
}

void checkLine(const char* line, const char* buf) {
  if (line < buf || line >= buf + AT_LINE_BUF_SIZE) abort();
  size_t len = strnlen(line, static_cast<size_t>(buf + AT_LINE_BUF_SIZE - line));
  if (line + len >= buf + AT_LINE_BUF_SIZE) abort();  // not terminated inside the buffer
  if (len >= static_cast<size_t>(AT_LINE_BUF_DATA)) abort();
  if (strpbrk(line, "\r\n") != nullptr) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  android::host::LogCapture quiet;
  FuzzedDataProvider in(data, size);
  const int32_t pending = in.ConsumeBool();
  const int32_t type = in.ConsumeBool() ? at_type_singleline : at_type_none;
  const char* prefixes[] = {nullptr, "+CGLA:", "+CSIM:", "^CARDATR:", ">"};
  const char* prefix = prefixes[in.ConsumeIntegralInRange<int>(0, 4)];

  // Exactly the buffer's size on the heap, so an overrun is seen at once.
  std::unique_ptr<char[]> buf(new char[AT_LINE_BUF_SIZE]);
  char* cur = nullptr;
  char* end = nullptr;
  at_line_reset(buf.get(), &cur, &end);
  Stream s{&in};
  int32_t hasIntermediate = 0;
  bool smsPduNext = false;
  // A bound on the loop: every line or EOF consumes at least one byte of input.
  for (int guard = 0; guard < 100000; ++guard) {
    char* line = nullptr;
    int32_t r = at_line_next(buf.get(), &cur, &end, readChunk, &s, &line);
    if (r == AT_LINE_READ_ERROR || r == AT_LINE_EOF) {
      if (in.remaining_bytes() == 0) break;
      continue;  // the reader goes on after a failed or empty read
    }
    if (r != AT_LINE_READY) abort();
    checkLine(line, buf.get());
    if (cur < buf.get() || end < buf.get() || cur > end || end > buf.get() + AT_LINE_BUF_DATA) abort();
    if (*end != '\0') abort();
    if (smsPduNext) {
      smsPduNext = false;
      continue;
    }
    AtLineKind kind = at_classify_line(line, pending, type, hasIntermediate, prefix);
    switch (kind) {
      case AT_KIND_UNSOLICITED:
        if (at_is_sms_unsolicited(line)) smsPduNext = true;
        break;
      case AT_KIND_INTERMEDIATE:
        if (!pending || hasIntermediate || type != at_type_singleline) abort();
        hasIntermediate = 1;
        break;
      case AT_KIND_FINAL_SUCCESS:
      case AT_KIND_FINAL_ERROR:
        if (!pending) abort();
        hasIntermediate = 0;
        break;
      default:
        abort();
    }
    const char* masked = at_mask_find(line);
    if (masked != nullptr && strcasestr(line, masked) == nullptr) abort();
  }
  return 0;
}

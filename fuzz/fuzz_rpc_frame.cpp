// The RPC host's frame decoder fed arbitrary frames: the one-shot decoder on
// the raw input, then the stream decoder on the same bytes cut into chunks
// the input chooses. Every decoded frame must encode back to the bytes it
// came from, and no more than one frame may ever be held back.
#include <host/rpc_wire.h>

#include "fuzz_util.h"

using namespace android::host::rpc;

namespace {

void checkRoundTrip(const Frame& f, const uint8_t* from, size_t len) {
  std::vector<uint8_t> again;
  if (!encodeFrame(f, &again)) abort();
  if (again.size() != len || memcmp(again.data(), from, len) != 0) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) return 0;
  const uint8_t cut = data[0];
  const uint8_t* bytes = data + 1;
  const size_t len = size - 1;

  // One-shot: every decoded frame re-encodes to exactly what was consumed.
  std::vector<Frame> oneShot;
  size_t pos = 0;
  bool malformed = false;
  while (pos < len) {
    Frame f;
    size_t used = 0;
    DecodeStatus st = decodeFrame(bytes + pos, len - pos, &f, &used);
    if (st == DecodeStatus::NeedMore) {
      if (used != 0) abort();
      break;
    }
    if (st == DecodeStatus::Malformed) {
      malformed = true;
      break;
    }
    if (used < kHeaderSize || used > len - pos || f.body.size() > kMaxBodySize) abort();
    checkRoundTrip(f, bytes + pos, used);
    oneShot.push_back(f);
    pos += used;
  }

  // Streamed in chunks of 1..(cut+1) bytes: the same frames, the same verdict.
  FrameDecoder dec;
  std::vector<Frame> streamed;
  size_t at = 0;
  const size_t chunk = static_cast<size_t>(cut) + 1;
  while (at < len) {
    size_t n = len - at < chunk ? len - at : chunk;
    bool ok = dec.feed(bytes + at, n);
    at += n;
    Frame f;
    while (dec.next(&f)) streamed.push_back(f);
    if (!ok) break;
    if (dec.pending() >= kHeaderSize + kMaxBodySize) abort();
  }
  if (dec.broken() != malformed) abort();
  if (streamed.size() != oneShot.size()) abort();
  for (size_t i = 0; i < streamed.size(); ++i) {
    const Frame& a = streamed[i];
    const Frame& b = oneShot[i];
    if (a.kind != b.kind || a.id != b.id || a.object != b.object || a.code != b.code ||
        a.body != b.body) {
      abort();
    }
  }
  if (!malformed && dec.pending() != len - pos) abort();

  // The body readers over the last body: every read bounded.
  if (!oneShot.empty()) {
    const std::vector<uint8_t>& body = oneShot.back().body;
    BodyReader r(body);
    for (int i = 0; i < 16 && r.ok(); ++i) {
      switch ((cut >> (i % 4)) & 3) {
        case 0: { uint32_t v; r.u32(&v); break; }
        case 1: { bool v; r.boolean(&v); break; }
        case 2: { ::android::hardware::hidl_vec<uint8_t> v; if (r.bytes(&v) && v.size() > body.size()) abort(); break; }
        default: { std::string s; if (r.text(&s, kMaxErrorText) && s.size() > kMaxErrorText) abort(); break; }
      }
    }
  }
  return 0;
}

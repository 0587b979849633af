#pragma once
// Wire format of the RPC host: fixed-width little-endian frames and the
// bounded readers and writers of their bodies. Pure code with no I/O, so the
// frame decoder can be fed arbitrary bytes (tests, fuzzing).
//
// Frame: header of six little-endian u32 fields, then `bodyLength` bytes.
//   magic | kind | id | object | code | bodyLength
// kind Call:  `object` names the target (0 = the registered instance, other
//             values = an object the peer exported), `code` the method.
// kind Reply: answers the Call with the same `id`; `code` 0.
// kind Error: answers the Call with the same `id`; the call failed in
//             transport; `code` carries a status, the body a short text.
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include <hidl/HidlSupport.h>

namespace android {
namespace host {
namespace rpc {

constexpr uint32_t kFrameMagic = 0x31484553;  // "SEH1" as little-endian bytes
constexpr size_t kHeaderSize = 24;
// The largest APDU (extended length) is a little over 64 KiB; the rest is room
// for the other arguments of one call.
constexpr size_t kMaxBodySize = 65536 + 1024;
// Error texts are short; longer ones are cut before sending.
constexpr size_t kMaxErrorText = 256;

enum class FrameKind : uint32_t { Call = 1, Reply = 2, Error = 3 };

struct Frame {
  FrameKind kind = FrameKind::Call;
  uint32_t id = 0;
  uint32_t object = 0;
  uint32_t code = 0;
  std::vector<uint8_t> body;
};

enum class DecodeStatus {
  Ok,         // one frame decoded; *consumed bytes used
  NeedMore,   // a valid prefix of a frame; nothing consumed
  Malformed,  // never a frame: bad magic, kind or length
};

// Decodes the frame at the start of `data`. The header is checked before the
// body is looked at, so a bad length is reported after kHeaderSize bytes.
// `why` (optional) receives a reason for Malformed.
DecodeStatus decodeFrame(const uint8_t* data, size_t len, Frame* out, size_t* consumed,
                         std::string* why = nullptr);

// Encodes a frame; false (and nothing written) when the body is too large.
bool encodeFrame(const Frame& frame, std::vector<uint8_t>* out);

// Accumulates a byte stream and cuts it into frames. At most one frame (header
// plus kMaxBodySize) is ever buffered.
class FrameDecoder {
 public:
  // Appends bytes; false when the stream is malformed (the decoder then stays broken).
  bool feed(const uint8_t* data, size_t len);
  // Takes the next complete frame, if any.
  bool next(Frame* out);
  bool broken() const { return mBroken; }
  const std::string& error() const { return mError; }
  // Bytes of an incomplete frame held back.
  size_t pending() const { return mBuffer.size() - mStart; }

 private:
  void decodeAvailable();
  std::vector<uint8_t> mBuffer;
  size_t mStart = 0;
  std::vector<Frame> mReady;
  size_t mReadyTaken = 0;
  bool mBroken = false;
  std::string mError;
};

// Builds a body. Every write is bounded by kMaxBodySize; after an overflow the
// writer is marked failed and ignores further writes.
class BodyWriter {
 public:
  void u8(uint8_t v);
  void u32(uint32_t v);
  void bytes(const uint8_t* data, size_t len);
  void bytes(const ::android::hardware::hidl_vec<uint8_t>& v) { bytes(v.data(), v.size()); }
  void text(const std::string& s);
  bool ok() const { return mOk; }
  const std::vector<uint8_t>& data() const { return mData; }
  std::vector<uint8_t> take() { return std::move(mData); }

 private:
  bool room(size_t n);
  std::vector<uint8_t> mData;
  bool mOk = true;
};

// Reads a body; every read checks the bytes that remain. After a failed read
// the reader stays failed.
class BodyReader {
 public:
  BodyReader(const uint8_t* data, size_t len) : mData(data), mLen(len) {}
  explicit BodyReader(const std::vector<uint8_t>& v) : BodyReader(v.data(), v.size()) {}
  bool u8(uint8_t* v);
  bool u32(uint32_t* v);
  // A bool is one byte, 0 or 1; anything else is malformed.
  bool boolean(bool* v);
  bool bytes(::android::hardware::hidl_vec<uint8_t>* v);
  bool text(std::string* s, size_t maxLen);
  // True when every byte was read and no read failed.
  bool finished() const { return mOk && mPos == mLen; }
  bool ok() const { return mOk; }

 private:
  bool take(size_t n, const uint8_t** p);
  const uint8_t* mData;
  size_t mLen;
  size_t mPos = 0;
  bool mOk = true;
};

}  // namespace rpc
}  // namespace host
}  // namespace android

#include <host/rpc_wire.h>

#include <cstring>

namespace android {
namespace host {
namespace rpc {

namespace {

uint32_t loadU32(const uint8_t* p) {
  return static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) |
         (static_cast<uint32_t>(p[2]) << 16) | (static_cast<uint32_t>(p[3]) << 24);
}

void storeU32(uint8_t* p, uint32_t v) {
  p[0] = static_cast<uint8_t>(v);
  p[1] = static_cast<uint8_t>(v >> 8);
  p[2] = static_cast<uint8_t>(v >> 16);
  p[3] = static_cast<uint8_t>(v >> 24);
}

bool validKind(uint32_t k) {
  return k == static_cast<uint32_t>(FrameKind::Call) ||
         k == static_cast<uint32_t>(FrameKind::Reply) ||
         k == static_cast<uint32_t>(FrameKind::Error);
}

}  // namespace

DecodeStatus decodeFrame(const uint8_t* data, size_t len, Frame* out, size_t* consumed,
                         std::string* why) {
  if (consumed) *consumed = 0;
  // A prefix of the header can already be judged by its magic and kind.
  uint8_t magicBytes[4];
  storeU32(magicBytes, kFrameMagic);
  size_t magicSeen = len < 4 ? len : 4;
  if (magicSeen > 0 && (data == nullptr || memcmp(data, magicBytes, magicSeen) != 0)) {
    if (why) *why = "bad magic";
    return DecodeStatus::Malformed;
  }
  if (len >= 8 && !validKind(loadU32(data + 4))) {
    if (why) *why = "bad frame kind " + std::to_string(loadU32(data + 4));
    return DecodeStatus::Malformed;
  }
  if (len < kHeaderSize) return DecodeStatus::NeedMore;
  uint32_t bodyLength = loadU32(data + 20);
  if (bodyLength > kMaxBodySize) {
    if (why) *why = "body of " + std::to_string(bodyLength) + " bytes exceeds the limit";
    return DecodeStatus::Malformed;
  }
  if (len - kHeaderSize < bodyLength) return DecodeStatus::NeedMore;
  if (out) {
    out->kind = static_cast<FrameKind>(loadU32(data + 4));
    out->id = loadU32(data + 8);
    out->object = loadU32(data + 12);
    out->code = loadU32(data + 16);
    out->body.assign(data + kHeaderSize, data + kHeaderSize + bodyLength);
  }
  if (consumed) *consumed = kHeaderSize + bodyLength;
  return DecodeStatus::Ok;
}

bool encodeFrame(const Frame& frame, std::vector<uint8_t>* out) {
  if (out == nullptr || frame.body.size() > kMaxBodySize) return false;
  out->resize(kHeaderSize + frame.body.size());
  uint8_t* p = out->data();
  storeU32(p, kFrameMagic);
  storeU32(p + 4, static_cast<uint32_t>(frame.kind));
  storeU32(p + 8, frame.id);
  storeU32(p + 12, frame.object);
  storeU32(p + 16, frame.code);
  storeU32(p + 20, static_cast<uint32_t>(frame.body.size()));
  if (!frame.body.empty()) memcpy(p + kHeaderSize, frame.body.data(), frame.body.size());
  return true;
}

bool FrameDecoder::feed(const uint8_t* data, size_t len) {
  if (mBroken) return false;
  if (len == 0) return true;
  // Drop what earlier frames consumed before growing the buffer.
  if (mStart > 0) {
    mBuffer.erase(mBuffer.begin(), mBuffer.begin() + static_cast<std::ptrdiff_t>(mStart));
    mStart = 0;
  }
  mBuffer.insert(mBuffer.end(), data, data + len);
  decodeAvailable();
  return !mBroken;
}

void FrameDecoder::decodeAvailable() {
  while (!mBroken && mStart < mBuffer.size()) {
    Frame f;
    size_t used = 0;
    DecodeStatus st =
        decodeFrame(mBuffer.data() + mStart, mBuffer.size() - mStart, &f, &used, &mError);
    if (st == DecodeStatus::NeedMore) break;
    if (st == DecodeStatus::Malformed) {
      mBroken = true;
      mBuffer.clear();
      mStart = 0;
      break;
    }
    mReady.push_back(std::move(f));
    mStart += used;
  }
  if (mStart == mBuffer.size()) {
    mBuffer.clear();
    mStart = 0;
  }
}

bool FrameDecoder::next(Frame* out) {
  if (mReadyTaken >= mReady.size()) {
    mReady.clear();
    mReadyTaken = 0;
    return false;
  }
  *out = std::move(mReady[mReadyTaken++]);
  if (mReadyTaken == mReady.size()) {
    mReady.clear();
    mReadyTaken = 0;
  }
  return true;
}

bool BodyWriter::room(size_t n) {
  if (!mOk) return false;
  if (n > kMaxBodySize - mData.size()) {
    mOk = false;
    return false;
  }
  return true;
}

void BodyWriter::u8(uint8_t v) {
  if (room(1)) mData.push_back(v);
}

void BodyWriter::u32(uint32_t v) {
  if (!room(4)) return;
  uint8_t b[4];
  storeU32(b, v);
  mData.insert(mData.end(), b, b + 4);
}

void BodyWriter::bytes(const uint8_t* data, size_t len) {
  if (len > kMaxBodySize || !room(4 + len)) {
    mOk = false;
    return;
  }
  u32(static_cast<uint32_t>(len));
  if (len > 0) mData.insert(mData.end(), data, data + len);
}

void BodyWriter::text(const std::string& s) {
  bytes(reinterpret_cast<const uint8_t*>(s.data()), s.size());
}

bool BodyReader::take(size_t n, const uint8_t** p) {
  if (!mOk || n > mLen - mPos) {
    mOk = false;
    return false;
  }
  *p = mData + mPos;
  mPos += n;
  return true;
}

bool BodyReader::u8(uint8_t* v) {
  const uint8_t* p;
  if (!take(1, &p)) return false;
  *v = *p;
  return true;
}

bool BodyReader::u32(uint32_t* v) {
  const uint8_t* p;
  if (!take(4, &p)) return false;
  *v = loadU32(p);
  return true;
}

bool BodyReader::boolean(bool* v) {
  uint8_t b;
  if (!u8(&b)) return false;
  if (b > 1) {
    mOk = false;
    return false;
  }
  *v = b == 1;
  return true;
}

bool BodyReader::bytes(::android::hardware::hidl_vec<uint8_t>* v) {
  uint32_t n;
  const uint8_t* p;
  if (!u32(&n) || !take(n, &p)) return false;
  v->setToExternal(const_cast<uint8_t*>(p), n);
  return true;
}

bool BodyReader::text(std::string* s, size_t maxLen) {
  uint32_t n;
  const uint8_t* p;
  if (!u32(&n)) return false;
  if (n > maxLen) {
    mOk = false;
    return false;
  }
  if (!take(n, &p)) return false;
  s->assign(reinterpret_cast<const char*>(p), n);
  return true;
}

}  // namespace rpc
}  // namespace host
}  // namespace android

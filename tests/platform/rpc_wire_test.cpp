// The pure frame codec and the bounded body readers and writers.
#include <gtest/gtest.h>

#include <host/rpc_wire.h>

#include "rpc_test_util.h"

namespace {

using namespace ::android::host::rpc;

std::vector<uint8_t> encoded(FrameKind kind, uint32_t id, uint32_t object, uint32_t code,
                             std::vector<uint8_t> body) {
  std::vector<uint8_t> out = fake::frameBytes(kind, id, object, code, std::move(body));
  EXPECT_FALSE(out.empty());
  return out;
}

TEST(FrameCodec, HeaderIsLittleEndianAndRoundTrips) {
  std::vector<uint8_t> bytes = encoded(FrameKind::Reply, 0x01020304, 7, 9, {0xAA, 0xBB});
  ASSERT_EQ(bytes.size(), kHeaderSize + 2);
  EXPECT_EQ(std::vector<uint8_t>(bytes.begin(), bytes.begin() + 12),
            (std::vector<uint8_t>{'S', 'E', 'H', '1', 2, 0, 0, 0, 4, 3, 2, 1}));
  Frame f;
  size_t used = 0;
  ASSERT_EQ(decodeFrame(bytes.data(), bytes.size(), &f, &used), DecodeStatus::Ok);
  EXPECT_EQ(used, bytes.size());
  EXPECT_EQ(f.kind, FrameKind::Reply);
  EXPECT_EQ(f.id, 0x01020304u);
  EXPECT_EQ(f.object, 7u);
  EXPECT_EQ(f.code, 9u);
  EXPECT_EQ(f.body, (std::vector<uint8_t>{0xAA, 0xBB}));
}

TEST(FrameCodec, JudgesEveryPrefixAndBadHeader) {
  std::vector<uint8_t> good = encoded(FrameKind::Call, 1, 0, 4, {1, 2, 3});
  // Every proper prefix of a good frame asks for more and consumes nothing.
  for (size_t n = 0; n < good.size(); ++n) {
    size_t used = 99;
    EXPECT_EQ(decodeFrame(good.data(), n, nullptr, &used), DecodeStatus::NeedMore) << n;
    EXPECT_EQ(used, 0u);
  }
  struct Case {
    const char* name;
    size_t at;
    uint32_t value;
    size_t length;  // bytes handed to the decoder
  };
  const Case cases[] = {
      {"magic", 0, 0x31484554, kHeaderSize},
      {"magic seen in the first byte", 0, 0x00000000, 1},
      {"kind zero", 4, 0, kHeaderSize},
      {"kind four", 4, 4, 8},
      {"body over the limit", 20, static_cast<uint32_t>(kMaxBodySize + 1), kHeaderSize},
      {"body of 4 GiB", 20, 0xFFFFFFFF, kHeaderSize},
  };
  for (const Case& c : cases) {
    std::vector<uint8_t> bad = good;
    for (int i = 0; i < 4; ++i) bad[c.at + i] = static_cast<uint8_t>(c.value >> (8 * i));
    std::string why;
    EXPECT_EQ(decodeFrame(bad.data(), c.length, nullptr, nullptr, &why), DecodeStatus::Malformed)
        << c.name;
    EXPECT_FALSE(why.empty()) << c.name;
  }
  // The largest body is still a frame.
  Frame f;
  f.body.assign(kMaxBodySize, 0x5A);
  std::vector<uint8_t> max;
  ASSERT_TRUE(encodeFrame(f, &max));
  EXPECT_EQ(decodeFrame(max.data(), max.size(), nullptr, nullptr), DecodeStatus::Ok);
  f.body.push_back(0);
  EXPECT_FALSE(encodeFrame(f, &max));
}

TEST(FrameDecoder, CutsAStreamFedInAnyPieces) {
  std::vector<uint8_t> stream;
  for (uint32_t id = 1; id <= 3; ++id) {
    std::vector<uint8_t> one = encoded(FrameKind::Call, id, 0, id, std::vector<uint8_t>(id * 5, 1));
    stream.insert(stream.end(), one.begin(), one.end());
  }
  for (size_t piece : {size_t{1}, size_t{7}, size_t{24}, stream.size()}) {
    FrameDecoder d;
    std::vector<uint32_t> ids;
    for (size_t at = 0; at < stream.size(); at += piece) {
      size_t n = std::min(piece, stream.size() - at);
      ASSERT_TRUE(d.feed(stream.data() + at, n));
      Frame f;
      while (d.next(&f)) {
        EXPECT_EQ(f.body.size(), f.id * 5);
        ids.push_back(f.id);
      }
    }
    EXPECT_EQ(ids, (std::vector<uint32_t>{1, 2, 3})) << "piece " << piece;
    EXPECT_EQ(d.pending(), 0u);
  }
}

TEST(FrameDecoder, StaysBrokenAfterGarbage) {
  FrameDecoder d;
  std::vector<uint8_t> good = encoded(FrameKind::Call, 1, 0, 1, {});
  ASSERT_TRUE(d.feed(good.data(), good.size()));
  const uint8_t junk[] = {'G', 'E', 'T', ' ', '/'};
  EXPECT_FALSE(d.feed(junk, sizeof(junk)));
  EXPECT_TRUE(d.broken());
  EXPECT_FALSE(d.feed(good.data(), good.size()));
  // The frame decoded before the garbage is still handed out.
  Frame f;
  EXPECT_TRUE(d.next(&f));
  EXPECT_FALSE(d.next(&f));
}

TEST(RpcBody, ReadsAreBoundedByWhatRemains) {
  BodyWriter w;
  w.u8(7);
  w.u32(0xDEADBEEF);
  w.bytes(std::vector<uint8_t>{1, 2, 3});
  w.text("hi");
  w.u8(1);
  ASSERT_TRUE(w.ok());
  BodyReader r(w.data());
  uint8_t b;
  uint32_t x;
  ::android::hardware::hidl_vec<uint8_t> v;
  std::string s;
  bool flag;
  ASSERT_TRUE(r.u8(&b) && r.u32(&x) && r.bytes(&v) && r.text(&s, 10) && r.boolean(&flag));
  EXPECT_EQ(b, 7);
  EXPECT_EQ(x, 0xDEADBEEF);
  EXPECT_EQ(v, (::android::hardware::hidl_vec<uint8_t>{1, 2, 3}));
  EXPECT_EQ(s, "hi");
  EXPECT_TRUE(flag);
  EXPECT_TRUE(r.finished());
  EXPECT_FALSE(r.u8(&b));
  EXPECT_FALSE(r.ok());

  struct Case {
    const char* name;
    std::vector<uint8_t> body;
  };
  const Case bad[] = {
      {"length past the end", {5, 0, 0, 0, 1, 2}},
      {"length of 4 GiB", {0xFF, 0xFF, 0xFF, 0xFF, 1}},
      {"length cut", {1, 0}},
  };
  for (const Case& c : bad) {
    BodyReader br(c.body);
    EXPECT_FALSE(br.bytes(&v)) << c.name;
    EXPECT_FALSE(br.finished()) << c.name;
  }
  const std::vector<uint8_t> notBool = {2};
  BodyReader nb(notBool);
  EXPECT_FALSE(nb.boolean(&flag));
  const std::vector<uint8_t> longText = {3, 0, 0, 0, 'a', 'b', 'c'};
  BodyReader lt(longText);
  EXPECT_FALSE(lt.text(&s, 2));
}

TEST(RpcBody, WriterRefusesMoreThanAFrame) {
  BodyWriter w;
  std::vector<uint8_t> big(kMaxBodySize - 4);
  w.bytes(big.data(), big.size());
  EXPECT_TRUE(w.ok());
  w.u8(1);
  EXPECT_FALSE(w.ok());
  EXPECT_EQ(w.data().size(), kMaxBodySize);
}

}  // namespace

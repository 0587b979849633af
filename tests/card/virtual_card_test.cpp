#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "virtual_card.h"

using se_card::VirtualCard;
using Bytes = std::vector<uint8_t>;

namespace {

Bytes cat(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

Bytes selectCmd(uint8_t cla, const Bytes& aid, uint8_t p2 = 0x00) {
  Bytes c = {cla, 0xA4, 0x04, p2};
  if (!aid.empty()) {
    c.push_back(static_cast<uint8_t>(aid.size()));
    c.insert(c.end(), aid.begin(), aid.end());
  }
  return c;
}

uint16_t sw(const Bytes& r) { return r.size() < 2 ? 0 : static_cast<uint16_t>((r[r.size() - 2] << 8) | r.back()); }

int openChannel(VirtualCard& card) {
  Bytes r = card.process({0x00, 0x70, 0x00, 0x00, 0x01});
  if (r.size() != 3 || sw(r) != 0x9000) return -1;
  return r[0];
}

TEST(ClaCoding, ChannelFromClassByte) {
  struct Case {
    uint8_t cla;
    int channel;
  } cases[] = {
      {0x00, 0}, {0x01, 1}, {0x03, 3}, {0x0C, 0},  {0x13, 3},  {0x40, 4},  {0x45, 9},  {0x4F, 19},
      {0x80, 0}, {0x83, 3}, {0xC3, 7}, {0xCF, 19}, {0x60, 4},  {0x20, -1}, {0x3F, -1}, {0xA0, -1},
      {0xFF, -1},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(se_card::channelFromCla(c.cla), c.channel) << "CLA " << std::hex << int(c.cla);
  }
}

TEST(ClaCoding, ClaForChannelKeepsProprietaryAndSecureMessagingBits) {
  struct Case {
    uint8_t base;
    int channel;
    uint8_t cla;
  } cases[] = {
      {0x00, 3, 0x03}, {0x00, 9, 0x45}, {0x80, 7, 0xC3}, {0xC3, 19, 0xCF},
      {0x0C, 2, 0x0A}, {0x0C, 5, 0x61}, {0xFF, 3, 0xFF}, {0x00, 20, 0x00},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(se_card::claForChannel(c.base, c.channel), c.cla) << int(c.base) << " ch " << c.channel;
  }
}

TEST(VirtualCardTest, ManageChannelOpenUntilExhaustedThenCloseAndReuse) {
  VirtualCard card(se_card::CardOptions{4, {}});
  EXPECT_EQ(openChannel(card), 1);
  EXPECT_EQ(openChannel(card), 2);
  EXPECT_EQ(openChannel(card), 3);
  EXPECT_EQ(card.process({0x00, 0x70, 0x00, 0x00, 0x01}), (Bytes{0x6A, 0x81}));
  // Close channel 2 from the basic channel, by P2.
  EXPECT_EQ(card.process({0x00, 0x70, 0x80, 0x02}), (Bytes{0x90, 0x00}));
  EXPECT_FALSE(card.isChannelOpen(2));
  EXPECT_EQ(card.process({0x00, 0x70, 0x80, 0x02}), (Bytes{0x68, 0x81}));
  EXPECT_EQ(openChannel(card), 2);
  // Close from the channel itself (P2 00 means the channel of the class byte).
  EXPECT_EQ(card.process({0x03, 0x70, 0x80, 0x00}), (Bytes{0x90, 0x00}));
  EXPECT_FALSE(card.isChannelOpen(3));
  // The basic channel cannot be closed; an open may ask for a free channel.
  EXPECT_EQ(card.process({0x00, 0x70, 0x80, 0x00}), (Bytes{0x6A, 0x86}));
  EXPECT_EQ(card.process({0x00, 0x70, 0x00, 0x03}), (Bytes{0x90, 0x00}));
  EXPECT_TRUE(card.isChannelOpen(3));
  EXPECT_EQ(card.process({0x00, 0x70, 0x00, 0x03}), (Bytes{0x69, 0x85}));  // already open
}

TEST(VirtualCardTest, TwentyChannelsUseFurtherInterindustryClasses) {
  VirtualCard card;
  for (int expect = 1; expect < se_card::kMaxChannels; ++expect) ASSERT_EQ(openChannel(card), expect);
  EXPECT_EQ(sw(card.process({0x00, 0x70, 0x00, 0x00, 0x01})), 0x6A81);
  // Channel 9 through CLA 0x45, channel 19 through 0x4F, 7 through 0xC3.
  Bytes r = card.process(selectCmd(0x45, se_card::aid::kEcho));
  EXPECT_EQ(sw(r), 0x9000);
  EXPECT_EQ(card.selectedApplet(9), "echo");
  EXPECT_EQ(card.process({0x4F, 0x01, 0x00, 0x00, 0x01, 0x77}), (Bytes{0x6D, 0x00}));  // ISD there: no INS 01
  EXPECT_EQ(sw(card.process(selectCmd(0xC3, se_card::aid::kP2Reporter, 0x04))), 0x9000);
  EXPECT_EQ(card.selectedApplet(7), "p2");
  EXPECT_EQ(card.selectedApplet(9), "echo");
}

TEST(VirtualCardTest, StatusWordsForBadCommands) {
  VirtualCard card(se_card::CardOptions{4, {}});
  struct Case {
    const char* what;
    Bytes apdu;
    Bytes expect;
  } cases[] = {
      {"too short", {0x00, 0xA4, 0x04}, {0x67, 0x00}},
      {"Lc beyond data", {0x00, 0x01, 0x00, 0x00, 0x05, 0x01}, {0x67, 0x00}},
      {"extended length", {0x00, 0x01, 0x00, 0x00, 0x00, 0x00, 0x01, 0xAA}, {0x67, 0x00}},
      {"invalid class", {0xFF, 0xA4, 0x04, 0x00}, {0x6E, 0x00}},
      {"reserved class", {0x20, 0xA4, 0x04, 0x00}, {0x6E, 0x00}},
      {"unknown INS on ISD", {0x00, 0x42, 0x00, 0x00}, {0x6D, 0x00}},
      {"unknown AID", selectCmd(0x00, {0xA0, 0x00, 0x00, 0x00, 0x09}), {0x6A, 0x82}},
      {"select by file id", {0x00, 0xA4, 0x00, 0x00, 0x02, 0x3F, 0x00}, {0x6A, 0x82}},
      {"select bad P1", {0x00, 0xA4, 0x07, 0x00}, {0x6A, 0x86}},
      {"manage channel bad P1", {0x00, 0x70, 0x40, 0x00}, {0x6A, 0x86}},
      {"manage channel wrong Le", {0x00, 0x70, 0x00, 0x00, 0x02}, {0x6C, 0x01}},
      {"GET RESPONSE, nothing waiting", {0x00, 0xC0, 0x00, 0x00, 0x10}, {0x69, 0x85}},
      {"GET DATA unknown tag", {0x80, 0xCA, 0x12, 0x34, 0x00}, {0x6A, 0x88}},
      {"channel not open", selectCmd(0x01, se_card::aid::kEcho), {0x68, 0x81}},
      {"further channel not open", {0x45, 0x01, 0x00, 0x00}, {0x68, 0x81}},
      {"open asks for channel 4 of 4", {0x00, 0x70, 0x00, 0x04}, {0x68, 0x81}},
      {"open asks for channel 20", {0x00, 0x70, 0x00, 0x14}, {0x6A, 0x86}},
  };
  for (const Case& c : cases) EXPECT_EQ(card.process(c.apdu), c.expect) << c.what;
}

TEST(VirtualCardTest, SelectIsKeptPerChannelAndFailedSelectKeepsIt) {
  VirtualCard card;
  int c1 = openChannel(card), c2 = openChannel(card);
  ASSERT_EQ(c1, 1);
  ASSERT_EQ(c2, 2);
  EXPECT_EQ(card.selectedApplet(1), "isd");  // a new channel starts on the ISD
  Bytes r = card.process(selectCmd(0x01, se_card::aid::kEcho));
  EXPECT_EQ(r, cat(cat({0x6F, 0x08, 0x84, 0x06}, se_card::aid::kEcho), {0x90, 0x00}));
  EXPECT_EQ(sw(card.process(selectCmd(0x02, se_card::aid::kP2Reporter))), 0x9000);
  EXPECT_EQ(card.process({0x01, 0x01, 0x00, 0x00, 0x02, 0xAB, 0xCD}), (Bytes{0xAB, 0xCD, 0x90, 0x00}));
  EXPECT_EQ(card.process({0x02, 0x01, 0x00, 0x00, 0x02, 0xAB, 0xCD}), (Bytes{0x6D, 0x00}));
  EXPECT_EQ(sw(card.process(selectCmd(0x01, {0x01, 0x02, 0x03}))), 0x6A82);
  EXPECT_EQ(card.selectedApplet(1), "echo");
  // Empty AID (no data, or Le only) selects the ISD.
  EXPECT_EQ(sw(card.process({0x01, 0xA4, 0x04, 0x00, 0x00})), 0x9000);
  EXPECT_EQ(card.selectedApplet(1), "isd");
  // P2 0C asks for no response data.
  EXPECT_EQ(card.process(selectCmd(0x00, se_card::aid::kEcho, 0x0C)), (Bytes{0x90, 0x00}));
  // A closed channel forgets its applet; reset closes everything.
  card.reset();
  EXPECT_FALSE(card.isChannelOpen(1));
  EXPECT_EQ(card.selectedApplet(0), "isd");
}

TEST(VirtualCardTest, EchoWithStatusAndLeChecks) {
  VirtualCard card;
  ASSERT_EQ(sw(card.process(selectCmd(0x00, se_card::aid::kEcho))), 0x9000);
  EXPECT_EQ(card.process({0x00, 0x02, 0x6A, 0x82, 0x01, 0x55}), (Bytes{0x55, 0x6A, 0x82}));
  // Le 00 takes whatever comes; an exact Le must match, else 6C with the right one.
  EXPECT_EQ(card.process({0x00, 0x01, 0x00, 0x00, 0x02, 0x11, 0x22, 0x00}), (Bytes{0x11, 0x22, 0x90, 0x00}));
  EXPECT_EQ(card.process({0x00, 0x01, 0x00, 0x00, 0x02, 0x11, 0x22, 0x05}), (Bytes{0x6C, 0x02}));
  EXPECT_EQ(card.process({0x00, 0x01, 0x00, 0x00, 0x02, 0x11, 0x22, 0x02}), (Bytes{0x11, 0x22, 0x90, 0x00}));
  EXPECT_EQ(card.process({0x00, 0x01, 0x00, 0x00}), (Bytes{0x90, 0x00}));
}

TEST(VirtualCardTest, P2ReporterTellsTheSelectP2PerChannel) {
  VirtualCard card;
  ASSERT_EQ(openChannel(card), 1);
  ASSERT_EQ(openChannel(card), 2);
  Bytes fci = card.process(selectCmd(0x01, se_card::aid::kP2Reporter, 0x04));
  ASSERT_GE(fci.size(), 5u);
  EXPECT_EQ(Bytes(fci.end() - 5, fci.end()), (Bytes{0x85, 0x01, 0x04, 0x90, 0x00}));
  ASSERT_EQ(sw(card.process(selectCmd(0x02, se_card::aid::kP2Reporter, 0x00))), 0x9000);
  EXPECT_EQ(card.process({0x01, 0x20, 0x00, 0x00, 0x01}), (Bytes{0x04, 0x90, 0x00}));
  EXPECT_EQ(card.process({0x02, 0x20, 0x00, 0x00, 0x00}), (Bytes{0x00, 0x90, 0x00}));
}

Bytes pattern(size_t from, size_t n) {
  Bytes b(n);
  for (size_t i = 0; i < n; ++i) b[i] = static_cast<uint8_t>((from + i) & 0xFF);
  return b;
}

TEST(VirtualCardTest, LongAnswersComeInGetResponseChunks) {
  VirtualCard card;
  ASSERT_EQ(openChannel(card), 1);
  // Its SELECT leaves the FCI for GET RESPONSE.
  Bytes r = card.process(selectCmd(0x01, se_card::aid::kBig));
  ASSERT_EQ(r.size(), 2u);
  ASSERT_EQ(r[0], 0x61);
  Bytes fci = card.process({0x01, 0xC0, 0x00, 0x00, r[1]});
  EXPECT_EQ(fci.size(), r[1] + 2u);
  EXPECT_EQ(sw(fci), 0x9000);
  EXPECT_EQ(fci[0], 0x6F);

  // 300 bytes: 61 00, then 256 + 61 2C, then 44 + 90 00.
  EXPECT_EQ(card.process({0x01, 0x10, 0x00, 0x00}), (Bytes{0x61, 0x00}));
  r = card.process({0x01, 0xC0, 0x00, 0x00, 0x00});
  EXPECT_EQ(r, cat(pattern(0, 256), {0x61, 0x2C}));
  // A wrong Le is answered with the right one and keeps the data.
  EXPECT_EQ(card.process({0x01, 0xC0, 0x00, 0x00, 0x30}), (Bytes{0x6C, 0x2C}));
  r = card.process({0x01, 0xC0, 0x00, 0x00, 0x2C});
  EXPECT_EQ(r, cat(pattern(256, 44), {0x90, 0x00}));
  EXPECT_EQ(sw(card.process({0x01, 0xC0, 0x00, 0x00, 0x00})), 0x6985);

  // Partial fetches; another command drops what was waiting.
  EXPECT_EQ(card.process({0x01, 0x11, 0x00, 0x10}), (Bytes{0x61, 0x10}));
  EXPECT_EQ(card.process({0x01, 0xC0, 0x00, 0x00, 0x04}), cat(pattern(0, 4), {0x61, 0x0C}));
  EXPECT_EQ(card.process({0x00, 0xC0, 0x00, 0x00, 0x0C}), (Bytes{0x69, 0x85}));  // other channel
  EXPECT_EQ(sw(card.process({0x01, 0xCA, 0x00, 0x00})), 0x6D00);
  EXPECT_EQ(sw(card.process({0x01, 0xC0, 0x00, 0x00, 0x0C})), 0x6985);

  // Up to 256 bytes come at once, more than 4096 are refused.
  EXPECT_EQ(card.process({0x01, 0x10, 0x01, 0x00, 0x00}), cat(pattern(0, 256), {0x90, 0x00}));
  EXPECT_EQ(card.process({0x01, 0x10, 0x10, 0x01}), (Bytes{0x6A, 0x86}));
}

TEST(VirtualCardTest, OpenAndSelectInOneStep) {
  VirtualCard card(se_card::CardOptions{3, {}});
  auto r = card.openChannelAndSelect(se_card::aid::kP2Reporter, 0x04);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kOk);
  EXPECT_EQ(r.channel, 1);
  EXPECT_EQ(card.process({0x01, 0x20, 0x00, 0x00, 0x01}), (Bytes{0x04, 0x90, 0x00}));
  // An unknown applet gives its channel back.
  r = card.openChannelAndSelect({0xA0, 0x00, 0x00, 0x00, 0x01, 0x7F}, 0);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kNoApplet);
  EXPECT_FALSE(card.isChannelOpen(2));
  // The BIG applet's 61 xx SELECT still opens.
  r = card.openChannelAndSelect(se_card::aid::kBig, 0);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kOk);
  EXPECT_EQ(r.channel, 2);
  r = card.openChannelAndSelect(se_card::aid::kEcho, 0);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kNoChannel);
  EXPECT_TRUE(card.closeChannel(1));
  EXPECT_FALSE(card.closeChannel(1));
  EXPECT_FALSE(card.closeChannel(0));
}

TEST(VirtualCardTest, AtrCarriesItsChecksum) {
  VirtualCard card;
  const Bytes atr = card.atr();
  ASSERT_GE(atr.size(), 3u);
  EXPECT_EQ(atr[0], 0x3B);
  uint8_t x = 0;
  for (size_t i = 1; i < atr.size(); ++i) x ^= atr[i];
  EXPECT_EQ(x, 0) << "TCK must make the XOR from T0 to TCK zero";
  VirtualCard custom(se_card::CardOptions{20, {0x3B, 0x00}});
  EXPECT_EQ(custom.atr(), (Bytes{0x3B, 0x00}));
}

}  // namespace

#include <gtest/gtest.h>

#include <cstdio>
#include <string>
#include <vector>

#include "virtual_card.h"

using se_card::VirtualCard;
using Bytes = std::vector<uint8_t>;

namespace {

Bytes unhex(const std::string& s) {
  Bytes b;
  for (size_t i = 0; i + 1 < s.size(); i += 2) b.push_back(static_cast<uint8_t>(std::stoul(s.substr(i, 2), nullptr, 16)));
  return b;
}
std::string hex(const Bytes& b) {
  std::string s;
  char t[3];
  for (uint8_t x : b) {
    std::snprintf(t, sizeof(t), "%02X", x);
    s += t;
  }
  return s;
}
std::string pattern(size_t from, size_t n) {
  Bytes b(n);
  for (size_t i = 0; i < n; ++i) b[i] = static_cast<uint8_t>(from + i);
  return hex(b);
}

TEST(ClaCoding, ChannelFromClassByteAndBack) {
  const std::pair<uint8_t, int> toChannel[] = {
      {0x00, 0}, {0x01, 1}, {0x03, 3}, {0x0C, 0},  {0x13, 3},  {0x40, 4},  {0x45, 9},  {0x4F, 19}, {0x80, 0},
      {0x83, 3}, {0xC3, 7}, {0xCF, 19}, {0x60, 4}, {0x20, -1}, {0x3F, -1}, {0xA0, -1}, {0xFF, -1}};
  for (const auto& [cla, ch] : toChannel) EXPECT_EQ(se_card::channelFromCla(cla), ch) << int(cla);
  // Proprietary and secure messaging bits survive; invalid classes and
  // channels beyond 19 leave the byte alone.
  const std::tuple<uint8_t, int, uint8_t> toCla[] = {{0x00, 3, 0x03}, {0x00, 9, 0x45}, {0x80, 7, 0xC3},
                                                     {0xC3, 19, 0xCF}, {0x0C, 2, 0x0A}, {0x0C, 5, 0x61},
                                                     {0xFF, 3, 0xFF},  {0x00, 20, 0x00}};
  for (const auto& [base, ch, cla] : toCla) EXPECT_EQ(se_card::claForChannel(base, ch), cla) << int(base) << " " << ch;
}

// Command/response scripts, each on a fresh card with the channels given.
TEST(VirtualCardTest, Scripts) {
  struct Script {
    const char* name;
    int channels;
    std::vector<std::pair<std::string, std::string>> steps;  // command, response (hex)
  };
  const std::string echoFci = "6F088406A000000001019000";
  const Script scripts[] = {
      {"manage channel", 4,
       {{"0070000001", "019000"}, {"0070000001", "029000"}, {"0070000001", "039000"}, {"0070000001", "6A81"},
        {"00708002", "9000"}, {"00708002", "6881"}, {"0070000001", "029000"},
        // P2 00 closes the channel of the class byte; the basic channel stays.
        {"03708000", "9000"}, {"03010000", "6881"}, {"00708000", "6A86"},
        {"00700003", "9000"}, {"00700003", "6985"}, {"00700004", "6881"}, {"00700014", "6A86"}}},
      {"bad commands", 4,
       {{"00A404", "6700"}, {"000100000501", "6700"}, {"0001000000000100AA", "6700"}, {"FFA40400", "6E00"},
        {"20A40400", "6E00"}, {"00420000", "6D00"}, {"00A4040005A000000009", "6A82"}, {"00A40000023F00", "6A82"},
        {"00A40700", "6A86"}, {"00704000", "6A86"}, {"0070000002", "6C01"}, {"00C0000010", "6985"},
        {"80CA123400", "6A88"}, {"01A4040006A00000000101", "6881"}, {"45010000", "6881"}}},
      {"select per channel", 20,
       {{"0070000001", "019000"}, {"0070000001", "029000"},
        {"01A4040006A00000000101", echoFci}, {"02A4040406A00000000103", ""},
        {"0101000002ABCD", "ABCD9000"}, {"0201000002ABCD", "6D00"},
        // A failed SELECT keeps the applet; an empty AID selects the ISD.
        {"01A4040003010203", "6A82"}, {"0101000001AA", "AA9000"}, {"01A4040000", ""}, {"0101000001AA", "6D00"},
        {"00A404" "0C06A00000000101", "9000"},
        // The P2 reporter tells each channel's SELECT P2.
        {"0120000001", "6D00"}, {"0220000001", "049000"}, {"02A4040006A00000000103", ""}, {"0220000000", "009000"}}},
      {"echo status and Le", 20,
       {{"00A4040006A00000000101", echoFci}, {"00026A820155", "556A82"}, {"0001000002112200", "11229000"},
        {"0001000002112205", "6C02"}, {"0001000002112202", "11229000"}, {"00010000", "9000"}}},
      {"further channels", 20,
       {{"00700009", "9000"}, {"45A4040006A00000000101", echoFci},
        {"450100000177", "779000"}, {"00700013", "9000"}, {"4F0100000177", "6D00"},
        {"00700007", "9000"}, {"C3A4040406A00000000103", ""}, {"C320000001", "049000"}}},
      {"get response", 20,
       {{"0070000001", "019000"}, {"01A4040006A00000000102", "611C"}, {"01C000001C", ""}, {"01100000", "6100"},
        {"01C0000000", pattern(0, 256) + "612C"}, {"01C0000030", "6C2C"},
        {"01C000002C", pattern(256, 44) + "9000"}, {"01C0000000", "6985"},
        // Partial fetches; another command or channel drops nothing but its own.
        {"01110010", "6110"}, {"01C0000004", pattern(0, 4) + "610C"}, {"00C000000C", "6985"},
        {"01CA0000", "6D00"}, {"01C000000C", "6985"},
        {"0110010000", pattern(0, 256) + "9000"}, {"01101001", "6A86"},
        // INS 12: in one response however long, whatever the Le.
        {"0112010F00", pattern(0, 271) + "9000"}, {"0112000205", pattern(0, 2) + "9000"}}},
  };
  for (const Script& s : scripts) {
    VirtualCard card(se_card::CardOptions{s.channels, {}});
    for (const auto& [cmd, rsp] : s.steps) {
      const std::string got = hex(card.process(unhex(cmd)));
      // "" : only a success status word is checked.
      if (rsp.empty()) {
        EXPECT_TRUE(got.size() >= 4 && (got.substr(got.size() - 4) == "9000" || got.substr(got.size() - 4, 2) == "61"))
            << s.name << ": " << cmd << " -> " << got;
      } else {
        EXPECT_EQ(got, rsp) << s.name << ": " << cmd;
      }
    }
  }
}

TEST(VirtualCardTest, ChannelsUpToTheCardsCountAndReset) {
  VirtualCard card;
  for (int c = 1; c < se_card::kMaxChannels; ++c) ASSERT_EQ(hex(card.process(unhex("0070000001"))), hex({uint8_t(c), 0x90, 0}));
  EXPECT_EQ(hex(card.process(unhex("0070000001"))), "6A81");
  card.reset();
  EXPECT_FALSE(card.isChannelOpen(1));
  EXPECT_EQ(card.selectedApplet(0), "isd");
}

TEST(VirtualCardTest, OpenAndSelectInOneStep) {
  VirtualCard card(se_card::CardOptions{3, {}});
  auto r = card.openChannelAndSelect(se_card::aid::kP2Reporter, 0x04);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kOk);
  EXPECT_EQ(r.channel, 1);
  EXPECT_EQ(hex(card.process(unhex("0120000001"))), "049000");
  // An unknown applet gives its channel back; BIG's 61 xx SELECT still opens.
  EXPECT_EQ(card.openChannelAndSelect(unhex("A0000000017F"), 0).status, VirtualCard::OpenStatus::kNoApplet);
  EXPECT_FALSE(card.isChannelOpen(2));
  r = card.openChannelAndSelect(se_card::aid::kBig, 0);
  EXPECT_EQ(r.status, VirtualCard::OpenStatus::kOk);
  EXPECT_EQ(r.channel, 2);
  EXPECT_EQ(card.openChannelAndSelect(se_card::aid::kEcho, 0).status, VirtualCard::OpenStatus::kNoChannel);
  EXPECT_TRUE(card.closeChannel(1));
  EXPECT_FALSE(card.closeChannel(1));
  EXPECT_FALSE(card.closeChannel(0));
}

TEST(VirtualCardTest, AtrCarriesItsChecksum) {
  const Bytes atr = VirtualCard().atr();
  ASSERT_GE(atr.size(), 3u);
  EXPECT_EQ(atr[0], 0x3B);
  uint8_t x = 0;
  for (size_t i = 1; i < atr.size(); ++i) x ^= atr[i];
  EXPECT_EQ(x, 0) << "TCK makes the XOR from T0 to TCK zero";
  EXPECT_EQ(VirtualCard(se_card::CardOptions{20, {0x3B, 0x00}}).atr(), (Bytes{0x3B, 0x00}));
}

}  // namespace

// card-vpcd's protocol side: framing, control codes and the card behind
// them, then the program itself against a TCP listener playing vpcd.
#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "card_applets.h"
#include "se_harness.h"
#include "vpcd_card.h"

using Bytes = std::vector<uint8_t>;
using se_vpcd::CardSession;
using se_vpcd::FrameReader;

namespace {

Bytes cat(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

Bytes framed(const Bytes& body) {
  Bytes out;
  EXPECT_TRUE(se_vpcd::frame(body, &out));
  return out;
}

// Big-endian length, then the body; messages come out whole and in order
// however the stream is cut.
TEST(VpcdFraming, LengthPrefixAndReassembly) {
  EXPECT_EQ(framed({0x04}), (Bytes{0x00, 0x01, 0x04}));
  EXPECT_EQ(framed(Bytes(0x0123, 0xAB)).size(), 2u + 0x0123);
  EXPECT_EQ(framed(Bytes(0x0123, 0xAB))[0], 0x01);
  Bytes out;
  EXPECT_TRUE(se_vpcd::frame(Bytes(0xFFFF, 0), &out));
  EXPECT_FALSE(se_vpcd::frame(Bytes(0x10000, 0), &out));
  const std::vector<Bytes> bodies = {{0x04}, {}, {0x00, 0xA4, 0x04, 0x00}, Bytes(300, 0x5A), {0x01}};
  Bytes stream;
  for (const Bytes& b : bodies) stream = cat(stream, framed(b));
  for (size_t piece : {size_t{1}, size_t{3}, size_t{256}, stream.size()}) {
    FrameReader r;
    std::vector<Bytes> got;
    Bytes body;
    for (size_t at = 0; at < stream.size(); at += piece) {
      r.feed(stream.data() + at, std::min(piece, stream.size() - at));
      while (r.next(&body)) got.push_back(body);
    }
    EXPECT_EQ(got, bodies) << "pieces of " << piece;
    EXPECT_EQ(r.pending(), 0u);
  }
}

// Power off, power on and reset all close the card's logical channels; the
// ATR request is the only control code answered.
TEST(VpcdCardSession, ControlCodes) {
  struct Row {
    uint8_t code;
    bool answered;
    bool poweredAfter;
    const char* event;
  };
  const Row rows[] = {{se_vpcd::kPowerOff, false, false, "# power off"},
                      {se_vpcd::kPowerOn, false, true, "# power on"},
                      {se_vpcd::kReset, false, true, "# reset"},
                      {3, false, true, "# unknown control code 3"}};
  for (const Row& r : rows) {
    CardSession s(se_card::CardOptions{4, {}});
    s.handle({se_vpcd::kPowerOn});
    ASSERT_EQ(s.handle({0x00, 0x70, 0x00, 0x00, 0x01}).reply, (Bytes{0x01, 0x90, 0x00}));
    ASSERT_TRUE(s.card().isChannelOpen(1));
    const CardSession::Result res = s.handle({r.code});
    EXPECT_EQ(res.reply.has_value(), r.answered) << int(r.code);
    EXPECT_EQ(res.event.rfind(r.event, 0), 0u) << res.event;
    EXPECT_EQ(s.powered(), r.poweredAfter) << int(r.code);
    // Only a real power event drops the channel.
    EXPECT_EQ(s.card().isChannelOpen(1), r.code == 3) << int(r.code);
    // Pulling the card out drops everything.
    s.handle({se_vpcd::kPowerOn});
    s.handle({0x00, 0x70, 0x00, 0x00, 0x01});
    s.remove();
    EXPECT_FALSE(s.card().isChannelOpen(1));
    EXPECT_FALSE(s.powered());
  }
}

TEST(VpcdCardSession, AtrAndApdus) {
  const Bytes atr = {0x3B, 0x80, 0x01, 0x81};
  CardSession s(se_card::CardOptions{4, atr});
  CardSession::Result r = s.handle({se_vpcd::kAtrRequest});
  EXPECT_EQ(r.reply, atr);
  EXPECT_EQ(r.event, "# ATR 3B 80 01 81");
  // vpcd polls with ATR requests: traced once until the next power event.
  EXPECT_EQ(s.handle({se_vpcd::kAtrRequest}).event, "");
  s.handle({se_vpcd::kReset});
  EXPECT_EQ(s.handle({se_vpcd::kAtrRequest}).event, "# ATR 3B 80 01 81");

  Bytes select = {0x00, 0xA4, 0x04, 0x00, 0x06};
  select = cat(select, se_card::aid::kEcho);
  r = s.handle(select);
  ASSERT_TRUE(r.reply);
  EXPECT_EQ(r.reply->back(), 0x00);
  EXPECT_EQ((*r.reply)[r.reply->size() - 2], 0x90);
  EXPECT_EQ(r.event.rfind("< 00 A4 04 00 06 A0", 0), 0u) << r.event;
  // Anything longer than a control code, shorter than a header or empty
  // included, is an APDU and gets the card's answer: vpcd waits for one.
  for (const Bytes& shortCmd : {Bytes{}, Bytes{0x00, 0xA4}}) {
    r = s.handle(shortCmd);
    EXPECT_EQ(r.reply, (Bytes{0x67, 0x00}));
  }
}

std::unique_ptr<se_test::Process> runCard(const std::vector<std::string>& args) {
  std::vector<std::string> argv{SE_CARD_VPCD_PATH};
  argv.insert(argv.end(), args.begin(), args.end());
  return std::make_unique<se_test::Process>(argv, "/");
}

// The tool against the real vpcd is exercised by the PC/SC tests; here its
// command line, and a stop while nothing listens yet.
TEST(CardVpcdTool, CommandLine) {
  struct Row {
    std::vector<std::string> args;
    int exit;
    const char* says;  // on stdout for 0, stderr otherwise
  };
  const Row rows[] = {
      {{"--help"}, 0, "usage: card-vpcd"},
      {{"--port", "0"}, 2, "--port takes 1 to 65535"},
      {{"--port", "x"}, 2, "--port takes"},
      {{"--atr", "3B0"}, 2, "--atr takes"},
      {{"--channels", "21"}, 2, "--channels takes 1 to 20"},
      {{"--bogus"}, 2, "usage: card-vpcd"},
      {{"extra"}, 2, "unexpected argument 'extra'"},
  };
  for (const Row& r : rows) {
    auto p = runCard(r.args);
    EXPECT_EQ(p->waitExit(), r.exit) << r.args[0];
    const std::string text = r.exit == 0 ? p->out().text() : p->err().text();
    EXPECT_NE(text.find(r.says), std::string::npos) << r.args[0] << ": " << text;
  }
}

TEST(CardVpcdTool, StopsWhileWaiting) {
  // A port that was free a moment ago: nobody listens there.
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(a);
  ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)), 0);
  getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
  close(fd);
  const std::string port = std::to_string(ntohs(a.sin_port));
  auto card = runCard({"--port", port});
  EXPECT_TRUE(card->err().waitFor("waiting for vpcd on 127.0.0.1:" + port));
  card->stop(SIGTERM);
  EXPECT_EQ(card->waitExit(), 0);
}

}  // namespace

// End to end: the real daemon with the simulated vendor library in a fresh
// device root, driven by the real secli over the daemon's sockets. A killed
// client, the instance list and the start without an eSE are in the
// integration suite; the status word and P2 rules in the unit tests.
#include <gtest/gtest.h>

#include <signal.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "se_harness.h"

namespace {

using namespace se_test;

// The card's applets (card/card_applets.h).
constexpr const char* kEchoAid = "A00000000101";
constexpr const char* kBigAid = "A00000000102";
constexpr const char* kMissingAid = "A00000000199";

class EseEndToEnd : public ::testing::Test {
 protected:
  void TearDown() override {
    if (!daemon) return;
    daemon->stop(SIGKILL);
    expectNoSanitizerReport("daemon", daemon->err().text());
    if (HasFailure()) fprintf(stderr, "---- daemon log ----\n%s---- end ----\n", daemon->err().text().c_str());
  }
  void startDaemon() { daemon = se_test::startDaemon(root); }

  TempRoot root;
  std::unique_ptr<Process> daemon;
};

TEST_F(EseEndToEnd, ChannelsAndApdusThroughTheDaemon) {
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  SecliSession s(root, "eSE1");
  EXPECT_EQ(s.call("init"), R"({"cmd":"init","state":true})");
  EXPECT_EQ(field(s.call("present"), "present"), "true");
  EXPECT_EQ(field(s.call("atr"), "atr"), "");

  // Logical channel to the echo applet; an exchange on it; its close.
  std::string open = s.call(std::string("open ") + kEchoAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int echo = std::atoi(field(open, "channel").c_str());
  ASSERT_GE(echo, 1);
  ASSERT_LE(echo, 3);
  EXPECT_EQ(field(open, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(echo) + " 01 00 00 03 AA BB CC"), "response"),
            "AABBCC9000");

  // An applet whose SELECT answers 61xx: the front fetches the FCI; then a
  // command left for GET RESPONSE, which the client sends itself.
  open = s.call(std::string("open ") + kBigAid);
  EXPECT_EQ(field(open, "status"), "SUCCESS");
  const int big = std::atoi(field(open, "channel").c_str());
  ASSERT_GE(big, 1);
  ASSERT_LE(big, 3);
  EXPECT_NE(big, echo);
  const std::string fci = field(open, "select");
  EXPECT_EQ(fci.substr(0, 2), "6F");
  EXPECT_EQ(fci.substr(fci.size() - 4), "9000");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " 11 00 10 00"), "response"), "6110");
  EXPECT_EQ(field(s.call("transmit " + hexByte(big) + " C0 00 00 10"), "response"),
            "000102030405060708090A0B0C0D0E0F9000");

  EXPECT_EQ(field(s.call("close " + std::to_string(echo)), "status"), "SUCCESS");
  EXPECT_EQ(field(s.call("close " + std::to_string(big)), "status"), "SUCCESS");

  // The basic channel; an exchange on it.
  const std::string basic = s.call(std::string("basic ") + kEchoAid);
  EXPECT_EQ(field(basic, "status"), "SUCCESS");
  EXPECT_EQ(field(basic, "select"), std::string("6F088406") + kEchoAid + "9000");
  EXPECT_EQ(field(s.call("transmit 00 01 00 00 02 12 34"), "response"), "12349000");

  // An applet the card does not have, on both channel kinds.
  open = s.call(std::string("open ") + kMissingAid);
  EXPECT_EQ(field(open, "status"), "NO_SUCH_ELEMENT_ERROR");
  EXPECT_EQ(field(open, "select"), "6A82");
  EXPECT_EQ(field(s.call(std::string("basic ") + kMissingAid), "status"), "NO_SUCH_ELEMENT_ERROR");

  s.process().closeStdin();
  EXPECT_EQ(s.process().waitExit(), 0);
}

}  // namespace

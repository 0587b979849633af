// The whole system as a user runs it: the daemon with the simulated eSE
// library, modem-sim behind "SIM1", and secli clients, over the daemon's
// real sockets and a real pty.
#include <gtest/gtest.h>

#include <signal.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;
using Clock = std::chrono::steady_clock;

constexpr const char* kEchoAid = "A00000000101";

long msSince(Clock::time_point t0) {
  return static_cast<long>(
      std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - t0).count());
}

class EndToEnd : public ::testing::Test {
 protected:
  void TearDown() override {
    // The daemon first, so that no port is in use when the modem goes.
    if (daemon) {
      daemon->stop(SIGKILL);
      expectNoSanitizerReport("daemon", daemon->err().text());
      if (HasFailure()) fprintf(stderr, "---- daemon ----\n%s", daemon->err().text().c_str());
    }
    if (modem && HasFailure()) fprintf(stderr, "---- modem ----\n%s", modem->err().text().c_str());
  }
  void start(const std::vector<std::string>& modemArgs = {}) {
    modem = startModem(root, 0, modemArgs);
    daemon = startDaemon(root);
  }
  // A session's open of the echo applet; the channel, or -1.
  static int openEcho(SecliSession& s) {
    const std::string open = s.call(std::string("open ") + kEchoAid);
    EXPECT_EQ(field(open, "status"), "SUCCESS") << open;
    return field(open, "status") == "SUCCESS" ? std::atoi(field(open, "channel").c_str()) : -1;
  }
  static std::string echo(SecliSession& s, int channel, const std::string& byte) {
    return field(s.call("transmit " + hexByte(channel) + " 01 00 00 01 " + byte), "response");
  }

  TempRoot root;
  std::unique_ptr<Process> modem;
  std::unique_ptr<Process> daemon;
};

// Two clients at once; while a slow modem keeps a SIM call waiting, eSE1
// calls go through.
TEST_F(EndToEnd, ASlowSimAnswerDoesNotHoldUpTheEse) {
  constexpr int kModemDelayMs = 3000;
  ASSERT_NO_FATAL_FAILURE(start({"--delay", std::to_string(kModemDelayMs)}));
  SecliSession sim(root, "SIM1");
  SecliSession ese(root, "eSE1");
  ASSERT_EQ(field(sim.call("init"), "state"), "true");

  const size_t mark = modem->err().size();
  sim.send(std::string("open ") + kEchoAid);
  ASSERT_TRUE(modem->err().waitFor("< AT+CCHP", mark));  // the SIM call is now at the modem
  const auto t0 = Clock::now();
  EXPECT_EQ(field(ese.call("init"), "state"), "true");
  const int ch = openEcho(ese);
  EXPECT_EQ(echo(ese, ch, "5A"), "5A9000");
  EXPECT_EQ(field(ese.call("close " + std::to_string(ch)), "status"), "SUCCESS");
  const long eseMs = msSince(t0);
  std::string line;
  EXPECT_FALSE(sim.answer(&line, 0)) << "the SIM answered before the eSE calls ended: " << line;
  EXPECT_LT(eseMs, kModemDelayMs);

  // The SIM call completes in its own time.
  ASSERT_TRUE(sim.answer(&line));
  EXPECT_EQ(field(line, "status"), "SUCCESS") << line;
}

// Clients killed in the middle of their sessions: both fronts learn of it;
// the eSE is closed and opened by the next init; the next SIM init closes
// channels 3 to 19 and keeps 1 and 2.
TEST_F(EndToEnd, KilledClientsAreCleanedUpOnBothFronts) {
  ASSERT_NO_FATAL_FAILURE(start());
  size_t mark = 0;
  {
    SecliSession ese(root, "eSE1");
    SecliSession sim(root, "SIM1");
    ASSERT_EQ(field(ese.call("init"), "state"), "true");
    ASSERT_GE(openEcho(ese), 1);
    ASSERT_EQ(field(sim.call("init"), "state"), "true");
    for (int want = 1; want <= 4; ++want) ASSERT_EQ(openEcho(sim), want);
    mark = daemon->err().size();
    ese.process().stop(SIGKILL);
    sim.process().stop(SIGKILL);
  }
  EXPECT_TRUE(daemon->err().waitFor("qvese@1.0-service: serviceDied enter!", mark));
  EXPECT_TRUE(daemon->err().waitFor("ZerbSimSecureElement: serviceDied, enter", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close", mark));
  EXPECT_EQ(countOf(modem->err().text(), "AT+CCHC="), 0u);

  mark = daemon->err().size();
  SecliSession ese(root, "eSE1");
  EXPECT_EQ(field(ese.call("init"), "state"), "true");
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_init_open: open", mark));
  EXPECT_EQ(echo(ese, openEcho(ese), "11"), "119000");

  SecliSession sim(root, "SIM1");
  EXPECT_EQ(field(sim.call("init"), "state"), "true");
  EXPECT_TRUE(modem->err().waitFor("< AT+CCHC=259"));
  EXPECT_TRUE(modem->err().waitFor("< AT+CCHC=260"));
  const std::string log = modem->err().text();
  EXPECT_EQ(countOf(log, "< AT+CCHC="), 2u) << log;
  EXPECT_EQ(echo(sim, 1, "22"), "229000");
  EXPECT_EQ(echo(sim, 2, "33"), "339000");
  EXPECT_EQ(echo(sim, 3, "44"), "");
}

// The modem goes away under a running daemon: SIM calls fail as failures,
// soon, and the daemon and eSE1 go on.
TEST_F(EndToEnd, ALostModemFailsSimCallsCleanly) {
  ASSERT_NO_FATAL_FAILURE(start());
  SecliSession sim(root, "SIM1");
  SecliSession ese(root, "eSE1");
  ASSERT_EQ(field(sim.call("init"), "state"), "true");
  const int ch = openEcho(sim);
  ASSERT_GE(ch, 1);
  ASSERT_EQ(field(ese.call("init"), "state"), "true");
  modem->stop(SIGKILL);

  struct Case {
    std::string command, name, want;
  };
  const Case cases[] = {
      {"present", "present", "false"},
      {"atr", "atr", ""},
      {"transmit " + hexByte(ch) + " 01 00 00 01 AA", "response", ""},
      {std::string("open ") + kEchoAid, "status", "FAILED"},
      {"close " + std::to_string(ch), "status", "FAILED"},
  };
  // Until the reader has seen the port gone, each send is retried for about
  // five seconds (usually one or two calls pay that); no call waits for the
  // 600 s AT command time-out, and once the port is gone calls fail at once.
  auto t0 = Clock::now();
  for (const Case& c : cases) EXPECT_EQ(field(sim.call(c.command), c.name), c.want) << c.command;
  EXPECT_LT(msSince(t0), 30000);
  t0 = Clock::now();
  EXPECT_EQ(field(sim.call("present"), "present"), "false");
  EXPECT_LT(msSince(t0), 1000);

  EXPECT_TRUE(daemon->running());
  const int e = openEcho(ese);
  EXPECT_EQ(echo(ese, e, "77"), "779000");
  EXPECT_EQ(field(ese.call("close " + std::to_string(e)), "status"), "SUCCESS");
}

// secli --chain fetches what the card leaves for GET RESPONSE and answers
// 6C xx, on both instances; --trace shows each exchange.
TEST_F(EndToEnd, ChainedExchangesOnBothInstances) {
  ASSERT_NO_FATAL_FAILURE(start());
  std::string pattern;
  for (int i = 0; i < 0x20; ++i) pattern += hexByte(i);
  for (const char* instance : {"eSE1", "SIM1"}) {
    SecliSession s(root, instance, {"--chain", "--trace"});
    ASSERT_EQ(field(s.call("init"), "state"), "true") << instance;
    const std::string open = s.call("open A00000000102");
    ASSERT_EQ(field(open, "status"), "SUCCESS") << open;
    const int ch = std::atoi(field(open, "channel").c_str());
    const std::string cla = hexByte(ch);
    const std::string big = s.call("transmit " + cla + " 11 00 20 00");
    EXPECT_EQ(field(big, "response"), pattern + "9000") << instance;
    EXPECT_EQ(field(big, "exchanges"), "2") << instance;
    EXPECT_TRUE(s.process().err().waitFor("secli: trace > " + cla + " C0 00 00 20")) << instance;
    const int echo = openEcho(s);
    const std::string fixed = s.call("transmit " + hexByte(echo) + " 01 00 00 02 AB CD 05");
    EXPECT_EQ(field(fixed, "response"), "ABCD9000") << instance;
    EXPECT_EQ(field(fixed, "exchanges"), "2") << instance;
    EXPECT_TRUE(s.process().err().waitFor("secli: trace < 6C 02")) << instance;
  }
}

TEST_F(EndToEnd, WithoutAnEseOnlySim1IsServed) {
  root.property("vendor.ese_sim.type=0");
  ASSERT_NO_FATAL_FAILURE(start());
  EXPECT_TRUE(daemon->err().waitFor("g_ese_type = 0!"));
  std::string out;
  EXPECT_EQ(secli(root, {"list"}, &out), 0);
  EXPECT_EQ(out, "SIM1\nandroid.hardware.secure_element.ISecureElement/SIM1\n");
  EXPECT_EQ(daemon->err().text().find("eSE1"), std::string::npos);
  EXPECT_EQ(secli(root, {"-i", "eSE1", "present"}, &out), 1);
  SecliSession sim(root, "SIM1");
  EXPECT_EQ(field(sim.call("init"), "state"), "true");
  EXPECT_EQ(field(sim.call("present"), "present"), "true");
}

// Where the socket cannot be made, the first registration fails and the
// daemon ends with status 1.
TEST_F(EndToEnd, AFailedRegistrationEndsTheDaemon) {
  struct Case {
    const char* eseType;
    const char* line;
  };
  for (const Case& c : {Case{"1", "SecureElement Registered eSE1 fail"},
                        Case{"0", "ZerbSimSecureElement Registered sim1 fail"}}) {
    TempRoot r;
    r.write("dev/socket", "a file where the socket folder should be\n");
    r.property(std::string("vendor.ese_sim.type=") + c.eseType);
    Process d({kDaemon}, r.path());
    EXPECT_EQ(d.waitExit(), 1) << d.err().text();
    EXPECT_NE(d.err().text().find(c.line), std::string::npos) << d.err().text();
    expectNoSanitizerReport("daemon", d.err().text());
  }
}

}  // namespace

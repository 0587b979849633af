// The whole system as a user runs it: the daemon with the simulated eSE
// library, modem-sim behind "SIM1", and secli clients, over the daemon's
// real sockets and a real pty.
#include <gtest/gtest.h>

#include <signal.h>

#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;

class EndToEnd : public ::testing::Test, public System {
 protected:
  void start() {
    modem = startModem(root, 0);
    daemon = startDaemon(root);
  }
};

// AIDL clients killed in the middle of their sessions: both fronts learn of
// it; the eSE is closed and opened by the next init; every SIM channel the
// dead client held is closed at the modem, a live client's stays open.
TEST_F(EndToEnd, KilledClientsAreCleanedUpOnBothFronts) {
  ASSERT_NO_FATAL_FAILURE(start());
  SecliSession survivor(root, "SIM1");
  ASSERT_EQ(field(survivor.call("init"), "state"), "true");
  ASSERT_EQ(openEcho(survivor), 1);
  size_t mark = 0;
  {
    SecliSession ese(root, "eSE1", {"--aidl"});
    SecliSession sim(root, "SIM1", {"--aidl"});
    ASSERT_EQ(field(ese.call("init"), "state"), "true");
    ASSERT_GE(openEcho(ese), 1);
    ASSERT_EQ(field(sim.call("init"), "state"), "true");
    for (int want = 2; want <= 5; ++want) ASSERT_EQ(openEcho(sim), want);
    mark = daemon->err().size();
    ese.process().stop(SIGKILL);
    sim.process().stop(SIGKILL);
  }
  EXPECT_TRUE(daemon->err().waitFor("qvese@1.0-service: serviceDied enter!", mark));
  EXPECT_TRUE(daemon->err().waitFor("ZerbSimSecureElement: serviceDied, enter", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close", mark));
  for (int session = 258; session <= 261; ++session) {
    EXPECT_TRUE(modem->err().waitFor("< AT+CCHC=" + std::to_string(session)));
  }
  EXPECT_EQ(countOf(modem->err().text(), "< AT+CCHC="), 4u) << modem->err().text();
  EXPECT_EQ(echo(survivor, 1, "11"), "119000");

  mark = daemon->err().size();
  SecliSession ese(root, "eSE1");
  EXPECT_EQ(field(ese.call("init"), "state"), "true");
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_init_open: open", mark));
  EXPECT_EQ(echo(ese, openEcho(ese), "11"), "119000");

  SecliSession sim(root, "SIM1");
  EXPECT_EQ(field(sim.call("init"), "state"), "true");
  EXPECT_EQ(echo(sim, openEcho(sim), "22"), "229000");
  EXPECT_EQ(echo(sim, 3, "44"), "");
}

// secli --chain fetches what the card leaves for GET RESPONSE and answers
// 6C xx, on both instances; --trace shows each exchange.
TEST_F(EndToEnd, ChainedExchangesOnBothInstances) {
  ASSERT_NO_FATAL_FAILURE(start());
  std::string pattern;
  for (int i = 0; i < 0x20; ++i) pattern += hexByte(i);
  for (const char* instance : {"eSE1", "SIM1"}) {
    SCOPED_TRACE(instance);
    SecliSession s(root, instance, {"--chain", "--trace"});
    ASSERT_EQ(field(s.call("init"), "state"), "true");
    const std::string open = s.call("open A00000000102");
    ASSERT_EQ(field(open, "status"), "SUCCESS") << open;
    const std::string cla = hexByte(std::atoi(field(open, "channel").c_str()));
    const std::string big = s.call("transmit " + cla + " 11 00 20 00");
    EXPECT_EQ(field(big, "response"), pattern + "9000");
    EXPECT_EQ(field(big, "exchanges"), "2");
    EXPECT_TRUE(s.process().err().waitFor("secli: trace > " + cla + " C0 00 00 20"));
    const std::string fixed = s.call("transmit " + hexByte(openEcho(s)) + " 01 00 00 02 AB CD 05");
    EXPECT_EQ(field(fixed, "response"), "ABCD9000");
    EXPECT_EQ(field(fixed, "exchanges"), "2");
    EXPECT_TRUE(s.process().err().waitFor("secli: trace < 6C 02"));
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
  EXPECT_EQ(secli(root, {"--aidl", "-i", "eSE1", "present"}, &out), 1);
  SecliSession sim(root, "SIM1");
  EXPECT_EQ(field(sim.call("init"), "state"), "true");
  EXPECT_EQ(field(sim.call("present"), "present"), "true");
}

// The commands in a log, each cut at its '=' (the daemon's log masks what
// follows): what the daemon logged as sent, or what the modem received.
std::vector<std::string> commandHeads(const std::string& log, const std::regex& line) {
  std::vector<std::string> heads;
  std::istringstream in(log);
  std::smatch m;
  for (std::string l; std::getline(in, l);) {
    if (std::regex_search(l, m, line)) heads.push_back(m[1].str().substr(0, m[1].str().find('=')));
  }
  return heads;
}

// A SIM1 session on a modem with one of real modems' habits, and with all of
// them at once (a USB modem as plugged in): a port left in the kernel's
// default terminal settings, which the daemon must make raw or the modem
// gets its own answers back as commands; command echo; verbose and bare
// errors (a refused open then carries no code); unsolicited lines inside
// answers; no vendor queries (presence by AT+CPIN?, no ATR, learned once).
TEST(ModemHabits, ASim1SessionOnEachKindOfModem) {
  struct Habit {
    std::vector<std::string> args;
    bool vendorQueries, numericErrors, card;
  };
  const Habit habits[] = {
      {{"--tty-defaults"}, true, true, true},
      {{"--echo"}, true, true, true},
      {{"--errors", "verbose"}, true, false, true},
      {{"--errors", "bare"}, true, false, true},
      {{"--unsol", "1"}, true, true, true},
      {{"--no-vendor-queries"}, false, true, true},
      {{"--profile", "usb"}, false, false, true},
      {{"--profile", "usb", "--errors", "bare", "--unsol", "1"}, false, false, true},
      {{"--profile", "usb", "--card-absent"}, false, false, false},
      {{"--no-vendor-queries", "--errors", "bare", "--card-absent"}, false, false, false},
  };
  const std::regex sent("atchannel: m0_[0-9]+>(AT.*)");
  const std::regex received("^< (.*)");
  for (const Habit& h : habits) {
    std::string name;
    for (const std::string& a : h.args) name += a + " ";
    SCOPED_TRACE(name);
    System sys;
    sys.modem = startModem(sys.root, 0, h.args);
    sys.daemon = startDaemon(sys.root);
    {
      SecliSession s(sys.root, "SIM1");
      EXPECT_EQ(field(s.call("init"), "state"), "true");
      // The second round asks what the first one learned about the modem.
      for (int round = 0; round < 2; ++round) {
        EXPECT_EQ(field(s.call("present"), "present"), h.card ? "true" : "false");
        EXPECT_EQ(field(s.call("atr"), "atr"), h.card && h.vendorQueries ? "3B86800153452D53494D6B" : "");
      }
      if (!h.card) {
        EXPECT_EQ(field(s.call(std::string("open ") + kEchoApplet), "status"), "FAILED");
      } else {
        const int channel = openEcho(s);
        EXPECT_EQ(channel, 1);
        EXPECT_EQ(echo(s, channel, "5A"), "5A9000");
        EXPECT_EQ(field(s.call("transmit 00 CA 00 66"), "response"), "66067304060201019000");
        EXPECT_EQ(field(s.call("open A000000001FF"), "status"),
                  h.numericErrors ? "NO_SUCH_ELEMENT_ERROR" : "FAILED");
        EXPECT_EQ(field(s.call("close " + std::to_string(channel)), "status"), "SUCCESS");
        EXPECT_EQ(echo(s, channel, "5A"), "");
      }
    }
    // Both logs complete: the daemon first, so that no port is in use when
    // the modem goes.
    sys.daemon->stop(SIGKILL);
    sys.modem->stop(SIGTERM);
    const std::string daemonLog = sys.daemon->err().text();
    const std::string modemLog = sys.modem->err().text();
    EXPECT_NE(daemonLog.find("asyncCmdRawTerminal, /dev/appvcom18 is a terminal: raw mode set"),
              std::string::npos);
    // Nothing reached the modem but the daemon's commands.
    const std::vector<std::string> heads = commandHeads(modemLog, received);
    EXPECT_EQ(heads, commandHeads(daemonLog, sent));
    EXPECT_GE(heads.size(), h.card ? 9u : 4u);
    EXPECT_EQ(countOf(modemLog, "< AT^CARDTYPE?"), h.vendorQueries ? 2u : 1u);
    EXPECT_EQ(countOf(modemLog, "< AT^CARDATR"), h.vendorQueries ? 2u : 1u);
    EXPECT_EQ(countOf(modemLog, "< AT+CPIN?"), h.vendorQueries ? 0u : 2u);
  }
}

// A device root of 200 characters, as a user's build or temporary folder may
// be: every socket path is longer than a Unix socket address holds, so the
// daemon binds and secli connects relative to the socket's folder. Both
// instances, HIDL and AIDL; the first secli waits for the AIDL instance of a
// daemon that has just been started.
TEST(DeepDeviceRoot, TwoHundredCharactersDeep) {
  System sys(200);
  ASSERT_GE(sys.root.path().size(), 200u);
  sys.modem = startModem(sys.root, 0);
  sys.daemon = std::make_unique<Process>(std::vector<std::string>{kDaemon}, sys.root.path());
  std::string out;
  EXPECT_EQ(secli(sys.root, {"--aidl", "--wait", "20", "-i", "SIM1", "present"}, &out), 0);
  // No init yet: the modem port is not open, and the call says it failed.
  EXPECT_EQ(out, "FAILED (isCardPresent failed)\n");
  EXPECT_EQ(secli(sys.root, {"list"}, &out), 0);
  EXPECT_EQ(out,
            "SIM1\neSE1\nandroid.hardware.secure_element.ISecureElement/SIM1\n"
            "android.hardware.secure_element.ISecureElement/eSE1\n");
  for (const char* instance : {"eSE1", "SIM1"}) {
    for (bool aidl : {false, true}) {
      SCOPED_TRACE(std::string(instance) + (aidl ? " AIDL" : " HIDL"));
      SecliSession s(sys.root, instance, aidl ? std::vector<std::string>{"--aidl"} : std::vector<std::string>{});
      EXPECT_EQ(field(s.call("init"), "state"), "true");
      const int channel = openEcho(s);
      EXPECT_EQ(echo(s, channel, "C3"), "C39000");
      EXPECT_EQ(field(s.call("close " + std::to_string(channel)), "status"), "SUCCESS");
    }
  }
}

// Where the socket cannot be made (a file in the way of its folder, a device
// root so deep that the folder's path exceeds what the system takes), the
// first registration fails with a line naming the path and the daemon ends
// with status 1.
TEST_F(EndToEnd, AFailedRegistrationEndsTheDaemon) {
  const struct {
    size_t rootLength;
    const char* eseType;
    const char* says;
  } cases[] = {
      {0, "1", "SecureElement Registered eSE1 fail"},
      {0, "0", "ZerbSimSecureElement Registered sim1 fail"},
      {4080, "1", "/dev/socket/secure_element: File name too long"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.says);
    TempRoot r(c.rootLength);
    if (c.rootLength == 0) r.write("dev/socket", "a file where the socket folder should be\n");
    r.property(std::string("vendor.ese_sim.type=") + c.eseType);
    Process d({kDaemon}, r.path());
    EXPECT_EQ(d.waitExit(), 1) << d.err().text();
    EXPECT_NE(d.err().text().find(c.says), std::string::npos) << d.err().text();
    expectNoSanitizerReport("daemon", d.err().text());
  }
}

}  // namespace

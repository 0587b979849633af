// The whole system as a user runs it: the daemon with the simulated eSE
// library, modem-sim behind "SIM1", and secli clients, over the daemon's
// real sockets and a real pty.
#include <gtest/gtest.h>

#include <signal.h>

#include <string>

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

// Where the socket cannot be made, the first registration fails and the
// daemon ends with status 1.
TEST_F(EndToEnd, AFailedRegistrationEndsTheDaemon) {
  for (const auto& c : {std::make_pair("1", "SecureElement Registered eSE1 fail"),
                        std::make_pair("0", "ZerbSimSecureElement Registered sim1 fail")}) {
    TempRoot r;
    r.write("dev/socket", "a file where the socket folder should be\n");
    r.property(std::string("vendor.ese_sim.type=") + c.first);
    Process d({kDaemon}, r.path());
    EXPECT_EQ(d.waitExit(), 1) << d.err().text();
    EXPECT_NE(d.err().text().find(c.second), std::string::npos) << d.err().text();
    expectNoSanitizerReport("daemon", d.err().text());
  }
}

}  // namespace

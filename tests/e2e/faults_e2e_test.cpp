// Field faults over the real programs: a silent or restarted modem, a modem
// that comes up late or answers malformed lines, a vendor library call that
// never returns, a card that hands out channels the daemon cannot serve. Each
// instance keeps answering whatever happens to the other, within the bounds
// the README's failure model gives. The SIM1 cases run once with the modem
// answering AT+CCHO/AT+CCHP with the "+CCHO:" prefix and once in the bare
// form of 3GPP TS 27.007.
#include <gtest/gtest.h>

#include <signal.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;
using Clock = std::chrono::steady_clock;

// A basic-channel APDU: it goes to the modem as AT+CSIM.
constexpr const char* kBasicGetData = "transmit 00 CA 00 66 00";

// Asks "present" until the answer is true; false when it never is within
// `ms`. Right after the port's log line a call may still find it away.
bool servedWithin(SecliSession& s, long ms) {
  const auto t0 = Clock::now();
  do {
    if (field(s.call("present"), "present") == "true") return true;
  } while (msSince(t0) < ms);
  return false;
}

// SIM1's init returns once the worker has had its first try at the port; a
// loaded machine may need more: wait until a call is served.
bool initSim(SecliSession& s) {
  return field(s.call("init"), "state") == "true" && servedWithin(s, 10000);
}

// The answer to a command sent earlier with send().
std::string answerOf(SecliSession& s) {
  std::string line;
  return s.answer(&line) ? line : "(no answer; stderr: " + s.process().err().text() + ")";
}

enum class OpenForm { kPrefixed, kBare };

class SimFaults : public ::testing::TestWithParam<OpenForm>, public System {
 protected:
  void startModem(std::vector<std::string> extra = {}) {
    if (GetParam() == OpenForm::kBare) extra.push_back("--bare-open");
    modem = se_test::startModem(root, 0, extra);
  }
};

// A SIM call stuck on a modem that does not answer, two more SIM callers
// behind it: eSE1 calls and an eSE client's death notice still get a thread
// within a second; a caller beyond the three SIM1 admits is refused at once;
// the callers behind the stuck one give up at the hang bound.
TEST_P(SimFaults, ASilentModemLeavesEse1Answering) {
  ASSERT_NO_FATAL_FAILURE(startModem({"--silent-on", "AT+CSIM"}));
  root.property("vendor.secure_element.sim.hang_ms=5000");
  daemon = startDaemon(root);
  SecliSession sim(root, "SIM1");
  ASSERT_TRUE(initSim(sim));
  const int ch = openEcho(sim);  // opens still work: only AT+CSIM is silent
  ASSERT_GE(ch, 1);
  SecliSession ese(root, "eSE1");
  auto victim = std::make_unique<SecliSession>(root, "eSE1");
  for (SecliSession* s : {&ese, victim.get()}) ASSERT_EQ(field(s->call("init"), "state"), "true");
  // Connected already, so that their calls reach the daemon before eSE1's.
  SecliSession sim2(root, "SIM1");
  SecliSession sim3(root, "SIM1");
  SecliSession sim4(root, "SIM1");
  for (SecliSession* s : {&sim2, &sim3, &sim4}) ASSERT_EQ(field(s->call("present"), "present"), "true");

  size_t mark = modem->err().size();
  const size_t daemonMark = daemon->err().size();
  // The silence starts once the command is written, after this moment.
  const auto sent = Clock::now();
  sim.send(kBasicGetData);
  ASSERT_TRUE(modem->err().waitFor("< AT+CSIM=", mark));  // now stuck at the modem
  sim2.send("present");
  sim3.send(echoCommand(ch, "AA"));
  sim4.send("present");

  auto t0 = Clock::now();
  EXPECT_EQ(field(ese.call(kBasicGetData), "response").substr(0, 2), "66");
  EXPECT_LT(msSince(t0), 1000);
  RecordProperty("ese_transmit_ms", static_cast<int>(msSince(t0)));

  mark = daemon->err().size();
  t0 = Clock::now();
  victim->process().stop(SIGKILL);
  EXPECT_TRUE(daemon->err().waitFor("qvese@1.0-service: serviceDied enter!", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close", mark));
  EXPECT_LT(msSince(t0), 1000);
  RecordProperty("ese_death_notice_ms", static_cast<int>(msSince(t0)));
  victim.reset();

  // One of the three callers behind the stuck one found SIM1 full and was
  // refused; the other two gave up at the hang bound. Each got its failure.
  EXPECT_EQ(field(answerOf(sim2), "present"), "false");
  EXPECT_EQ(field(answerOf(sim3), "response"), "");
  EXPECT_EQ(field(answerOf(sim4), "present"), "false");
  EXPECT_GE(msSince(sent), 5000);
  EXPECT_TRUE(daemon->err().waitFor("SIM1 without progress for", daemonMark));
  EXPECT_EQ(countOf(daemon->err().text().substr(daemonMark), "SIM1 busy with 3 callers: call refused"), 1u);
  std::string line;
  EXPECT_FALSE(sim.answer(&line, 0)) << "the silent modem answered: " << line;

  // The stuck client itself dies: its death notice is taken as well, and the
  // close of its channel waits for the modem.
  mark = daemon->err().size();
  t0 = Clock::now();
  sim.process().stop(SIGKILL);
  EXPECT_TRUE(daemon->err().waitFor("ZerbSimSecureElement: serviceDied, enter", mark));
  EXPECT_TRUE(daemon->err().waitFor("serviceDied, close of channel " + std::to_string(ch) +
                                        ", SIM1 busy: queued until it is free", mark));
  EXPECT_LT(msSince(t0), 1000);
}

// The modem restarts: while its port is away SIM1 calls fail within 6 s
// each; once it is back SIM1 serves again within 10 s, without a daemon
// restart. Channels from before are gone with the modem.
TEST_P(SimFaults, Sim1ServesAgainAfterTheModemRestarts) {
  ASSERT_NO_FATAL_FAILURE(startModem());
  daemon = startDaemon(root);
  SecliSession sim(root, "SIM1");
  ASSERT_TRUE(initSim(sim));
  const int old = openEcho(sim);
  ASSERT_GE(old, 1);
  ASSERT_EQ(echo(sim, old, "11"), "119000");

  size_t mark = daemon->err().size();
  modem->stop(SIGTERM);
  ASSERT_TRUE(daemon->err().waitFor("AT port lost", mark));
  const std::vector<std::string> whileAway[] = {
      {"present", "present", "false"},
      {"atr", "atr", ""},
      {echoCommand(old, "22"), "response", ""},
      {std::string("open ") + kEchoApplet, "status", "FAILED"},
      {"close " + std::to_string(old), "status", "FAILED"},
  };
  long slowest = 0;
  for (const auto& c : whileAway) {
    const auto t0 = Clock::now();
    EXPECT_EQ(field(sim.call(c[0]), c[1]), c[2]) << c[0];
    EXPECT_LT(msSince(t0), 6000) << c[0];
    slowest = std::max(slowest, msSince(t0));
  }
  RecordProperty("slowest_call_while_away_ms", static_cast<int>(slowest));

  mark = daemon->err().size();
  const auto back = Clock::now();
  ASSERT_NO_FATAL_FAILURE(startModem());
  ASSERT_TRUE(daemon->err().waitFor("AT port back", mark));
  EXPECT_TRUE(servedWithin(sim, 10000 - msSince(back)));
  RecordProperty("served_after_restart_ms", static_cast<int>(msSince(back)));
  EXPECT_EQ(echo(sim, old, "33"), "");  // the old session went with the modem
  EXPECT_EQ(echo(sim, openEcho(sim), "44"), "449000");
}

// The modem's port appears only after SIM1's first init has given up its
// start attempts: calls fail until then, and SIM1 serves once it is there.
// Finding the port plays no part in the open form: this case runs once.
class SimLateModem : public ::testing::Test, public System {};

TEST_F(SimLateModem, AModemThatComesUpLateIsServed) {
  daemon = startDaemon(root);
  SecliSession sim(root, "SIM1");
  const size_t mark = daemon->err().size();
  sim.send("init");
  ASSERT_TRUE(daemon->err().waitFor("still waiting for the AT port", mark));
  EXPECT_EQ(field(answerOf(sim), "state"), "true");
  const auto t0 = Clock::now();
  EXPECT_EQ(field(sim.call("present"), "present"), "false");
  EXPECT_LT(msSince(t0), 6000);

  const auto up = Clock::now();
  modem = se_test::startModem(root, 0, {});
  ASSERT_TRUE(daemon->err().waitFor("AT port back", mark));
  EXPECT_TRUE(servedWithin(sim, 10000));
  RecordProperty("served_after_start_ms", static_cast<int>(msSince(up)));
  EXPECT_EQ(echo(sim, openEcho(sim), "55"), "559000");
}

// A +CGLA:/+CSIM: answer whose length field is shorter than its text is a
// failure, never a response cut before its status word; the failed open
// releases the session the modem gave.
TEST_P(SimFaults, AShortLengthFieldGivesAFailure) {
  ASSERT_NO_FATAL_FAILURE(startModem({"--short-length"}));
  daemon = startDaemon(root);
  SecliSession sim(root, "SIM1");
  ASSERT_TRUE(initSim(sim));
  EXPECT_EQ(field(sim.call(kBasicGetData), "response"), "");
  const std::string open = sim.call(std::string("open ") + kEchoApplet);
  EXPECT_EQ(field(open, "status"), "FAILED") << open;
  EXPECT_TRUE(modem->err().waitFor("< AT+CCHC=257"));
}

// A healthy but slow modem (150 ms per answer) and three SIM1 clients at
// once: nobody gives up, every answer is right.
TEST_P(SimFaults, ASlowModemServesEveryWaitingClient) {
  ASSERT_NO_FATAL_FAILURE(startModem({"--delay", "150"}));
  daemon = startDaemon(root);
  std::vector<std::unique_ptr<SecliSession>> clients;
  for (int i = 0; i < 3; ++i) {
    clients.push_back(std::make_unique<SecliSession>(root, "SIM1"));
    ASSERT_TRUE(initSim(*clients.back()));
  }
  for (auto& c : clients) c->send(std::string("open ") + kEchoApplet);
  std::vector<int> channels;
  for (auto& c : clients) {
    const std::string open = answerOf(*c);
    EXPECT_EQ(field(open, "status"), "SUCCESS") << open;
    channels.push_back(std::atoi(field(open, "channel").c_str()));
  }
  for (size_t i = 0; i < clients.size(); ++i) clients[i]->send(echoCommand(channels[i], hexByte(i)));
  for (size_t i = 0; i < clients.size(); ++i) {
    EXPECT_EQ(field(answerOf(*clients[i]), "response"), hexByte(i) + "9000");
  }
  EXPECT_EQ(daemon->err().text().find("given up"), std::string::npos);
}

INSTANTIATE_TEST_SUITE_P(OpenForms, SimFaults,
                         ::testing::Values(OpenForm::kPrefixed, OpenForm::kBare),
                         [](const ::testing::TestParamInfo<OpenForm>& info) {
                           return info.param == OpenForm::kBare ? "Bare" : "Prefixed";
                         });

class EseFaults : public ::testing::Test, public System {
 protected:
  void start() {
    modem = se_test::startModem(root, 0);
    daemon = startDaemon(root);
  }
  std::string openChannelsOnTheCard() {
    std::ifstream in(root.at("data/vendor/ese_sim/open_channels"));
    std::stringstream ss;
    ss << in.rdbuf();
    return in ? ss.str() : "(no report)";
  }
};

// A vendor library call that hangs: SIM1 is served within a second, other
// eSE callers give up with their usual failure at the hang bound, a death
// notice is not held up, and once the call returns the close the death
// notice left runs before the eSE serves again.
TEST_F(EseFaults, AHungVendorCallLeavesSim1Answering) {
  root.property("vendor.secure_element.ese.hang_ms=2000");
  ASSERT_NO_FATAL_FAILURE(start());
  SecliSession sim(root, "SIM1");
  ASSERT_TRUE(initSim(sim));
  const int simCh = openEcho(sim);
  ASSERT_GE(simCh, 1);
  SecliSession stuck(root, "eSE1");
  SecliSession other(root, "eSE1");
  auto victim = std::make_unique<SecliSession>(root, "eSE1");
  for (SecliSession* s : {&stuck, &other, victim.get()}) {
    ASSERT_EQ(field(s->call("init"), "state"), "true");
  }
  const int eseCh = openEcho(stuck);
  ASSERT_GE(eseCh, 1);

  root.property("vendor.ese_sim.hang_exchange=1");
  size_t mark = daemon->err().size();
  // The hung call enters the library after this moment.
  const auto sent = Clock::now();
  stuck.send(echoCommand(eseCh, "5A"));
  ASSERT_TRUE(daemon->err().waitFor("phQVNciHal_Transmit_APDU_by_IPC: hanging", mark));
  other.send(echoCommand(eseCh, "5B"));

  auto t0 = Clock::now();
  EXPECT_EQ(echo(sim, simCh, "C3"), "C39000");
  EXPECT_LT(msSince(t0), 1000);
  RecordProperty("sim_transmit_ms", static_cast<int>(msSince(t0)));
  EXPECT_EQ(field(answerOf(other), "response"), "1F");
  EXPECT_GE(msSince(sent), 2000);
  EXPECT_TRUE(daemon->err().waitFor("transmit, eSE1 without progress for", mark));
  t0 = Clock::now();  // a later caller gives up at once
  EXPECT_EQ(field(other.call(std::string("open ") + kEchoApplet), "status"), "FAILED");
  EXPECT_LT(msSince(t0), 1000);

  mark = daemon->err().size();
  t0 = Clock::now();
  victim->process().stop(SIGKILL);
  EXPECT_TRUE(daemon->err().waitFor("serviceDied, phQvEse_close, eSE1 busy: queued until it is free", mark));
  EXPECT_LT(msSince(t0), 1000);
  RecordProperty("ese_death_notice_ms", static_cast<int>(msSince(t0)));
  victim.reset();
  EXPECT_EQ(echo(sim, simCh, "C4"), "C49000");

  // The call returns: its answer, then the close the death notice left.
  mark = daemon->err().size();
  root.property("vendor.ese_sim.hang_exchange=0");
  EXPECT_EQ(field(answerOf(stuck), "response"), "5A9000");
  EXPECT_TRUE(daemon->err().waitFor("serviceDied, phQvEse_close, eSE1: queued cleanup runs now", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close: closed", mark));
  ASSERT_EQ(field(other.call("init"), "state"), "true");
  EXPECT_EQ(echo(other, openEcho(other), "77"), "779000");
}

// The card hands out channels above 3: each open is refused, and the channel
// is closed on the card, so none is left open and none is used up.
TEST_F(EseFaults, ARefusedChannelIsNotLeftOpenOnTheCard) {
  root.property("vendor.ese_sim.channels=8");
  root.property("vendor.ese_sim.min_channel=4");
  daemon = startDaemon(root);
  SecliSession ese(root, "eSE1");
  ASSERT_EQ(field(ese.call("init"), "state"), "true");
  // More opens than the card has channels from 4 on: a leak would show as
  // 6A 81 on the fifth.
  for (int i = 0; i < 5; ++i) {
    SCOPED_TRACE(i);
    const std::string open = ese.call(std::string("open ") + kEchoApplet);
    EXPECT_EQ(field(open, "status"), "CHANNEL_NOT_AVAILABLE") << open;
    EXPECT_EQ(field(open, "channel"), "255") << open;
    EXPECT_EQ(openChannelsOnTheCard(), "\n");
  }
  EXPECT_EQ(countOf(daemon->err().text(), "card assigned channel 4, closing it"), 5u);

  root.property("vendor.ese_sim.min_channel=1");
  const int ch = openEcho(ese);
  EXPECT_EQ(ch, 1);
  EXPECT_EQ(openChannelsOnTheCard(), "1\n");
  EXPECT_EQ(echo(ese, ch, "66"), "669000");
}

}  // namespace

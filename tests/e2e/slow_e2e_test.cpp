// Healthy devices that are slow, as real ones are: a modem that takes 1.5 s
// for each answer, a card command that takes 3 s. Nothing a healthy device
// does fails a call; the other instance keeps answering within a second;
// closes owed by a client that died are made once the device is free.
#include <gtest/gtest.h>

#include <signal.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;
using Clock = std::chrono::steady_clock;

// The answer to a command sent earlier with send().
std::string answerOf(SecliSession& s) {
  std::string line;
  return s.answer(&line, 60000) ? line : "(no answer; stderr: " + s.process().err().text() + ")";
}

class SlowDevices : public ::testing::Test, public System {
 protected:
  void start(const std::vector<std::string>& modemExtra) {
    modem = startModem(root, 0, modemExtra);
    daemon = startDaemon(root);
  }
  // Several eSE1 transmits while `busy` is still true; the slowest in ms.
  long worstEseMs(SecliSession& ese, int channel, const std::function<bool()>& busy) {
    long worst = 0;
    const auto start = Clock::now();
    do {
      const auto t0 = Clock::now();
      EXPECT_EQ(echo(ese, channel, "E1"), "E19000");
      worst = std::max(worst, msSince(t0));
    } while (busy() && msSince(start) < 60000);
    return worst;
  }
};

// Three SIM1 clients at once on a modem that takes 1.5 s for each answer: each
// opens a channel and exchanges an APDU on it, every answer right, while eSE1
// answers within a second throughout. A fourth client finds SIM1 full and is
// refused at once, over AIDL with an error, not a default value.
TEST_F(SlowDevices, ThreeSimClientsOnASlowModemAreAllServed) {
  ASSERT_NO_FATAL_FAILURE(start({"--delay", "1500"}));
  SecliSession ese(root, "eSE1");
  ASSERT_EQ(field(ese.call("init"), "state"), "true");
  const int eseCh = openEcho(ese);
  ASSERT_GE(eseCh, 1);
  std::vector<std::unique_ptr<SecliSession>> sims;
  for (int i = 0; i < 3; i++) {
    sims.push_back(std::make_unique<SecliSession>(root, "SIM1"));
    ASSERT_EQ(field(sims.back()->call("init"), "state"), "true");
  }
  const size_t mark = daemon->err().size();
  for (auto& s : sims) s->send(std::string("open ") + kEchoApplet);
  ASSERT_TRUE(daemon->err().waitFor("openLogicalChannel, SIM1 busy: waiting (3 callers)", mark));

  SecliSession fourth(root, "SIM1", {"--aidl"});
  const auto t0 = Clock::now();
  const std::string refused = fourth.call("present");
  EXPECT_EQ(field(refused, "status"), "FAILED") << refused;
  EXPECT_LT(msSince(t0), 1000);

  size_t answered = 0;
  std::vector<int> channels;
  const long worst = worstEseMs(ese, eseCh, [&] {
    std::string line;
    while (answered < sims.size() && sims[answered]->answer(&line, 0)) {
      EXPECT_EQ(field(line, "status"), "SUCCESS") << line;
      channels.push_back(std::atoi(field(line, "channel").c_str()));
      answered++;
    }
    return answered < sims.size();
  });
  ASSERT_EQ(answered, sims.size());
  EXPECT_LT(worst, 1000);
  RecordProperty("ese_worst_ms_behind_slow_opens", static_cast<int>(worst));
  for (size_t i = 0; i < sims.size(); i++) sims[i]->send(echoCommand(channels[i], hexByte(0x30 + i)));
  for (size_t i = 0; i < sims.size(); i++) {
    EXPECT_EQ(field(answerOf(*sims[i]), "response"), hexByte(0x30 + i) + "9000");
  }
  EXPECT_EQ(countOf(daemon->err().text(), "call given up"), 0u);
}

// An eSE1 command that takes 3 s (a key generation): an exchange queued
// behind it is served with its own answer, an init sent meanwhile gets its
// state, and SIM1 answers within a second throughout.
TEST_F(SlowDevices, AnEseCallQueuedBehindALongCommandIsServed) {
  root.property("vendor.ese_sim.slow_p1=55");
  root.property("vendor.ese_sim.slow_ms=3000");
  ASSERT_NO_FATAL_FAILURE(start({}));
  SecliSession sim(root, "SIM1");
  ASSERT_EQ(field(sim.call("init"), "state"), "true");
  const int simCh = openEcho(sim);
  ASSERT_GE(simCh, 1);
  SecliSession slow(root, "eSE1");
  SecliSession queued(root, "eSE1");
  SecliSession starting(root, "eSE1");
  for (SecliSession* s : {&slow, &queued}) ASSERT_EQ(field(s->call("init"), "state"), "true");
  const int a = openEcho(slow);
  const int b = openEcho(queued);
  ASSERT_GE(a, 1);
  ASSERT_GE(b, 1);

  const size_t mark = daemon->err().size();
  slow.send("transmit " + hexByte(a) + " 01 55 00 01 AB");
  ASSERT_TRUE(daemon->err().waitFor("slow command (P1 55)", mark));
  const auto t0 = Clock::now();
  queued.send(echoCommand(b, "CD"));
  starting.send("init");
  long worst = 0;
  for (int i = 0; i < 5; i++) {
    const auto s0 = Clock::now();
    EXPECT_EQ(echo(sim, simCh, "5" + std::to_string(i)), "5" + std::to_string(i) + "9000");
    worst = std::max(worst, msSince(s0));
  }
  EXPECT_LT(worst, 1000);
  RecordProperty("sim_worst_ms_behind_long_ese_command", static_cast<int>(worst));
  EXPECT_EQ(field(answerOf(slow), "response"), "AB9000");
  EXPECT_EQ(field(answerOf(queued), "response"), "CD9000");
  EXPECT_EQ(field(answerOf(starting), "state"), "true");
  EXPECT_GE(msSince(t0), 2000);
  EXPECT_EQ(countOf(daemon->err().text(), "call given up"), 0u);
}

// A client killed while its command runs on the slow modem: the channel it
// held is closed at the modem within 5 s after that command ends, and the
// client started again is served.
TEST_F(SlowDevices, AClientKilledMidCommandHasItsChannelClosed) {
  ASSERT_NO_FATAL_FAILURE(start({"--delay", "1500"}));
  int channel = -1;
  {
    SecliSession victim(root, "SIM1");
    ASSERT_EQ(field(victim.call("init"), "state"), "true");
    channel = openEcho(victim);
    ASSERT_GE(channel, 1);
    const size_t mark = modem->err().size();
    victim.send(echoCommand(channel, "77"));
    ASSERT_TRUE(modem->err().waitFor("< AT+CGLA=", mark));
    victim.process().stop(SIGKILL);
  }
  // The command's answer, then the close.
  const size_t mark = modem->err().size();
  ASSERT_TRUE(modem->err().waitFor("> +CGLA:", mark));
  const auto answered = Clock::now();
  EXPECT_TRUE(modem->err().waitFor("< AT+CCHC=" + std::to_string(256 + channel), mark));
  EXPECT_LT(msSince(answered), 5000);
  RecordProperty("close_ms_after_command", static_cast<int>(msSince(answered)));

  SecliSession again(root, "SIM1");
  ASSERT_EQ(field(again.call("init"), "state"), "true");
  const int ch = openEcho(again);
  ASSERT_GE(ch, 1);
  EXPECT_EQ(echo(again, ch, "78"), "789000");
}

// An AIDL reset while another SIM1 client's command runs waits for it, then
// closes every channel, whoever opened it, and only then answers SUCCESS.
TEST_F(SlowDevices, AnAidlResetDuringABusySimClosesEveryChannel) {
  ASSERT_NO_FATAL_FAILURE(start({"--delay", "700"}));
  SecliSession aidl(root, "SIM1", {"--aidl"});
  SecliSession other(root, "SIM1");
  ASSERT_EQ(field(aidl.call("init"), "status"), "SUCCESS");
  ASSERT_EQ(field(other.call("init"), "state"), "true");
  const int mine = openEcho(aidl);
  const int theirs = openEcho(other);
  ASSERT_GE(mine, 1);
  ASSERT_GE(theirs, 1);
  const size_t mark = modem->err().size();
  other.send(echoCommand(theirs, "11"));
  ASSERT_TRUE(modem->err().waitFor("< AT+CGLA=", mark));
  const std::string reset = aidl.call("reset");
  EXPECT_EQ(field(reset, "status"), "SUCCESS") << reset;
  EXPECT_NE(reset.find("[false,true]"), std::string::npos) << reset;
  EXPECT_EQ(field(answerOf(other), "response"), "119000");
  for (int ch : {mine, theirs}) {
    EXPECT_EQ(countOf(modem->err().text(), "< AT+CCHC=" + std::to_string(256 + ch)), 1u) << ch;
  }
  EXPECT_EQ(echo(other, theirs, "12"), "");
}

}  // namespace

// The chaos soak's schedule and judge: a seed must replay the same run, and
// the judge must tell a right answer, a documented failure and a wrong one
// apart (a judge that passes everything would make the soak worthless).
#include <gtest/gtest.h>

#include <set>

#include "card_applets.h"
#include "virtual_card.h"
#include "chaos_check.h"
#include "chaos_judge.h"
#include "chaos_plan.h"
#include "chaos_record.h"

namespace chaos {
namespace {

using Bytes = std::vector<uint8_t>;

TEST(ChaosPlan, TheSeedFixesTheWholeScheduleAndFaultsOfOneStreamNeverOverlap) {
  const Plan a = makePlan(1207, 60000, false), b = makePlan(1207, 60000, false), c = makePlan(1208, 60000, false);
  ASSERT_EQ(a.faults.size(), b.faults.size());
  bool differs = a.faults.size() != c.faults.size();
  for (size_t i = 0; i < a.faults.size(); ++i) {
    EXPECT_EQ(describeFault(a.faults[i]), describeFault(b.faults[i]));
    EXPECT_EQ(a.faults[i].startMs, b.faults[i].startMs);
    EXPECT_EQ(a.faults[i].endMs, b.faults[i].endMs);
    EXPECT_LE(a.faults[i].endMs, 59000);
    if (i < c.faults.size()) differs = differs || a.faults[i].startMs != c.faults[i].startMs;
  }
  EXPECT_TRUE(differs);
  ASSERT_EQ(a.kills.size(), b.kills.size());
  for (size_t i = 0; i < a.kills.size(); ++i) EXPECT_EQ(a.kills[i].atMs, b.kills[i].atMs);
  EXPECT_EQ(a.clientSeed(3, 7), b.clientSeed(3, 7));
  EXPECT_NE(a.clientSeed(3, 7), a.clientSeed(3, 8));

  // The modem's outages share one stream: never two at once.
  auto outage = [](FaultKind k) {
    return k == FaultKind::ModemSilence || k == FaultKind::ModemPortLost || k == FaultKind::ModemRestart;
  };
  int64_t lastEnd = -1;
  std::set<FaultKind> kinds;
  for (const Fault& f : makePlan(99, 600000, false).faults) {
    kinds.insert(f.kind);
    if (!outage(f.kind)) continue;
    EXPECT_GT(f.startMs, lastEnd);
    lastEnd = f.endMs;
  }
  EXPECT_EQ(kinds.size(), 10u);  // every kind but the PC/SC card's
  EXPECT_EQ(makePlan(99, 600000, true).faults.size() > 0, true);
}

TEST(ChaosRecord, RoundTrip) {
  CallRecord r;
  r.slot = 3;
  r.gen = 2;
  r.seq = 17;
  r.kind = Kind::Transmit;
  r.inst = Inst::Sim;
  r.iface = Iface::Aidl;
  r.t0 = 100;
  r.t1 = 250;
  r.cmd = {0x01, 0x01, 0x00, 0x00};
  r.channel = 1;
  r.appletKnown = true;
  r.appletAid = se_card::aid::kEcho;
  r.error = "connection lost to peer";
  r.status = "SUCCESS";
  r.data = {0x90, 0x00};
  CallRecord back;
  ASSERT_TRUE(decodeRecord(encodeRecord(r), &back));
  EXPECT_EQ(encodeRecord(back), encodeRecord(r));
  EXPECT_EQ(back.appletAid, r.appletAid);
  EXPECT_FALSE(decodeRecord("E slot=1", &back));
}

CallRecord transmit(Inst inst, Iface iface, const Bytes& cmd, const Bytes& answer, const std::string& status = "") {
  CallRecord r;
  r.kind = Kind::Transmit;
  r.inst = inst;
  r.iface = iface;
  r.cmd = cmd;
  r.channel = 2;
  r.appletKnown = true;
  r.appletAid = se_card::aid::kEcho;
  r.data = answer;
  r.status = iface == Iface::Aidl && status.empty() ? "SUCCESS" : status;
  return r;
}

TEST(ChaosCheck, AnswersAreRightCleanFailuresOrWrong) {
  const Bytes echo = {0x02, 0x01, 0x00, 0x00, 0x02, 0xAA, 0xBB};
  const Bytes sw = {0x02, 0x02, 0x6A, 0x82, 0x01, 0xCC};
  CallContext certain, lost;
  lost.channelCertain = false;
  struct Case {
    const char* what;
    CallRecord r;
    CallContext c;
    Outcome want;
  } cases[] = {
      {"echo answered", transmit(Inst::Sim, Iface::Hidl, echo, {0xAA, 0xBB, 0x90, 0x00}), certain, Outcome::Ok},
      {"status word asked for", transmit(Inst::Ese, Iface::Aidl, sw, {0xCC, 0x6A, 0x82}), certain, Outcome::Ok},
      {"a wrong byte", transmit(Inst::Sim, Iface::Hidl, echo, {0xAA, 0xBC, 0x90, 0x00}), certain, Outcome::Wrong},
      {"a wrong status word", transmit(Inst::Ese, Iface::Aidl, sw, {0xCC, 0x90, 0x00}), certain, Outcome::Wrong},
      {"no status word", transmit(Inst::Ese, Iface::Aidl, echo, {0xAA}), lost, Outcome::Wrong},
      {"SUCCESS with nothing", transmit(Inst::Sim, Iface::Aidl, echo, {}), certain, Outcome::Wrong},
      {"eSE1's failure marker", transmit(Inst::Ese, Iface::Hidl, echo, {0x1F}), certain, Outcome::Clean},
      {"SIM1's failure marker", transmit(Inst::Sim, Iface::Hidl, echo, {}), certain, Outcome::Clean},
      {"an AIDL error", transmit(Inst::Sim, Iface::Aidl, echo, {}, "CHANNEL_NOT_AVAILABLE"), certain, Outcome::Clean},
      {"a lost channel's answer", transmit(Inst::Ese, Iface::Hidl, echo, {0x68, 0x81}), lost, Outcome::Clean},
      {"a transport error", [&] { CallRecord r = transmit(Inst::Ese, Iface::Hidl, echo, {}); r.error = "x"; return r; }(),
       certain, Outcome::Wrong},
  };
  for (const Case& c : cases) EXPECT_EQ(classify(c.r, c.c).outcome, c.want) << c.what;
  CallContext failing;
  failing.libFail = true;
  failing.libFailSw = 0x6F00;
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Hidl, echo, {0x6F, 0x00}), failing).outcome, Outcome::Clean)
      << "the failed exchange's status word";
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Aidl, echo, {0x6F, 0x00}), failing).outcome, Outcome::Wrong)
      << "AIDL SUCCESS for a failed exchange";
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Aidl, echo, {0x6F, 0x00}), certain).outcome, Outcome::Wrong);
  // All of a call inside the failing: nothing may be served, whatever the channel.
  CallContext allFailing = failing;
  allFailing.libFailAll = true;
  allFailing.channelCertain = false;
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Hidl, echo, {0x6F, 0x00}), allFailing).outcome, Outcome::Clean);
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Hidl, echo, {0x90, 0x00}), allFailing).outcome, Outcome::Wrong);
  EXPECT_EQ(classify(transmit(Inst::Ese, Iface::Aidl, echo, {0x6F, 0x00}), allFailing).outcome, Outcome::Wrong);

  auto call = [](Kind k, Inst inst, Iface iface) {
    CallRecord r;
    r.kind = k;
    r.inst = inst;
    r.iface = iface;
    r.status = iface == Iface::Aidl ? "SUCCESS" : "";
    return r;
  };
  CallRecord atr = call(Kind::Atr, Inst::Sim, Iface::Aidl);
  EXPECT_EQ(classify(atr, certain).outcome, Outcome::Wrong) << "SUCCESS with an empty ATR from SIM1";
  atr.data = se_card::defaultAtr();
  EXPECT_EQ(classify(atr, certain).outcome, Outcome::Ok);
  CallRecord present = call(Kind::Present, Inst::Sim, Iface::Aidl);
  EXPECT_EQ(classify(present, certain).outcome, Outcome::Wrong) << "SUCCESS with present=false";
  present.iface = Iface::Hidl;
  EXPECT_EQ(classify(present, certain).outcome, Outcome::Clean) << "HIDL's failure form";

  CallRecord open = call(Kind::Open, Inst::Sim, Iface::Hidl);
  open.cmd = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x77};
  open.status = "SUCCESS";
  open.resultChannel = 1;
  EXPECT_EQ(classify(open, certain).outcome, Outcome::Wrong) << "an AID the card lacks opened";
  open.status = "NO_SUCH_ELEMENT_ERROR";
  open.resultChannel = 0;
  EXPECT_EQ(classify(open, certain).outcome, Outcome::Clean);
  open.resultChannel = 3;
  EXPECT_EQ(classify(open, certain).outcome, Outcome::Wrong) << "SIM1 fails with channel 0";
  open.cmd = se_card::aid::kEcho;
  open.resultChannel = 0;
  EXPECT_EQ(classify(open, certain).outcome, Outcome::Wrong) << "an installed applet not found";

  CallRecord reset = call(Kind::Reset, Inst::Ese, Iface::Aidl);
  reset.states = "0";
  EXPECT_EQ(classify(reset, certain).outcome, Outcome::Wrong);
  reset.states = "01";
  EXPECT_EQ(classify(reset, certain).outcome, Outcome::Ok);
}

TEST(ChaosCheck, TheCardsAnswersFollowTheInstance) {
  // eSE1 fetches what the card leaves behind 61 xx; SIM1 hands it on.
  const Bytes big = expectedSelect(Inst::Ese, se_card::aid::kBig, 0);
  ASSERT_GE(big.size(), 4u);
  EXPECT_EQ(big[0], 0x6F);
  EXPECT_EQ(Bytes(big.end() - 2, big.end()), (Bytes{0x90, 0x00}));
  EXPECT_EQ(expectedSelect(Inst::Sim, se_card::aid::kBig, 0), (Bytes{0x61, static_cast<uint8_t>(big[1] + 2)}));
  EXPECT_TRUE(expectedSelect(Inst::Sim, {0xA0, 0x01}, 0).empty());
  EXPECT_EQ(expectedResponse(se_card::aid::kP2Reporter, 0x04, {0x03, 0x20, 0x00, 0x00, 0x01}),
            (Bytes{0x04, 0x90, 0x00}));
}

TEST(ChaosCheck, BoundsAddUpTheFaultsAroundACall) {
  BoundConfig c;
  Fault shortSilence{FaultKind::ModemSilence, 1000, 3500};
  Fault longSilence{FaultKind::ModemSilence, 1000, 9000};
  Fault bare{FaultKind::ModemBare, 0, 9000};
  EXPECT_EQ(callBoundMs({}, false, c), c.baseMs);
  // Waiting behind a silent modem ends at the hang bound; the call in flight
  // waits the silence out.
  EXPECT_EQ(callBoundMs({shortSilence}, false, c), c.baseMs + c.hangMs);
  EXPECT_EQ(callBoundMs({longSilence}, false, c), c.baseMs + 8000);
  EXPECT_EQ(callBoundMs({shortSilence, longSilence}, false, c), c.baseMs + c.hangMs + 8000);
  EXPECT_EQ(callBoundMs({longSilence}, false, c, false), c.baseMs + c.hangMs);
  // The other instance's faults cost nothing.
  EXPECT_EQ(callBoundMs({bare}, true, c), c.baseMs);
}

TEST(ChaosCheck, ServiceIsJudgedOutsideOutages) {
  EXPECT_FALSE(faultIsOutage(FaultKind::ModemBare));
  EXPECT_FALSE(faultIsOutage(FaultKind::LibSlow));
  EXPECT_TRUE(faultIsOutage(FaultKind::ModemSilence));
  EXPECT_TRUE(faultIsOutage(FaultKind::LibFail));
  EXPECT_EQ(uncoveredNs(0, 100, {}), 100);
  // Overlapping and unordered outages, one reaching past the end.
  EXPECT_EQ(uncoveredNs(0, 100, {{50, 70}, {10, 20}, {15, 30}, {90, 200}}), 10 + 20 + 20);
  EXPECT_EQ(uncoveredNs(0, 100, {{-10, 150}}), 0);
  // A recovery's clock stops while another outage lasts.
  EXPECT_EQ(afterUncovered(0, 100, {}), 100);
  EXPECT_EQ(afterUncovered(0, 100, {{50, 80}, {60, 90}, {300, 400}}), 140);
  EXPECT_EQ(afterUncovered(0, 100, {{-5, 20}}), 120);
  EXPECT_EQ(afterUncovered(0, 100, {{10, INT64_MAX}}), INT64_MAX);
}

TEST(ChaosCheck, AGiveUpIsExcusedOnlyByAnOutageOfItsInstance) {
  struct Case {
    const char* line;
    bool parsed;
    Inst inst;
    int64_t msOfDay;
  } cases[] = {
      {"[main] 12-07 00:22:44.041 20415 20421 E qvese@1.0-service: transmit, eSE1 without progress for "
       "3001 ms: call given up",
       true, Inst::Ese, 1364041},
      {"[radio] 12-07 23:59:59.999 1 2 E ZerbSimSecureElement: getAtr, SIM1 without progress for 3000 ms: "
       "call given up",
       true, Inst::Sim, 86399999},
      // Refusals and waits are not give-ups.
      {"[radio] 12-07 00:00:01.000 1 2 E ZerbSimSecureElement: getAtr, SIM1 busy with 3 callers: call refused",
       false, Inst::Sim, 0},
      {"[radio] 12-07 00:00:01.000 1 2 D ZerbSimSecureElement: getAtr, SIM1 busy: waiting (2 callers)", false,
       Inst::Sim, 0},
      {"no time here, SIM1 without progress for 1 ms: call given up", false, Inst::Sim, 0},
  };
  for (const Case& c : cases) {
    GiveUp g;
    ASSERT_EQ(parseGiveUp(c.line, &g), c.parsed) << c.line;
    if (!c.parsed) continue;
    EXPECT_EQ(g.inst, c.inst) << c.line;
    EXPECT_EQ(g.msOfDay, c.msOfDay) << c.line;
  }

  const int64_t s = 1000000000;
  // A hang bound of 3 s: a stall that ended within the bound (and half a
  // second) before the give-up excuses it, one long gone or still to come
  // does not.
  EXPECT_TRUE(giveUpExcused(20 * s, 3000, {{10 * s, 18 * s}}));
  EXPECT_TRUE(giveUpExcused(20 * s, 3000, {{19 * s, INT64_MAX}}));
  EXPECT_FALSE(giveUpExcused(20 * s, 3000, {{1 * s, 16 * s}}));
  EXPECT_FALSE(giveUpExcused(20 * s, 3000, {{21 * s, 30 * s}}));
  EXPECT_FALSE(giveUpExcused(20 * s, 3000, {}));
  // A failing library or a slow modem answers: no excuse.
  EXPECT_TRUE(faultStallsDevice(FaultKind::LibHang));
  EXPECT_TRUE(faultStallsDevice(FaultKind::ModemPortLost));
  EXPECT_FALSE(faultStallsDevice(FaultKind::LibFail));
  EXPECT_FALSE(faultStallsDevice(FaultKind::LibSlow));
  EXPECT_FALSE(faultStallsDevice(FaultKind::ModemSlow));
}

TEST(ChaosJudge, ChannelsAtTheDeviceNoClientOpenedSinceAreKept) {
  const int64_t s = 1000000000;
  FILE* quiet = fopen("/dev/null", "w");
  ASSERT_NE(quiet, nullptr);
  Judge judge(1, BoundConfig{}, false, 0, quiet);
  auto opened = [&](long seq, int64_t t0, int channel) {
    judge.callStarted(0, 0, seq, Kind::Open, Inst::Sim, -1, t0);
    CallRecord r;
    r.slot = 0;
    r.seq = seq;
    r.kind = Kind::Open;
    r.inst = Inst::Sim;
    r.t0 = t0;
    r.t1 = t0 + s / 100;
    r.status = channel >= 0 ? "SUCCESS" : "FAILED";
    r.resultChannel = channel;
    judge.callEnded(r);
  };
  opened(1, 1 * s, 1);   // before the loss began at 10 s
  opened(2, 2 * s, 2);
  opened(3, 12 * s, 2);  // channel 2 again, after it
  opened(4, 13 * s, -1);
  EXPECT_EQ(judge.channelsKept(Inst::Sim, {}, 10 * s, 20 * s), 0);
  EXPECT_EQ(judge.channelsKept(Inst::Sim, {2}, 10 * s, 20 * s), 0);
  EXPECT_EQ(judge.channelsKept(Inst::Sim, {1, 2, 5}, 10 * s, 20 * s), 2);
  // The other instance's opens explain nothing here.
  EXPECT_EQ(judge.channelsKept(Inst::Ese, {2}, 10 * s, 20 * s), 1);
  // An open under way may hold a channel its client has not heard of yet,
  // until it is a minute old.
  judge.callStarted(0, 0, 5, Kind::Open, Inst::Sim, -1, 19 * s);
  EXPECT_EQ(judge.channelsKept(Inst::Sim, {1, 2, 5}, 10 * s, 20 * s), 1);
  EXPECT_EQ(judge.channelsKept(Inst::Sim, {1, 2, 5}, 10 * s, 80 * s), 2);
  fclose(quiet);
}

}  // namespace
}  // namespace chaos

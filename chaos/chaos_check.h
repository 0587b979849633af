#pragma once
// The soak's judge: what the virtual card must answer, whether a call's
// result is right, a clean failure of a documented kind or wrong, and how long
// a call may take with the faults active around it.
#include <cstdint>
#include <string>
#include <vector>

#include "chaos_plan.h"
#include "chaos_record.h"

namespace chaos {

// The answers of the card behind both instances (card/), computed on a fresh
// copy of it, so they do not depend on what other clients did.
bool knownAid(const std::vector<uint8_t>& aid);
// The select response an open of `aid` must carry: the card's answer to the
// SELECT; on eSE1 the daemon fetches data the card leaves behind 61 xx, so
// the whole FCI with 90 00. Empty for an AID the card lacks.
std::vector<uint8_t> expectedSelect(Inst inst, const std::vector<uint8_t>& aid, uint8_t p2);
// The card's answer to `apdu` on a channel where `aid` was selected with
// `selectP2`, whatever channel the CLA names.
std::vector<uint8_t> expectedResponse(const std::vector<uint8_t>& aid, uint8_t selectP2,
                                      const std::vector<uint8_t>& apdu);
// The SIM's basic channel keeps the card's default applet: its answer.
std::vector<uint8_t> expectedBasicResponse(const std::vector<uint8_t>& apdu);
std::vector<uint8_t> expectedAtr(Inst inst, bool pcsc);

enum class Outcome { Ok, Clean, Wrong };
const char* outcomeName(Outcome o);

struct Verdict {
  Outcome outcome = Outcome::Ok;
  std::string why;  // Clean: which documented failure; Wrong: what was wrong
};

// What else was going on while the call ran.
struct CallContext {
  // transmit: nothing since the channel was opened could have closed it or
  // given its number to another client (a reset, an init, a death on eSE1,
  // the modem's restart...). When false any answer with a status word is a
  // clean "channel lost".
  bool channelCertain = true;
  // reset: another client's init or reset ran at the same time, so state
  // changes of its own may have reached this client's callback.
  bool statesShared = false;
  bool libFail = false;  // the eSE library failing exchanges during the call
  // ... for all of the call: no exchange can have succeeded, so nothing that
  // needs one may succeed.
  bool libFailAll = false;
  // ... and the status word it leaves behind (0: none). eSE1 hands a failed
  // exchange's leftover status word on as the answer: a documented failure.
  int libFailSw = 0;
  bool cardOut = false;  // PC/SC: the card out of its reader during the call
  bool pcsc = false;
};

Verdict classify(const CallRecord& r, const CallContext& c);

// Service. Some faults the daemon must hide: slow or cut-up answers,
// unsolicited lines, the bare open form, slow card commands are served as
// usual ("Failure model"). The others are outages: calls fail cleanly while
// they last, and the device is served again once they end.
bool faultIsOutage(FaultKind k);
// After an outage ends, a call is answered right within this long (the
// failure model's bound for a port that is back).
constexpr int64_t kRecoveryMs = 10000;
struct Span {
  int64_t start = 0;
  int64_t end = 0;
};
// How much of [start, end] lies outside every span of `outages`.
int64_t uncoveredNs(int64_t start, int64_t end, std::vector<Span> outages);
// The time by which `needNs` outside every span of `outages` has passed
// since `from`: a recovery's clock stops while another outage lasts.
int64_t afterUncovered(int64_t from, int64_t needNs, std::vector<Span> outages);
// How long after an outage calls may still fail: a port that is back is
// opened again within kRecoveryMs; the other outages end at once.
int64_t outageMarginMs(FaultKind k);

// Latency bounds: those the README's failure model gives, added up for the
// faults active around the call.
struct BoundConfig {
  int64_t baseMs = 2000;  // a call on a healthy device, on a loaded 2-core machine
  int64_t hangMs = 3000;  // the hang bound set in the run's properties
  // What a fault on the other instance may add: nothing, as the other
  // instance always has a thread and answers as usual ("Failure model").
  int64_t otherInstMs = 0;
};
// A fault still weighs on calls for this long after it ended: calls queued
// behind it and the closes it left finish first.
int64_t faultTailMs(const BoundConfig& c);
// What one fault may add to a call on its own instance.
// `inFlight`: for the call a silence or a hung library caught in the device,
// which waits the fault out; every other call gives up after the hang bound.
int64_t faultAllowanceMs(const Fault& f, const BoundConfig& c, bool inFlight = true);
// The bound for a call given the faults that overlapped it (with their tails).
int64_t callBoundMs(const std::vector<Fault>& sameInst, bool otherInstFaulty, const BoundConfig& c,
                    bool inFlight = true);
// A caller that gave up waiting: the daemon's log line "<op>, <instance>
// without progress for N ms: call given up", its instance and its time of
// day (the log's wall clock, ms since midnight).
struct GiveUp {
  Inst inst = Inst::Sim;
  int64_t msOfDay = 0;
};
bool parseGiveUp(const std::string& logLine, GiveUp* out);
// Faults that stop a device call in the middle: a silent, lost or
// restarting modem, a hung library, a card gone or reset under PC/SC. (A
// failing library answers at once.)
bool faultStallsDevice(FaultKind k);
// Slow is not broken: a caller may give up only when its device stopped
// making progress, that is within a stall of its instance that overlaps the
// hang bound (and a margin) before the give-up.
bool giveUpExcused(int64_t atNs, int64_t hangMs, const std::vector<Span>& stallsOfInst);

// Whether a fault holds the device call in flight: then only that call may
// take longer than a waiter's bound.
bool faultHoldsCall(FaultKind k);

}  // namespace chaos

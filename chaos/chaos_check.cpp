#include "chaos_check.h"

#include <algorithm>
#include <cstdio>

#include "card_applets.h"
#include "virtual_card.h"

namespace chaos {

namespace {

using Bytes = std::vector<uint8_t>;

// Opens a channel on a fresh card and selects `aid` there; its number.
int openOn(se_card::VirtualCard& card, const Bytes& aid, uint8_t p2, Bytes* answer) {
  const Bytes opened = card.process({0x00, 0x70, 0x00, 0x00, 0x01});
  if (opened.size() != 3) return -1;
  const int ch = opened[0];
  Bytes sel = {se_card::claForChannel(0x00, ch), 0xA4, 0x04, p2};
  if (!aid.empty()) {
    sel.push_back(static_cast<uint8_t>(aid.size()));
    sel.insert(sel.end(), aid.begin(), aid.end());
  }
  *answer = card.process(sel);
  return ch;
}

bool isSuccess(const std::string& s) { return s == "SUCCESS"; }

Verdict ok() { return {Outcome::Ok, ""}; }
Verdict clean(const std::string& why) { return {Outcome::Clean, why}; }
Verdict wrong(const std::string& why) { return {Outcome::Wrong, why}; }

std::string got(const Bytes& b) { return b.empty() ? "(empty)" : toHex(b); }

// HIDL's failure markers: eSE1 answers 1F (with the library's status word
// when it left one), SIM1 nothing.
bool hidlTransmitFailure(Inst inst, const Bytes& d) {
  if (inst == Inst::Sim) return d.empty();
  return (d.size() == 1 || d.size() == 3) && d[0] == 0x1F;
}

Verdict checkTransmitAnswer(const CallRecord& r, const CallContext& c) {
  const Bytes& d = r.data;
  Bytes want;
  bool know = c.channelCertain;
  if (r.appletKnown) {
    want = expectedResponse(r.appletAid, r.appletP2, r.cmd);
  } else if (r.inst == Inst::Sim && r.channel == 0) {
    want = expectedBasicResponse(r.cmd);
  } else {
    know = false;  // eSE1's basic channel: any client may select there
  }
  if (know && d == want) return ok();
  // HIDL's eSE1 failure form; over AIDL a failed exchange is an error status.
  if (r.inst == Inst::Ese && r.iface == Iface::Hidl && c.libFailSw != 0 && d.size() == 2 &&
      d[0] == (c.libFailSw >> 8) && d[1] == (c.libFailSw & 0xFF)) {
    return clean("the failed exchange's status word");
  }
  if (d.size() < 2) return wrong("response without a status word: " + got(d));
  if (!know) return clean("channel lost or shared");
  return wrong("got " + got(d) + ", want " + toHex(want));
}

Verdict classifyHidl(const CallRecord& r, const CallContext& c) {
  const int maxCh = r.inst == Inst::Ese ? 3 : 19;
  switch (r.kind) {
    case Kind::Init:
      if (r.state == 1) return ok();
      if (r.state == -1) return clean("no state");
      return wrong("onStateChange(false)");
    case Kind::Present:
      return r.present ? ok() : clean("present=false");
    case Kind::Atr: {
      const Bytes want = expectedAtr(r.inst, c.pcsc);
      if (r.data == want) return ok();
      if (r.data.empty()) return clean("empty ATR");
      return wrong("ATR " + got(r.data) + ", want " + got(want));
    }
    case Kind::Open: {
      if (!isSuccess(r.status)) {
        // SIM1 gives channel 0 with a failure; eSE1 a marker, or the channel
        // its SELECT failed on, which it closes right after.
        if (r.inst == Inst::Sim && r.resultChannel != 0) {
          return wrong(r.status + " with channel " + std::to_string(r.resultChannel));
        }
        if (r.status == "NO_SUCH_ELEMENT_ERROR" && knownAid(r.cmd) && !c.libFail) {
          return wrong("NO_SUCH_ELEMENT_ERROR for an installed applet");
        }
        return clean(r.status);
      }
      if (!knownAid(r.cmd)) return wrong("SUCCESS for an AID the card lacks");
      if (r.resultChannel < 1 || r.resultChannel > maxCh) {
        return wrong("SUCCESS with channel " + std::to_string(r.resultChannel));
      }
      const Bytes want = expectedSelect(r.inst, r.cmd, r.p2);
      if (r.data != want) return wrong("select response " + got(r.data) + ", want " + toHex(want));
      return ok();
    }
    case Kind::Basic: {
      if (r.inst == Inst::Sim) {
        if (isSuccess(r.status)) return wrong("SUCCESS for SIM1's basic channel");
        return clean(r.status);
      }
      if (!isSuccess(r.status)) return clean(r.status);
      const Bytes want = expectedSelect(r.inst, r.cmd, r.p2);
      if (r.data != want) return wrong("select response " + got(r.data) + ", want " + toHex(want));
      return ok();
    }
    case Kind::Transmit:
      if (hidlTransmitFailure(r.inst, r.data) && !(c.channelCertain && r.appletKnown &&
                                                  r.data == expectedResponse(r.appletAid, r.appletP2, r.cmd))) {
        return clean("transmit failure marker");
      }
      return checkTransmitAnswer(r, c);
    case Kind::Close:
      return isSuccess(r.status) ? ok() : clean(r.status);
    case Kind::Reset:
      return wrong("reset over HIDL");
  }
  return wrong("unknown call");
}

Verdict classifyAidl(const CallRecord& r, const CallContext& c) {
  if (!isSuccess(r.status)) {
    if (r.status.empty()) return wrong("no status");
    if (r.kind == Kind::Open && r.status == "NO_SUCH_ELEMENT_ERROR" && knownAid(r.cmd) && !c.libFail) {
      return wrong("NO_SUCH_ELEMENT_ERROR for an installed applet");
    }
    return clean(r.status);
  }
  const int maxCh = r.inst == Inst::Ese ? 3 : 19;
  switch (r.kind) {
    case Kind::Init:
      if (r.state == 1) return ok();
      return wrong(r.state == 0 ? "SUCCESS with onStateChange(false)" : "SUCCESS without onStateChange");
    case Kind::Present:
      if (r.present || c.cardOut) return ok();
      return wrong("SUCCESS with present=false");
    case Kind::Atr: {
      const Bytes want = expectedAtr(r.inst, c.pcsc);
      if (r.data == want) return ok();
      return wrong("SUCCESS with ATR " + got(r.data) + ", want " + got(want));
    }
    case Kind::Open: {
      if (!knownAid(r.cmd)) return wrong("SUCCESS for an AID the card lacks");
      if (r.resultChannel < 1 || r.resultChannel > maxCh) {
        return wrong("SUCCESS with channel " + std::to_string(r.resultChannel));
      }
      const Bytes want = expectedSelect(r.inst, r.cmd, r.p2);
      if (r.data != want) return wrong("SUCCESS with select response " + got(r.data) + ", want " + toHex(want));
      return ok();
    }
    case Kind::Basic: {
      if (r.inst == Inst::Sim) return wrong("SUCCESS for SIM1's basic channel");
      const Bytes want = expectedSelect(r.inst, r.cmd, r.p2);
      if (r.data != want) return wrong("SUCCESS with select response " + got(r.data) + ", want " + toHex(want));
      return ok();
    }
    case Kind::Transmit:
      return checkTransmitAnswer(r, c);
    case Kind::Close:
      return ok();
    case Kind::Reset:
      // The states go to the callback of the instance's latest init, which
      // may be another client's.
      if (r.states == "01" || r.states.empty() || c.statesShared) return ok();
      return wrong("SUCCESS with states \"" + r.states + "\", want false then true");
  }
  return wrong("unknown call");
}

}  // namespace

bool knownAid(const std::vector<uint8_t>& aid) {
  for (const auto& a : se_card::makeDefaultApplets()) {
    if (a->aid() == aid) return true;
  }
  return false;
}

std::vector<uint8_t> expectedSelect(Inst inst, const std::vector<uint8_t>& aid, uint8_t p2) {
  se_card::VirtualCard card;
  Bytes answer;
  const int ch = openOn(card, aid, p2, &answer);
  if (ch < 0 || answer.size() < 2) return {};
  if (answer[answer.size() - 2] == 0x6A && answer.back() == 0x82) return {};
  if (inst == Inst::Ese && answer.size() == 2 && answer[0] == 0x61) {
    answer = card.process({se_card::claForChannel(0x00, ch), 0xC0, 0x00, 0x00, answer[1]});
  }
  return answer;
}

std::vector<uint8_t> expectedResponse(const std::vector<uint8_t>& aid, uint8_t selectP2,
                                      const std::vector<uint8_t>& apdu) {
  se_card::VirtualCard card;
  Bytes answer;
  const int ch = openOn(card, aid, selectP2, &answer);
  if (ch < 0 || apdu.empty()) return {};
  Bytes cmd = apdu;
  cmd[0] = se_card::claForChannel(cmd[0], ch);
  return card.process(cmd);
}

std::vector<uint8_t> expectedBasicResponse(const std::vector<uint8_t>& apdu) {
  se_card::VirtualCard card;
  return card.process(apdu);
}

std::vector<uint8_t> expectedAtr(Inst inst, bool pcsc) {
  // The eSE front reports no ATR: the vendor library has no call for it.
  (void)pcsc;
  if (inst == Inst::Ese) return {};
  return se_card::defaultAtr();
}

const char* outcomeName(Outcome o) {
  switch (o) {
    case Outcome::Ok: return "ok";
    case Outcome::Clean: return "clean failure";
    case Outcome::Wrong: return "WRONG";
  }
  return "?";
}

Verdict classify(const CallRecord& r, const CallContext& c) {
  if (!r.error.empty()) return wrong("transport error: " + r.error);
  if (c.libFailAll && r.inst == Inst::Ese) {
    // Every exchange of the library failed while the call ran.
    const bool success = r.iface == Iface::Aidl ? isSuccess(r.status)
                         : r.kind == Kind::Transmit
                             ? !(hidlTransmitFailure(r.inst, r.data) ||
                                 (c.libFailSw != 0 && r.data.size() == 2 && r.data[0] == (c.libFailSw >> 8) &&
                                  r.data[1] == (c.libFailSw & 0xFF)))
                             : isSuccess(r.status);
    if (success && (r.kind == Kind::Transmit || r.kind == Kind::Open || r.kind == Kind::Basic)) {
      return wrong("served while every exchange of the library failed");
    }
  }
  return r.iface == Iface::Hidl ? classifyHidl(r, c) : classifyAidl(r, c);
}

bool faultIsOutage(FaultKind k) {
  switch (k) {
    case FaultKind::ModemSlow:
    case FaultKind::ModemPieces:
    case FaultKind::ModemUnsol:
    case FaultKind::ModemBare:
    case FaultKind::LibSlow:
      return false;
    default:
      return true;
  }
}

int64_t uncoveredNs(int64_t start, int64_t end, std::vector<Span> outages) {
  std::sort(outages.begin(), outages.end(), [](const Span& a, const Span& b) { return a.start < b.start; });
  int64_t left = 0;
  int64_t at = start;
  for (const Span& o : outages) {
    if (o.end <= at) continue;
    if (o.start >= end) break;
    if (o.start > at) left += o.start - at;
    at = std::max(at, o.end);
    if (at >= end) return left;
  }
  return left + std::max<int64_t>(0, end - at);
}

int64_t afterUncovered(int64_t from, int64_t needNs, std::vector<Span> outages) {
  std::sort(outages.begin(), outages.end(), [](const Span& a, const Span& b) { return a.start < b.start; });
  int64_t at = from;
  for (const Span& o : outages) {
    if (o.end <= at) continue;
    if (o.start >= at + needNs) break;
    if (o.start > at) needNs -= o.start - at;
    if (o.end == INT64_MAX) return INT64_MAX;
    at = o.end;
  }
  return at + needNs;
}

bool parseGiveUp(const std::string& line, GiveUp* out) {
  if (line.find(" without progress for ") == std::string::npos ||
      line.find(": call given up") == std::string::npos) {
    return false;
  }
  // "[main] 12-07 00:22:44.041 pid tid E tag: op, SIM1 without progress ..."
  int month, day, h, m, sec, ms;
  if (sscanf(line.c_str(), "%*s %d-%d %d:%d:%d.%d", &month, &day, &h, &m, &sec, &ms) != 6) return false;
  if (line.find(", SIM1 without progress") != std::string::npos) {
    out->inst = Inst::Sim;
  } else if (line.find(", eSE1 without progress") != std::string::npos) {
    out->inst = Inst::Ese;
  } else {
    return false;
  }
  out->msOfDay = ((int64_t(h) * 60 + m) * 60 + sec) * 1000 + ms;
  return true;
}

bool faultStallsDevice(FaultKind k) {
  switch (k) {
    case FaultKind::ModemSilence:
    case FaultKind::ModemPortLost:
    case FaultKind::ModemRestart:
    case FaultKind::LibHang:
    case FaultKind::CardOut:
    case FaultKind::OtherReset:
      return true;
    default:
      return false;
  }
}

bool giveUpExcused(int64_t atNs, int64_t hangMs, const std::vector<Span>& stallsOfInst) {
  // The device went the hang bound without progress just before the give-up;
  // the margin covers the log's and the fault switch's timing.
  constexpr int64_t kMarginMs = 500;
  const int64_t from = atNs - (hangMs + kMarginMs) * 1000000;
  const int64_t to = atNs + kMarginMs * 1000000;
  for (const Span& o : stallsOfInst) {
    if (o.start <= to && o.end >= from) return true;
  }
  return false;
}

int64_t outageMarginMs(FaultKind k) {
  switch (k) {
    case FaultKind::ModemPortLost:
    case FaultKind::ModemRestart:
    case FaultKind::CardOut:
      return kRecoveryMs;
    default:
      return 2000;
  }
}

int64_t faultTailMs(const BoundConfig& c) { return c.hangMs + 2000; }

bool faultHoldsCall(FaultKind k) { return k == FaultKind::ModemSilence || k == FaultKind::LibHang; }

int64_t faultAllowanceMs(const Fault& f, const BoundConfig& c, bool inFlight) {
  // A call waits for at most the two callers admitted before it and the
  // closes queued ahead of it, then runs itself: four calls' worth. The
  // longest call on the SIM is an init that closes every channel: 24 AT
  // commands.
  constexpr int64_t kCalls = 4;
  constexpr int64_t kCommands = 24;
  const int64_t len = f.endMs - f.startMs;
  switch (f.kind) {
    case FaultKind::ModemSilence:
    case FaultKind::LibHang:
      // The call in flight waits out the silence; those behind it give up
      // once it has gone the hang bound without progress, later ones at once
      // ("Failure model").
      return inFlight ? std::max(len, c.hangMs) : c.hangMs;
    case FaultKind::ModemSlow:
      return kCalls * kCommands * f.a;
    case FaultKind::ModemPieces: {
      // Short answers in a few pieces each, and one long +CGLA: answer.
      const int64_t a = std::max(1, f.a);
      return kCalls * (kCommands * ((40 + a - 1) / a + 1) + (600 + a - 1) / a);
    }
    case FaultKind::ModemPortLost:
    case FaultKind::ModemRestart:
      return 6000;  // the failure model's bound for a call while the port is away
    case FaultKind::LibSlow:
      return kCalls * f.b;
    case FaultKind::CardOut:
    case FaultKind::OtherReset:
      return 2000;
    case FaultKind::ModemUnsol:
    case FaultKind::ModemBare:
    case FaultKind::LibFail:
      return 0;
  }
  return 0;
}

int64_t callBoundMs(const std::vector<Fault>& sameInst, bool otherInstFaulty, const BoundConfig& c,
                    bool inFlight) {
  int64_t b = c.baseMs;
  for (const Fault& f : sameInst) b += faultAllowanceMs(f, c, inFlight);
  if (otherInstFaulty) b += c.otherInstMs;
  return b;
}

}  // namespace chaos

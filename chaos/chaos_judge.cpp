#include "chaos_judge.h"

#include <algorithm>

namespace chaos {

namespace {

// A death notice or a queued close may take this long to reach the device
// after the event that caused it.
constexpr int64_t kSettleMarginNs = 1000 * kMs;

bool dropsEveryChannel(FaultKind k) {
  return k == FaultKind::ModemPortLost || k == FaultKind::ModemRestart || k == FaultKind::CardOut ||
         k == FaultKind::OtherReset;
}

bool touchesDevice(Kind k) { return k == Kind::Transmit || k == Kind::Open || k == Kind::Basic; }

}  // namespace

Judge::Judge(uint64_t seed, const BoundConfig& bounds, bool pcsc, int64_t origin, FILE* out, int shown)
    : seed_(seed), bounds_(bounds), pcsc_(pcsc), origin_(origin), out_(out), shown_(shown) {}

std::string Judge::at(int64_t t) const {
  char b[32];
  snprintf(b, sizeof(b), "+%.3f s", static_cast<double>(t - origin_) / 1e9);
  return b;
}

size_t Judge::addDrop(Inst inst, int64_t start, int64_t end, int channel, std::pair<int, int> by) {
  Drop d{inst, start, end};
  d.channel = channel;
  d.by = by;
  drops_.push_back(d);
  return drops_.size() - 1;
}

void Judge::faultStarted(const Fault& f, int64_t t) {
  std::lock_guard<std::mutex> l(mu_);
  faults_.push_back({f, t, INT64_MAX});
  if (dropsEveryChannel(f.kind)) {
    faultDrops_[{static_cast<int>(f.kind), f.startMs}] = addDrop(faultInst(f.kind), t, INT64_MAX);
  }
}

void Judge::faultEnded(const Fault& f, int64_t t) {
  std::lock_guard<std::mutex> l(mu_);
  for (FaultSpan& s : faults_) {
    if (s.end == INT64_MAX && s.fault.kind == f.kind && s.fault.startMs == f.startMs) s.end = t;
  }
  auto it = faultDrops_.find({static_cast<int>(f.kind), f.startMs});
  if (it != faultDrops_.end()) {
    drops_[it->second].end = t + kSettleMarginNs;
    faultDrops_.erase(it);
  }
}

std::vector<FaultSpan> Judge::faults() const {
  std::lock_guard<std::mutex> l(mu_);
  return faults_;
}

void Judge::callStarted(int slot, int gen, long seq, Kind kind, Inst inst, int channel, int64_t t0) {
  if (kind == Kind::Open || kind == Kind::Basic) {
    std::lock_guard<std::mutex> l(mu_);
    opening_[{slot, gen, seq}] = {inst, t0};
    return;
  }
  if (kind != Kind::Init && kind != Kind::Reset && kind != Kind::Close) return;
  std::lock_guard<std::mutex> l(mu_);
  // An init or a reset may close every channel of the instance (an init
  // sweeps what earlier clients left); a close, that channel for whoever
  // holds its number now.
  const size_t i = kind == Kind::Close ? addDrop(inst, t0, INT64_MAX, channel, {slot, gen})
                                       : addDrop(inst, t0, INT64_MAX, -1, {slot, gen});
  openDrops_[{slot, gen, seq}] = i;
  dropsOfClient_[{slot, gen}].push_back(i);
}

void Judge::callEnded(const CallRecord& r) {
  std::lock_guard<std::mutex> l(mu_);
  if (r.kind == Kind::Open || r.kind == Kind::Basic) {
    opening_.erase({r.slot, r.gen, r.seq});
    if (r.resultChannel >= 0) lastOpened_[{r.inst, r.resultChannel}] = r.t0;
  }
  auto it = openDrops_.find({r.slot, r.gen, r.seq});
  if (it != openDrops_.end()) {
    drops_[it->second].end = r.t1;  // what an init, a reset or a close does, it does in the call
    openDrops_.erase(it);
  }
  queue_.push_back(r);
}

void Judge::clientGone(int slot, int gen, Inst inst, int64_t t, bool inCall) {
  std::lock_guard<std::mutex> l(mu_);
  for (size_t i : dropsOfClient_[{slot, gen}]) {
    Drop& d = drops_[i];
    if (d.end != INT64_MAX) continue;
    // The daemon carries on with the call its client died in (a reset goes
    // on closing channels): it ends within the bound it would have had.
    d.end = std::max(t, d.start + boundMsFor(d.inst, d.start, t) * kMs) + kSettleMarginNs;
  }
  dropsOfClient_.erase({slot, gen});
  // eSE1 closes the library on any client's death, and every channel with it.
  if (inst == Inst::Ese) addDrop(inst, t, t + kSettleMarginNs);
  if (inCall) ++callsCut_;
}

std::vector<FaultSpan> Judge::overlapping(Inst inst, int64_t t0, int64_t t1, bool* other) const {
  const int64_t tail = faultTailMs(bounds_) * kMs;
  std::vector<FaultSpan> same;
  *other = false;
  // Faults are kept in the order they started; none lasts longer than 10 s.
  for (auto it = faults_.rbegin(); it != faults_.rend(); ++it) {
    const FaultSpan& s = *it;
    if (s.start + 10000 * kMs + tail < t0) break;
    const int64_t end = s.end == INT64_MAX ? INT64_MAX : s.end + tail;
    if (s.start > t1 || end < t0) continue;
    if (faultInst(s.fault.kind) == inst) {
      same.push_back(s);
    } else {
      *other = true;
    }
  }
  return same;
}

int64_t Judge::boundMsFor(Inst inst, int64_t t0, int64_t t1, bool inFlight) const {
  bool other = false;
  const std::vector<FaultSpan> same = overlapping(inst, t0, t1, &other);
  std::vector<Fault> weighing;
  for (const FaultSpan& s : same) {
    // Weigh what actually happened, not what was planned.
    Fault f = s.fault;
    f.startMs = s.start / kMs;
    f.endMs = (s.end == INT64_MAX ? t1 : s.end) / kMs;
    weighing.push_back(f);
  }
  return callBoundMs(weighing, other, bounds_, inFlight);
}

bool Judge::channelCertain(const CallRecord& r) const {
  if (r.inst == Inst::Sim && r.channel == 0) return true;  // the SIM's basic channel keeps its applet
  if (!r.appletKnown) return false;
  for (const Drop& d : drops_) {
    if (d.inst != r.inst || d.start > r.t1 || d.settle < r.openedAt) continue;
    if (d.channel >= 0 && (d.channel != r.channel || d.by == std::make_pair(r.slot, r.gen))) continue;
    return false;
  }
  return true;
}

std::string Judge::describe(const CallRecord& r) const {
  std::string s = std::string(instName(r.inst)) + " " + ifaceName(r.iface) + " " + kindName(r.kind);
  if (!r.cmd.empty()) s += " " + toHex(r.cmd);
  if (r.kind == Kind::Open || r.kind == Kind::Basic) s += " P2 " + std::to_string(r.p2);
  if (r.channel >= 0) s += " on channel " + std::to_string(r.channel);
  if (r.channel >= 0 && r.appletKnown) s += " (opened " + at(r.openedAt) + ")";
  char b[160];
  snprintf(b, sizeof(b), " (client %d.%d pid %d call %ld, %s to %s, %.1f ms)", r.slot, r.gen, r.pid, r.seq,
           at(r.t0).c_str(), at(r.t1).c_str(), static_cast<double>(r.t1 - r.t0) / 1e6);
  return s + b;
}

void Judge::violation(const std::string& invariant, const CallRecord& r, const std::vector<FaultSpan>& active) {
  if (++reported_ > shown_) {
    if (reported_ == shown_ + 1) fprintf(out_, "chaos: (further violations counted, not shown)\n");
    return;
  }
  std::string faults;
  for (const FaultSpan& s : active) {
    faults += (faults.empty() ? "" : ", ") + describeFault(s.fault) + " " + at(s.start) + " to " +
              (s.end == INT64_MAX ? std::string("now") : at(s.end));
  }
  fprintf(out_, "chaos: VIOLATION seed %llu at %s: %s\n  call: %s\n  faults active: %s\n",
          static_cast<unsigned long long>(seed_), at(r.t1).c_str(), invariant.c_str(), describe(r).c_str(),
          faults.empty() ? "none" : faults.c_str());
  fflush(out_);
}

void Judge::judgeUpTo(int64_t horizon) {
  std::lock_guard<std::mutex> l(mu_);
  std::sort(queue_.begin(), queue_.end(), [](const CallRecord& a, const CallRecord& b) { return a.t1 < b.t1; });
  size_t n = 0;
  while (n < queue_.size() && queue_[n].t1 < horizon) judge(queue_[n++]);
  queue_.erase(queue_.begin(), queue_.begin() + static_cast<std::ptrdiff_t>(n));
  checkService(horizon);
  // No client lives longer than a minute and a half (chaos_client.cpp), so
  // no channel was opened before what settled that long ago.
  const int64_t forget = horizon - 120000 * kMs;
  if (drops_.size() > pruneAt_) {
    std::vector<Drop> kept;
    for (const Drop& d : drops_) {
      if (d.settle >= forget) kept.push_back(d);
    }
    // Indexes held for calls under way point into the old list: remap them.
    std::map<size_t, size_t> moved;
    for (size_t i = 0, j = 0; i < drops_.size(); ++i) {
      if (drops_[i].settle >= forget) moved[i] = j++;
    }
    for (auto& e : openDrops_) e.second = moved.count(e.second) ? moved[e.second] : SIZE_MAX;
    for (auto& e : faultDrops_) e.second = moved.count(e.second) ? moved[e.second] : SIZE_MAX;
    for (auto& e : dropsOfClient_) {
      std::vector<size_t> v;
      for (size_t i : e.second) {
        if (moved.count(i)) v.push_back(moved[i]);
      }
      e.second = v;
    }
    drops_.swap(kept);
    pruneAt_ = std::max<size_t>(2000, 2 * drops_.size());
  }
}

long Judge::channelsKept(Inst inst, const std::vector<int>& openAtDevice, int64_t since, int64_t now) {
  std::lock_guard<std::mutex> l(mu_);
  long unexplained = 0;
  for (int c : openAtDevice) {
    auto it = lastOpened_.find({inst, c});
    if (it == lastOpened_.end() || it->second < since) ++unexplained;
  }
  // An open under way may hold a channel its client has not heard of yet;
  // one whose client was killed stays under way, so only recent ones count.
  long underWay = 0;
  for (auto it = opening_.begin(); it != opening_.end();) {
    if (it->second.second < now - 60000 * kMs) {
      it = opening_.erase(it);
      continue;
    }
    if (it->second.first == inst) ++underWay;
    ++it;
  }
  return std::max(0L, unexplained - underWay);
}

bool Judge::gaveUp(Inst inst, int64_t at, const std::string& logLine) {
  std::vector<Span> stalls;
  std::string active;
  {
    std::lock_guard<std::mutex> l(mu_);
    for (const FaultSpan& f : faults_) {
      if (faultInst(f.fault.kind) != inst) continue;
      if (faultStallsDevice(f.fault.kind)) stalls.push_back({f.start, f.end});
      if (f.start <= at && f.end >= at - bounds_.hangMs * kMs) active += " " + describeFault(f.fault);
    }
  }
  if (giveUpExcused(at, bounds_.hangMs, stalls)) return false;
  {
    std::lock_guard<std::mutex> l(mu_);
    ++wrong_;
    if (++reported_ > shown_) return true;
  }
  fprintf(out_,
          "chaos: VIOLATION seed %llu at %s: a caller gave up while its device made progress (no stall of %s)\n"
          "  daemon: %s\n  faults of %s active: %s\n",
          static_cast<unsigned long long>(seed_), this->at(at).c_str(), instName(inst), logLine.c_str(),
          instName(inst), active.empty() ? "none" : active.c_str());
  fflush(out_);
  return true;
}

void Judge::serviceViolation(const std::string& what) {
  if (++reported_ > shown_) return;
  fprintf(out_, "chaos: VIOLATION seed %llu: %s\n", static_cast<unsigned long long>(seed_), what.c_str());
  fflush(out_);
}

void Judge::checkService(int64_t horizon) {
  const int64_t recovery = kRecoveryMs * kMs;
  for (FaultSpan& f : faults_) {
    if (f.serviceChecked || f.end == INT64_MAX) continue;
    // A recovery may be looked for until well after the fault ended.
    if (horizon != INT64_MAX && horizon < f.end + 3 * recovery) continue;
    f.serviceChecked = true;
    const Inst inst = faultInst(f.fault.kind);
    // The instance's other outages as they were, and with the time calls
    // may still fail after them.
    const std::vector<Served>& served = served_[inst];
    std::vector<Span> outages, shadows;
    for (const FaultSpan& o : faults_) {
      if (&o == &f || faultInst(o.fault.kind) != inst || !faultIsOutage(o.fault.kind)) continue;
      if (o.end == INT64_MAX) {
        outages.push_back({o.start, INT64_MAX});
        shadows.push_back({o.start, INT64_MAX});
        continue;
      }
      outages.push_back({o.start, o.end});
      // Its shadow lasts until the first call served after it, at most its margin.
      int64_t back = o.end + outageMarginMs(o.fault.kind) * kMs;
      for (const Served& c : served) {
        if (c.t1 >= o.end && c.t1 < back) back = c.t1;
      }
      shadows.push_back({o.start, back});
    }
    const std::string name = describeFault(f.fault) + " " + at(f.start) + " to " + at(f.end);
    if (!faultIsOutage(f.fault.kind)) {
      ++service_.hidden;
      const int64_t open = uncoveredNs(f.start, f.end, shadows);
      // Opens under the bare form are what it is about; they are rarer.
      const bool needOpen = f.fault.kind == FaultKind::ModemBare && open >= 2000 * kMs;
      if (open < 1000 * kMs) {
        ++service_.hiddenUnjudged;
        continue;
      }
      bool ok = false;
      for (const Served& c : served) {
        if (c.t0 < f.start || c.t1 > f.end || (needOpen && c.kind != Kind::Open)) continue;
        bool clear = true;
        for (const Span& o : shadows) clear = clear && (c.t1 < o.start || c.t0 > o.end);
        if (clear) {
          ok = true;
          break;
        }
      }
      if (!ok) {
        // A note, not a violation: whether a call that could succeed came
        // in the window depends on the random load as much as on the daemon.
        ++service_.unserved;
        fprintf(out_, "chaos: NOTE seed %llu: no %s%s answered right during %s, which the daemon must hide\n",
                static_cast<unsigned long long>(seed_), instName(inst), needOpen ? " open" : " call",
                name.c_str());
        fflush(out_);
      }
      continue;
    }
    ++service_.outages;
    const int64_t by = afterUncovered(f.end, recovery, outages);
    bool ok = false;
    for (const Served& c : served) ok = ok || (c.t1 >= f.end && c.t1 <= by);
    if (ok) continue;
    if (by == INT64_MAX || lastStart_[inst] < by) {
      ++service_.outagesUnjudged;  // the run ended first
      continue;
    }
    ++service_.late;
    serviceViolation(std::string("no ") + instName(inst) + " call answered right within " +
                     std::to_string(kRecoveryMs) + " ms after " + name);
  }
  // Nothing checked later looks further back than a fault's length and the
  // time to recover from it.
  if (horizon != INT64_MAX) {
    const int64_t keep = horizon - 90000 * kMs;
    for (auto& e : served_) {
      auto& v = e.second;
      v.erase(v.begin(), std::find_if(v.begin(), v.end(), [&](const Served& c) { return c.t1 >= keep; }));
    }
  }
}

void Judge::judge(const CallRecord& r) {
  bool other = false;
  const std::vector<FaultSpan> same = overlapping(r.inst, r.t0, r.t1, &other);
  CallContext c;
  c.pcsc = pcsc_;
  c.channelCertain = channelCertain(r);
  for (const Drop& d : drops_) {
    if (d.inst == r.inst && d.channel < 0 && d.by.first >= 0 && d.by != std::make_pair(r.slot, r.gen) &&
        d.start <= r.t1 && d.end >= r.t0) {
      c.statesShared = true;
    }
  }
  for (const FaultSpan& s : same) {
    // The library reads its switches on each call: a little either side.
    const bool during = s.start <= r.t1 + 100 * kMs && (s.end == INT64_MAX || s.end + 100 * kMs >= r.t0);
    if (!during) continue;
    if (s.fault.kind == FaultKind::LibFail) {
      c.libFail = true;
      if (s.fault.a != 0) c.libFailSw = s.fault.a;
      c.libFailAll = c.libFailAll || (s.start + 100 * kMs <= r.t0 && s.end != INT64_MAX && r.t1 + 100 * kMs <= s.end);
    }
    if (s.fault.kind == FaultKind::CardOut) c.cardOut = true;
  }
  const Verdict v = classify(r, c);
  if (trace_ != nullptr) {
    std::string result = r.error.empty() ? r.status : "error " + r.error;
    if (r.kind == Kind::Open && r.resultChannel >= 0) result += " channel " + std::to_string(r.resultChannel);
    if (!r.data.empty()) result += " " + (r.data.size() > 24 ? toHex({r.data.begin(), r.data.begin() + 24}) + "..." : toHex(r.data));
    fprintf(trace_, "%s -> %s: %s%s%s%s\n", describe(r).c_str(), result.empty() ? "-" : result.c_str(),
            outcomeName(v.outcome), v.why.empty() ? "" : " (", v.why.c_str(), v.why.empty() ? "" : ")");
  }
  if (r.kind == Kind::Transmit && r.appletKnown) {
    ++transmits_;
    if (c.channelCertain) ++transmitsChecked_;
  }

  // A waiter's bound; the call a silence or a hung library caught in the
  // device (one per fault) may wait the fault out.
  int64_t boundMs = boundMsFor(r.inst, r.t0, r.t1, false);
  const int64_t tookNs = r.t1 - r.t0;
  bool secondInFlight = false;
  if (tookNs > boundMs * kMs) {
    const int64_t inFlightMs = boundMsFor(r.inst, r.t0, r.t1, true);
    if (tookNs <= inFlightMs * kMs) {
      bool exempt = false;
      for (FaultSpan& s : faults_) {
        if (!faultHoldsCall(s.fault.kind) || faultInst(s.fault.kind) != r.inst || s.start > r.t1 ||
            (s.end != INT64_MAX && s.end < r.t0) || s.waitedOut) {
          continue;
        }
        s.waitedOut = true;
        exempt = true;
      }
      if (exempt) {
        boundMs = inFlightMs;
      } else {
        secondInFlight = true;
      }
    }
  }

  Tally& t = tallies_[{r.inst, r.iface}];
  ++t.calls;
  ++calls_;
  switch (v.outcome) {
    case Outcome::Ok: ++t.ok; break;
    case Outcome::Clean: ++t.clean; break;
    case Outcome::Wrong:
      ++t.wrong;
      ++wrong_;
      violation("wrong answer: " + v.why, r, same);
      break;
  }
  if (tookNs > boundMs * kMs) {
    ++t.over;
    ++over_;
    char b[96];
    snprintf(b, sizeof(b), "over bound: took %.1f ms, bound %lld ms", static_cast<double>(tookNs) / 1e6,
             static_cast<long long>(boundMs));
    violation(std::string(b) + (secondInFlight ? " (a second call waited a silence or a hang out: only the one in "
                                                 "the device may, the others give up after the hang bound)"
                                               : ""),
              r, same);
  }
  // "A fault active": one on either instance while the call ran (the
  // tails that widen the bound do not count here).
  bool active = false;
  for (auto it = faults_.rbegin(); it != faults_.rend() && !active; ++it) {
    active = it->start <= r.t1 && (it->end == INT64_MAX || it->end >= r.t0);
    if (it->start + 20000 * kMs < r.t0) break;
  }
  Worst& w = worst_[static_cast<int>(r.kind)][active ? 1 : 0];
  if (tookNs > w.ns) {
    w.ns = tookNs;
    w.boundMs = boundMs;
    w.call = describe(r);
  }

  lastStart_[r.inst] = std::max(lastStart_[r.inst], r.t0);
  if (v.outcome == Outcome::Ok && touchesDevice(r.kind)) served_[r.inst].push_back({r.t0, r.t1, r.kind});
  if (v.outcome == Outcome::Ok && touchesDevice(r.kind)) {
    for (Drop& d : drops_) {
      if (d.inst == r.inst && d.settle == INT64_MAX && d.end < r.t0) d.settle = r.t1;
    }
  }
}

}  // namespace chaos

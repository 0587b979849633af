#pragma once
// The soak's running account: the faults as they actually happened, the
// events that may take a client's channel away, and every finished call,
// judged (right / clean failure / wrong, within its bound or not) a moment
// after it ended, once everything that overlapped it is known.
#include <cstdint>
#include <cstdio>
#include <map>
#include <mutex>
#include <string>
#include <tuple>
#include <vector>

#include "chaos_check.h"
#include "chaos_plan.h"
#include "chaos_record.h"

namespace chaos {

struct FaultSpan {
  Fault fault;
  int64_t start = 0;  // monoNanos()
  int64_t end = INT64_MAX;
  bool serviceChecked = false;
  // A silence or a hung library: a call has waited it out as the one in
  // flight (only one may).
  bool waitedOut = false;
};

// The service checks (chaos_check.h): faults the daemon must hide, each
// served while it lasted; outages, each followed by service within
// kRecoveryMs. Windows too short or too crowded to tell are not judged.
struct ServiceTally {
  long hidden = 0, hiddenUnjudged = 0, unserved = 0;
  long outages = 0, outagesUnjudged = 0, late = 0;
};

struct Tally {
  long calls = 0, ok = 0, clean = 0, wrong = 0, over = 0;
};

struct Worst {
  int64_t ns = -1;
  int64_t boundMs = 0;
  std::string call;
};

class Judge {
 public:
  Judge(uint64_t seed, const BoundConfig& bounds, bool pcsc, int64_t origin, FILE* out, int shown = 20);

  // From the fault thread.
  void faultStarted(const Fault& f, int64_t at);
  void faultEnded(const Fault& f, int64_t at);

  // From the clients' records.
  // `channel`: what a close names (-1 for other calls).
  void callStarted(int slot, int gen, long seq, Kind kind, Inst inst, int channel, int64_t t0);
  void callEnded(const CallRecord& r);
  // A client gone: killed by the soak or left by itself; `inCall` when it
  // died in the middle of a call.
  void clientGone(int slot, int gen, Inst inst, int64_t at, bool inCall);

  // Judges the calls that ended before `horizon`.
  void judgeUpTo(int64_t horizon);

  // Of the channels open at `inst`'s device, those no client opened since
  // `since` (beyond the opens still under way at `now`).
  long channelsKept(Inst inst, const std::vector<int>& openAtDevice, int64_t since, int64_t now);

  // A caller of `inst` gave up waiting at `at` (the daemon's log): wrong
  // unless an outage of that instance was about then (true: counted wrong).
  bool gaveUp(Inst inst, int64_t at, const std::string& logLine);

  // Every judged call, one line each, in the order judged (nullptr: none).
  void traceTo(FILE* trace) { trace_ = trace; }

  const std::map<std::pair<Inst, Iface>, Tally>& tallies() const { return tallies_; }
  long wrong() const { return wrong_; }
  const ServiceTally& service() const { return service_; }
  long over() const { return over_; }
  long calls() const { return calls_; }
  long callsCut() const { return callsCut_; }
  // Transmits on a logical channel, and those of them whose answer could be
  // checked byte for byte (the channel certainly still the client's).
  long transmits() const { return transmits_; }
  long transmitsChecked() const { return transmitsChecked_; }
  // [kind][0: no fault active, 1: a fault active]
  const Worst& worst(Kind k, int faulted) const { return worst_[static_cast<int>(k)][faulted]; }
  std::vector<FaultSpan> faults() const;
  // "+12.345 s" from the start of the chaos phase.
  std::string at(int64_t t) const;

 private:
  // Something that may have closed channels: every channel of an instance,
  // or (a client's close) one channel number for everyone else. It has
  // settled once a call that started after it ended was served right.
  struct Drop {
    Inst inst;
    int64_t start;
    int64_t end;  // INT64_MAX while it lasts
    int channel = -1;
    std::pair<int, int> by{-1, -1};
    int64_t settle = INT64_MAX;
  };

  void judge(const CallRecord& r);
  // The service checks of the faults that ended long enough before `horizon`.
  void checkService(int64_t horizon);
  void serviceViolation(const std::string& what);
  std::vector<FaultSpan> overlapping(Inst inst, int64_t t0, int64_t t1, bool* other) const;
  // The bound of a call on `inst` from t0 to t1, given the faults around it.
  int64_t boundMsFor(Inst inst, int64_t t0, int64_t t1, bool inFlight = true) const;
  bool channelCertain(const CallRecord& r) const;
  size_t addDrop(Inst inst, int64_t start, int64_t end, int channel = -1, std::pair<int, int> by = {-1, -1});
  std::string describe(const CallRecord& r) const;
  void violation(const std::string& invariant, const CallRecord& r, const std::vector<FaultSpan>& active);

  uint64_t seed_;
  BoundConfig bounds_;
  bool pcsc_;
  int64_t origin_;
  FILE* out_;
  FILE* trace_ = nullptr;

  mutable std::mutex mu_;  // the fault thread and the main thread
  std::vector<FaultSpan> faults_;
  std::map<std::pair<int, int64_t>, size_t> faultDrops_;  // (kind, planned start) -> drop

  std::vector<Drop> drops_;
  std::map<std::tuple<int, int, long>, size_t> openDrops_;  // init/reset/close calls under way
  std::map<std::pair<int, int>, std::vector<size_t>> dropsOfClient_;
  std::vector<CallRecord> queue_;

  struct Served {
    int64_t t0, t1;
    Kind kind;
  };
  std::map<Inst, std::vector<Served>> served_;  // calls answered right that reached the device
  std::map<Inst, int64_t> lastStart_;           // the latest call judged, by its start
  std::map<std::tuple<int, int, long>, std::pair<Inst, int64_t>> opening_;  // opens under way: their start
  std::map<std::pair<Inst, int>, int64_t> lastOpened_;  // a channel's last open by a client: its start
  ServiceTally service_;

  std::map<std::pair<Inst, Iface>, Tally> tallies_;
  Worst worst_[kKinds][2];
  long calls_ = 0, wrong_ = 0, over_ = 0, callsCut_ = 0, transmits_ = 0, transmitsChecked_ = 0;
  int shown_;
  int reported_ = 0;
  size_t pruneAt_ = 2000;
};

}  // namespace chaos

#pragma once
// Checks of the run made from what the daemon and the modem leave behind,
// beside the calls' own answers: callers the daemon let give up, and
// sessions of a lost port still open at the modem.
#include <cstdint>
#include <cstdio>
#include <functional>
#include <set>
#include <string>

#include "chaos_judge.h"

namespace chaos {

// Every "call given up" line of the daemon's log, against the faults of its
// instance: slow is not broken. `origin` is the chaos phase's start
// (monoNanos) and `originMsOfDay` the same moment by the log's wall clock.
void judgeGiveUps(Judge& judge, const std::string& daemonLog, int64_t origin, int64_t originMsOfDay);

// The sessions of a lost port are released once it is back: some time after
// a port loss no channel is open at the modem but those clients opened since
// it began. Judged only where no other outage of the modem came in between
// (a restart clears the card, a silence holds the releases).
class PortLossCheck {
 public:
  explicit PortLossCheck(uint64_t seed) : seed_(seed) {}
  // Judges the port losses that ended long enough before `now`; `pump` reads
  // what the clients have announced so far.
  void check(Judge& judge, const std::string& modemReport, int64_t now, const std::function<void()>& pump);
  long kept() const { return kept_; }
  void report(FILE* out) const;

 private:
  // The port is tried again once a second, and the releases go first.
  static constexpr int64_t kReleasedMs = 4000;
  uint64_t seed_;
  std::set<int64_t> checked_;  // by the loss's start
  long seen_ = 0, judged_ = 0, kept_ = 0;
};

}  // namespace chaos

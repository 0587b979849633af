#include "chaos_audit.h"

#include <vector>

#include "chaos_check.h"
#include "chaos_env.h"

namespace chaos {

void judgeGiveUps(Judge& judge, const std::string& daemonLog, int64_t origin, int64_t originMsOfDay) {
  FILE* f = fopen(daemonLog.c_str(), "r");
  if (f == nullptr) return;
  char line[1024];
  constexpr int64_t kDayMs = 24 * 3600 * 1000;
  while (fgets(line, sizeof(line), f) != nullptr) {
    GiveUp g;
    if (!parseGiveUp(line, &g)) continue;
    int64_t sinceMs = g.msOfDay - originMsOfDay;
    if (sinceMs < -kDayMs / 2) sinceMs += kDayMs;  // the run went past midnight
    if (sinceMs < 0) continue;                      // before the chaos phase
    std::string text(line);
    if (!text.empty() && text.back() == '\n') text.pop_back();
    judge.gaveUp(g.inst, origin + sinceMs * kMs, text);
  }
  fclose(f);
}

void PortLossCheck::check(Judge& judge, const std::string& modemReport, int64_t now,
                          const std::function<void()>& pump) {
  const std::vector<FaultSpan> faults = judge.faults();
  for (const FaultSpan& f : faults) {
    if (f.fault.kind != FaultKind::ModemPortLost || f.end == INT64_MAX || now < f.end + kReleasedMs * kMs ||
        !checked_.insert(f.start).second) {
      continue;
    }
    ++seen_;
    bool crowded = false;
    for (const FaultSpan& o : faults) {
      if (&o == &f || faultInst(o.fault.kind) != Inst::Sim || !faultIsOutage(o.fault.kind)) continue;
      if (o.start <= now && o.end >= f.start) crowded = true;
    }
    if (crowded) continue;
    // The card first: every open it shows was announced before it was sent.
    std::vector<int> atModem;
    if (!channelListIn(modemReport, &atModem)) continue;
    pump();
    ++judged_;
    const long kept = judge.channelsKept(Inst::Sim, atModem, f.start, now);
    if (kept == 0) continue;
    kept_ += kept;
    std::string list;
    for (int c : atModem) list += (list.empty() ? "" : " ") + std::to_string(c);
    printf("chaos: VIOLATION seed %llu at %s: %ld channel(s) open at the modem %lld ms after a port loss ended "
           "that no client opened since it began: sessions of the lost port kept (modem: \"%s\")\n",
           static_cast<unsigned long long>(seed_), judge.at(now).c_str(), kept,
           static_cast<long long>((now - f.end) / kMs), list.c_str());
    fflush(stdout);
  }
}

void PortLossCheck::report(FILE* out) const {
  fprintf(out,
          "chaos: port losses: %ld, the modem's channels judged after %ld of them (the rest crowded by other "
          "outages), sessions kept %ld\n",
          seen_, judged_, kept_);
}

}  // namespace chaos

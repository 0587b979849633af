#include "chaos_report.h"

#include <map>

namespace chaos {

std::string summaryLine(const Judge& j, const Summary& s) {
  char b[400];
  snprintf(b, sizeof(b),
           "chaos: seed %llu, %d s, %ld calls, %ld faults, %ld wrong, %ld over bound, %ld channels left open, "
           "RSS %ld->%ld kB, fds %ld->%ld, threads %ld->%ld",
           static_cast<unsigned long long>(s.seed), s.seconds, j.calls(), s.faults, j.wrong(), j.over(), s.leftOpen,
           s.start.rssKb, s.end.rssKb, s.start.fds, s.end.fds, s.start.threads, s.end.threads);
  return b;
}

void printReport(FILE* out, const Judge& j, const Summary& s) {
  fprintf(out, "\nchaos: calls by instance and interface (clean = a documented failure; %ld calls cut by a kill)\n",
          j.callsCut());
  fprintf(out, "  %-5s %-5s %9s %9s %9s %7s %6s\n", "inst", "iface", "calls", "right", "clean", "wrong", "over");
  for (const auto& [key, t] : j.tallies()) {
    fprintf(out, "  %-5s %-5s %9ld %9ld %9ld %7ld %6ld\n", instName(key.first), ifaceName(key.second), t.calls, t.ok,
            t.clean, t.wrong, t.over);
  }

  fprintf(out, "  transmits on a channel the client opened: %ld, answers checked byte for byte: %ld\n",
          j.transmits(), j.transmitsChecked());

  std::map<FaultKind, std::pair<long, double>> byKind;
  for (const FaultSpan& f : j.faults()) {
    auto& e = byKind[f.fault.kind];
    ++e.first;
    if (f.end != INT64_MAX) e.second += static_cast<double>(f.end - f.start) / 1e9;
  }
  fprintf(out, "\nchaos: faults by kind\n  %-16s %6s %9s\n", "kind", "count", "seconds");
  for (const auto& [k, e] : byKind) fprintf(out, "  %-16s %6ld %9.1f\n", faultName(k), e.first, e.second);

  const ServiceTally& sv = j.service();
  fprintf(out,
          "\nchaos: service\n  faults the daemon must hide: %ld, each served while it lasted but %ld (%ld too covered "
          "by outages to tell)\n  outages: %ld, each followed by service within %lld ms (other outages not "
          "counted) but %ld (%ld cut by the end)\n",
          sv.hidden, sv.unserved, sv.hiddenUnjudged, sv.outages, static_cast<long long>(kRecoveryMs), sv.late,
          sv.outagesUnjudged);

  fprintf(out, "\nchaos: worst latency per call kind, ms (bound at that call)\n  %-9s %19s %19s\n", "call",
          "no fault active", "a fault active");
  for (int k = 0; k < kKinds; ++k) {
    char cells[2][32];
    for (int f = 0; f < 2; ++f) {
      const Worst& w = j.worst(static_cast<Kind>(k), f);
      if (w.ns < 0) {
        snprintf(cells[f], sizeof(cells[f]), "-");
      } else {
        snprintf(cells[f], sizeof(cells[f]), "%.1f (%lld)", static_cast<double>(w.ns) / 1e6,
                 static_cast<long long>(w.boundMs));
      }
    }
    fprintf(out, "  %-9s %19s %19s\n", kindName(static_cast<Kind>(k)), cells[0], cells[1]);
  }
  fprintf(out, "\n%s\n", summaryLine(j, s).c_str());
  fflush(out);
}

}  // namespace chaos

#include "chaos_plan.h"

#include <algorithm>
#include <cstdio>
#include <random>

namespace chaos {

namespace {

const char* const kFaultNames[] = {"modem-silence", "modem-slow",  "modem-pieces", "modem-unsol",
                                   "modem-port-lost", "modem-restart", "modem-bare", "lib-hang",
                                   "lib-fail",      "lib-slow",    "card-out",     "other-reset"};

uint64_t splitmix(uint64_t x) {
  x += 0x9E3779B97F4A7C15ULL;
  x = (x ^ (x >> 30)) * 0xBF58476D1CE4E5B9ULL;
  x = (x ^ (x >> 27)) * 0x94D049BB133111EBULL;
  return x ^ (x >> 31);
}

// Draws of our own rather than <random>'s distributions, whose results may
// differ between standard libraries: a seed must mean the same run anywhere.
class Draw {
 public:
  explicit Draw(uint64_t seed) : rng_(seed) {}
  int64_t between(int64_t lo, int64_t hi) {  // inclusive
    return lo + static_cast<int64_t>(rng_() % static_cast<uint64_t>(hi - lo + 1));
  }
  bool chance(int percent) { return between(1, 100) <= percent; }

 private:
  std::mt19937_64 rng_;
};

struct Stream {
  std::vector<FaultKind> kinds;  // one drawn per fault, in turn weighted equally
  int64_t meanGapMs;
  int64_t minLenMs, maxLenMs;
};

void fillParams(Fault& f, Draw& d) {
  switch (f.kind) {
    case FaultKind::ModemSlow: f.a = static_cast<int>(d.between(10, 200)); break;
    case FaultKind::ModemPieces: f.a = static_cast<int>(d.between(4, 48)); break;
    case FaultKind::ModemUnsol: f.a = static_cast<int>(d.between(1, 3)); break;
    case FaultKind::LibFail: {
      static const int kWords[] = {0, 0x6A82, 0x6F00, 0x6985};
      f.a = kWords[d.between(0, 3)];
      break;
    }
    case FaultKind::LibSlow:
      f.a = static_cast<int>(d.between(1, kEchoP1Max));
      f.b = static_cast<int>(d.between(50, 400));
      break;
    default: break;
  }
}

}  // namespace

const char* faultName(FaultKind k) { return kFaultNames[static_cast<int>(k)]; }

Inst faultInst(FaultKind k) {
  switch (k) {
    case FaultKind::LibHang:
    case FaultKind::LibFail:
    case FaultKind::LibSlow:
    case FaultKind::CardOut:
    case FaultKind::OtherReset: return Inst::Ese;
    default: return Inst::Sim;
  }
}

std::string describeFault(const Fault& f) {
  char b[96];
  switch (f.kind) {
    case FaultKind::ModemSlow: snprintf(b, sizeof(b), "%s %d ms/answer", faultName(f.kind), f.a); break;
    case FaultKind::ModemPieces: snprintf(b, sizeof(b), "%s %d-byte pieces", faultName(f.kind), f.a); break;
    case FaultKind::ModemUnsol: snprintf(b, sizeof(b), "%s %d line(s)/answer", faultName(f.kind), f.a); break;
    case FaultKind::LibFail:
      if (f.a == 0) snprintf(b, sizeof(b), "%s no status", faultName(f.kind));
      else snprintf(b, sizeof(b), "%s status %04X", faultName(f.kind), static_cast<unsigned>(f.a));
      break;
    case FaultKind::LibSlow: snprintf(b, sizeof(b), "%s P1=%02X %d ms", faultName(f.kind), f.a, f.b); break;
    default: snprintf(b, sizeof(b), "%s", faultName(f.kind)); break;
  }
  return b;
}

uint64_t Plan::clientSeed(int slot, int gen) const {
  return splitmix(seed ^ splitmix((static_cast<uint64_t>(slot) << 32) | static_cast<uint32_t>(gen)));
}

Plan makePlan(uint64_t seed, int64_t durationMs, bool pcsc) {
  Plan p;
  p.seed = seed;
  p.durationMs = durationMs;
  p.pcsc = pcsc;
  for (Inst inst : {Inst::Ese, Inst::Sim}) {
    for (Iface iface : {Iface::Hidl, Iface::Hidl, Iface::Aidl, Iface::Aidl}) p.slots.push_back({inst, iface});
  }

  Draw d(splitmix(seed));
  // Faults of one stream never overlap one another; different streams do.
  // The modem's outages share a stream: a silent port that is also gone is
  // just gone.
  std::vector<Stream> streams = {
      {{FaultKind::ModemSilence, FaultKind::ModemSilence, FaultKind::ModemPortLost, FaultKind::ModemRestart},
       7000, 200, 6000},
      {{FaultKind::ModemSlow}, 9000, 1000, 8000},
      {{FaultKind::ModemPieces}, 9000, 1000, 8000},
      {{FaultKind::ModemUnsol}, 8000, 1000, 8000},
      {{FaultKind::ModemBare}, 12000, 2000, 10000},
  };
  if (pcsc) {
    streams.push_back({{FaultKind::CardOut}, 10000, 300, 3000});
    streams.push_back({{FaultKind::OtherReset}, 7000, 50, 50});
  } else {
    streams.push_back({{FaultKind::LibHang}, 8000, 200, 6000});
    streams.push_back({{FaultKind::LibFail}, 9000, 300, 3000});
    streams.push_back({{FaultKind::LibSlow}, 9000, 1000, 8000});
  }
  // Nothing starts in the last 3 s: the end of the run finds every device
  // healed for a moment before the clients go.
  const int64_t lastStart = durationMs - 3000;
  for (const Stream& s : streams) {
    int64_t t = d.between(0, s.meanGapMs);
    while (t < lastStart) {
      Fault f;
      f.kind = s.kinds[static_cast<size_t>(d.between(0, static_cast<int64_t>(s.kinds.size()) - 1))];
      f.startMs = t;
      int64_t len = d.between(s.minLenMs, s.maxLenMs);
      if (f.kind == FaultKind::ModemPortLost || f.kind == FaultKind::ModemRestart) len = std::min<int64_t>(len, 4000);
      f.endMs = std::min(t + len, durationMs - 1000);
      fillParams(f, d);
      p.faults.push_back(f);
      t = f.endMs + d.between(s.meanGapMs / 5, s.meanGapMs * 9 / 5);
    }
  }
  std::stable_sort(p.faults.begin(), p.faults.end(),
                   [](const Fault& a, const Fault& b) { return a.startMs < b.startMs; });

  // A client killed every 3 s on average, the slot drawn at random.
  for (int64_t t = d.between(500, 5000); t < durationMs - 2000; t += d.between(1000, 5000)) {
    p.kills.push_back({static_cast<int>(d.between(0, static_cast<int64_t>(p.slots.size()) - 1)), t});
  }
  return p;
}

}  // namespace chaos

#pragma once
// Small helpers shared by the benchmark programs: a monotonic clock and
// latency statistics over a run of samples.
#include <algorithm>
#include <chrono>
#include <cstdint>
#include <vector>

namespace se_bench {

inline int64_t nowNanos() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

struct Stats {
  size_t count = 0;
  double medianUs = 0;
  double p99Us = 0;
  double perSecond = 0;  // exchanges per second over the whole run, back to back
};

// `samples` are per-exchange nanoseconds; `totalNanos` the wall time of the run.
inline Stats statsOf(std::vector<int64_t> samples, int64_t totalNanos) {
  Stats s;
  s.count = samples.size();
  if (samples.empty()) return s;
  std::sort(samples.begin(), samples.end());
  s.medianUs = samples[samples.size() / 2] / 1000.0;
  // Nearest-rank 99th percentile.
  size_t rank = (samples.size() * 99 + 99) / 100;
  if (rank < 1) rank = 1;
  s.p99Us = samples[rank - 1] / 1000.0;
  if (totalNanos > 0) s.perSecond = static_cast<double>(samples.size()) * 1e9 / totalNanos;
  return s;
}

// Runs `op` `warmup` times untimed, then `count` times timed.
template <typename Op>
Stats measure(size_t warmup, size_t count, Op op) {
  for (size_t i = 0; i < warmup; ++i) op();
  std::vector<int64_t> samples;
  samples.reserve(count);
  int64_t start = nowNanos();
  for (size_t i = 0; i < count; ++i) {
    int64_t t0 = nowNanos();
    op();
    samples.push_back(nowNanos() - t0);
  }
  return statsOf(std::move(samples), nowNanos() - start);
}

}  // namespace se_bench

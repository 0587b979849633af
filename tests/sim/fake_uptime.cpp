#include "fake_uptime.h"

#include <atomic>

#include "se_uptime.h"

namespace {
std::atomic<long> g_seconds{1000};
std::atomic<bool> g_fails{false};
}  // namespace

namespace sim_test {
void setUptime(long seconds, bool fails) {
  g_seconds = seconds;
  g_fails = fails;
}
}  // namespace sim_test

int32_t se_uptime_seconds(long* seconds) {
  if (g_fails) return -1;
  *seconds = g_seconds;
  return 0;
}

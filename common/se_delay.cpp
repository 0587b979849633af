#include "se_delay.h"

#include <atomic>
#include <cerrno>
#include <ctime>

namespace se_delay {
namespace {
std::atomic<uint32_t> g_divisor{1};
}

uint64_t scaledMicros(uint64_t productMicros) { return productMicros / g_divisor.load(); }

void sleepMicros(uint64_t productMicros) {
  uint64_t us = scaledMicros(productMicros);
  struct timespec req;
  req.tv_sec = static_cast<time_t>(us / 1000000);
  req.tv_nsec = static_cast<long>(us % 1000000) * 1000;
  struct timespec rem;
  while (nanosleep(&req, &rem) != 0 && errno == EINTR) req = rem;
}

void setDivisorForTest(uint32_t divisor) { g_divisor.store(divisor == 0 ? 1 : divisor); }

}  // namespace se_delay

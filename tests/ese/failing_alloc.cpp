// The eSE front's working buffers for tests: the same allocation, except that
// the nth one from a chosen point fails, so the out-of-memory paths run.
#include <atomic>
#include <cstdlib>

#include "ese_buffer.h"
#include "ese_test_util.h"

namespace {
std::atomic<unsigned> g_countdown{0};
}

void ese_test::setBufferAllocFailureForTest(unsigned nth) { g_countdown.store(nth); }

uint8_t* android::hardware::secure_element::V1_0::implementation::eseBufferAlloc(size_t size,
                                                                                 bool zeroFill) {
  unsigned left = g_countdown.load();
  while (left != 0 && !g_countdown.compare_exchange_weak(left, left - 1)) {
  }
  if (left == 1) return nullptr;
  return static_cast<uint8_t*>(zeroFill ? std::calloc(size, 1) : std::malloc(size));
}

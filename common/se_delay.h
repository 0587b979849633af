#pragma once
// The daemon's real waits (retry pauses, the settling delay, the AT command
// time-out) keep their product values in the code and pass through here, so
// that tests can shrink all of them at once. The product never changes the
// divisor.
#include <cstdint>

namespace se_delay {

// `productMicros` divided by the test divisor (1 in the product).
uint64_t scaledMicros(uint64_t productMicros);
// Sleeps the scaled duration, going on after signals.
void sleepMicros(uint64_t productMicros);
// Tests only: every later delay is divided by `divisor` (0 counts as 1).
void setDivisorForTest(uint32_t divisor);

}  // namespace se_delay

#pragma once
// The eSE front's calls into the vendor library (ese_qv_hal.h), each made
// through one process-wide LibraryGate. A call the gate gives up on is not
// made: the wrapper answers as a failing library call would (-1, the response
// records left as the caller filled them), so every operation ends the way
// it ends when the library fails.
#include <pthread.h>

#include <chrono>
#include <cstdint>

#include "ese_qv_hal.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

// How long the call in the library may run before others stop waiting for
// it (ese_stuck_bound.cpp, a unit of its own so that a test program can link
// another value).
std::chrono::milliseconds stuckCallBound();

// One wrapper per library function; a give-up is logged under the function's
// name.
int32_t initOpen();
int32_t transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu);
int32_t transmitByIpc(phQvEse_data* cmd, phQvEse_data* rsp);
int32_t setReady();
int32_t setPower(const char* state);
// A give-up counts as "not ready" (-1), so init closes nothing.
int32_t readyStatus();

// phQvEse_close now, or as soon as the call in the library returns; never
// waits. `op` names the caller in the log.
void closeNowOrAfterCurrentCall(const char* op);

// Takes the front's lock unless its holder is stuck in the library; false
// (logged) when the caller gave up.
bool lockFront(pthread_mutex_t* mutex, const char* op);

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

#pragma once
// The eSE front's calls into the vendor library (ese_qv_hal.h). Each wrapper
// records when the call went in, so that callers waiting for the front can
// tell a library that is working from one that does not return.
#include <cstdint>

#include "ese_qv_hal.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

int32_t initOpen();
int32_t close();
int32_t transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu);
int32_t transmitByIpc(phQvEse_data* cmd, phQvEse_data* rsp);
int32_t setReady();
int32_t setPower(const char* state);
int32_t readyStatus();

// How long the call now in the library has run, in microseconds; 0 when no
// call is in it.
int64_t silenceMicros();

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

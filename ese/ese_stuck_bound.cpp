#include "ese_library.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

// A card exchange takes milliseconds; half a second without a return is a
// library in trouble, and waiting longer would hold an RPC thread that SIM1
// needs (the pool has two for both instances). Calls that each return within
// it are all served, however many callers queue up.
std::chrono::milliseconds stuckCallBound() { return std::chrono::milliseconds(500); }

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

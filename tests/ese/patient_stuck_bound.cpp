// Linked into test programs whose library calls are held by the test for as
// long as it likes (contention tests): nobody gives up on them while the test
// runs. Takes the place of the product's value at link time.
#include "ese_library.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

std::chrono::milliseconds stuckCallBound() { return std::chrono::minutes(10); }

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

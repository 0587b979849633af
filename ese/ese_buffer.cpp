#include "ese_buffer.h"

#include <cstdlib>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

uint8_t* eseBufferAlloc(size_t size, bool zeroFill) {
  return static_cast<uint8_t*>(zeroFill ? std::calloc(size, 1) : std::malloc(size));
}

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

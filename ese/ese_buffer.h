#pragma once
// Where the eSE front gets its per-call working buffers. The function lives in
// a unit of its own (ese_buffer.cpp) so that a program can link another one in
// its place, e.g. one that runs out of memory on purpose.
#include <cstddef>
#include <cstdint>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {

// `size` bytes (zero-filled when asked), released with std::free; null when
// memory is short.
uint8_t* eseBufferAlloc(size_t size, bool zeroFill);

}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

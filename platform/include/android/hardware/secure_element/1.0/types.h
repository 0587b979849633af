#pragma once
#include <cstdint>
#include <string>

#include <hidl/HidlSupport.h>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {

enum class SecureElementStatus : uint8_t {
  SUCCESS = 0,
  FAILED = 1,
  CHANNEL_NOT_AVAILABLE = 2,
  NO_SUCH_ELEMENT_ERROR = 3,
  UNSUPPORTED_OPERATION = 4,
  IOERROR = 5,
};

struct LogicalChannelResponse {
  uint8_t channelNumber = 0;
  ::android::hardware::hidl_vec<uint8_t> selectResponse;
};

inline std::string toString(SecureElementStatus s) {
  switch (s) {
    case SecureElementStatus::SUCCESS: return "SUCCESS";
    case SecureElementStatus::FAILED: return "FAILED";
    case SecureElementStatus::CHANNEL_NOT_AVAILABLE: return "CHANNEL_NOT_AVAILABLE";
    case SecureElementStatus::NO_SUCH_ELEMENT_ERROR: return "NO_SUCH_ELEMENT_ERROR";
    case SecureElementStatus::UNSUPPORTED_OPERATION: return "UNSUPPORTED_OPERATION";
    case SecureElementStatus::IOERROR: return "IOERROR";
  }
  return std::to_string(static_cast<unsigned>(s));
}

}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

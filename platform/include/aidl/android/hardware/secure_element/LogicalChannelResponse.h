#pragma once
// Host stand-in for the NDK code generated from LogicalChannelResponse.aidl.
#include <cstdint>
#include <vector>

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

class LogicalChannelResponse {
 public:
  std::vector<uint8_t> selectResponse;
  int8_t channelNumber = 0;

  bool operator==(const LogicalChannelResponse& o) const {
    return selectResponse == o.selectResponse && channelNumber == o.channelNumber;
  }
  bool operator!=(const LogicalChannelResponse& o) const { return !(*this == o); }
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

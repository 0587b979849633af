#pragma once
// Host stand-in for the NDK code generated from ISecureElement.aidl.
#include <cstdint>
#include <memory>
#include <vector>

#include <aidl/android/hardware/secure_element/ISecureElementCallback.h>
#include <aidl/android/hardware/secure_element/LogicalChannelResponse.h>
#include <android/binder_interface_utils.h>

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

class ISecureElement : public ::ndk::ICInterface {
 public:
  static const char* descriptor;
  static const int32_t version = 1;

  enum : int32_t {
    FAILED = 1,
    CHANNEL_NOT_AVAILABLE = 2,
    NO_SUCH_ELEMENT_ERROR = 3,
    UNSUPPORTED_OPERATION = 4,
    IOERROR = 5,
  };

  static std::shared_ptr<ISecureElement> fromBinder(const ::ndk::SpAIBinder& binder);

  virtual ::ndk::ScopedAStatus closeChannel(int8_t in_channelNumber) = 0;
  virtual ::ndk::ScopedAStatus getAtr(std::vector<uint8_t>* _aidl_return) = 0;
  virtual ::ndk::ScopedAStatus init(
      const std::shared_ptr<ISecureElementCallback>& in_clientCallback) = 0;
  virtual ::ndk::ScopedAStatus isCardPresent(bool* _aidl_return) = 0;
  virtual ::ndk::ScopedAStatus openBasicChannel(const std::vector<uint8_t>& in_aid, int8_t in_p2,
                                                std::vector<uint8_t>* _aidl_return) = 0;
  virtual ::ndk::ScopedAStatus openLogicalChannel(const std::vector<uint8_t>& in_aid,
                                                  int8_t in_p2,
                                                  LogicalChannelResponse* _aidl_return) = 0;
  virtual ::ndk::ScopedAStatus reset() = 0;
  virtual ::ndk::ScopedAStatus transmit(const std::vector<uint8_t>& in_data,
                                        std::vector<uint8_t>* _aidl_return) = 0;
  virtual ::ndk::ScopedAStatus getInterfaceVersion(int32_t* _aidl_return) = 0;
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

#pragma once
#include <cstdint>
#include <functional>
#include <string>

#include <android/hardware/secure_element/1.0/ISecureElementHalCallback.h>
#include <android/hardware/secure_element/1.0/types.h>
#include <android/hidl/base/1.0/IBase.h>
#include <hidl/HidlSupport.h>
#include <hidl/Status.h>
#include <utils/Errors.h>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {

struct ISecureElement : public ::android::hidl::base::V1_0::IBase {
  static const char* descriptor;

  using getAtr_cb = std::function<void(const ::android::hardware::hidl_vec<uint8_t>& response)>;
  using transmit_cb = std::function<void(const ::android::hardware::hidl_vec<uint8_t>& response)>;
  using openLogicalChannel_cb =
      std::function<void(const LogicalChannelResponse& response, SecureElementStatus status)>;
  using openBasicChannel_cb = std::function<void(
      const ::android::hardware::hidl_vec<uint8_t>& selectResponse, SecureElementStatus status)>;

  virtual ::android::hardware::Return<void> init(
      const ::android::sp<ISecureElementHalCallback>& clientCallback) = 0;
  virtual ::android::hardware::Return<void> getAtr(getAtr_cb _hidl_cb) = 0;
  virtual ::android::hardware::Return<bool> isCardPresent() = 0;
  virtual ::android::hardware::Return<void> transmit(
      const ::android::hardware::hidl_vec<uint8_t>& data, transmit_cb _hidl_cb) = 0;
  virtual ::android::hardware::Return<void> openLogicalChannel(
      const ::android::hardware::hidl_vec<uint8_t>& aid, uint8_t p2,
      openLogicalChannel_cb _hidl_cb) = 0;
  virtual ::android::hardware::Return<void> openBasicChannel(
      const ::android::hardware::hidl_vec<uint8_t>& aid, uint8_t p2,
      openBasicChannel_cb _hidl_cb) = 0;
  virtual ::android::hardware::Return<SecureElementStatus> closeChannel(uint8_t channelNumber) = 0;

  // Client side: a proxy to the registered instance, or null when none is there.
  static ::android::sp<ISecureElement> getService(const std::string& serviceName = "default",
                                                  bool getStub = false);
  // Server side: serve this object under the instance name; 0 (OK) when registered.
  __attribute__((warn_unused_result)) ::android::status_t registerAsService(
      const std::string& serviceName = "default");
};

}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

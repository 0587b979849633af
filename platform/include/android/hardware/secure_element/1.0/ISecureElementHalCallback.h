#pragma once
#include <android/hidl/base/1.0/IBase.h>
#include <hidl/Status.h>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {

struct ISecureElementHalCallback : public ::android::hidl::base::V1_0::IBase {
  static const char* descriptor;
  virtual ::android::hardware::Return<void> onStateChange(bool connected) = 0;
};

}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

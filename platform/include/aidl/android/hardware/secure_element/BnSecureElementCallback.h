#pragma once
#include <aidl/android/hardware/secure_element/ISecureElementCallback.h>

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

class BnSecureElementCallback : public ::ndk::BnCInterface<ISecureElementCallback> {
 public:
  ::ndk::ScopedAStatus getInterfaceVersion(int32_t* _aidl_return) final {
    *_aidl_return = ISecureElementCallback::version;
    return ::ndk::ScopedAStatus::ok();
  }

 protected:
  ::ndk::SpAIBinder createBinder() override;
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

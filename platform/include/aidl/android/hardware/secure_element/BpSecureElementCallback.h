#pragma once
#include <aidl/android/hardware/secure_element/ISecureElementCallback.h>

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

class BpSecureElementCallback : public ::ndk::BpCInterface<ISecureElementCallback> {
 public:
  explicit BpSecureElementCallback(const ::ndk::SpAIBinder& binder) : BpCInterface(binder) {}
  ::ndk::ScopedAStatus onStateChange(bool in_connected, const std::string& in_debugReason) override;
  ::ndk::ScopedAStatus getInterfaceVersion(int32_t* _aidl_return) override;
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

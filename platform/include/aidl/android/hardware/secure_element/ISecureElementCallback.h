#pragma once
// Host stand-in for the NDK code generated from ISecureElementCallback.aidl.
#include <cstdint>
#include <memory>
#include <string>

#include <android/binder_interface_utils.h>

namespace aidl {
namespace android {
namespace hardware {
namespace secure_element {

class ISecureElementCallback : public ::ndk::ICInterface {
 public:
  static const char* descriptor;
  static const int32_t version = 1;

  // A local callback object as itself, a remote one through a proxy; null for
  // a null binder.
  static std::shared_ptr<ISecureElementCallback> fromBinder(const ::ndk::SpAIBinder& binder);

  virtual ::ndk::ScopedAStatus onStateChange(bool in_connected,
                                             const std::string& in_debugReason) = 0;
  virtual ::ndk::ScopedAStatus getInterfaceVersion(int32_t* _aidl_return) = 0;
};

}  // namespace secure_element
}  // namespace hardware
}  // namespace android
}  // namespace aidl

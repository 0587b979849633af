#pragma once
#include <cstdint>
#include <string>

#include <hidl/HidlSupport.h>
#include <hidl/Status.h>

namespace android {
namespace hidl {
namespace base {
namespace V1_0 {

struct IBase : virtual public ::android::RefBase {
  static const char* descriptor;
  // True for proxies of objects living in another process.
  virtual bool isRemote() const { return false; }
  // A local object never dies apart from this process: linking succeeds and
  // never fires. Proxies notify the recipient when their peer goes away.
  virtual ::android::hardware::Return<bool> linkToDeath(
      const ::android::sp<::android::hardware::hidl_death_recipient>& recipient, uint64_t cookie);
  virtual ::android::hardware::Return<bool> unlinkToDeath(
      const ::android::sp<::android::hardware::hidl_death_recipient>& recipient);
  virtual ::android::hardware::Return<void> ping();
  virtual ~IBase() {}
};

}  // namespace V1_0
}  // namespace base
}  // namespace hidl
}  // namespace android

#include <android/hidl/base/1.0/IBase.h>

namespace android {
namespace hidl {
namespace base {
namespace V1_0 {

const char* IBase::descriptor = "android.hidl.base@1.0::IBase";

::android::hardware::Return<bool> IBase::linkToDeath(
    const ::android::sp<::android::hardware::hidl_death_recipient>&, uint64_t) {
  return true;
}

::android::hardware::Return<bool> IBase::unlinkToDeath(
    const ::android::sp<::android::hardware::hidl_death_recipient>&) {
  return true;
}

::android::hardware::Return<void> IBase::ping() { return ::android::hardware::Void(); }

}  // namespace V1_0
}  // namespace base
}  // namespace hidl
}  // namespace android

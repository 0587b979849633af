#include "service.h"

#include <cstdint>

#include <android/binder_manager.h>
#include <android/binder_process.h>
#include <hidl/HidlTransportSupport.h>
#include <log/log.h>

#include <memory>
#include <string>

#include "SecureElement.h"
#include "ZerbSimSecureElement.h"
#include "aidl_front.h"
#include "ese_qv_hal.h"
#include "se_device_gate.h"

using ::android::OK;
using ::android::sp;
using ::android::hardware::configureRpcThreadpool;
using ::android::hardware::joinRpcThreadpool;
using ::android::hardware::secure_element::V1_0::implementation::SecureElement;
using ::android::hardware::secure_element::V1_0::implementation::ZerbSimSecureElement;
using AidlFront = ::aidl::android::hardware::secure_element::AidlFront;
using AidlISecureElement = ::aidl::android::hardware::secure_element::ISecureElement;

namespace {
constexpr const char* kTag = "qvese@1.0-service";
// Each pool has a thread more than either instance may take (see the gate in
// se_device_gate.h), so a stuck device never holds every thread.
constexpr size_t kRpcThreads = kRpcPoolThreads;
// Binder threads the driver may add beside the one the pool starts with: as
// many AIDL threads as the HIDL pool has. (On a host both share one pool.)
constexpr uint32_t kAidlExtraThreads = kRpcPoolThreads - 1;

// Serves `front` as the AIDL instance `instance`; false (logged) on failure.
bool registerAidl(const std::shared_ptr<AidlFront>& front, const char* instance) {
  const std::string name = std::string(AidlISecureElement::descriptor) + "/" + instance;
  if (AServiceManager_addService(front->asBinder().get(), name.c_str()) != EX_NONE) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "AIDL Registered %s fail", name.c_str());
    return false;
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "AIDL Registered %s success", name.c_str());
  return true;
}
}  // namespace

int qvese_service_main() {
  __android_log_print(ANDROID_LOG_INFO, kTag, "ecure Element HAL Service 1.0 is starting");

  const int32_t eseType = get_korva_exist_flag();
  g_korva_exist = eseType;
  __android_log_print(ANDROID_LOG_ERROR, kTag, "g_ese_type = %d!", eseType);

  sp<SecureElement> ese;
  sp<ZerbSimSecureElement> sim;

  // Types 1 and 2 mean an eSE is fitted; one unsigned comparison puts 0,
  // negatives and anything above 2 outside.
  if (static_cast<uint32_t>(eseType) - 1u <= 1u) {
    ese = new SecureElement();
    configureRpcThreadpool(kRpcThreads, true);
    if (ese->registerAsService("eSE1") != OK) {
      __android_log_print(ANDROID_LOG_ERROR, kTag, "SecureElement Registered eSE1 fail");
      return 1;
    }
    __android_log_print(ANDROID_LOG_INFO, kTag, "SecureElement Registered eSE1 success");
  }

  sim = new ZerbSimSecureElement(0);
  configureRpcThreadpool(kRpcThreads, true);
  if (sim->registerAsService("SIM1") != OK) {
    __android_log_print(ANDROID_LOG_ERROR, kTag, "ZerbSimSecureElement Registered sim1 fail");
    return 1;
  }
  __android_log_print(ANDROID_LOG_INFO, kTag, "ZerbSimSecureElement Registered sim1 success");

  // The AIDL faces of the same objects, after the HIDL instances: eSE1 only
  // where the HIDL eSE1 is served.
  ABinderProcess_setThreadPoolMaxThreadCount(kAidlExtraThreads);
  std::shared_ptr<AidlFront> aidlEse;
  if (ese != nullptr) {
    aidlEse = ::ndk::SharedRefBase::make<AidlFront>(
        ese, "eSE1",
        AidlFront::Element{SecureElement::isLogicalChannelOpen,
                           [] { return SecureElement::releaseLibrary("reset"); },
                           &SecureElement::gate()});
    if (!registerAidl(aidlEse, "eSE1")) return 1;
  }
  // The SIM's channels are closed on the modem by the reset itself; the
  // modem's port stays open.
  auto aidlSim = ::ndk::SharedRefBase::make<AidlFront>(
      sim, "SIM1",
      AidlFront::Element{ZerbSimSecureElement::isChannelOpen, [] { return true; },
                         &ZerbSimSecureElement::gate()});
  if (!registerAidl(aidlSim, "SIM1")) return 1;
  ABinderProcess_startThreadPool();

  joinRpcThreadpool();
  // The pool is not expected to give the thread back.
  return 1;
}

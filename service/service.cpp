#include "service.h"

#include <cstdint>

#include <hidl/HidlTransportSupport.h>
#include <log/log.h>

#include "SecureElement.h"
#include "ZerbSimSecureElement.h"
#include "ese_qv_hal.h"

using ::android::OK;
using ::android::sp;
using ::android::hardware::configureRpcThreadpool;
using ::android::hardware::joinRpcThreadpool;
using ::android::hardware::secure_element::V1_0::implementation::SecureElement;
using ::android::hardware::secure_element::V1_0::implementation::ZerbSimSecureElement;

namespace {
constexpr const char* kTag = "qvese@1.0-service";
constexpr size_t kRpcThreads = 2;
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

  joinRpcThreadpool();
  // The pool is not expected to give the thread back.
  return 1;
}

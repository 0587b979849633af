#include "ese_library.h"

#include <time.h>

#include <atomic>

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

namespace {

// Monotonic time the call now in the library went in, in microseconds; 0
// when none is in it. Library calls are made one at a time, by the holder of
// the front's lock.
std::atomic<int64_t> g_inLibrarySince{0};

int64_t nowMicros() {
  struct timespec t;
  clock_gettime(CLOCK_MONOTONIC, &t);
  return static_cast<int64_t>(t.tv_sec) * 1000000 + t.tv_nsec / 1000;
}

template <typename Call>
int32_t timed(Call call) {
  g_inLibrarySince.store(nowMicros());
  const int32_t rc = call();
  g_inLibrarySince.store(0);
  return rc;
}

}  // namespace

int32_t initOpen() {
  return timed([] { return phQvEse_init_open(); });
}

int32_t close() {
  return timed([] { return phQvEse_close(); });
}

int32_t transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu) {
  return timed([&] { return phQvEse_7816_Transceive(cpdu, rpdu); });
}

int32_t transmitByIpc(phQvEse_data* cmd, phQvEse_data* rsp) {
  return timed([&] { return phQVNciHal_Transmit_APDU_by_IPC(cmd, rsp); });
}

int32_t setReady() {
  return timed([] { return phQVNciHal_Set_KORVA_READY(); });
}

int32_t setPower(const char* state) {
  return timed([&] { return phQVNciHal_Set_KORVA_Power(state); });
}

int32_t readyStatus() {
  return timed([] { return phQVNciHal_Get_KORVA_Ready_Status(); });
}

int64_t silenceMicros() {
  const int64_t since = g_inLibrarySince.load();
  if (since == 0) return 0;
  const int64_t d = nowMicros() - since;
  return d > 0 ? d : 1;
}

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

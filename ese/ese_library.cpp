#include "ese_library.h"

#include "ese_library_gate.h"

namespace android {
namespace hardware {
namespace secure_element {
namespace V1_0 {
namespace implementation {
namespace ese_library {

namespace {

constexpr int32_t kGaveUp = -1;

LibraryGate& gate() {
  // Lives as long as the process: a pool thread may still be in the library
  // when the process exits.
  static LibraryGate* instance = new LibraryGate(stuckCallBound());
  return *instance;
}

// Runs one library call through the gate.
template <typename Call>
int32_t gated(const char* op, Call call) {
  if (!gate().enter(op)) return kGaveUp;
  const int32_t rc = call();
  gate().leave();
  return rc;
}

void closeLibrary() { (void)phQvEse_close(); }

}  // namespace

int32_t initOpen() {
  return gated("phQvEse_init_open", [] { return phQvEse_init_open(); });
}

int32_t transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu) {
  return gated("phQvEse_7816_Transceive", [&] { return phQvEse_7816_Transceive(cpdu, rpdu); });
}

int32_t transmitByIpc(phQvEse_data* cmd, phQvEse_data* rsp) {
  return gated("phQVNciHal_Transmit_APDU_by_IPC",
               [&] { return phQVNciHal_Transmit_APDU_by_IPC(cmd, rsp); });
}

int32_t setReady() {
  return gated("phQVNciHal_Set_KORVA_READY", [] { return phQVNciHal_Set_KORVA_READY(); });
}

int32_t setPower(const char* state) {
  return gated("phQVNciHal_Set_KORVA_Power", [&] { return phQVNciHal_Set_KORVA_Power(state); });
}

int32_t readyStatus() {
  return gated("phQVNciHal_Get_KORVA_Ready_Status",
               [] { return phQVNciHal_Get_KORVA_Ready_Status(); });
}

void closeNowOrAfterCurrentCall(const char* op) { (void)gate().runOrLeave(closeLibrary, op); }

bool lockFront(pthread_mutex_t* mutex, const char* op) { return gate().lock(mutex, op); }

}  // namespace ese_library
}  // namespace implementation
}  // namespace V1_0
}  // namespace secure_element
}  // namespace hardware
}  // namespace android

// The eSE front fed arbitrary vendor library replies: return codes, response
// lengths up to and beyond the caller's buffers, status words. The library is
// a fake linked into this target: it writes at most what the caller's buffer
// holds but reports whatever length the input chooses, as a faulty library
// could. A sequence of front operations runs per input.
#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <host/log_capture.h>

#include "SecureElement.h"
#include "ese_qv_hal.h"
#include "fuzz_util.h"

using ::android::sp;
using ::android::hardware::hidl_death_recipient;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using ::android::hardware::secure_element::V1_0::implementation::SecureElement;

namespace {

// The front's response buffers: 270 bytes for IPC exchanges; a SELECT's
// record may point at 256 bytes (the basic channel's), so no more is written.
constexpr size_t kIpcRspBuf = 270;
constexpr size_t kTransceiveRspBuf = 256;

int32_t rcFrom(FuzzedDataProvider& in) {
  if (in.remaining_bytes() == 0) return -1;
  uint8_t b = in.ConsumeIntegral<uint8_t>();
  if (b < 200) return 0;
  return b < 230 ? -1 : static_cast<int32_t>(b);
}

// The reported length: the bytes written, or any value, some beyond the buffer.
uint32_t reportedLen(FuzzedDataProvider& in, size_t written, uint32_t max) {
  switch (in.ConsumeIntegralInRange<int>(0, 3)) {
    case 0: return static_cast<uint32_t>(written);
    case 1: return in.ConsumeIntegralInRange<uint32_t>(0, max);
    case 2: return static_cast<uint32_t>(kIpcRspBuf + in.ConsumeIntegralInRange<uint32_t>(0, 4));
    default: return in.ConsumeIntegralInRange<uint32_t>(0, 3);
  }
}

std::vector<uint8_t> replyBytes(FuzzedDataProvider& in, size_t cap) {
  std::vector<uint8_t> b = in.ConsumeBytes<uint8_t>(in.ConsumeIntegralInRange<size_t>(0, cap));
  if (in.ConsumeBool()) {
    // Often end in a status word worth reading, with a channel byte in front.
    static const uint8_t kSw[][2] = {{0x90, 0x00}, {0x61, 0x10}, {0x6A, 0x82}, {0x6A, 0x81},
                                     {0x67, 0x00}, {0x6A, 0x86}, {0x6D, 0x00}, {0x6E, 0x00}};
    const uint8_t* sw = kSw[in.ConsumeIntegralInRange<int>(0, 7)];
    if (b.size() + 2 > cap) b.resize(cap - 2);
    b.push_back(sw[0]);
    b.push_back(sw[1]);
  }
  return b;
}

struct Client : public ISecureElementHalCallback {
  Return<void> onStateChange(bool) override { return ::android::hardware::Void(); }
  Return<bool> linkToDeath(const sp<hidl_death_recipient>&, uint64_t) override { return true; }
};

}  // namespace

extern "C" {

int32_t g_korva_exist = 1;

int32_t get_korva_exist_flag(void) { return 1; }
int32_t phQvEse_init_open(void) { return fuzz::input() ? rcFrom(*fuzz::input()) : 0; }
int32_t phQvEse_close(void) { return 0; }
int32_t phQVNciHal_Set_KORVA_READY(void) { return fuzz::input() ? rcFrom(*fuzz::input()) : 0; }
int32_t phQVNciHal_Get_KORVA_Ready_Status(void) { return fuzz::input() ? rcFrom(*fuzz::input()) : 0; }

int32_t phQVNciHal_Set_KORVA_Power(const char* state) {
  if (state == nullptr) abort();
  fuzz::touch(reinterpret_cast<const uint8_t*>(state), strlen(state));
  return 0;
}

int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp) {
  if (cmd == nullptr || rsp == nullptr || rsp->p_data == nullptr) abort();
  fuzz::touch(cmd->p_data, cmd->len);
  FuzzedDataProvider& in = *fuzz::input();
  int32_t rc = rcFrom(in);
  std::vector<uint8_t> b = replyBytes(in, kIpcRspBuf);
  if (!b.empty()) memcpy(rsp->p_data, b.data(), b.size());
  rsp->len = reportedLen(in, b.size(), UINT32_MAX);
  return rc;
}

int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu) {
  if (cpdu == nullptr || rpdu == nullptr || rpdu->pdata == nullptr) abort();
  fuzz::touch(cpdu->pdata, cpdu->lc);
  FuzzedDataProvider& in = *fuzz::input();
  int32_t rc = rcFrom(in);
  std::vector<uint8_t> b = in.ConsumeBytes<uint8_t>(in.ConsumeIntegralInRange<size_t>(0, kTransceiveRspBuf));
  if (!b.empty()) memcpy(rpdu->pdata, b.data(), b.size());
  rpdu->len = static_cast<uint16_t>(reportedLen(in, b.size(), UINT16_MAX));
  rpdu->sw1 = in.ConsumeIntegral<uint8_t>();
  rpdu->sw2 = in.ConsumeIntegral<uint8_t>();
  return rc;
}

}  // extern "C"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  android::host::LogCapture quiet;
  FuzzedDataProvider in(data, size);
  fuzz::CurrentInput current(in);
  static sp<SecureElement> se = new SecureElement();
  sp<Client> client = new Client();

  for (int op = 0; op < 8 && in.remaining_bytes() > 0; ++op) {
    int calls = 0;
    switch (in.ConsumeIntegralInRange<int>(0, 6)) {
      case 0:
        se->init(client);
        break;
      case 1: {
        std::vector<uint8_t> apdu = in.ConsumeBytes<uint8_t>(in.ConsumeIntegralInRange<size_t>(0, 300));
        se->transmit(hidl_vec<uint8_t>(apdu), [&](const hidl_vec<uint8_t>& r) {
          ++calls;
          if (r.size() > kIpcRspBuf) abort();  // never more than the buffer holds
        });
        if (calls != 1) abort();
        break;
      }
      case 2: {
        std::vector<uint8_t> aid = in.ConsumeBytes<uint8_t>(in.ConsumeIntegralInRange<size_t>(0, 20));
        uint8_t p2 = in.ConsumeIntegral<uint8_t>();
        se->openLogicalChannel(hidl_vec<uint8_t>(aid), p2,
                               [&](const LogicalChannelResponse& r, SecureElementStatus st) {
                                 ++calls;
                                 if (st == SecureElementStatus::SUCCESS && r.channelNumber > 3) abort();
                                 if (r.selectResponse.size() > kIpcRspBuf + 2) abort();
                               });
        if (calls != 1) abort();
        break;
      }
      case 3: {
        std::vector<uint8_t> aid = in.ConsumeBytes<uint8_t>(in.ConsumeIntegralInRange<size_t>(0, 20));
        uint8_t p2 = in.ConsumeIntegral<uint8_t>();
        se->openBasicChannel(hidl_vec<uint8_t>(aid), p2,
                             [&](const hidl_vec<uint8_t>& r, SecureElementStatus) {
                               ++calls;
                               if (r.size() > kIpcRspBuf + 2) abort();
                             });
        if (calls != 1) abort();
        break;
      }
      case 4:
        (void)se->closeChannel(in.ConsumeIntegral<uint8_t>());
        break;
      case 5:
        se->getAtr([&](const hidl_vec<uint8_t>&) { ++calls; });
        if (calls != 1) abort();
        (void)se->isCardPresent();
        break;
      default:
        se->serviceDied(0, nullptr);
        break;
    }
  }
  return 0;
}

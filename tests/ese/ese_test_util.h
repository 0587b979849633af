#pragma once
// Shared pieces of the eSE front tests. The helpers that run one operation
// keep what its result callback got and note "result" in the call log.
#include <algorithm>
#include <atomic>
#include <cstdint>
#include <string>
#include <vector>

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <gtest/gtest.h>
#include <host/log_capture.h>

#include "SecureElement.h"
#include "fake_ese_hal.h"
#include "se_device_gate.h"

namespace ese_test {

using ::android::sp;
using ::android::hardware::hidl_death_recipient;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::implementation::SecureElement;
using Status = ::android::hardware::secure_element::V1_0::SecureElementStatus;
using Bytes = std::vector<uint8_t>;
using Calls = std::vector<std::string>;

// The nth working-buffer allocation of the front from now on fails (1 = the
// next one); 0 turns it off. Defined by the test allocator, failing_alloc.cpp.
void setBufferAllocFailureForTest(unsigned nth);

struct FakeClient : public ISecureElementHalCallback {
  std::atomic<int> connected{0}, disconnected{0};
  std::vector<uint64_t> linkCookies;
  std::vector<sp<hidl_death_recipient>> linkRecipients;

  Return<void> onStateChange(bool isConnected) override {
    (isConnected ? connected : disconnected)++;
    return ::android::hardware::Void();
  }
  Return<bool> linkToDeath(const sp<hidl_death_recipient>& recipient, uint64_t cookie) override {
    linkCookies.push_back(cookie);
    linkRecipients.push_back(recipient);
    return true;
  }
};

struct OpenResult {
  int calls = 0;
  uint8_t channel = 0;
  Bytes select;
  Status status = Status::SUCCESS;
};

inline OpenResult openLogical(const sp<SecureElement>& se, const Bytes& aid, uint8_t p2) {
  OpenResult r;
  se->openLogicalChannel(aid, p2, [&](const LogicalChannelResponse& resp, Status st) {
    fake_ese::note("result");
    r = {r.calls + 1, resp.channelNumber, resp.selectResponse, st};
  });
  return r;
}

inline OpenResult openBasic(const sp<SecureElement>& se, const Bytes& aid, uint8_t p2) {
  OpenResult r;
  se->openBasicChannel(aid, p2, [&](const hidl_vec<uint8_t>& resp, Status st) {
    fake_ese::note("result");
    r = {r.calls + 1, 0, resp, st};
  });
  return r;
}

inline std::pair<int, Bytes> transmit(const sp<SecureElement>& se, const Bytes& apdu) {
  std::pair<int, Bytes> r{0, {}};
  se->transmit(apdu, [&](const hidl_vec<uint8_t>& resp) {
    fake_ese::note("result");
    r = {r.first + 1, resp};
  });
  return r;
}

// A record with exactly this text and priority, under the front's tag in the
// main buffer.
inline bool logged(const ::android::host::LogCapture& cap, const std::string& text, int priority) {
  for (const auto& rec : cap.records())
    if (rec.text == text && rec.tag == "qvese@1.0-service" && rec.buffer == 0 &&
        rec.priority == priority)
      return true;
  return false;
}

const Bytes kAid = {0xA0, 0x00, 0x00, 0x01, 0x51};
constexpr const char* kManageOpen = "ipc 00 70 00 00 01";
constexpr const char* kPowerOff = "power korva_poweroff";

inline std::string hex2(uint8_t b) { return fake_ese::hex({b}); }

// Call log lines: SELECT by DF name for kAid; MANAGE CHANNEL close of c.
inline std::string selectLine(uint8_t cla, uint8_t p2) {
  return "trx " + hex2(cla) + " A4 04 " + hex2(p2) + " lc=5 " + fake_ese::hex(kAid) +
         " le_type=1 le=256 rlen=2";
}
inline std::string closeLine(uint8_t c) {
  return "trx " + hex2(c) + " 70 80 " + hex2(c) + " lc=0 le_type=0 le=36864 rlen=0";
}

// Scripts channel c opened and selected, so that it ends up flagged.
inline void scriptOpen(uint8_t c) {
  fake_ese::queueIpc({0, {c, 0x90, 0x00}});
  fake_ese::queueTransceive({0, {}, 0x90, 0x00});
}

// Which of channels 1..3 are flagged, seen the only way the front shows it:
// an init whose ready status is 0 closes exactly those, and clears them.
inline std::vector<uint8_t> sweepFlags(const sp<SecureElement>& se) {
  fake_ese::reset();
  for (int i = 0; i < 3; ++i) fake_ese::queueTransceive({0, {}, 0x90, 0x00});
  se->init(new FakeClient());
  std::vector<uint8_t> closed;
  for (uint8_t c = 1; c <= 3; ++c) {
    const Calls calls = fake_ese::calls();
    if (std::find(calls.begin(), calls.end(), closeLine(c)) != calls.end()) closed.push_back(c);
  }
  fake_ese::reset();
  return closed;
}

// A fresh front over a reset library. The channel table is process-wide, so
// every entry is cleared first, through the front's own close.
class EseFixture : public ::testing::Test {
 protected:
  void SetUp() override {
    setBufferAllocFailureForTest(0);
    for (uint8_t c = 0; c < 4; ++c) se->closeChannel(c);
    // Closes owed by an earlier test are not this one's.
    SecureElement::gate().forgetChannels();
    fake_ese::reset();
    cap.clear();
  }
  ::android::host::LogCapture cap;
  sp<SecureElement> se = new SecureElement();
};

}  // namespace ese_test

// secli over the HIDL interface: a session runs the commands on one
// connection.
#include "secli_lib.h"

#include <host/rpc_host.h>

#include <chrono>
#include <cstdio>
#include <thread>

namespace secli {

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;

namespace {

template <typename R>
std::string errorText(const R& ret) {
  const std::string& m = ret.getStatus().exceptionMessage();
  return m.empty() ? ret.description() : m;
}

class StateCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

}  // namespace

Session::Session(sp<ISecureElement> se, int timeoutMs) : mSe(std::move(se)), mTimeoutMs(timeoutMs) {}

Result Session::run(const Command& c) {
  Result r;
  r.kind = c.kind;
  r.cmd = c.name;
  switch (c.kind) {
    case CommandKind::Init: {
      sp<StateCallback> cb = new StateCallback();
      auto ret = mSe->init(cb);
      if (!ret.isOk()) {
        r.error = errorText(ret);
        break;
      }
      // The state may come during init or after it; wait for it up to the time-out.
      auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(mTimeoutMs);
      while (!cb->state) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                        deadline - std::chrono::steady_clock::now())
                        .count();
        if (left <= 0) break;
        if (::android::host::pollIncomingCalls(mSe, static_cast<int>(left)) < 0) {
          r.error = "connection to the service lost";
          break;
        }
      }
      r.state = cb->state;
      r.waitedSeconds = mTimeoutMs / 1000.0;
      break;
    }
    case CommandKind::Present: {
      Return<bool> ret = mSe->isCardPresent();
      if (!ret.isOk()) {
        r.error = errorText(ret);
      } else {
        r.present = ret;
      }
      break;
    }
    case CommandKind::Atr: {
      auto ret = mSe->getAtr([&](const hidl_vec<uint8_t>& atr) { r.data = atr; });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Open: {
      auto ret = mSe->openLogicalChannel(
          c.bytes, c.p2, [&](const LogicalChannelResponse& resp, SecureElementStatus st) {
            r.channel = resp.channelNumber;
            r.data = resp.selectResponse;
            r.status = st;
          });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Basic: {
      auto ret = mSe->openBasicChannel(
          c.bytes, c.p2, [&](const hidl_vec<uint8_t>& select, SecureElementStatus st) {
            r.data = select;
            r.status = st;
          });
      if (!ret.isOk()) r.error = errorText(ret);
      break;
    }
    case CommandKind::Transmit: {
      if (!mChain) {
        r.data = exchange(c.bytes, &r.error);
        break;
      }
      // A transport error ends the chain: the answers that follow are empty.
      r.data = transmitChained(
          c.bytes, [&](const std::vector<uint8_t>& apdu) {
            return r.error.empty() ? exchange(apdu, &r.error) : std::vector<uint8_t>();
          },
          &r.exchanges);
      break;
    }
    case CommandKind::Close: {
      Return<SecureElementStatus> ret = mSe->closeChannel(c.channel);
      if (!ret.isOk()) {
        r.error = errorText(ret);
      } else {
        r.status = ret;
      }
      break;
    }
    case CommandKind::Sleep:
      std::this_thread::sleep_for(std::chrono::milliseconds(c.ms));
      r.ms = c.ms;
      break;
    case CommandKind::Reset:
      r.error = "reset is an AIDL call (--aidl)";
      break;
  }
  return r;
}

std::vector<uint8_t> Session::exchange(const std::vector<uint8_t>& apdu, std::string* error) {
  if (mTrace) fprintf(mTrace, "secli: trace > %s\n", hexGrouped(apdu).c_str());
  std::vector<uint8_t> out;
  auto ret = mSe->transmit(apdu, [&](const hidl_vec<uint8_t>& resp) { out = resp; });
  if (!ret.isOk()) {
    *error = errorText(ret);
    out.clear();
  }
  if (mTrace) {
    fprintf(mTrace, "secli: trace < %s\n",
            !ret.isOk() ? "(transport error)" : out.empty() ? "(empty)" : hexGrouped(out).c_str());
    fflush(mTrace);
  }
  return out;
}
}  // namespace secli

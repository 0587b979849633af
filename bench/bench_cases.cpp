#include "bench_cases.h"

#include <host/rpc_host.h>
#include <host/rpc_wire.h>

#include "bench_util.h"

namespace se_bench {

uint8_t claFor(uint8_t channel) {
  return channel < 4 ? channel : static_cast<uint8_t>(0x40 | ((channel - 4) & 0x0F));
}

namespace {

class StateCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

}  // namespace

std::vector<Case> casesFor(uint8_t channel) {
  std::vector<Case> cases;
  cases.push_back({"case-2 (5 B)", {claFor(channel), 0x01, 0x00, 0x00, 0x00}, {0x90, 0x00}});
  Bytes data(255);
  for (size_t i = 0; i < data.size(); ++i) data[i] = static_cast<uint8_t>(i * 7 + 3);
  Bytes cmd = {claFor(channel), 0x01, 0x00, 0x00, 0xFF};
  cmd.insert(cmd.end(), data.begin(), data.end());
  cmd.push_back(0x00);
  Bytes rsp = data;
  rsp.push_back(0x90);
  rsp.push_back(0x00);
  cases.push_back({"case-4 (261 B)", cmd, rsp});
  return cases;
}

std::string hexOf(const Bytes& b) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string s;
  for (uint8_t v : b) {
    s.push_back(kDigits[v >> 4]);
    s.push_back(kDigits[v & 0x0F]);
  }
  return s;
}

// The frames of one call on the wire: the call with `args`, the reply
// with `result` (the RPC host's encoding, so the floor moves the same bytes).
se_bench::Exchange frameExchange(uint32_t code, const Bytes* args, const Bytes* result, uint8_t flag) {
  using ::android::host::rpc::BodyWriter;
  using ::android::host::rpc::Frame;
  using ::android::host::rpc::FrameKind;
  Frame call, reply;
  call.kind = FrameKind::Call;
  call.id = reply.id = 1;
  call.code = code;
  reply.kind = FrameKind::Reply;
  BodyWriter a, r;
  if (args) a.bytes(args->data(), args->size());
  if (result) {
    r.bytes(result->data(), result->size());
  } else {
    r.u8(flag);
  }
  call.body = a.take();
  reply.body = r.take();
  se_bench::Exchange e;
  if (!::android::host::rpc::encodeFrame(call, &e.request) || !::android::host::rpc::encodeFrame(reply, &e.answer)) {
    fail("cannot encode the floor's frames");
  }
  return e;
}

se_bench::Exchange textExchange(const std::string& request, const std::string& answer) {
  return {Bytes(request.begin(), request.end()), Bytes(answer.begin(), answer.end())};
}

sp<ISecureElement> connectInstance(const std::string& name) {
  sp<ISecureElement> se = ISecureElement::getService(name);
  if (se == nullptr) fail("cannot reach " + name);
  ::android::host::setCallTimeout(se, 30000);
  sp<StateCallback> cb = new StateCallback();
  if (!se->init(cb).isOk()) fail("init on " + name + " failed in transport");
  int64_t deadline = nowNanos() + 15 * 1000000000LL;
  while (!cb->state && nowNanos() < deadline) {
    if (::android::host::pollIncomingCalls(se, 1000) < 0) fail("connection to " + name + " lost");
  }
  if (!cb->state || !*cb->state) fail(name + " did not report itself connected");
  return se;
}

uint8_t openEcho(const sp<ISecureElement>& se, const std::string& name) {
  uint8_t channel = 0;
  SecureElementStatus status = SecureElementStatus::FAILED;
  auto r = se->openLogicalChannel(se_card::aid::kEcho, 0x00,
                                  [&](const LogicalChannelResponse& rsp, SecureElementStatus st) {
                                    channel = rsp.channelNumber;
                                    status = st;
                                  });
  if (!r.isOk() || status != SecureElementStatus::SUCCESS || channel == 0) {
    fail("cannot open a logical channel to the echo applet on " + name);
  }
  return channel;
}

}  // namespace se_bench

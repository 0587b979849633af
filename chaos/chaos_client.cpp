#include "chaos_client.h"

#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>
#include <aidl/android/hardware/secure_element/ISecureElement.h>
#include <android/binder_manager.h>
#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <host/aidl_host.h>
#include <host/rpc_host.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <optional>
#include <random>
#include <thread>

#include "card_applets.h"
#include "chaos_check.h"
#include "chaos_plan.h"
#include "virtual_card.h"

namespace chaos {

namespace {

using Bytes = std::vector<uint8_t>;
using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
namespace hidl_se = ::android::hardware::secure_element::V1_0;
using AidlSE = ::aidl::android::hardware::secure_element::ISecureElement;
using ::aidl::android::hardware::secure_element::BnSecureElementCallback;
using ::ndk::ScopedAStatus;

// Calls are timed by the soak; the connection itself never gives up first.
constexpr int kCallTimeoutMs = 600000;
// How long init's state may come after init returned (not counted in the
// call's time: a refused init never sends one).
constexpr int kStateWaitMs = 2000;

class Conn {
 public:
  virtual ~Conn() = default;
  // Runs the call `r` describes and fills in its results.
  virtual void call(CallRecord& r) = 0;
};

const char* hidlStatusName(hidl_se::SecureElementStatus s) {
  switch (s) {
    case hidl_se::SecureElementStatus::SUCCESS: return "SUCCESS";
    case hidl_se::SecureElementStatus::FAILED: return "FAILED";
    case hidl_se::SecureElementStatus::CHANNEL_NOT_AVAILABLE: return "CHANNEL_NOT_AVAILABLE";
    case hidl_se::SecureElementStatus::NO_SUCH_ELEMENT_ERROR: return "NO_SUCH_ELEMENT_ERROR";
    case hidl_se::SecureElementStatus::UNSUPPORTED_OPERATION: return "UNSUPPORTED_OPERATION";
    case hidl_se::SecureElementStatus::IOERROR: return "IOERROR";
  }
  return "STATUS_?";
}

class HidlState : public hidl_se::ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

class HidlConn : public Conn {
 public:
  explicit HidlConn(sp<hidl_se::ISecureElement> se) : se_(std::move(se)) {
    ::android::host::setCallTimeout(se_, kCallTimeoutMs);
  }

  void call(CallRecord& r) override {
    auto fail = [&](const auto& ret) {
      if (!ret.isOk()) r.error = ret.description();
    };
    switch (r.kind) {
      case Kind::Init: {
        sp<HidlState> cb = new HidlState();
        auto ret = se_->init(cb);
        r.t1 = monoNanos();  // the daemon's part ends here; a state may still follow
        fail(ret);
        const int64_t deadline = monoNanos() + int64_t(kStateWaitMs) * 1000000;
        while (ret.isOk() && !cb->state && monoNanos() < deadline) {
          if (::android::host::pollIncomingCalls(se_, 50) < 0) break;
        }
        r.state = cb->state ? (*cb->state ? 1 : 0) : -1;
        break;
      }
      case Kind::Present: {
        Return<bool> ret = se_->isCardPresent();
        fail(ret);
        if (ret.isOk()) r.present = ret;
        break;
      }
      case Kind::Atr:
        fail(se_->getAtr([&](const hidl_vec<uint8_t>& atr) { r.data = atr; }));
        break;
      case Kind::Open:
        fail(se_->openLogicalChannel(r.cmd, r.p2,
                                     [&](const hidl_se::LogicalChannelResponse& resp, hidl_se::SecureElementStatus st) {
                                       r.resultChannel = resp.channelNumber;
                                       r.data = resp.selectResponse;
                                       r.status = hidlStatusName(st);
                                     }));
        break;
      case Kind::Basic:
        fail(se_->openBasicChannel(r.cmd, r.p2, [&](const hidl_vec<uint8_t>& sel, hidl_se::SecureElementStatus st) {
          r.data = sel;
          r.status = hidlStatusName(st);
        }));
        break;
      case Kind::Transmit:
        fail(se_->transmit(r.cmd, [&](const hidl_vec<uint8_t>& resp) { r.data = resp; }));
        break;
      case Kind::Close: {
        Return<hidl_se::SecureElementStatus> ret = se_->closeChannel(static_cast<uint8_t>(r.channel));
        fail(ret);
        if (ret.isOk()) r.status = hidlStatusName(ret);
        break;
      }
      case Kind::Reset:
        r.error = "no reset over HIDL";
        break;
    }
  }

 private:
  sp<hidl_se::ISecureElement> se_;
};

class AidlState : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string&) override {
    states.push_back(connected);
    return ScopedAStatus::ok();
  }
  std::vector<bool> states;
};

void takeAidlStatus(const ScopedAStatus& st, CallRecord& r) {
  if (st.isOk()) {
    r.status = "SUCCESS";
  } else if (st.getExceptionCode() == EX_TRANSACTION_FAILED) {
    r.error = st.getDescription();
  } else if (st.getExceptionCode() == EX_SERVICE_SPECIFIC) {
    const int32_t code = st.getServiceSpecificError();
    r.status = code >= 1 && code <= 5 ? hidlStatusName(static_cast<hidl_se::SecureElementStatus>(code))
                                      : "SERVICE_SPECIFIC_" + std::to_string(code);
  } else {
    r.status = "EX_" + std::to_string(st.getExceptionCode());
  }
}

class AidlConn : public Conn {
 public:
  AidlConn(std::shared_ptr<AidlSE> se, ::ndk::SpAIBinder binder) : se_(std::move(se)), binder_(std::move(binder)) {
    ::android::host::setCallTimeout(binder_.get(), kCallTimeoutMs);
  }

  void call(CallRecord& r) override {
    switch (r.kind) {
      case Kind::Init: {
        if (cb_ == nullptr) cb_ = ::ndk::SharedRefBase::make<AidlState>();
        const size_t before = cb_->states.size();
        takeAidlStatus(se_->init(cb_), r);
        r.t1 = monoNanos();  // the daemon's part ends here; a state may still follow
        const int64_t deadline = monoNanos() + int64_t(kStateWaitMs) * 1000000;
        while (r.error.empty() && r.status == "SUCCESS" && cb_->states.size() == before && monoNanos() < deadline) {
          if (::android::host::pollIncomingCalls(binder_.get(), 50) < 0) break;
        }
        r.state = cb_->states.size() > before ? (cb_->states.back() ? 1 : 0) : -1;
        break;
      }
      case Kind::Present:
        takeAidlStatus(se_->isCardPresent(&r.present), r);
        break;
      case Kind::Atr:
        takeAidlStatus(se_->getAtr(&r.data), r);
        break;
      case Kind::Open: {
        ::aidl::android::hardware::secure_element::LogicalChannelResponse resp;
        takeAidlStatus(se_->openLogicalChannel(r.cmd, static_cast<int8_t>(r.p2), &resp), r);
        r.resultChannel = static_cast<uint8_t>(resp.channelNumber);
        r.data = resp.selectResponse;
        break;
      }
      case Kind::Basic:
        takeAidlStatus(se_->openBasicChannel(r.cmd, static_cast<int8_t>(r.p2), &r.data), r);
        break;
      case Kind::Transmit:
        takeAidlStatus(se_->transmit(r.cmd, &r.data), r);
        break;
      case Kind::Close:
        takeAidlStatus(se_->closeChannel(static_cast<int8_t>(r.channel)), r);
        break;
      case Kind::Reset: {
        const size_t before = cb_ ? cb_->states.size() : 0;
        takeAidlStatus(se_->reset(), r);
        if (cb_) {
          for (size_t i = before; i < cb_->states.size(); ++i) r.states += cb_->states[i] ? '1' : '0';
        }
        break;
      }
    }
  }

 private:
  std::shared_ptr<AidlSE> se_;
  ::ndk::SpAIBinder binder_;
  std::shared_ptr<AidlState> cb_;
};

std::unique_ptr<Conn> connect(Inst inst, Iface iface) {
  if (iface == Iface::Hidl) {
    sp<hidl_se::ISecureElement> se = hidl_se::ISecureElement::getService(instName(inst));
    if (se == nullptr) return nullptr;
    return std::make_unique<HidlConn>(se);
  }
  const std::string name = std::string(AidlSE::descriptor) + "/" + instName(inst);
  ::ndk::SpAIBinder binder(AServiceManager_checkService(name.c_str()));
  std::shared_ptr<AidlSE> se = AidlSE::fromBinder(binder);
  if (se == nullptr) return nullptr;
  return std::make_unique<AidlConn>(std::move(se), std::move(binder));
}

bool writeLine(int fd, const std::string& line) {
  const std::string s = line + "\n";
  size_t off = 0;
  while (off < s.size()) {
    ssize_t n = write(fd, s.data() + off, s.size() - off);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    off += static_cast<size_t>(n);
  }
  return true;
}

struct OpenChannel {
  int number = 0;
  Bytes aid;  // empty: eSE1's basic channel, whatever is selected there
  uint8_t p2 = 0;
  int64_t openedAt = 0;
};

// The AIDs clients open: the card's four applets and one it lacks.
const Bytes kUnknownAid = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x77};

class Client {
 public:
  Client(const ClientArgs& a, std::unique_ptr<Conn> conn) : a_(a), conn_(std::move(conn)), rng_(a.seed) {}

  // The nudge at the end: calls that reach the device but change nothing.
  int nudge() {
    doCall(Kind::Present);
    doCall(Kind::Atr);
    writeLine(a_.fd, "X " + std::to_string(a_.slot) + " " + std::to_string(a_.gen));
    return 0;
  }

  int probe() {
    doCall(Kind::Init);
    CallRecord r = doCall(Kind::Open, se_card::aid::kEcho, 0);
    if (r.status == "SUCCESS") {
      OpenChannel ch{r.resultChannel, se_card::aid::kEcho, 0, r.t0};
      doCall(Kind::Transmit, commandFor(se_card::aid::kEcho, ch.number, 5), 0, &ch);
      doCall(Kind::Transmit, commandFor(se_card::aid::kEcho, ch.number, 12345), 0, &ch);
      doCall(Kind::Close, {}, 0, &ch);
    }
    doCall(Kind::Present);
    doCall(Kind::Atr);
    writeLine(a_.fd, "X " + std::to_string(a_.slot) + " " + std::to_string(a_.gen));
    return 0;
  }

  int run() {
    const int calls = static_cast<int>(between(50, 600));
    const bool tidy = between(0, 1) == 0;
    if (between(0, 9) != 0) doCall(Kind::Init);
    // A client lives at most a minute (the judge forgets older history).
    const int64_t until = monoNanos() + 60000 * int64_t(1000000);
    for (int i = 0; i < calls && monoNanos() < until; ++i) {
      step();
      std::this_thread::sleep_for(std::chrono::milliseconds(between(0, 15)));
    }
    if (tidy) {
      while (!channels_.empty()) closeOne(channels_.size() - 1);
    }
    writeLine(a_.fd, "X " + std::to_string(a_.slot) + " " + std::to_string(a_.gen));
    // Leaving without closing is a client's death like any other.
    return 0;
  }

 private:
  uint64_t between(uint64_t lo, uint64_t hi) { return lo + rng_() % (hi - lo + 1); }

  CallRecord doCall(Kind k, const Bytes& cmd = {}, uint8_t p2 = 0, const OpenChannel* ch = nullptr) {
    CallRecord r;
    r.slot = a_.slot;
    r.gen = a_.gen;
    r.pid = getpid();
    r.seq = ++seq_;
    r.kind = k;
    r.inst = a_.inst;
    r.iface = a_.iface;
    r.cmd = cmd;
    r.p2 = p2;
    if (ch != nullptr) {
      r.channel = ch->number;
      r.openedAt = ch->openedAt;
      r.appletKnown = !ch->aid.empty() || (a_.inst == Inst::Sim && ch->number == 0);
      r.appletAid = ch->aid;
      r.appletP2 = ch->p2;
      if (a_.inst == Inst::Sim && ch->number == 0) r.appletKnown = false;
    }
    // The call is timed from after its start line went out, so a slow
    // reader on the other end of the pipe never counts as the daemon's time.
    const int64_t announced = monoNanos();
    writeLine(a_.fd, "S " + std::to_string(a_.slot) + " " + std::to_string(a_.gen) + " " +
                         std::to_string(r.seq) + " " + kindName(k) + " " + std::to_string(announced) + " " +
                         std::to_string(r.channel));
    r.t0 = monoNanos();
    r.t1 = 0;
    conn_->call(r);
    if (r.t1 == 0) r.t1 = monoNanos();
    if (!writeLine(a_.fd, encodeRecord(r))) _exit(3);  // the soak is gone
    return r;
  }

  // Inits and resets close every client's channels, so they stay rare:
  // otherwise few channels would live long enough to check answers on.
  void step() {
    const uint64_t roll = between(0, 999);
    if (roll < 5) return (void)doCall(Kind::Init);
    if (roll < 10 && a_.iface == Iface::Aidl) return reset();
    if (roll < 160) return open();
    if (roll < 260) return channels_.empty() ? open() : closeOne(static_cast<size_t>(between(0, channels_.size() - 1)));
    if (roll < 320) return (void)doCall(Kind::Present);
    if (roll < 370) return (void)doCall(Kind::Atr);
    if (roll < 430) return basic();
    transmit();
  }

  void open() {
    if (channels_.size() >= 3) return closeOne(0);
    static const Bytes* const kAids[] = {&se_card::aid::kEcho, &se_card::aid::kEcho, &se_card::aid::kBig,
                                         &se_card::aid::kP2Reporter, &se_card::aid::kIsd, &kUnknownAid};
    const Bytes& aid = *kAids[between(0, 5)];
    const uint8_t p2 = between(0, 1) ? 0x04 : 0x00;
    CallRecord r = doCall(Kind::Open, aid, p2);
    if (r.error.empty() && r.status == "SUCCESS" && r.resultChannel >= 1 && r.resultChannel <= 19) {
      hold({r.resultChannel, aid, p2, r.t0});
    }
  }

  void basic() {
    if (a_.inst == Inst::Sim) {
      doCall(Kind::Basic, {}, 0);
      return;
    }
    for (size_t i = 0; i < channels_.size(); ++i) {
      if (channels_[i].number == 0) return closeOne(i);
    }
    const Bytes aid = between(0, 1) ? se_card::aid::kEcho : Bytes();
    CallRecord r = doCall(Kind::Basic, aid, 0);
    // What the basic channel holds is anyone's guess once others select there.
    if (r.error.empty() && r.status == "SUCCESS") hold({0, {}, 0, r.t0});
  }

  // A number the element hands out again is free there: the channel this
  // client held under it was taken away (a reset, an init, a death), and a
  // close of that one would now close the new one.
  void hold(const OpenChannel& ch) {
    for (size_t i = 0; i < channels_.size(); ++i) {
      if (channels_[i].number == ch.number) {
        channels_.erase(channels_.begin() + static_cast<std::ptrdiff_t>(i));
        break;
      }
    }
    channels_.push_back(ch);
  }

  void transmit() {
    OpenChannel ch;
    size_t index = channels_.size();
    if (!channels_.empty() && between(0, 9) != 0) {
      index = static_cast<size_t>(between(0, channels_.size() - 1));
      ch = channels_[index];
    } else if (a_.inst == Inst::Sim) {
      ch.number = 0;  // the SIM's basic channel: its default applet
    } else if (!channels_.empty()) {
      index = 0;
      ch = channels_[0];
    } else {
      ch.number = 1;  // a channel this client does not hold: a refusal or another's applet
    }
    const Bytes& aid = ch.number == 0 && a_.inst == Inst::Sim ? se_card::aid::kIsd : ch.aid;
    const Bytes cmd = commandFor(aid.empty() ? se_card::aid::kEcho : aid, ch.number, rng_());
    CallRecord r = doCall(Kind::Transmit, cmd, 0, &ch);
    if (index >= channels_.size()) return;
    // A channel that stopped answering as its applet would is given up,
    // sometimes closed first.
    const Bytes want = ch.aid.empty() ? Bytes() : expectedResponse(ch.aid, ch.p2, cmd);
    if (!r.error.empty() || (!ch.aid.empty() && r.data != want)) {
      if (between(0, 1)) {
        closeOne(index);
      } else {
        channels_.erase(channels_.begin() + static_cast<std::ptrdiff_t>(index));
      }
    }
  }

  void closeOne(size_t index) {
    const OpenChannel ch = channels_[index];
    channels_.erase(channels_.begin() + static_cast<std::ptrdiff_t>(index));
    doCall(Kind::Close, {}, 0, &ch);
  }

  void reset() {
    CallRecord r = doCall(Kind::Reset);
    if (r.status == "SUCCESS") channels_.clear();
  }

  ClientArgs a_;
  std::unique_ptr<Conn> conn_;
  std::mt19937_64 rng_;
  long seq_ = 0;
  std::vector<OpenChannel> channels_;
};

}  // namespace

std::vector<uint8_t> commandFor(const std::vector<uint8_t>& aid, int channel, uint64_t r) {
  const uint8_t cla = se_card::claForChannel(0x00, channel);
  const unsigned pick = static_cast<unsigned>(r % 8);
  r /= 8;
  if (aid == se_card::aid::kBig) {
    // Case 2: up to one response's worth of the pattern, Le exact.
    const unsigned n = 1 + static_cast<unsigned>(r % 256);
    return {cla, 0x10, static_cast<uint8_t>(n >> 8), static_cast<uint8_t>(n & 0xFF), static_cast<uint8_t>(n & 0xFF)};
  }
  if (aid == se_card::aid::kIsd) {
    static const uint8_t kTags[][2] = {{0x00, 0x66}, {0x9F, 0x7F}, {0x00, 0x01}};
    const uint8_t* t = kTags[r % 3];
    return {cla, 0xCA, t[0], t[1], 0x00};
  }
  if (aid == se_card::aid::kP2Reporter) return {cla, 0x20, 0x00, 0x00, 0x01};
  // The echo applet: all four cases, and chosen status words.
  const uint8_t p1 = static_cast<uint8_t>(r % (kEchoP1Max + 1));
  r /= (kEchoP1Max + 1);
  const size_t n = 1 + r % 255;
  r /= 255;
  Bytes data(n);
  for (size_t i = 0; i < n; ++i) data[i] = static_cast<uint8_t>(0x20 + ((r + i * 7) % 0xD0));  // never 1F first
  Bytes cmd = {cla, 0x01, p1, 0x00};
  switch (pick) {
    case 0: return cmd;                                       // case 1
    case 1: cmd.push_back(0x00); return cmd;                  // case 2: no data, 90 00
    case 2: case 3:                                           // case 3
      cmd.push_back(static_cast<uint8_t>(n));
      cmd.insert(cmd.end(), data.begin(), data.end());
      return cmd;
    case 4: case 5:                                           // case 4, Le 00 or exact
      cmd.push_back(static_cast<uint8_t>(n));
      cmd.insert(cmd.end(), data.begin(), data.end());
      cmd.push_back(pick == 4 ? 0x00 : static_cast<uint8_t>(n & 0xFF));
      return cmd;
    default: {                                                // any status word back
      static const uint16_t kWords[] = {0x9000, 0x6282, 0x6300, 0x63C2, 0x6700, 0x6982, 0x6A82, 0x6F00};
      const uint16_t sw = kWords[r % 8];
      Bytes c = {cla, 0x02, static_cast<uint8_t>(sw >> 8), static_cast<uint8_t>(sw & 0xFF),
                 static_cast<uint8_t>(std::min<size_t>(n, 16))};
      c.insert(c.end(), data.begin(), data.begin() + static_cast<std::ptrdiff_t>(std::min<size_t>(n, 16)));
      return c;
    }
  }
}

std::vector<std::string> clientArgv(const ClientArgs& a) {
  std::vector<std::string> v = {"--client",       std::to_string(a.slot), std::to_string(a.gen),
                                std::to_string(a.seed), instName(a.inst),      ifaceName(a.iface),
                                std::to_string(a.fd)};
  if (a.probe) v.push_back("probe");
  if (a.nudge) v.push_back("nudge");
  return v;
}

bool parseClientArgv(const std::vector<std::string>& v, ClientArgs* out) {
  if (v.size() < 7 || v.size() > 8 || v[0] != "--client") return false;
  if (v.size() == 8 && v[7] != "probe" && v[7] != "nudge") return false;
  ClientArgs a;
  char* end = nullptr;
  a.slot = static_cast<int>(strtol(v[1].c_str(), &end, 10));
  a.gen = static_cast<int>(strtol(v[2].c_str(), &end, 10));
  a.seed = strtoull(v[3].c_str(), &end, 10);
  a.fd = static_cast<int>(strtol(v[6].c_str(), &end, 10));
  a.probe = v.size() == 8 && v[7] == "probe";
  a.nudge = v.size() == 8 && v[7] == "nudge";
  if (!parseInst(v[4], &a.inst) || !parseIface(v[5], &a.iface) || a.fd < 0) return false;
  *out = a;
  return true;
}

int runClient(const ClientArgs& a) {
  std::unique_ptr<Conn> conn = connect(a.inst, a.iface);
  if (conn == nullptr) {
    writeLine(a.fd, "X " + std::to_string(a.slot) + " " + std::to_string(a.gen) + " unregistered");
    return 3;
  }
  Client client(a, std::move(conn));
  return a.nudge ? client.nudge() : a.probe ? client.probe() : client.run();
}

}  // namespace chaos

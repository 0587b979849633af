// The AIDL interface of the real daemon, over its real sockets: what AIDL
// clients expect beyond HIDL 1.0, on both instances, by an in-process client
// of the NDK calls and by secli --aidl. HIDL and AIDL clients meet on the
// same card and channel tables.
#include <gtest/gtest.h>

#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>
#include <aidl/android/hardware/secure_element/ISecureElement.h>
#include <android/binder_manager.h>
#include <host/aidl_host.h>

#include <signal.h>
#include <stdlib.h>

#include <future>
#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "se_harness.h"

namespace {

using namespace se_test;
using ::aidl::android::hardware::secure_element::BnSecureElementCallback;
using ::aidl::android::hardware::secure_element::ISecureElement;
using ::aidl::android::hardware::secure_element::LogicalChannelResponse;
using ::ndk::ScopedAStatus;
using Bytes = std::vector<uint8_t>;

const Bytes kEchoAid = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x01};
const Bytes kMissingAid = {0xA0, 0x00, 0x00, 0x00, 0xFF, 0xFF};
const char* const kInstances[] = {"eSE1", "SIM1"};

std::string fullName(const std::string& instance) {
  return std::string(ISecureElement::descriptor) + "/" + instance;
}

// "SUCCESS", the interface's error name, or the exception by number.
std::string nameOf(const ScopedAStatus& st) {
  if (st.isOk()) return "SUCCESS";
  const char* names[] = {"?", "FAILED", "CHANNEL_NOT_AVAILABLE", "NO_SUCH_ELEMENT_ERROR",
                         "UNSUPPORTED_OPERATION", "IOERROR"};
  const int32_t c = st.getServiceSpecificError();
  if (st.getExceptionCode() == EX_SERVICE_SPECIFIC && c >= 1 && c <= 5) return names[c];
  return "EXCEPTION " + std::to_string(st.getExceptionCode()) + " " + std::to_string(c);
}

class Recorder : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string& reason) override {
    std::lock_guard<std::mutex> g(mu);
    states.push_back(connected);
    last = reason;
    return ScopedAStatus::ok();
  }
  std::vector<bool> seen() {
    std::lock_guard<std::mutex> g(mu);
    return states;
  }
  std::mutex mu;
  std::vector<bool> states;
  std::string last;
};

// One client connection to an AIDL instance, with its callback.
struct Client {
  explicit Client(const std::string& instance) {
    ::ndk::SpAIBinder b(AServiceManager_checkService(fullName(instance).c_str()));
    se = ISecureElement::fromBinder(b);
    if (se != nullptr) ::android::host::setCallTimeout(b.get(), kGenerousMs);
  }
  std::string init() { return nameOf(se->init(cb)); }
  std::string open(const Bytes& aid, LogicalChannelResponse* resp) {
    return nameOf(se->openLogicalChannel(aid, 0, resp));
  }
  std::string basic(const Bytes& aid) {
    Bytes select;
    return nameOf(se->openBasicChannel(aid, 0, &select));
  }
  std::string close(int channel) { return nameOf(se->closeChannel(static_cast<int8_t>(channel))); }
  std::string transmit(int channel, uint8_t data, Bytes* out = nullptr) {
    Bytes rsp;
    const std::string st = nameOf(se->transmit({static_cast<uint8_t>(channel), 1, 0, 0, 1, data}, &rsp));
    if (out) *out = rsp;
    return st;
  }
  std::shared_ptr<ISecureElement> se;
  std::shared_ptr<Recorder> cb = ::ndk::SharedRefBase::make<Recorder>();
};

class AidlEndToEnd : public ::testing::Test, public System {
 protected:
  void SetUp() override { setenv("SE_DEVICE_ROOT", root.path().c_str(), 1); }
  void TearDown() override { unsetenv("SE_DEVICE_ROOT"); }
  void start(const std::vector<std::string>& modemArgs = {}) {
    modem = startModem(root, 0, modemArgs);
    daemon = startDaemon(root);
    ASSERT_TRUE(daemon->err().waitFor("AIDL Registered " + fullName("SIM1") + " success"));
  }
  // init, and for SIM1 until its worker has the modem port.
  std::string initReady(Client& c, const std::string& instance) {
    const std::string st = c.init();
    if (instance != "SIM1" || st != "SUCCESS") return st;
    EXPECT_TRUE(daemon->err().waitFor("at_open,ac->index=0"));
    bool present = false;
    for (int round = 0; round < 100 && !present; ++round) {
      if (!c.se->isCardPresent(&present).isOk()) break;
    }
    EXPECT_TRUE(present);
    return st;
  }
  // Waits until the logs hold everything that came before: a presence query
  // goes through the same front (and for SIM1 the modem) after it.
  void settle(Client& c, const std::string& instance) {
    const size_t d = daemon->err().size();
    const size_t m = modem->err().size();
    bool present = false;
    ASSERT_TRUE(c.se->isCardPresent(&present).isOk());
    ASSERT_TRUE(daemon->err().waitFor("isCardPresent", d));
    if (instance == "SIM1") {
      ASSERT_TRUE(modem->err().waitFor("< AT^CARDTYPE?", m));
    }
  }
  static size_t countAfter(Process& p, size_t mark, const std::string& needle) {
    return countOf(p.err().text().substr(mark), needle);
  }
};

TEST_F(AidlEndToEnd, InitNeedsACallbackReportsReadyEachTimeAndSaysWhenItCannot) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_NE(c.se, nullptr);
    EXPECT_NE(nameOf(c.se->init(nullptr)), "SUCCESS");
    EXPECT_EQ(c.init(), "SUCCESS");
    EXPECT_EQ(c.init(), "SUCCESS");
    EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, true}));
    EXPECT_EQ(c.cb->last, instance + " is ready");
    int32_t version = 0;
    EXPECT_TRUE(c.se->getInterfaceVersion(&version).isOk());
    EXPECT_EQ(version, 1);
  }
  // A reset that cannot bring the element back fails.
  EXPECT_EQ(nameOf(Client("eSE1").se->reset()), "FAILED");  // no init: nothing to report to
  Client c("eSE1");
  ASSERT_EQ(c.init(), "SUCCESS");
  root.property("vendor.ese_sim.fail_open=1");
  EXPECT_EQ(nameOf(c.se->reset()), "FAILED");
  EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, false}));
  // An init that cannot open the element says so instead of leaving the
  // client waiting for a state.
  EXPECT_EQ(c.init(), "IOERROR");
  root.property("vendor.ese_sim.fail_open=0");
  EXPECT_EQ(nameOf(c.se->reset()), "SUCCESS");
  EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, false, false, true}));
}

// Logical channels 1..19 with a select response, failures with the HIDL
// front's status; closing a channel that is not open fails and sends
// nothing, and an APDU on a closed channel does not succeed.
TEST_F(AidlEndToEnd, LogicalChannelsOpenCloseAndFailWithTheirStatus) {
  ASSERT_NO_FATAL_FAILURE(start({"--channels", "3"}));
  root.property("vendor.ese_sim.channels=3");
  for (const std::string instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_EQ(initReady(c, instance), "SUCCESS");
    std::vector<int> opened;
    for (int i = 0; i < 2; ++i) {
      LogicalChannelResponse resp;
      ASSERT_EQ(c.open(kEchoAid, &resp), "SUCCESS");
      EXPECT_GE(resp.channelNumber, 1);
      EXPECT_LE(resp.channelNumber, 19);
      ASSERT_GE(resp.selectResponse.size(), 2u);
      EXPECT_EQ(resp.selectResponse[resp.selectResponse.size() - 2], 0x90);
      opened.push_back(resp.channelNumber);
      Bytes rsp;
      EXPECT_EQ(c.transmit(resp.channelNumber, 0x40 + i, &rsp), "SUCCESS");
      EXPECT_EQ(rsp, (Bytes{static_cast<uint8_t>(0x40 + i), 0x90, 0x00}));
    }
    LogicalChannelResponse resp;
    EXPECT_EQ(c.open(kEchoAid, &resp), "CHANNEL_NOT_AVAILABLE");  // all channels in use
    EXPECT_EQ(c.open(kMissingAid, &resp), "CHANNEL_NOT_AVAILABLE");
    for (int ch : opened) EXPECT_EQ(c.close(ch), "SUCCESS");
    EXPECT_EQ(c.open(kMissingAid, &resp), "NO_SUCH_ELEMENT_ERROR");
    ASSERT_NO_FATAL_FAILURE(settle(c, instance));

    const size_t dmark = daemon->err().size();
    const size_t mmark = modem->err().size();
    for (int channel : {0, opened[0], 5, 19, 20, -1}) EXPECT_EQ(c.close(channel), "FAILED") << channel;
    Bytes rsp;
    EXPECT_EQ(c.transmit(opened[0], 0x11, &rsp), "CHANNEL_NOT_AVAILABLE");
    EXPECT_TRUE(rsp.empty());
    EXPECT_EQ(countAfter(*daemon, dmark, "closeChannel enter!"), 0u);
    EXPECT_EQ(countAfter(*daemon, dmark, "closeChannel, modem_id"), 0u);
    EXPECT_EQ(countAfter(*modem, mmark, "< AT+CCHC"), 0u);
    EXPECT_EQ(countAfter(*modem, mmark, "< AT+CGLA"), 0u);
  }
}

TEST_F(AidlEndToEnd, TheBasicChannelOpensOnceUntilClosedOnEse1AndNeverOnSim1) {
  ASSERT_NO_FATAL_FAILURE(start());
  Client ese("eSE1");
  ASSERT_EQ(ese.init(), "SUCCESS");
  ASSERT_EQ(ese.basic(kEchoAid), "SUCCESS");
  EXPECT_EQ(ese.basic(kEchoAid), "CHANNEL_NOT_AVAILABLE");
  Bytes rsp;
  EXPECT_EQ(ese.transmit(0, 0x21, &rsp), "SUCCESS");
  EXPECT_EQ(rsp, (Bytes{0x21, 0x90, 0x00}));
  EXPECT_EQ(ese.close(0), "SUCCESS");
  EXPECT_EQ(ese.transmit(0, 0x22), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(ese.basic(kEchoAid), "SUCCESS");
  EXPECT_EQ(ese.close(0), "SUCCESS");
  EXPECT_EQ(ese.basic(kMissingAid), "NO_SUCH_ELEMENT_ERROR");

  Client sim("SIM1");
  ASSERT_EQ(initReady(sim, "SIM1"), "SUCCESS");
  ASSERT_NO_FATAL_FAILURE(settle(sim, "SIM1"));
  const size_t mmark = modem->err().size();
  EXPECT_EQ(sim.basic(kEchoAid), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(sim.close(0), "FAILED");
  EXPECT_EQ(sim.transmit(0, 0x23), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(countAfter(*modem, mmark, "< AT"), 0u);
}

TEST_F(AidlEndToEnd, ResetClosesEveryChannelAndReportsFalseThenTrue) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_EQ(initReady(c, instance), "SUCCESS");
    LogicalChannelResponse a, b;
    ASSERT_EQ(c.open(kEchoAid, &a), "SUCCESS");
    ASSERT_EQ(c.open(kEchoAid, &b), "SUCCESS");
    const bool ese = instance == "eSE1";
    if (ese) {
      ASSERT_EQ(c.basic(kEchoAid), "SUCCESS");
    }

    ASSERT_NO_FATAL_FAILURE(settle(c, instance));
    const size_t dmark = daemon->err().size();
    const size_t mmark = modem->err().size();
    EXPECT_EQ(nameOf(c.se->reset()), "SUCCESS");
    EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, false, true}));
    for (int ch : {0, static_cast<int>(a.channelNumber), static_cast<int>(b.channelNumber)}) {
      EXPECT_EQ(c.transmit(ch, 0x31), "CHANNEL_NOT_AVAILABLE") << ch;
      EXPECT_EQ(c.close(ch), "FAILED") << ch;
    }
    if (ese) {  // closed and opened again through the vendor library
      const std::string log = daemon->err().text().substr(dmark);
      const size_t closed = log.find("phQvEse_close: closed");
      ASSERT_NE(closed, std::string::npos) << log;
      EXPECT_NE(log.find("phQvEse_init_open: open", closed), std::string::npos) << log;
    } else {
      for (int ch : {a.channelNumber, b.channelNumber}) {
        EXPECT_EQ(countAfter(*modem, mmark, "< AT+CCHC=" + std::to_string(256 + ch)), 1u);
      }
    }
    LogicalChannelResponse again;
    ASSERT_EQ(c.open(kEchoAid, &again), "SUCCESS");
    EXPECT_EQ(c.transmit(again.channelNumber, 0x32), "SUCCESS");
  }
}

TEST_F(AidlEndToEnd, AFailedExchangeIsAnErrorNotAnEmptySuccess) {
  ASSERT_NO_FATAL_FAILURE(start());
  Client ese("eSE1");
  Client sim("SIM1");
  ASSERT_EQ(ese.init(), "SUCCESS");
  ASSERT_EQ(initReady(sim, "SIM1"), "SUCCESS");
  LogicalChannelResponse e, s;
  ASSERT_EQ(ese.open(kEchoAid, &e), "SUCCESS");
  ASSERT_EQ(sim.open(kEchoAid, &s), "SUCCESS");

  root.property("vendor.ese_sim.fail_exchange=1");
  modem->stop(SIGKILL);
  Bytes rsp{0xEE};
  const Bytes apdu = {static_cast<uint8_t>(e.channelNumber), 0x01, 0x00, 0x00, 0x01, 0x41};
  EXPECT_EQ(nameOf(ese.se->transmit(apdu, &rsp)), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(rsp, Bytes{0xEE});  // an error carries no result
  EXPECT_EQ(sim.transmit(s.channelNumber, 0x42, &rsp), "CHANNEL_NOT_AVAILABLE");
  // Shorter than a command header: a bad argument, not sent.
  EXPECT_EQ(nameOf(ese.se->transmit({0x01, 0x01}, &rsp)).rfind("EXCEPTION", 0), 0u);
}

// A HIDL client and an AIDL client reach the same card and channel tables.
TEST_F(AidlEndToEnd, HidlAndAidlClientsShareChannels) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string instance : kInstances) {
    SCOPED_TRACE(instance);
    Client a(instance);
    SecliSession h(root, instance);
    ASSERT_EQ(initReady(a, instance), "SUCCESS");
    ASSERT_EQ(field(h.call("init"), "state"), "true");

    LogicalChannelResponse resp;
    ASSERT_EQ(a.open(kEchoAid, &resp), "SUCCESS");
    EXPECT_EQ(echo(h, resp.channelNumber, "51"), "519000");
    EXPECT_EQ(field(h.call("close " + std::to_string(resp.channelNumber)), "status"), "SUCCESS");
    EXPECT_EQ(a.transmit(resp.channelNumber, 0x52), "CHANNEL_NOT_AVAILABLE");
    EXPECT_EQ(a.close(resp.channelNumber), "FAILED");

    const int hch = openEcho(h);
    Bytes rsp;
    EXPECT_EQ(a.transmit(hch, 0x53, &rsp), "SUCCESS");
    EXPECT_EQ(rsp, (Bytes{0x53, 0x90, 0x00}));
    EXPECT_EQ(a.close(hch), "SUCCESS");
  }
}

TEST_F(AidlEndToEnd, SecliSpeaksAidlWithStatusesByName) {
  ASSERT_NO_FATAL_FAILURE(start());
  std::string out;
  EXPECT_EQ(secli(root, {"list"}, &out), 0);
  EXPECT_EQ(out, "SIM1\neSE1\n" + fullName("SIM1") + "\n" + fullName("eSE1") + "\n");

  SecliSession s(root, "eSE1", {"--aidl"});
  EXPECT_EQ(s.call("init"),
            R"({"cmd":"init","status":"SUCCESS","state":true,"reason":"eSE1 is ready"})");
  EXPECT_EQ(s.call(echoCommand(openEcho(s), "61")),
            R"({"cmd":"transmit","status":"SUCCESS","response":"619000"})");
  EXPECT_EQ(s.call("open A000000000FF"),
            R"({"cmd":"open","status":"NO_SUCH_ELEMENT_ERROR","message":"openLogicalChannel: NO_SUCH_ELEMENT_ERROR"})");
  EXPECT_EQ(s.call("reset"), R"({"cmd":"reset","status":"SUCCESS","states":[false,true]})");
  EXPECT_EQ(field(s.call("close 1"), "status"), "FAILED");

  // reset is an AIDL call only; a missing AIDL instance is named.
  std::string err;
  EXPECT_EQ(secli(root, {"-i", "eSE1", "reset"}, &out, &err), 2);
  EXPECT_NE(err.find("--aidl"), std::string::npos) << err;
  EXPECT_EQ(secli(root, {"--aidl", "-i", "eSE9", "present"}, &out, &err), 1);
  EXPECT_NE(err.find(fullName("eSE9")), std::string::npos) << err;
}

// The basic channel belongs to the client that opened it: another client can
// neither open it, send on it nor close it; once its client is gone (here one
// that never called init, so no death notice comes) it is free again.
TEST_F(AidlEndToEnd, TheBasicChannelBelongsToItsClient) {
  ASSERT_NO_FATAL_FAILURE(start());
  const std::string open = std::string("basic ") + kEchoApplet;
  auto owner = std::make_unique<SecliSession>(root, "eSE1", std::vector<std::string>{"--aidl"});
  SecliSession other(root, "eSE1", {"--aidl"});
  ASSERT_EQ(field(other.call("init"), "status"), "SUCCESS");
  ASSERT_EQ(field(owner->call(open), "status"), "SUCCESS");
  EXPECT_EQ(field(other.call(open), "status"), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(field(other.call(echoCommand(0, "A1")), "status"), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(field(other.call("close 0"), "status"), "FAILED");
  EXPECT_EQ(field(owner->call(echoCommand(0, "A2")), "response"), "A29000");

  owner->process().stop(SIGKILL);
  owner.reset();
  EXPECT_EQ(field(other.call(open), "status"), "SUCCESS");
  EXPECT_EQ(field(other.call(echoCommand(0, "A3")), "response"), "A39000");
}

// Clients whose callback never answers hold a pool thread each only until
// the daemon gives up on the callback (5 s) and drops them as dead; another
// client is served all the while.
TEST_F(AidlEndToEnd, ClientsThatNeverAnswerACallbackDoNotStopAThird) {
  ASSERT_NO_FATAL_FAILURE(start());
  struct Mute : BnSecureElementCallback {
    explicit Mute(std::shared_future<void> until) : until_(std::move(until)) {}
    ScopedAStatus onStateChange(bool, const std::string&) override {
      until_.wait();
      return ScopedAStatus::ok();
    }
    std::shared_future<void> until_;
  };
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  std::shared_ptr<void> unblock(nullptr, [&](void*) { release.set_value(); });
  std::vector<std::future<ScopedAStatus>> mute;
  for (int i = 0; i < 2; i++) {
    mute.push_back(std::async(std::launch::async, [&, released] {
      Client c("eSE1");
      return c.se->init(::ndk::SharedRefBase::make<Mute>(released));
    }));
  }
  ASSERT_TRUE(daemon->err().waitFor("phQvEse_init_open: open"));
  const auto t0 = std::chrono::steady_clock::now();
  SecliSession other(root, "eSE1", {"--aidl"});
  ASSERT_EQ(field(other.call("init"), "status"), "SUCCESS");
  EXPECT_EQ(echo(other, openEcho(other), "3C"), "3C9000");
  EXPECT_LT(msSince(t0), 4000);
  const std::string dropped = "did not answer a callback within 5000 ms: dropped as dead";
  ASSERT_TRUE(daemon->err().waitFor(dropped));
  ASSERT_TRUE(daemon->err().waitFor(dropped, daemon->err().text().find(dropped) + 1));
  const size_t second = daemon->err().text().rfind(dropped);
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close: closed", second));
  // The mute clients' own calls come back once their callbacks return: the
  // daemon has let them go.
  unblock.reset();
  for (auto& f : mute) EXPECT_FALSE(f.get().isOk());
  // Their deaths closed the eSE library, as any client's death does: the
  // client left opens it again and is served. The death notices of a
  // dropped connection run on pool threads after it is closed, so one may
  // still close the library after this init; that shows as a close after
  // it in the log, and only then is the init made again.
  std::string served;
  for (int attempt = 0; attempt < 3 && served != "3D9000"; ++attempt) {
    const size_t from = daemon->err().text().size();
    ASSERT_EQ(field(other.call("init"), "status"), "SUCCESS");
    const std::string open = other.call(std::string("open ") + kEchoApplet);
    if (field(open, "status") == "SUCCESS") {
      served = echo(other, atoi(field(open, "channel").c_str()), "3D");
    }
    if (served != "3D9000" &&
        daemon->err().text().find("phQvEse_close: closed", from) == std::string::npos) {
      break;  // not the late notice: a real failure
    }
  }
  EXPECT_EQ(served, "3D9000");
}

}  // namespace

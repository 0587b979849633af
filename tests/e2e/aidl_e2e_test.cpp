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
const std::vector<std::string> kInstances = {"eSE1", "SIM1"};

std::string fullName(const std::string& instance) {
  return std::string(ISecureElement::descriptor) + "/" + instance;
}

// "SUCCESS", the interface's error name, an exception by number, or the
// transport failure.
std::string nameOf(const ScopedAStatus& st) {
  if (st.isOk()) return "SUCCESS";
  if (st.getExceptionCode() == EX_SERVICE_SPECIFIC) {
    switch (st.getServiceSpecificError()) {
      case ISecureElement::FAILED: return "FAILED";
      case ISecureElement::CHANNEL_NOT_AVAILABLE: return "CHANNEL_NOT_AVAILABLE";
      case ISecureElement::NO_SUCH_ELEMENT_ERROR: return "NO_SUCH_ELEMENT_ERROR";
      case ISecureElement::UNSUPPORTED_OPERATION: return "UNSUPPORTED_OPERATION";
      case ISecureElement::IOERROR: return "IOERROR";
      default: return "SERVICE_SPECIFIC " + std::to_string(st.getServiceSpecificError());
    }
  }
  return "EXCEPTION " + std::to_string(st.getExceptionCode()) + " " + st.getMessage();
}

class Recorder : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string& reason) override {
    std::lock_guard<std::mutex> g(mu);
    states.push_back(connected);
    reasons.push_back(reason);
    return ScopedAStatus::ok();
  }
  std::vector<bool> seen() {
    std::lock_guard<std::mutex> g(mu);
    return states;
  }
  std::mutex mu;
  std::vector<bool> states;
  std::vector<std::string> reasons;
};

// One client connection to an AIDL instance, with its callback.
struct Client {
  explicit Client(const std::string& instance) {
    ::ndk::SpAIBinder b(AServiceManager_checkService(fullName(instance).c_str()));
    se = ISecureElement::fromBinder(b);
    if (se != nullptr) ::android::host::setCallTimeout(b.get(), kGenerousMs);
    cb = ::ndk::SharedRefBase::make<Recorder>();
  }
  // init with the callback; the state arrives while init runs.
  std::string init() { return nameOf(se->init(cb)); }
  std::string open(const Bytes& aid, LogicalChannelResponse* resp) {
    return nameOf(se->openLogicalChannel(aid, 0, resp));
  }
  std::string transmit(int channel, uint8_t data, Bytes* out = nullptr) {
    Bytes rsp;
    std::string st = nameOf(se->transmit({static_cast<uint8_t>(channel), 0x01, 0x00, 0x00, 0x01, data}, &rsp));
    if (out) *out = rsp;
    return st;
  }
  std::shared_ptr<ISecureElement> se;
  std::shared_ptr<Recorder> cb;
};

class AidlEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override { setenv("SE_DEVICE_ROOT", root.path().c_str(), 1); }
  void TearDown() override {
    if (daemon) {
      daemon->stop(SIGKILL);
      expectNoSanitizerReport("daemon", daemon->err().text());
      if (HasFailure()) fprintf(stderr, "---- daemon ----\n%s", daemon->err().text().c_str());
    }
    if (modem && HasFailure()) fprintf(stderr, "---- modem ----\n%s", modem->err().text().c_str());
    unsetenv("SE_DEVICE_ROOT");
  }
  void start(const std::vector<std::string>& modemArgs = {}) {
    modem = startModem(root, 0, modemArgs);
    daemon = startDaemon(root);
    ASSERT_TRUE(daemon->err().waitFor("AIDL Registered " + fullName("SIM1") + " success"))
        << daemon->err().text();
  }
  size_t modemMark() { return modem->err().size(); }
  // init, and for SIM1 until its worker has the modem port: the SIM front
  // reports ready once the worker is started, and the worker opens the port
  // in its own time. Waits on the worker's log line, then on the front's
  // own answer (one more round at most).
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
    const size_t m = modemMark();
    bool present = false;
    ASSERT_TRUE(c.se->isCardPresent(&present).isOk());
    ASSERT_TRUE(daemon->err().waitFor("isCardPresent", d));
    if (instance == "SIM1") {
      ASSERT_TRUE(modem->err().waitFor("< AT^CARDTYPE?", m));
    }
  }
  size_t countAfter(Process& p, size_t mark, const std::string& needle) {
    return countOf(p.err().text().substr(mark), needle);
  }

  TempRoot root;
  std::unique_ptr<Process> modem;
  std::unique_ptr<Process> daemon;
};

TEST_F(AidlEndToEnd, InitWithoutACallbackFailsAndEveryInitReportsReady) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string& instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_NE(c.se, nullptr);
    EXPECT_NE(nameOf(c.se->init(nullptr)), "SUCCESS");
    EXPECT_EQ(c.init(), "SUCCESS");
    EXPECT_EQ(c.init(), "SUCCESS");
    EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, true}));
    EXPECT_EQ(c.cb->reasons.back(), instance + " is ready");
    int32_t version = 0;
    EXPECT_TRUE(c.se->getInterfaceVersion(&version).isOk());
    EXPECT_EQ(version, 1);
  }
}

TEST_F(AidlEndToEnd, LogicalChannelsAnswerWithAChannelAndASelectResponseOrAnError) {
  ASSERT_NO_FATAL_FAILURE(start({"--channels", "3"}));
  root.property("vendor.ese_sim.channels=3");
  for (const std::string& instance : kInstances) {
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
    // The status of a failed open is the HIDL front's, and never SUCCESS.
    struct Case {
      Bytes aid;
      std::string want;
    };
    for (const Case& k : {Case{kEchoAid, "CHANNEL_NOT_AVAILABLE"},  // all channels in use
                          Case{kMissingAid, "CHANNEL_NOT_AVAILABLE"}}) {
      LogicalChannelResponse resp;
      EXPECT_EQ(c.open(k.aid, &resp), k.want);
    }
    for (int ch : opened) EXPECT_EQ(nameOf(c.se->closeChannel(ch)), "SUCCESS");
    LogicalChannelResponse resp;
    EXPECT_EQ(c.open(kMissingAid, &resp), "NO_SUCH_ELEMENT_ERROR");
  }
}

TEST_F(AidlEndToEnd, ClosingAChannelThatIsNotOpenFailsAndSendsNothing) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string& instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_EQ(initReady(c, instance), "SUCCESS");
    LogicalChannelResponse resp;
    ASSERT_EQ(c.open(kEchoAid, &resp), "SUCCESS");
    const int ch = resp.channelNumber;
    EXPECT_EQ(nameOf(c.se->closeChannel(ch)), "SUCCESS");
    ASSERT_NO_FATAL_FAILURE(settle(c, instance));

    const size_t dmark = daemon->err().size();
    const size_t mmark = modemMark();
    for (int channel : {0, ch, 5, 19, 20, -1}) {
      EXPECT_EQ(nameOf(c.se->closeChannel(static_cast<int8_t>(channel))), "FAILED") << channel;
    }
    // After the close an APDU on that channel does not succeed.
    Bytes rsp;
    EXPECT_EQ(c.transmit(ch, 0x11, &rsp), "CHANNEL_NOT_AVAILABLE");
    EXPECT_TRUE(rsp.empty());
    // Nothing reached either front.
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
  Bytes select;
  ASSERT_EQ(nameOf(ese.se->openBasicChannel(kEchoAid, 0, &select)), "SUCCESS");
  EXPECT_GE(select.size(), 2u);
  EXPECT_EQ(nameOf(ese.se->openBasicChannel(kEchoAid, 0, &select)), "CHANNEL_NOT_AVAILABLE");
  Bytes rsp;
  EXPECT_EQ(ese.transmit(0, 0x21, &rsp), "SUCCESS");
  EXPECT_EQ(rsp, (Bytes{0x21, 0x90, 0x00}));
  EXPECT_EQ(nameOf(ese.se->closeChannel(0)), "SUCCESS");
  EXPECT_EQ(ese.transmit(0, 0x22), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(nameOf(ese.se->openBasicChannel(kEchoAid, 0, &select)), "SUCCESS");
  EXPECT_EQ(nameOf(ese.se->closeChannel(0)), "SUCCESS");
  EXPECT_EQ(nameOf(ese.se->openBasicChannel(kMissingAid, 0, &select)), "NO_SUCH_ELEMENT_ERROR");

  Client sim("SIM1");
  ASSERT_EQ(initReady(sim, "SIM1"), "SUCCESS");
  ASSERT_NO_FATAL_FAILURE(settle(sim, "SIM1"));
  const size_t mmark = modemMark();
  EXPECT_EQ(nameOf(sim.se->openBasicChannel(kEchoAid, 0, &select)), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(nameOf(sim.se->closeChannel(0)), "FAILED");
  EXPECT_EQ(sim.transmit(0, 0x23), "CHANNEL_NOT_AVAILABLE");
  EXPECT_EQ(countAfter(*modem, mmark, "< AT"), 0u);
}

TEST_F(AidlEndToEnd, ResetClosesEveryChannelAndReportsFalseThenTrue) {
  ASSERT_NO_FATAL_FAILURE(start());
  for (const std::string& instance : kInstances) {
    SCOPED_TRACE(instance);
    Client c(instance);
    ASSERT_EQ(initReady(c, instance), "SUCCESS");
    LogicalChannelResponse a, b;
    ASSERT_EQ(c.open(kEchoAid, &a), "SUCCESS");
    ASSERT_EQ(c.open(kEchoAid, &b), "SUCCESS");
    Bytes select;
    const bool basic = instance == "eSE1";
    if (basic) {
      ASSERT_EQ(nameOf(c.se->openBasicChannel(kEchoAid, 0, &select)), "SUCCESS");
    }

    ASSERT_NO_FATAL_FAILURE(settle(c, instance));
    const size_t dmark = daemon->err().size();
    const size_t mmark = modemMark();
    EXPECT_EQ(nameOf(c.se->reset()), "SUCCESS");
    EXPECT_EQ(c.cb->seen(), (std::vector<bool>{true, false, true}));
    for (int ch : {0, static_cast<int>(a.channelNumber), static_cast<int>(b.channelNumber)}) {
      EXPECT_EQ(c.transmit(ch, 0x31), "CHANNEL_NOT_AVAILABLE") << ch;
      EXPECT_EQ(nameOf(c.se->closeChannel(ch)), "FAILED") << ch;
    }
    if (basic) {
      const std::string log = daemon->err().text().substr(dmark);
      const size_t closed = log.find("phQvEse_close: closed");
      ASSERT_NE(closed, std::string::npos) << log;
      EXPECT_NE(log.find("phQvEse_init_open: open", closed), std::string::npos) << log;
    } else {
      EXPECT_EQ(countAfter(*modem, mmark, "< AT+CCHC=" + std::to_string(256 + a.channelNumber)), 1u);
      EXPECT_EQ(countAfter(*modem, mmark, "< AT+CCHC=" + std::to_string(256 + b.channelNumber)), 1u);
    }
    // The element is usable again.
    LogicalChannelResponse again;
    ASSERT_EQ(c.open(kEchoAid, &again), "SUCCESS");
    EXPECT_EQ(c.transmit(again.channelNumber, 0x32), "SUCCESS");
    EXPECT_EQ(nameOf(c.se->closeChannel(again.channelNumber)), "SUCCESS");
  }
}

TEST_F(AidlEndToEnd, AResetThatCannotBringTheElementBackFails) {
  ASSERT_NO_FATAL_FAILURE(start());
  Client never("eSE1");
  EXPECT_EQ(nameOf(never.se->reset()), "FAILED");  // no init: nothing to report to

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
  for (const std::string& instance : kInstances) {
    SCOPED_TRACE(instance);
    Client a(instance);
    SecliSession h(root, instance);
    ASSERT_EQ(initReady(a, instance), "SUCCESS");
    ASSERT_EQ(field(h.call("init"), "state"), "true");

    LogicalChannelResponse resp;
    ASSERT_EQ(a.open(kEchoAid, &resp), "SUCCESS");
    const std::string ch = std::to_string(resp.channelNumber);
    EXPECT_EQ(field(h.call("transmit " + hexByte(resp.channelNumber) + " 01 00 00 01 51"), "response"),
              "519000");
    EXPECT_EQ(field(h.call("close " + ch), "status"), "SUCCESS");
    EXPECT_EQ(a.transmit(resp.channelNumber, 0x52), "CHANNEL_NOT_AVAILABLE");
    EXPECT_EQ(nameOf(a.se->closeChannel(resp.channelNumber)), "FAILED");

    const std::string open = h.call("open A00000000101");
    ASSERT_EQ(field(open, "status"), "SUCCESS") << open;
    const int hch = std::atoi(field(open, "channel").c_str());
    Bytes rsp;
    EXPECT_EQ(a.transmit(hch, 0x53, &rsp), "SUCCESS");
    EXPECT_EQ(rsp, (Bytes{0x53, 0x90, 0x00}));
    EXPECT_EQ(nameOf(a.se->closeChannel(hch)), "SUCCESS");
  }
}

// An AIDL client's death reaches the fronts as a HIDL client's does.
TEST_F(AidlEndToEnd, AnAidlClientsDeathReachesTheFronts) {
  ASSERT_NO_FATAL_FAILURE(start());
  const size_t mark = daemon->err().size();
  {
    SecliSession ese(root, "eSE1", {"--aidl"});
    SecliSession sim(root, "SIM1", {"--aidl"});
    ASSERT_EQ(field(ese.call("init"), "status"), "SUCCESS");
    ASSERT_EQ(field(sim.call("init"), "status"), "SUCCESS");
    ese.process().stop(SIGKILL);
    sim.process().stop(SIGKILL);
  }
  EXPECT_TRUE(daemon->err().waitFor("qvese@1.0-service: serviceDied enter!", mark));
  EXPECT_TRUE(daemon->err().waitFor("phQvEse_close", mark));
  EXPECT_TRUE(daemon->err().waitFor("ZerbSimSecureElement: serviceDied, enter", mark));
  Client c("eSE1");
  EXPECT_EQ(c.init(), "SUCCESS");
}

TEST_F(AidlEndToEnd, SecliSpeaksAidlWithStatusesByName) {
  ASSERT_NO_FATAL_FAILURE(start());
  std::string out;
  EXPECT_EQ(secli(root, {"list"}, &out), 0);
  EXPECT_EQ(out, "SIM1\neSE1\n" + fullName("SIM1") + "\n" + fullName("eSE1") + "\n");

  SecliSession s(root, "eSE1", {"--aidl"});
  EXPECT_EQ(s.call("init"),
            R"({"cmd":"init","status":"SUCCESS","state":true,"reason":"eSE1 is ready"})");
  const std::string open = s.call("open A00000000101");
  EXPECT_EQ(field(open, "status"), "SUCCESS") << open;
  EXPECT_EQ(s.call("transmit " + hexByte(std::atoi(field(open, "channel").c_str())) +
                   " 01 00 00 01 61"),
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

TEST_F(AidlEndToEnd, WithoutAnEseOnlySim1IsServedOverAidlToo) {
  root.property("vendor.ese_sim.type=0");
  ASSERT_NO_FATAL_FAILURE(start());
  std::string out;
  EXPECT_EQ(secli(root, {"list"}, &out), 0);
  EXPECT_EQ(out, "SIM1\n" + fullName("SIM1") + "\n");
  EXPECT_EQ(Client("eSE1").se, nullptr);
}

}  // namespace

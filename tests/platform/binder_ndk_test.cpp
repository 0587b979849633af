// The NDK binder stand-ins on their own: statuses, local binder identity,
// and an in-process AIDL service over the real socket with a death notice.
#include <gtest/gtest.h>

#include <aidl/android/hardware/secure_element/BnSecureElement.h>
#include <aidl/android/hardware/secure_element/BnSecureElementCallback.h>
#include <android/binder_manager.h>
#include <android/binder_process.h>
#include <hidl/HidlTransportSupport.h>
#include <host/aidl_host.h>
#include <host/rpc_host.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

#include "rpc_test_util.h"
#include "test_root.h"

namespace {

using ::aidl::android::hardware::secure_element::BnSecureElement;
using ::aidl::android::hardware::secure_element::BnSecureElementCallback;
using ::aidl::android::hardware::secure_element::ISecureElement;
using ::aidl::android::hardware::secure_element::ISecureElementCallback;
using ::aidl::android::hardware::secure_element::LogicalChannelResponse;
using ::ndk::ScopedAStatus;
using Bytes = std::vector<uint8_t>;

TEST(BinderStatus, FactoriesCarryTheirKindOfError) {
  struct Row {
    ScopedAStatus st;
    bool ok;
    binder_exception_t exception;
    int32_t specific;
  };
  Row rows[] = {
      {ScopedAStatus::ok(), true, EX_NONE, 0},
      {ScopedAStatus::fromServiceSpecificError(3), false, EX_SERVICE_SPECIFIC, 3},
      {ScopedAStatus::fromServiceSpecificErrorWithMessage(5, "io"), false, EX_SERVICE_SPECIFIC, 5},
      {ScopedAStatus::fromExceptionCode(EX_NULL_POINTER), false, EX_NULL_POINTER, 0},
      {ScopedAStatus::fromStatus(STATUS_DEAD_OBJECT), false, EX_TRANSACTION_FAILED, 0},
  };
  for (const Row& r : rows) {
    EXPECT_EQ(r.st.isOk(), r.ok) << r.st.getDescription();
    EXPECT_EQ(r.st.getExceptionCode(), r.exception) << r.st.getDescription();
    EXPECT_EQ(r.st.getServiceSpecificError(), r.specific) << r.st.getDescription();
  }
  EXPECT_STREQ(rows[2].st.getMessage(), "io");
  EXPECT_EQ(rows[4].st.getStatus(), STATUS_DEAD_OBJECT);
}

class Callback : public BnSecureElementCallback {
 public:
  ScopedAStatus onStateChange(bool connected, const std::string& reason) override {
    states.push_back(connected);
    last = reason;
    return ScopedAStatus::ok();
  }
  std::vector<bool> states;
  std::string last;
};

// Echoes; links to its client's death in init.
class Service : public BnSecureElement {
 public:
  ScopedAStatus init(const std::shared_ptr<ISecureElementCallback>& cb) override {
    if (cb == nullptr) return ScopedAStatus::fromExceptionCode(EX_NULL_POINTER);
    linked = AIBinder_linkToDeath(cb->asBinder().get(), death.get(), this);
    if (unlinkInInit) unlinked = AIBinder_unlinkToDeath(cb->asBinder().get(), death.get(), this);
    return cb->onStateChange(true, "up");
  }
  ScopedAStatus getAtr(Bytes*) override { return ScopedAStatus::ok(); }
  ScopedAStatus isCardPresent(bool*) override {
    std::lock_guard<std::mutex> g(mu);
    callers.push_back(AIBinder_getCallingPid());
    return ScopedAStatus::ok();
  }
  ScopedAStatus openBasicChannel(const Bytes&, int8_t, Bytes*) override {
    return ScopedAStatus::fromServiceSpecificErrorWithMessage(CHANNEL_NOT_AVAILABLE, "no basic");
  }
  ScopedAStatus openLogicalChannel(const Bytes& aid, int8_t p2, LogicalChannelResponse* out) override {
    out->channelNumber = p2;
    out->selectResponse = aid;
    return ScopedAStatus::ok();
  }
  ScopedAStatus reset() override { return ScopedAStatus::ok(); }
  ScopedAStatus transmit(const Bytes& data, Bytes* out) override {
    *out = data;
    return ScopedAStatus::ok();
  }
  ScopedAStatus closeChannel(int8_t) override { return ScopedAStatus::ok(); }

  static void died(void* cookie) {
    auto* self = static_cast<Service*>(cookie);
    std::lock_guard<std::mutex> g(self->mu);
    ++self->deaths;
    self->cv.notify_all();
  }
  bool waitDeaths(int n) {
    std::unique_lock<std::mutex> lk(mu);
    return cv.wait_for(lk, std::chrono::seconds(10), [&] { return deaths >= n; });
  }

  ::ndk::ScopedAIBinder_DeathRecipient death{AIBinder_DeathRecipient_new(&Service::died)};
  binder_status_t linked = -1;
  std::atomic<bool> unlinkInInit{false};
  std::atomic<binder_status_t> unlinked{-1};
  std::mutex mu;
  std::condition_variable cv;
  int deaths = 0;
  std::vector<pid_t> callers;
};

// An AIDL service registered as `instance`, served by a pool of `threads`.
class AidlServer {
 public:
  AidlServer(const std::shared_ptr<Service>& service, const std::string& instance,
             size_t threads)
      : name(std::string(ISecureElement::descriptor) + "/" + instance) {
    ::android::hardware::configureRpcThreadpool(threads, true);
    status = AServiceManager_addService(service->asBinder().get(), name.c_str());
    std::promise<void> left;
    mJoinerLeft = left.get_future();
    mJoiner = std::thread([p = std::move(left)]() mutable {
      ABinderProcess_joinThreadPool();
      p.set_value();
    });
  }
  ~AidlServer() {
    do {
      ::android::host::shutdownRpcHostForTest();
    } while (mJoinerLeft.wait_for(std::chrono::milliseconds(100)) != std::future_status::ready);
    mJoiner.join();
  }
  std::shared_ptr<ISecureElement> connect() const {
    return ISecureElement::fromBinder(::ndk::SpAIBinder(AServiceManager_checkService(name.c_str())));
  }
  const std::string name;
  binder_exception_t status;

 private:
  std::future<void> mJoinerLeft;
  std::thread mJoiner;
};

TEST(BinderObjects, ALocalObjectKeepsOneBinderAndComesBackAsItself) {
  auto s = ::ndk::SharedRefBase::make<Service>();
  ::ndk::SpAIBinder a = s->asBinder();
  EXPECT_EQ(a.get(), s->asBinder().get());
  EXPECT_FALSE(AIBinder_isRemote(a.get()));
  EXPECT_EQ(ISecureElement::fromBinder(a).get(), s.get());
  // Of another interface: no object.
  EXPECT_EQ(ISecureElementCallback::fromBinder(a), nullptr);
  auto cb = ::ndk::SharedRefBase::make<Callback>();
  EXPECT_EQ(AIBinder_linkToDeath(cb->asBinder().get(), s->death.get(), nullptr),
            STATUS_INVALID_OPERATION);
}

TEST(BinderObjects, AnAidlServiceOverTheSocketWithItsClientsDeath) {
  se_test::TestRoot root;
  auto service = ::ndk::SharedRefBase::make<Service>();
  AidlServer server(service, "test1", 2);
  const std::string& name = server.name;
  ASSERT_EQ(server.status, EX_NONE);
  EXPECT_EQ(::android::host::listAidlServices(), std::vector<std::string>{name});
  EXPECT_EQ(AServiceManager_checkService((name + "x").c_str()), nullptr);
  {
    ::ndk::SpAIBinder b(AServiceManager_checkService(name.c_str()));
    std::shared_ptr<ISecureElement> se = ISecureElement::fromBinder(b);
    ASSERT_NE(se, nullptr);
    EXPECT_TRUE(AIBinder_isRemote(b.get()));
    auto cb = ::ndk::SharedRefBase::make<Callback>();
    EXPECT_EQ(se->init(nullptr).getExceptionCode(), EX_NULL_POINTER);
    EXPECT_TRUE(se->init(cb).isOk());
    EXPECT_EQ(cb->states, std::vector<bool>{true});
    LogicalChannelResponse resp;
    EXPECT_TRUE(se->openLogicalChannel({1, 2, 3}, 7, &resp).isOk());
    EXPECT_EQ(resp.channelNumber, 7);
    EXPECT_EQ(resp.selectResponse, (Bytes{1, 2, 3}));
    Bytes out{9};
    ScopedAStatus st = se->openBasicChannel({}, 0, &out);
    EXPECT_EQ(st.getServiceSpecificError(), ISecureElement::CHANNEL_NOT_AVAILABLE);
    EXPECT_STREQ(st.getMessage(), "no basic");
    EXPECT_EQ(out, Bytes{9});
    Bytes big(60000, 0x5A);
    EXPECT_TRUE(se->transmit(big, &out).isOk());
    EXPECT_EQ(out, big);
  }  // the connection closes: the client is gone
  EXPECT_EQ(service->linked, STATUS_OK);
  EXPECT_TRUE(service->waitDeaths(1));
}

// Death links go with the death: none is left anywhere after many clients
// died. They are keyed by their binder, not by an address a later proxy may
// reuse: unlinking one client's binder leaves another's link alone.
TEST(BinderObjects, DeathLinksGoWithTheirClientsAndStayWithTheirBinder) {
  se_test::TestRoot root;
  auto service = ::ndk::SharedRefBase::make<Service>();
  // One thread runs notices and calls in the order they come.
  AidlServer server(service, "links", 1);
  ASSERT_EQ(server.status, EX_NONE);
  AIBinder_DeathRecipient* recipient = service->death.get();
  // A call answered only once the one pool thread let go of every notice
  // that came before it.
  auto settled = [&] {
    bool present;
    return server.connect()->isCardPresent(&present).isOk();
  };
  constexpr int kClients = 16;
  for (int i = 0; i < kClients; ++i) {
    auto cb = ::ndk::SharedRefBase::make<Callback>();
    ASSERT_TRUE(server.connect()->init(cb).isOk());
  }
  ASSERT_TRUE(service->waitDeaths(kClients));
  ASSERT_TRUE(settled());
  EXPECT_EQ(::android::host::liveDeathLinksForTest(recipient), 0u);

  // The service keeps no callback, so each proxy is freed after its init and
  // the next one may get its address.
  auto first = server.connect();
  auto second = server.connect();
  auto cb = ::ndk::SharedRefBase::make<Callback>();
  ASSERT_TRUE(first->init(cb).isOk());
  EXPECT_EQ(::android::host::liveDeathLinksForTest(recipient), 1u);
  service->unlinkInInit = true;
  ASSERT_TRUE(second->init(cb).isOk());
  EXPECT_EQ(service->unlinked, STATUS_OK);
  EXPECT_EQ(::android::host::liveDeathLinksForTest(recipient), 1u);
  second = nullptr;
  first = nullptr;
  ASSERT_TRUE(service->waitDeaths(kClients + 1));
  ASSERT_TRUE(settled());
  {
    std::lock_guard<std::mutex> g(service->mu);
    EXPECT_EQ(service->deaths, kClients + 1);  // the unlinked client's death is not told
  }
  EXPECT_EQ(::android::host::liveDeathLinksForTest(recipient), 0u);
}

// A call carries its client process's pid; outside a call, this process's.
TEST(BinderObjects, CallsCarryTheirClientsPid) {
  se_test::TestRoot root;
  auto service = ::ndk::SharedRefBase::make<Service>();
  AidlServer server(service, "pid", 2);
  ASSERT_EQ(server.status, EX_NONE);
  const std::vector<uint8_t> isCardPresent =
      fake::frameBytes(::android::host::rpc::FrameKind::Call, 1, 0, 4, {});
  const pid_t child = fake::callFromChild(::android::host::aidlSocketPath(server.name), isCardPresent);
  ASSERT_GT(child, 0);
  bool present;
  ASSERT_TRUE(server.connect()->isCardPresent(&present).isOk());
  {
    std::lock_guard<std::mutex> g(service->mu);
    EXPECT_EQ(service->callers, (std::vector<pid_t>{child, getpid()}));
  }
  EXPECT_EQ(AIBinder_getCallingPid(), getpid());
  EXPECT_EQ(AIBinder_getCallingUid(), getuid());
}

}  // namespace

// The RPC host end to end: a FakeSecureElement registered over the real Unix
// sockets, called through the client proxies (and through raw sockets for
// the frames a proxy would never send).
#include <gtest/gtest.h>

#include <android/binder_process.h>
#include <android/log.h>
#include <host/log_capture.h>

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>
#include <filesystem>
#include <thread>
#include <fstream>
#include <future>
#include <set>

#include "rpc_test_util.h"

namespace {

using namespace fake;
using ::android::OK;
using ::android::host::LogCapture;
using ::android::host::rpc::FrameKind;

class ClientCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    std::lock_guard<std::mutex> g(mLock);
    states.push_back(connected);
    sawInitReturned.push_back(initReturned.load());
    return Void();
  }
  std::atomic<bool> initReturned{false};
  std::vector<bool> states;
  std::vector<bool> sawInitReturned;
  std::mutex mLock;
};

// True when the server ends the connection within the test limit.
bool closedByServer(int fd) {
  char buf[256];
  for (;;) {
    pollfd pfd{fd, POLLIN, 0};
    if (poll(&pfd, 1, 10000) != 1) return false;
    ssize_t n = recv(fd, buf, sizeof(buf), 0);
    if (n == 0 || (n < 0 && errno == ECONNRESET)) return true;
    if (n < 0) return false;
  }
}

class RpcHostTest : public ::testing::Test {
 protected:
  void startServer(size_t threads) { server = std::make_unique<Server>(se, "SIM1", threads); }
  void TearDown() override {
    if (server) server->stop();
  }
  TempRoot root;
  sp<FakeSecureElement> se = new FakeSecureElement();
  std::unique_ptr<Server> server;
};

TEST_F(RpcHostTest, EveryOperationRoundTrips) {
  startServer(2);
  ASSERT_EQ(server->status(), OK);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  EXPECT_TRUE(client->isRemote());

  sp<ClientCallback> cb = new ClientCallback();
  ASSERT_TRUE(client->init(cb).isOk());
  ASSERT_NE(se->callback(), nullptr);
  EXPECT_TRUE(se->callback()->isRemote());

  std::vector<uint8_t> atr;
  ASSERT_TRUE(client->getAtr([&](const hidl_vec<uint8_t>& r) { atr = r; }).isOk());
  EXPECT_EQ(atr, kFakeAtr);
  se->present = false;
  Return<bool> present = client->isCardPresent();
  ASSERT_TRUE(present.isOk());
  EXPECT_FALSE(static_cast<bool>(present));

  // Empty and the largest extended APDU, each with its response.
  std::vector<uint8_t> big(65544);
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<uint8_t>(i * 7);
  for (const std::vector<uint8_t>& apdu : {std::vector<uint8_t>{}, big}) {
    std::vector<uint8_t> resp;
    ASSERT_TRUE(client->transmit(apdu, [&](const hidl_vec<uint8_t>& r) { resp = r; }).isOk());
    EXPECT_EQ(se->lastTransmit(), apdu);
    std::vector<uint8_t> want = apdu;
    want.insert(want.end(), {0x90, 0x00});
    EXPECT_EQ(resp, want);
  }

  // A success with its select response, then a failure with none.
  for (uint8_t first : {0xA0, 0xFF}) {
    const std::vector<uint8_t> aid = {first, 0x01};
    LogicalChannelResponse got;
    SecureElementStatus status = SecureElementStatus::IOERROR;
    ASSERT_TRUE(client
                    ->openLogicalChannel(aid, 0xFF,
                                         [&](const LogicalChannelResponse& r,
                                             SecureElementStatus s) {
                                           got = r;
                                           status = s;
                                         })
                    .isOk());
    EXPECT_EQ(se->lastAid(), aid);
    EXPECT_EQ(se->lastP2(), 0xFF);
    if (first == 0xA0) {
      EXPECT_EQ(status, SecureElementStatus::SUCCESS);
      EXPECT_EQ(got.channelNumber, 1);
      EXPECT_EQ(std::vector<uint8_t>(got.selectResponse),
                (std::vector<uint8_t>{0x6F, 0x0A, 0xA0, 0x01, 0x90, 0x00}));
    } else {
      EXPECT_EQ(status, SecureElementStatus::NO_SUCH_ELEMENT_ERROR);
      EXPECT_EQ(got.selectResponse.size(), 0u);
    }
  }

  std::vector<uint8_t> basicSel;
  SecureElementStatus basicStatus = SecureElementStatus::IOERROR;
  ASSERT_TRUE(client
                  ->openBasicChannel({0xA0, 0x02}, 0x04,
                                     [&](const hidl_vec<uint8_t>& r, SecureElementStatus s) {
                                       basicSel = r;
                                       basicStatus = s;
                                     })
                  .isOk());
  EXPECT_EQ(basicSel, (std::vector<uint8_t>{0xA0, 0x02, 0x04, 0x90, 0x00}));
  EXPECT_EQ(basicStatus, SecureElementStatus::SUCCESS);

  for (uint8_t channel : {1, 200}) {
    Return<SecureElementStatus> closed = client->closeChannel(channel);
    ASSERT_TRUE(closed.isOk());
    EXPECT_EQ(static_cast<SecureElementStatus>(closed), channel == 1
                                                            ? SecureElementStatus::SUCCESS
                                                            : SecureElementStatus::FAILED);
    EXPECT_EQ(se->lastClose(), channel);
  }
}

TEST_F(RpcHostTest, InitCallbackReachesClientBeforeInitReturns) {
  startServer(2);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  sp<ClientCallback> cb = new ClientCallback();
  ASSERT_TRUE(client->init(cb).isOk());
  cb->initReturned = true;
  ASSERT_EQ(cb->states, std::vector<bool>{true});
  EXPECT_EQ(cb->sawInitReturned, std::vector<bool>{false});

  // A null callback reaches the service as null.
  ASSERT_TRUE(client->init(nullptr).isOk());
  EXPECT_EQ(se->callback(), nullptr);
}

TEST_F(RpcHostTest, ClientReceivesCallbackAfterItsCallReturned) {
  se->deferStateChange = true;
  startServer(2);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  sp<ClientCallback> cb = new ClientCallback();
  ASSERT_TRUE(client->init(cb).isOk());
  EXPECT_TRUE(cb->states.empty());
  EXPECT_EQ(::android::host::pollIncomingCalls(client, 20), 0);

  // The service's call waits until the client reads it.
  std::atomic<bool> serviceCallOk{false};
  std::thread later([&] { serviceCallOk = se->callback()->onStateChange(true).isOk(); });
  EXPECT_EQ(::android::host::pollIncomingCalls(client, 10000), 1);
  later.join();
  EXPECT_TRUE(serviceCallOk);
  EXPECT_EQ(cb->states, std::vector<bool>{true});
}

// The joining thread included, a pool of n runs n calls at once; the next
// one waits for a thread.
TEST_F(RpcHostTest, PoolRunsAsManyCallsAtOnceAsItHasThreads) {
  for (int n : {2, 4}) {
    SCOPED_TRACE(n);
    se = new FakeSecureElement();
    se->blockTransmit = true;
    startServer(static_cast<size_t>(n));
    std::atomic<int> ok{0};
    std::vector<std::thread> callers;
    for (int i = 0; i <= n; ++i) {
      callers.emplace_back([&, i] {
        sp<ISecureElement> client = ISecureElement::getService("SIM1");
        if (client == nullptr) return;
        std::vector<uint8_t> resp;
        auto r = client->transmit({static_cast<uint8_t>(i)},
                                  [&](const hidl_vec<uint8_t>& x) { resp = x; });
        if (r.isOk() && resp.size() == 3 && resp[0] == i) ++ok;
      });
    }
    EXPECT_TRUE(se->waitEntered(n));
    EXPECT_FALSE(se->enteredWithin(n + 1, std::chrono::milliseconds(300)));
    se->release(1);
    EXPECT_TRUE(se->waitEntered(n + 1));
    se->release(n);
    for (auto& t : callers) t.join();
    EXPECT_EQ(ok, n + 1);
    EXPECT_EQ(se->maxRunning(), n);
    server->stop();
    server.reset();
  }
}

// A client that never answers a call on its callback holds a pool thread
// for the answer limit only; then it counts as dead. Here both pool threads
// are taken that way, and a third client must still be served.
TEST_F(RpcHostTest, ClientsThatNeverAnswerACallbackAreDroppedAsDead) {
  struct Case {
    const char* name;
    int clients;
    int callsEach;  // every fourth one an init, the rest isCardPresent
  };
  const Case cases[] = {
      {"two clients, one init each", 2, 1},
      {"one client pipelining eight calls, two of them inits", 1, 8},
  };
  constexpr int kLimitMs = 300;
  ::android::host::setCallbackAnswerLimitForTest(kLimitMs);
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    se = new FakeSecureElement();
    startServer(2);
    LogCapture cap;
    std::vector<int> silent;
    int inits = 0;
    for (int i = 0; i < c.clients; ++i) {
      int fd = connectRaw("SIM1");
      ASSERT_GE(fd, 0);
      silent.push_back(fd);
      std::vector<uint8_t> calls;
      for (int k = 0; k < c.callsEach; ++k) {
        // init(callback id k + 1): its u32 argument; isCardPresent has none
        std::vector<uint8_t> f =
            k % 4 == 0 ? frameBytes(FrameKind::Call, k + 1, 0, 1, {uint8_t(k + 1), 0, 0, 0})
                       : frameBytes(FrameKind::Call, k + 1, 0, 3, {});
        inits += k % 4 == 0;
        calls.insert(calls.end(), f.begin(), f.end());
      }
      ASSERT_EQ(send(fd, calls.data(), calls.size(), MSG_NOSIGNAL),
                static_cast<ssize_t>(calls.size()));
    }
    // Both threads wait for answers that never come.
    ASSERT_TRUE(se->waitInit(inits));
    sp<ISecureElement> third = ISecureElement::getService("SIM1");
    ASSERT_NE(third, nullptr);
    ASSERT_TRUE(::android::host::setCallTimeout(third, 10000));
    const auto start = std::chrono::steady_clock::now();
    EXPECT_TRUE(third->isCardPresent().isOk());
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    // Each silent client went as if it had died: its links were told.
    EXPECT_TRUE(se->watcher->waitDeaths(static_cast<size_t>(inits)));
    for (int fd : silent) {
      EXPECT_TRUE(closedByServer(fd));
      close(fd);
    }
    EXPECT_TRUE(cap.contains("did not answer a callback within 300 ms", "hidl_host"));
    EXPECT_TRUE(third->isCardPresent().isOk());
    third = nullptr;
    server->stop();
    server.reset();
  }
  ::android::host::setCallbackAnswerLimitForTest(0);
}

// The service sees who calls: each client process's own pid, in its calls
// and in its death notice; outside a call, this process.
TEST_F(RpcHostTest, CallsAndDeathNoticesCarryTheirClientsPid) {
  se->deferStateChange = true;
  startServer(2);
  const std::vector<uint8_t> init = frameBytes(FrameKind::Call, 1, 0, 1, {1, 0, 0, 0});
  std::set<pid_t> children;
  for (int i = 0; i < 2; ++i) children.insert(callFromChild(::android::host::serviceSocketPath("SIM1"), init));
  ASSERT_EQ(children.size(), 2u);
  ASSERT_EQ(children.count(-1), 0u);
  ASSERT_TRUE(se->watcher->waitDeaths(2));
  auto asSet = [](const std::vector<pid_t>& v) { return std::set<pid_t>(v.begin(), v.end()); };
  EXPECT_EQ(asSet(se->initPids()), children);
  EXPECT_EQ(asSet(se->watcher->pids()), children);

  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  ASSERT_TRUE(client->init(nullptr).isOk());
  EXPECT_EQ(se->initPids().back(), getpid());
  auto* self = ::android::hardware::IPCThreadState::self();
  EXPECT_EQ(self->getCallingPid(), getpid());
  EXPECT_EQ(self->getCallingUid(), getuid());
}

// The pool has no reader of its own: a client's answer to a callback must
// still be read while every pool thread is in a call.
TEST_F(RpcHostTest, CallbackAnswersAreReadWhileEveryPoolThreadIsBusy) {
  struct Case {
    const char* name;
    size_t threads;
    bool fromPoolThread;  // init calls back on the last free pool thread
  };
  const Case cases[] = {
      {"one thread, callback from another thread", 1, false},
      {"two threads, callback from another thread", 2, false},
      {"two threads, callback from init on the second", 2, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    se = new FakeSecureElement();
    se->blockTransmit = true;
    se->deferStateChange = !c.fromPoolThread;
    startServer(c.threads);
    sp<ISecureElement> client = ISecureElement::getService("SIM1");
    ASSERT_NE(client, nullptr);
    // A server that never reads the answer fails the test instead of hanging it.
    ASSERT_TRUE(::android::host::setCallTimeout(client, 10000));
    sp<ClientCallback> cb = new ClientCallback();
    if (!c.fromPoolThread) {
      ASSERT_TRUE(client->init(cb).isOk());
    }

    // Blocked calls hold the pool threads (all of them, or all but one).
    const size_t blocked = c.fromPoolThread ? c.threads - 1 : c.threads;
    std::atomic<int> ok{0};
    std::vector<std::thread> blockers;
    for (size_t i = 0; i < blocked; ++i) {
      blockers.emplace_back([&] {
        sp<ISecureElement> other = ISecureElement::getService("SIM1");
        if (other != nullptr && other->transmit({0x01}, [](const hidl_vec<uint8_t>&) {}).isOk()) {
          ++ok;
        }
      });
    }
    ASSERT_TRUE(se->waitEntered(static_cast<int>(blocked)));

    std::thread later;
    std::promise<bool> serviceCall;  // outlives `later`
    std::future<bool> serviceCallOk = serviceCall.get_future();
    if (c.fromPoolThread) {
      // init runs on the one free thread and waits there for the answer.
      EXPECT_TRUE(client->init(cb).isOk());
    } else {
      later = std::thread(
          [&] { serviceCall.set_value(se->callback()->onStateChange(true).isOk()); });
      EXPECT_EQ(::android::host::pollIncomingCalls(client, 10000), 1);
      // The answer is read though every pool thread is blocked.
      if (serviceCallOk.wait_for(std::chrono::seconds(10)) == std::future_status::ready) {
        EXPECT_TRUE(serviceCallOk.get());
      } else {
        ADD_FAILURE() << "the answer was not read while the pool was busy";
      }
    }
    EXPECT_EQ(cb->states, std::vector<bool>{true});

    se->release(static_cast<int>(blocked));
    for (auto& t : blockers) t.join();
    if (later.joinable()) later.join();
    EXPECT_EQ(ok, static_cast<int>(blocked));
    // Still served afterwards.
    EXPECT_TRUE(client->isCardPresent().isOk());
    client = nullptr;
    server->stop();
    server.reset();
  }
}

// Calls that arrive in one read are not run one after the other by the
// thread that read them: each gets a pool thread.
TEST_F(RpcHostTest, CallsReadTogetherRunAtOnce) {
  se->blockTransmit = true;
  startServer(2);
  int fd = connectRaw("SIM1");
  ASSERT_GE(fd, 0);
  std::vector<uint8_t> both;
  for (uint8_t id : {1, 2}) {
    // transmit of one byte: its length (u32) and the byte
    std::vector<uint8_t> f = frameBytes(FrameKind::Call, id, 0, 4, {1, 0, 0, 0, id});
    both.insert(both.end(), f.begin(), f.end());
  }
  ASSERT_EQ(send(fd, both.data(), both.size(), MSG_NOSIGNAL), static_cast<ssize_t>(both.size()));
  EXPECT_TRUE(se->waitEntered(2));
  EXPECT_EQ(se->maxRunning(), 2);
  se->release(2);

  ::android::host::rpc::FrameDecoder decoder;
  std::set<uint32_t> answered;
  ::android::host::rpc::Frame f;
  while (answered.size() < 2) {
    pollfd pfd{fd, POLLIN, 0};
    ASSERT_EQ(poll(&pfd, 1, 10000), 1);
    uint8_t buf[256];
    ssize_t n = recv(fd, buf, sizeof(buf), 0);
    ASSERT_GT(n, 0);
    ASSERT_TRUE(decoder.feed(buf, static_cast<size_t>(n)));
    while (decoder.next(&f)) {
      EXPECT_EQ(f.kind, FrameKind::Reply);
      answered.insert(f.id);
    }
  }
  EXPECT_EQ(answered, (std::set<uint32_t>{1, 2}));
  close(fd);
}

// More calls than a connection may have queued: reading it pauses at the
// limit and goes on as they finish, so every call is answered.
TEST_F(RpcHostTest, CallsBeyondTheConnectionsLimitAreAllAnswered) {
  se->blockTransmit = true;
  startServer(2);
  int fd = connectRaw("SIM1");
  ASSERT_GE(fd, 0);
  auto sendCalls = [&](uint32_t first, uint32_t count) {
    std::vector<uint8_t> all;
    for (uint32_t id = first; id < first + count; ++id) {
      std::vector<uint8_t> f =
          frameBytes(FrameKind::Call, id, 0, 4, {1, 0, 0, 0, static_cast<uint8_t>(id)});
      all.insert(all.end(), f.begin(), f.end());
    }
    return send(fd, all.data(), all.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(all.size());
  };
  // Two running, the rest queued: the connection is at its limit.
  ASSERT_TRUE(sendCalls(1, 8));
  ASSERT_TRUE(se->waitEntered(2));
  // These can only be read once some of the first have finished.
  ASSERT_TRUE(sendCalls(9, 12));
  constexpr uint32_t kCalls = 20;
  se->release(kCalls);

  ::android::host::rpc::FrameDecoder decoder;
  std::set<uint32_t> answered;
  ::android::host::rpc::Frame f;
  while (answered.size() < kCalls) {
    pollfd pfd{fd, POLLIN, 0};
    ASSERT_EQ(poll(&pfd, 1, 10000), 1) << answered.size() << " of " << kCalls << " answered";
    uint8_t buf[4096];
    ssize_t n = recv(fd, buf, sizeof(buf), 0);
    ASSERT_GT(n, 0);
    ASSERT_TRUE(decoder.feed(buf, static_cast<size_t>(n)));
    while (decoder.next(&f)) {
      ASSERT_EQ(f.kind, FrameKind::Reply);
      // transmit's answer: the byte sent and 90 00
      EXPECT_EQ(f.body, (std::vector<uint8_t>{3, 0, 0, 0, static_cast<uint8_t>(f.id), 0x90, 0x00}));
      answered.insert(f.id);
    }
  }
  EXPECT_EQ(se->maxRunning(), 2);
  close(fd);
}

// The pool's threads are all the host starts: a pool of four is the
// joining thread and three more, with no thread of its own for reading, and
// the NDK's thread pool calls (AIDL) add none.
TEST_F(RpcHostTest, PoolOfFourStartsThreeThreadsAndTheNdkPoolNone) {
  auto threads = [] {
    size_t n = 0;
    for (const auto& e : std::filesystem::directory_iterator("/proc/self/task")) {
      (void)e;
      ++n;
    }
    return n;
  };
  // A runtime that starts a helper thread along with the first thread (the
  // thread sanitizer's) has done so before the count.
  std::thread([] {}).join();
  const size_t before = threads();
  startServer(4);  // the helper joins on a thread of its own
  EXPECT_TRUE(ABinderProcess_setThreadPoolMaxThreadCount(1));
  ABinderProcess_startThreadPool();
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  ASSERT_TRUE(client->isCardPresent().isOk());  // the joiner has joined
  EXPECT_EQ(threads(), before + 4);
}

TEST_F(RpcHostTest, ClosedConnectionNotifiesLinkedAndNotUnlinkedRecipients) {
  // One pool thread runs the notifications in the order they were linked.
  startServer(1);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  sp<ClientCallback> cb = new ClientCallback();
  ASSERT_TRUE(client->init(cb).isOk());
  sp<DeathWatcher> unlinked = new DeathWatcher();
  sp<DeathWatcher> linked = new DeathWatcher();
  sp<ISecureElementHalCallback> proxy = se->callback();
  ASSERT_TRUE(proxy->linkToDeath(unlinked, 5).isOk());
  ASSERT_TRUE(proxy->linkToDeath(linked, 7));
  ASSERT_TRUE(proxy->unlinkToDeath(unlinked));
  EXPECT_FALSE(proxy->unlinkToDeath(unlinked));

  client = nullptr;  // the last reference closes the connection
  ASSERT_TRUE(linked->waitDeaths(1));
  ASSERT_TRUE(se->watcher->waitDeaths(1));
  EXPECT_EQ(linked->cookies(), std::vector<uint64_t>{7});
  EXPECT_TRUE(unlinked->cookies().empty());
  // A killed client process ends its connection the same way; the notice
  // names the callback that died.
  EXPECT_EQ(se->watcher->cookies(), std::vector<uint64_t>{0});
  EXPECT_EQ(se->watcher->lastWho().promote(), proxy);

  // The client is gone: calls on its callback fail at once and link fails.
  EXPECT_FALSE(proxy->onStateChange(true).isOk());
  EXPECT_FALSE(static_cast<bool>(proxy->linkToDeath(linked, 9)));

  // Told, the links are gone: nothing but the test holds the recipients.
  // (The one pool thread answers this call only after it let go of the last
  // notice.)
  ASSERT_TRUE(ISecureElement::getService("SIM1")->isCardPresent().isOk());
  EXPECT_EQ(linked->getStrongCount(), 1);
  EXPECT_EQ(unlinked->getStrongCount(), 1);
}

TEST_F(RpcHostTest, BadFramesCloseOnlyTheirConnection) {
  // A single pool thread: an idle half frame must not hold it.
  startServer(1);
  int idle = connectRaw("SIM1");
  ASSERT_GE(idle, 0);
  std::vector<uint8_t> half = frameBytes(FrameKind::Call, 1, 0, 3, {});
  ASSERT_EQ(send(idle, half.data(), 10, 0), 10);

  sp<ISecureElement> good = ISecureElement::getService("SIM1");
  ASSERT_NE(good, nullptr);

  // How the header is judged is the codec's test; one bad header stands for all.
  std::vector<uint8_t> badMagic = frameBytes(FrameKind::Call, 1, 0, 3, {});
  badMagic[0] ^= 0xFF;
  std::vector<uint8_t> truncated = frameBytes(FrameKind::Call, 1, 0, 4, std::vector<uint8_t>(100));
  truncated.resize(40);
  // transmit whose byte string claims more than the body holds
  std::vector<uint8_t> argPastBody = frameBytes(FrameKind::Call, 1, 0, 4, {0xE8, 0x03, 0, 0, 1});
  std::vector<uint8_t> trailingBytes = frameBytes(FrameKind::Call, 1, 0, 3, {0x00});
  std::vector<uint8_t> badChannelArg = frameBytes(FrameKind::Call, 1, 0, 7, {});

  struct Case {
    const char* name;
    std::vector<uint8_t> bytes;
    bool endStream;  // the client stops sending after the bytes
  };
  const Case cases[] = {
      {"bad magic", badMagic, false},
      {"frame cut short", truncated, true},
      {"unknown method", frameBytes(FrameKind::Call, 1, 0, 99, {}), false},
      {"call to an unknown object", frameBytes(FrameKind::Call, 1, 5, 3, {}), false},
      {"argument longer than the body", argPastBody, false},
      {"bytes after the arguments", trailingBytes, false},
      {"missing argument", badChannelArg, false},
      {"answer to no call", frameBytes(FrameKind::Reply, 77, 0, 0, {}), false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture cap;
    int fd = connectRaw("SIM1");
    ASSERT_GE(fd, 0);
    ASSERT_EQ(send(fd, c.bytes.data(), c.bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(c.bytes.size()));
    if (c.endStream) shutdown(fd, SHUT_WR);
    EXPECT_TRUE(closedByServer(fd));
    close(fd);
    bool logged = false;
    for (auto& r : cap.records()) {
      if (r.tag == "hidl_host" && r.priority == ANDROID_LOG_ERROR) logged = true;
    }
    EXPECT_TRUE(logged);
    // Everyone else is still served.
    Return<bool> r = good->isCardPresent();
    EXPECT_TRUE(r.isOk());
  }
  // The idle half frame is still pending, not dropped.
  pollfd pfd{idle, POLLIN, 0};
  EXPECT_EQ(poll(&pfd, 1, 0), 0);
  close(idle);
}

TEST_F(RpcHostTest, OperationWithoutResultGivesClientAnError) {
  startServer(2);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  se->skipResult = true;
  bool called = false;
  EXPECT_FALSE(client->getAtr([&](const hidl_vec<uint8_t>&) { called = true; }).isOk());
  EXPECT_FALSE(client->transmit({0x00}, [&](const hidl_vec<uint8_t>&) { called = true; }).isOk());
  EXPECT_FALSE(client
                   ->openLogicalChannel({0xA0}, 0,
                                        [&](const LogicalChannelResponse&,
                                            SecureElementStatus) { called = true; })
                   .isOk());
  EXPECT_FALSE(client
                   ->openBasicChannel({0xA0}, 0,
                                      [&](const hidl_vec<uint8_t>&, SecureElementStatus) {
                                        called = true;
                                      })
                   .isOk());
  EXPECT_FALSE(called);
  // The connection stays usable.
  se->skipResult = false;
  EXPECT_TRUE(client->isCardPresent().isOk());
}

TEST_F(RpcHostTest, SecondResultIsDroppedAndLogged) {
  startServer(2);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  LogCapture cap;
  se->doubleResult = true;
  std::vector<std::vector<uint8_t>> got;
  ASSERT_TRUE(client->getAtr([&](const hidl_vec<uint8_t>& r) { got.push_back(r); }).isOk());
  EXPECT_EQ(got, std::vector<std::vector<uint8_t>>{kFakeAtr});
  EXPECT_TRUE(cap.contains("getAtr: result callback called again", "hidl_host"));
}

TEST_F(RpcHostTest, CallTimeoutAndVanishedServiceGiveErrorsNotHangs) {
  se->blockTransmit = true;
  startServer(2);
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  sp<ISecureElement> other = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  ASSERT_NE(other, nullptr);
  ASSERT_TRUE(::android::host::setCallTimeout(client, 100));
  EXPECT_FALSE(client->transmit({0x01}, [](const hidl_vec<uint8_t>&) {}).isOk());
  // The late reply cannot be matched any more: the connection is closed.
  EXPECT_FALSE(client->isCardPresent().isOk());
  se->release(1);

  server->stop();
  EXPECT_FALSE(other->isCardPresent().isOk());
  EXPECT_EQ(ISecureElement::getService("SIM1"), nullptr);
  EXPECT_EQ(ISecureElement::getService("nothing"), nullptr);
}

TEST_F(RpcHostTest, RegistrationMakesPrivateSocketAndReplacesStaleOne) {
  std::string dir = root.path() + "/dev/socket/secure_element";
  std::filesystem::create_directories(dir);
  // A socket file left by a daemon that is gone.
  int stale = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, (dir + "/SIM1").c_str(), sizeof(addr.sun_path) - 1);
  ASSERT_EQ(bind(stale, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  close(stale);
  EXPECT_TRUE(::android::host::listServices().empty());

  startServer(2);
  ASSERT_EQ(server->status(), OK);
  struct stat st;
  ASSERT_EQ(stat(dir.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
  ASSERT_EQ(stat((dir + "/SIM1").c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_EQ(::android::host::listServices(), std::vector<std::string>{"SIM1"});
  sp<ISecureElement> client = ISecureElement::getService("SIM1");
  ASSERT_NE(client, nullptr);
  EXPECT_TRUE(client->isCardPresent().isOk());
}

TEST_F(RpcHostTest, RegistrationFailsWhenTheSocketCannotBeMade) {
  // The device root is a plain file: no folder can be made below it.
  std::string file = root.path() + "/not-a-folder";
  { std::ofstream(file) << "x"; }
  setenv("SE_DEVICE_ROOT", file.c_str(), 1);
  LogCapture cap;
  EXPECT_NE(se->registerAsService("SIM1"), OK);
  EXPECT_TRUE(cap.contains("cannot create", "hidl_host"));
  EXPECT_NE(se->registerAsService("bad/name"), OK);
  ::android::host::shutdownRpcHostForTest();
}

}  // namespace

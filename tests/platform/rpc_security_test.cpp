// What a hostile or careless local client can do to the RPC host: claim
// huge frames, park half frames or nothing at all on many connections, or
// connect from another user in numbers. The host must allocate no more
// than one frame per connection, keep its single pool thread free, and
// refuse foreign peers without letting them use up connection slots.
#include <gtest/gtest.h>

#include <host/rpc_wire.h>

#include <malloc.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <cstring>
#include <vector>

#include "rpc_test_util.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
extern "C" size_t __sanitizer_get_current_allocated_bytes(void);
#endif

namespace {

using namespace fake;
using ::android::host::rpc::FrameKind;
using ::android::host::rpc::kHeaderSize;
using ::android::host::rpc::kMaxBodySize;

constexpr int kLimitMs = 10000;

// Bytes the process's heap hands out now (the sanitizer's allocator when
// one is built in, else the C library's arenas and mapped chunks).
size_t heapInUse() {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  return __sanitizer_get_current_allocated_bytes();
#else
  struct mallinfo2 m = mallinfo2();
  return m.uordblks + m.hblkhd;
#endif
}

long growth(size_t before) { return static_cast<long>(heapInUse()) - static_cast<long>(before); }

// True when the server ends the connection within the limit, having sent
// nothing.
bool closedWithoutAnswer(int fd) {
  char buf[64];
  pollfd pfd{fd, POLLIN, 0};
  if (poll(&pfd, 1, kLimitMs) != 1) return false;
  ssize_t n = recv(fd, buf, sizeof(buf), 0);
  return n == 0 || (n < 0 && errno == ECONNRESET);
}

// True when nothing has happened on `fd`: no bytes, no close.
bool stillOpenAndQuiet(int fd) {
  pollfd pfd{fd, POLLIN, 0};
  return poll(&pfd, 1, 0) == 0;
}

// A transmit call's header claiming `bodyLength` bytes.
std::vector<uint8_t> headerClaiming(uint32_t bodyLength) {
  std::vector<uint8_t> out = frameBytes(FrameKind::Call, 1, 0, 4, {});
  for (int i = 0; i < 4; ++i) out[20 + i] = static_cast<uint8_t>(bodyLength >> (8 * i));
  return out;
}

bool sendAll(int fd, const std::vector<uint8_t>& bytes) {
  size_t off = 0;
  while (off < bytes.size()) {
    ssize_t n = send(fd, bytes.data() + off, bytes.size() - off, MSG_NOSIGNAL);
    if (n <= 0) return false;
    off += static_cast<size_t>(n);
  }
  return true;
}

class RpcSecurityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // One pool thread: whatever holds it starves everyone else.
    server = std::make_unique<Server>(se, "SIM1", 1);
    ASSERT_EQ(server->status(), ::android::OK);
    client = ISecureElement::getService("SIM1");
    ASSERT_NE(client, nullptr);
    ::android::host::setCallTimeout(client, kLimitMs);
  }
  void TearDown() override {
    closeRaw();
    client = nullptr;
    if (server) server->stop();
  }
  // A bare connection, closed by closeRaw() or at the end of the test.
  int raw() {
    int fd = connectRaw("SIM1");
    if (fd >= 0) rawFds.push_back(fd);
    return fd;
  }
  void closeRaw() {
    for (int fd : rawFds) close(fd);
    rawFds.clear();
  }
  // The well-behaved client gets its echo within the limit.
  bool served(uint8_t tag) {
    std::vector<uint8_t> resp;
    auto r = client->transmit({tag}, [&](const hidl_vec<uint8_t>& x) { resp = x; });
    return r.isOk() && resp == std::vector<uint8_t>{tag, 0x90, 0x00};
  }
  TempRoot root;
  sp<FakeSecureElement> se = new FakeSecureElement();
  std::unique_ptr<Server> server;
  sp<ISecureElement> client;
  std::vector<int> rawFds;
};

TEST_F(RpcSecurityTest, HugeLengthClaimsAreRefusedWithoutAllocating) {
  ASSERT_TRUE(served(1));
  const size_t before = heapInUse();
  const uint32_t claims[] = {static_cast<uint32_t>(kMaxBodySize + 1), 1u << 24, 1u << 31,
                             0xFFFFFFFFu};
  // Many rounds: an allocation of even the smallest claim per frame would
  // show as megabytes, the largest would fail outright.
  for (int round = 0; round < 16; ++round) {
    for (uint32_t claim : claims) {
      SCOPED_TRACE(claim);
      int fd = raw();
      ASSERT_GE(fd, 0);
      // The header alone: the refusal may not wait for a body.
      ASSERT_TRUE(sendAll(fd, headerClaiming(claim)));
      EXPECT_TRUE(closedWithoutAnswer(fd));
    }
    closeRaw();
  }
  EXPECT_TRUE(served(2));
  EXPECT_LT(growth(before), 256 * 1024);
}

TEST_F(RpcSecurityTest, StalledClientsHoldNeitherThePoolThreadNorMoreThanAFrameEach) {
  ASSERT_TRUE(served(1));
  const size_t before = heapInUse();
  constexpr int kEach = 8;
  // Per round: one silent, one with half a header, one with all but the
  // last byte of the largest frame allowed.
  for (int i = 0; i < kEach; ++i) {
    raw();
    int b = raw();
    int c = raw();
    ASSERT_TRUE(rawFds.size() == 3u * (i + 1) && b >= 0 && c >= 0);
    std::vector<uint8_t> head = headerClaiming(static_cast<uint32_t>(kMaxBodySize));
    ASSERT_TRUE(sendAll(b, std::vector<uint8_t>(head.begin(), head.begin() + kHeaderSize / 2)));
    head.resize(kHeaderSize + kMaxBodySize - 1, 0x5A);
    ASSERT_TRUE(sendAll(c, head));
  }
  // Served while all of them wait, more than once.
  EXPECT_TRUE(served(2));
  EXPECT_TRUE(served(3));
  // Each stalled connection costs at most its one frame (a growing buffer
  // may hold up to twice that); plus room for the host's own bookkeeping.
  const long bound = kEach * 2 * static_cast<long>(kHeaderSize + kMaxBodySize) + 512 * 1024;
  EXPECT_LT(growth(before), bound);
  // Nobody was answered or dropped for waiting.
  for (int fd : rawFds) EXPECT_TRUE(stillOpenAndQuiet(fd));

  // Gone clients leave nothing behind. Two calls in a row: the first is read
  // no earlier than the ends of the closed connections, the second only
  // after the host has dropped them.
  closeRaw();
  EXPECT_TRUE(served(4));
  EXPECT_TRUE(served(5));
  EXPECT_LT(growth(before), 256 * 1024);
}

TEST_F(RpcSecurityTest, ForeignPeersCannotUseUpConnectionSlots) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to connect as another user id";
  // Let another user reach the socket, so that only the peer check refuses it.
  const std::string dir = root.path() + "/dev/socket/secure_element";
  for (const std::string& d :
       {root.path(), root.path() + "/dev", root.path() + "/dev/socket", dir}) {
    ASSERT_EQ(chmod(d.c_str(), 0755), 0);
  }
  ASSERT_EQ(chmod((dir + "/SIM1").c_str(), 0666), 0);

  // More connections than the host keeps at once, all held open by a child
  // running as nobody, each sending a whole call.
  constexpr int kForeign = 300;
  // Everything the child needs is made before the fork: this process runs
  // the host's threads, so the child keeps to plain system calls.
  const std::vector<uint8_t> call = frameBytes(FrameKind::Call, 1, 0, 3, {});  // isCardPresent
  ASSERT_FALSE(call.empty());
  const std::string path = ::android::host::serviceSocketPath("SIM1");
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  int report[2];
  ASSERT_EQ(pipe(report), 0);
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    close(report[0]);
    if (setgid(65534) != 0 || setuid(65534) != 0) _exit(3);
    int fds[kForeign];
    for (int i = 0; i < kForeign; ++i) {
      fds[i] = socket(AF_UNIX, SOCK_STREAM, 0);
      if (fds[i] < 0 ||
          connect(fds[i], reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) != 0) {
        _exit(4);
      }
      (void)send(fds[i], call.data(), call.size(), MSG_NOSIGNAL);
    }
    int answered = 0, refused = 0;
    for (int fd : fds) {
      char buf[64];
      pollfd pfd{fd, POLLIN, 0};
      if (poll(&pfd, 1, kLimitMs) != 1) continue;
      ssize_t n = recv(fd, buf, sizeof(buf), 0);
      if (n > 0) ++answered;
      if (n == 0 || (n < 0 && errno == ECONNRESET)) ++refused;
    }
    // Refused all, answered none: report the count refused (as 2 bytes).
    unsigned char out[2] = {static_cast<unsigned char>(refused & 0xFF),
                            static_cast<unsigned char>(refused >> 8)};
    (void)write(report[1], out, 2);
    _exit(answered == 0 ? 0 : 5);
  }
  close(report[1]);
  unsigned char got[2] = {0, 0};
  pollfd pfd{report[0], POLLIN, 0};
  ASSERT_EQ(poll(&pfd, 1, 3 * kLimitMs), 1);
  ASSERT_EQ(read(report[0], got, 2), 2);
  close(report[0]);
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(got[0] | (got[1] << 8), kForeign);
  // The own user is served as before, on an existing and a new connection.
  EXPECT_TRUE(served(7));
  sp<ISecureElement> fresh = ISecureElement::getService("SIM1");
  ASSERT_NE(fresh, nullptr);
  EXPECT_TRUE(fresh->isCardPresent().isOk());
}

}  // namespace

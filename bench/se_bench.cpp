// se-bench: what one APDU costs through the daemon, against the floors it
// cannot go below, measured side by side in one run.
//
// It lays out a temporary device root, starts modem-sim and the daemon in
// it, and measures over the daemon's real sockets:
//   - the RPC hop alone (isCardPresent on eSE1, which touches no device);
//   - transmit on eSE1 and SIM1: a case-2 APDU and a 255-byte case-4 APDU
//     to the echo applet on an open logical channel;
// and, in the same run, the floors of those exchanges:
//   - the same APDUs straight into the simulated vendor library (dlopen,
//     in this process);
//   - the same AT+CGLA exchanges written straight to a second modem-sim's
//     port, without the daemon;
//   - one SIM call's modem choice (communication_which_modem, in a helper
//     process that resolves paths under the same device root);
//   - start-up: launch until both instances accept connections;
//   - the transports alone: a Unix-socket round trip between two processes
//     with the frames' sizes of those calls, and a pty round trip with the
//     AT texts' sizes (floors.h).
// The cases take turns exchange by exchange, in a shuffled order each turn,
// so that load from other processes, and the machine's changing wake-up
// latency, fall on floors and daemon paths alike and the ratios hold.
#include <dlfcn.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <host/rpc_host.h>
#include <host/rpc_wire.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "bench_util.h"
#include "card_applets.h"
#include "ese_qv_hal.h"
#include "floors.h"

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElement;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using Bytes = std::vector<uint8_t>;
using se_bench::nowNanos;
using se_bench::Stats;

namespace {

// What a failure must not leave behind: the processes started and the
// temporary roots made so far.
std::vector<pid_t> g_children;
std::vector<std::string> g_roots;
bool g_keepRoots = false;
// Standard error as it was at start: the library floor sends the real one to a log.
int g_errFd = STDERR_FILENO;

[[noreturn]] void fail(const std::string& what) {
  std::string text = "se-bench: " + what + "\n";
  ssize_t unused = write(g_errFd, text.data(), text.size());
  (void)unused;
  for (pid_t pid : g_children) {
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
  }
  std::error_code ec;
  if (!g_keepRoots) {
    for (const auto& r : g_roots) std::filesystem::remove_all(r, ec);
  }
  _exit(1);
}

struct Options {
  std::string binDir;
  std::string libDir;
  size_t count = 10000;  // timed exchanges per case
  int startups = 7;
  bool keep = false;
  std::string daemonLog;  // empty: daemon.log in the device root
};

const char kUsage[] =
    "usage: se-bench [--bin DIR] [--lib DIR] [--count N]\n"
    "                [--startups N] [--daemon-log FILE] [--keep]\n"
    "  --bin DIR      folder of qvese@1.0-service, modem-sim, se-bench-select\n"
    "                 (default: this program's folder)\n"
    "  --lib DIR      folder of libese_qv_hal.so (default: DIR/../lib)\n"
    "  --count N      timed exchanges per case (default 10000)\n"
    "  --startups N   daemon launches timed for start-up (default 7)\n"
    "  --daemon-log F where the measured daemon's log goes (default: daemon.log\n"
    "                 in its device root; /dev/null shows what logging costs)\n"
    "  --keep         keep the temporary device roots and their logs\n";

std::string selfDir() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof(buf) - 1);
  if (n <= 0) return ".";
  buf[n] = '\0';
  return std::filesystem::path(buf).parent_path().string();
}

Options parseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    auto value = [&]() -> std::string {
      if (i + 1 >= argc) fail(a + " needs a value\n" + kUsage);
      return argv[++i];
    };
    auto count = [&](long min) -> long {
      std::string v = value();
      char* end = nullptr;
      long n = strtol(v.c_str(), &end, 10);
      if (end == v.c_str() || *end != '\0' || n < min) fail(a + " takes a number >= " + std::to_string(min));
      return n;
    };
    if (a == "--bin") {
      o.binDir = value();
    } else if (a == "--lib") {
      o.libDir = value();
    } else if (a == "--count") {
      o.count = static_cast<size_t>(count(1));
    } else if (a == "--startups") {
      o.startups = static_cast<int>(count(1));
    } else if (a == "--daemon-log") {
      o.daemonLog = value();
    } else if (a == "--keep") {
      o.keep = true;
    } else if (a == "--help" || a == "-h") {
      fputs(kUsage, stdout);
      exit(0);
    } else {
      fail("unknown option " + a + "\n" + kUsage);
    }
  }
  if (o.binDir.empty()) o.binDir = selfDir();
  if (o.libDir.empty()) o.libDir = o.binDir + "/../lib";
  return o;
}

// ---------------------------------------------------------------------------
// Device roots and child processes

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::trunc);
  out << text;
  if (!out) fail("cannot write " + path);
}

// A temporary device root laid out as a single-modem phone: the NFC side
// switched to SIM 1, and the eSE of type 1.
class DeviceRoot {
 public:
  explicit DeviceRoot(bool keep) : mKeep(keep) {
    char tmpl[] = "/tmp/se-bench.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) fail(std::string("mkdtemp: ") + strerror(errno));
    mPath = tmpl;
    g_roots.push_back(mPath);
    std::filesystem::create_directories(mPath + "/sys/nfc");
    std::filesystem::create_directories(mPath + "/dev");
    writeFile(mPath + "/sys/nfc/nfc_sim_switch", "1\n");
    writeFile(mPath + "/sys/nfc/nfc_card_num", "1\n");
    writeFile(mPath + "/sys/nfc/nfc_wired_ese_type", "0\n");
    writeFile(mPath + "/properties",
              "ro.odm.config.modem_number=1\n"
              "persist.odm.radio.sim_slot_cfg=0,1\n"
              "vendor.ese_sim.type=1\n");
  }
  ~DeviceRoot() {
    std::error_code ec;
    if (!mKeep) std::filesystem::remove_all(mPath, ec);
  }
  DeviceRoot(const DeviceRoot&) = delete;
  DeviceRoot& operator=(const DeviceRoot&) = delete;
  const std::string& path() const { return mPath; }

 private:
  std::string mPath;
  bool mKeep;
};

class Child {
 public:
  Child() = default;
  // Starts `argv[0]` with SE_DEVICE_ROOT=root; its standard output goes to
  // `outFd` (or /dev/null when < 0) and its standard error to `errPath`.
  Child(const std::vector<std::string>& argv, const std::string& root, int outFd,
        const std::string& errPath) {
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    mPid = fork();
    if (mPid < 0) fail(std::string("fork: ") + strerror(errno));
    if (mPid == 0) {
      int devNull = ::open("/dev/null", O_RDWR);
      int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND, 0644);
      dup2(devNull, STDIN_FILENO);
      dup2(outFd >= 0 ? outFd : devNull, STDOUT_FILENO);
      dup2(err >= 0 ? err : devNull, STDERR_FILENO);
      setenv("SE_DEVICE_ROOT", root.c_str(), 1);
      execv(args[0], args.data());
      _exit(127);
    }
    g_children.push_back(mPid);
  }
  ~Child() { stop(); }
  Child(Child&& o) noexcept : mPid(o.mPid) { o.mPid = -1; }
  Child& operator=(Child&& o) noexcept {
    if (this != &o) {
      stop();
      mPid = o.mPid;
      o.mPid = -1;
    }
    return *this;
  }
  pid_t pid() const { return mPid; }

  // SIGTERM, then SIGKILL if it is still there after two seconds.
  void stop() {
    if (mPid <= 0) return;
    kill(mPid, SIGTERM);
    for (int i = 0; i < 200; ++i) {
      if (waitpid(mPid, nullptr, WNOHANG) == mPid) {
        forget();
        return;
      }
      struct timespec ts = {0, 10 * 1000 * 1000};
      nanosleep(&ts, nullptr);
    }
    kill(mPid, SIGKILL);
    waitpid(mPid, nullptr, 0);
    forget();
  }

  // Waits for it to end by itself; its exit status, or -1.
  int wait() {
    int status = 0;
    if (mPid <= 0 || waitpid(mPid, &status, 0) != mPid) return -1;
    forget();
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  void forget() {
    g_children.erase(std::remove(g_children.begin(), g_children.end(), mPid), g_children.end());
    mPid = -1;
  }
  pid_t mPid = -1;
};

// Reads one line from `fd` within `timeoutMs`.
std::string readLine(int fd, int timeoutMs) {
  std::string line;
  int64_t deadline = nowNanos() + int64_t(timeoutMs) * 1000000;
  for (;;) {
    int left = static_cast<int>((deadline - nowNanos()) / 1000000);
    if (left <= 0) return line;
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, left) <= 0) continue;
    char c;
    ssize_t n = read(fd, &c, 1);
    if (n <= 0) return line;
    if (c == '\n') return line;
    line.push_back(c);
  }
}

Child startModemSim(const Options& o, const std::string& root) {
  int p[2];
  if (pipe(p) != 0) fail("pipe");
  Child c({o.binDir + "/modem-sim", "--root", root, "--log", "/dev/null"}, root, p[1],
          root + "/modem-sim.err");
  close(p[1]);
  std::string ready = readLine(p[0], 5000);
  close(p[0]);
  if (ready.find("ready") == std::string::npos) fail("modem-sim did not come up in " + root);
  return c;
}

bool accepts(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr.sun_path)) return false;
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0;
  close(fd);
  return ok;
}

// Starts the daemon in `root`; the time until both instances accept
// connections in *startupNanos.
Child startDaemon(const Options& o, const std::string& root, int64_t* startupNanos,
                  const std::string& log = "") {
  const std::string dir = root + "/dev/socket/secure_element/";
  int64_t t0 = nowNanos();
  Child d({o.binDir + "/qvese@1.0-service"}, root, -1, log.empty() ? root + "/daemon.log" : log);
  bool ese = false, sim = false;
  while (!(ese && sim)) {
    if (nowNanos() - t0 > 10 * 1000000000LL) fail("the daemon did not register both instances in " + root);
    int status;
    if (waitpid(d.pid(), &status, WNOHANG) == d.pid()) fail("the daemon exited at start; see " + root + "/daemon.log");
    ese = ese || accepts(dir + "eSE1");
    sim = sim || accepts(dir + "SIM1");
    if (!(ese && sim)) {
      struct timespec ts = {0, 50 * 1000};
      nanosleep(&ts, nullptr);
    }
  }
  *startupNanos = nowNanos() - t0;
  return d;
}

// ---------------------------------------------------------------------------
// APDUs

uint8_t claFor(uint8_t channel) {
  return channel < 4 ? channel : static_cast<uint8_t>(0x40 | ((channel - 4) & 0x0F));
}

struct Case {
  const char* name;
  Bytes command;
  Bytes response;
};

// Case 2: INS 01 of the echo applet without data, Le 00; answer 90 00.
// Case 4: 255 bytes echoed back, Le 00; answer the same bytes and 90 00.
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

// ---------------------------------------------------------------------------
// The daemon over its sockets

class StateCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

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

// ---------------------------------------------------------------------------
// The vendor library in this process

class Library {
 public:
  Library(const std::string& path, const std::string& logPath) {
    // The library logs every exchange; into a file, as the daemon's log goes.
    mSavedErr = dup(STDERR_FILENO);
    int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND, 0644);
    if (log >= 0) {
      dup2(log, STDERR_FILENO);
      close(log);
    }
    mHandle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (mHandle == nullptr) fail(std::string("dlopen: ") + dlerror());
    auto* exist = static_cast<int32_t*>(dlsym(mHandle, "g_korva_exist"));
    auto* typeFn = reinterpret_cast<int32_t (*)()>(dlsym(mHandle, "get_korva_exist_flag"));
    auto* openFn = reinterpret_cast<int32_t (*)()>(dlsym(mHandle, "phQvEse_init_open"));
    mTransmit = reinterpret_cast<int32_t (*)(phQvEse_data*, phQvEse_data*)>(
        dlsym(mHandle, "phQVNciHal_Transmit_APDU_by_IPC"));
    if (!exist || !typeFn || !openFn || !mTransmit) fail("symbols missing in " + path);
    *exist = typeFn();
    if (openFn() != 0) fail("phQvEse_init_open failed");
  }
  ~Library() {
    if (mSavedErr >= 0) {
      dup2(mSavedErr, STDERR_FILENO);
      close(mSavedErr);
    }
    // Left loaded: its objects live to the end of the process by design.
  }
  Library(const Library&) = delete;
  Library& operator=(const Library&) = delete;

  Bytes transmit(const Bytes& cmd) {
    phQvEse_data c{static_cast<uint32_t>(cmd.size()), const_cast<uint8_t*>(cmd.data())};
    phQvEse_data r{0, mRsp};
    if (mTransmit(&c, &r) != 0 || r.len > sizeof(mRsp)) return {};
    return Bytes(mRsp, mRsp + r.len);
  }

  // Opens a channel with MANAGE CHANNEL and selects the echo applet there.
  uint8_t openEcho() {
    Bytes r = transmit({0x00, 0x70, 0x00, 0x00, 0x01});
    if (r.size() != 3 || r[1] != 0x90 || r[0] == 0) fail("MANAGE CHANNEL in the library failed");
    uint8_t channel = r[0];
    Bytes select = {claFor(channel), 0xA4, 0x04, 0x00, static_cast<uint8_t>(se_card::aid::kEcho.size())};
    select.insert(select.end(), se_card::aid::kEcho.begin(), se_card::aid::kEcho.end());
    select.push_back(0x00);
    r = transmit(select);
    if (r.size() < 2 || r[r.size() - 2] != 0x90) fail("SELECT of the echo applet in the library failed");
    return channel;
  }

 private:
  void* mHandle = nullptr;
  int mSavedErr = -1;
  int32_t (*mTransmit)(phQvEse_data*, phQvEse_data*) = nullptr;
  uint8_t mRsp[4096];
};

// ---------------------------------------------------------------------------
// A modem-sim port, written to directly

class ModemPort {
 public:
  explicit ModemPort(const std::string& path) {
    mFd = ::open(path.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC);
    if (mFd < 0) fail("cannot open " + path + ": " + strerror(errno));
  }
  ~ModemPort() {
    if (mFd >= 0) close(mFd);
  }
  ModemPort(const ModemPort&) = delete;
  ModemPort& operator=(const ModemPort&) = delete;

  // Sends one command and CR; the lines before the final one in *lines.
  // False on ERROR, a time-out or a broken port.
  bool command(const std::string& cmd, std::vector<std::string>* lines) {
    std::string out = cmd + "\r";
    const char* p = out.data();
    size_t left = out.size();
    while (left > 0) {
      ssize_t w = write(mFd, p, left);
      if (w < 0 && errno == EINTR) continue;
      if (w <= 0) return false;
      p += w;
      left -= static_cast<size_t>(w);
    }
    lines->clear();
    for (;;) {
      std::string line;
      if (!nextLine(&line)) return false;
      if (line == "OK") return true;
      if (line.rfind("ERROR", 0) == 0 || line.rfind("+CME ERROR", 0) == 0) return false;
      lines->push_back(line);
    }
  }

 private:
  bool nextLine(std::string* line) {
    for (;;) {
      size_t end = mBuf.find_first_of("\r\n");
      if (end != std::string::npos) {
        *line = mBuf.substr(0, end);
        mBuf.erase(0, end + 1);
        if (line->empty()) continue;
        return true;
      }
      pollfd p{mFd, POLLIN, 0};
      int r = poll(&p, 1, 10000);
      if (r < 0 && errno == EINTR) continue;
      if (r <= 0) return false;
      char chunk[4096];
      ssize_t n = read(mFd, chunk, sizeof(chunk));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      mBuf.append(chunk, static_cast<size_t>(n));
    }
  }
  int mFd = -1;
  std::string mBuf;
};

// ---------------------------------------------------------------------------
// Output

std::string cpuModel() {
  std::ifstream in("/proc/cpuinfo");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("model name", 0) == 0) {
      size_t colon = line.find(':');
      if (colon != std::string::npos) return line.substr(colon + 2);
    }
  }
  return "unknown";
}

std::string loadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string a, b, c;
  in >> a >> b >> c;
  return a + " " + b + " " + c;
}

// Lines of `path` that contain `needle`.
size_t countLines(const std::string& path, const std::string& needle) {
  std::ifstream in(path);
  std::string line;
  size_t n = 0;
  while (std::getline(in, line)) {
    if (line.find(needle) != std::string::npos) ++n;
  }
  return n;
}

std::map<std::string, std::string> procStatus(pid_t pid) {
  std::map<std::string, std::string> out;
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    std::string v = line.substr(colon + 1);
    size_t b = v.find_first_not_of(" \t");
    out[line.substr(0, colon)] = b == std::string::npos ? "" : v.substr(b);
  }
  return out;
}

void row(const std::string& what, const Stats& s) {
  printf("| %-52s | %6zu | %9.1f | %9.1f | %8.0f |\n", what.c_str(), s.count, s.medianUs, s.p99Us,
         s.perSecond);
}

// Samples of one case.
struct Series {
  std::vector<int64_t> samples;
  // Exchanges per second: one over the mean time of an exchange, as if
  // they ran back to back.
  Stats stats() const {
    int64_t sum = 0;
    for (int64_t v : samples) sum += v;
    return se_bench::statsOf(samples, sum);
  }
};

// One case: what it runs (false on a wrong answer) and where its times go.
struct Probe {
  std::string name;
  Series* series;
  std::function<bool()> op;
};

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  g_errFd = dup(STDERR_FILENO);
  const Options o = parseOptions(argc, argv);
  g_keepRoots = o.keep;
  const std::string loadBefore = loadAverage();

  // Start-up, each launch in a fresh root (registration needs no modem).
  std::vector<int64_t> startups;
  for (int i = 0; i < o.startups; ++i) {
    DeviceRoot root(false);
    int64_t t = 0;
    Child d = startDaemon(o, root.path(), &t);
    startups.push_back(t);
    d.stop();
  }
  Stats startup = se_bench::statsOf(startups, 0);
  int64_t startupMax = *std::max_element(startups.begin(), startups.end());

  // The daemon with its modem, and a second modem for the direct floor.
  DeviceRoot root(o.keep);
  DeviceRoot floorRoot(o.keep);
  Child modem = startModemSim(o, root.path());
  Child floorModem = startModemSim(o, floorRoot.path());
  int64_t firstStart = 0;
  Child daemon = startDaemon(o, root.path(), &firstStart, o.daemonLog);
  setenv("SE_DEVICE_ROOT", root.path().c_str(), 1);

  sp<ISecureElement> ese = connectInstance("eSE1");
  sp<ISecureElement> sim = connectInstance("SIM1");
  const std::vector<Case> eseCases = casesFor(openEcho(ese, "eSE1"));
  const std::vector<Case> simCases = casesFor(openEcho(sim, "SIM1"));

  Library lib(o.libDir + "/libese_qv_hal.so", root.path() + "/bench-library.log");
  const std::vector<Case> libCases = casesFor(lib.openEcho());

  ModemPort port(floorRoot.path() + "/dev/appvcom18");
  std::vector<std::string> lines;
  if (!port.command("AT+CCHO=\"" + hexOf(se_card::aid::kEcho) + "\"", &lines) || lines.size() != 1 ||
      lines[0].rfind("+CCHO: ", 0) != 0) {
    fail("cannot open a channel on the direct modem port");
  }
  const long session = strtol(lines[0].c_str() + 7, nullptr, 10);
  // The card's channel is the low bits of the session; the CLA names it as
  // the daemon's client would.
  const std::vector<Case> modemCases = casesFor(static_cast<uint8_t>(session & 0x1F));
  std::vector<std::string> modemCommands, modemAnswers;
  for (const Case& c : modemCases) {
    std::string hex = hexOf(c.command);
    modemCommands.push_back("AT+CGLA=" + std::to_string(session) + "," + std::to_string(hex.size()) + ",\"" +
                            hex + "\"");
    std::string rsp = hexOf(c.response);
    modemAnswers.push_back("+CGLA: " + std::to_string(rsp.size()) + ",\"" + rsp + "\"");
  }

  // The transport floors: exchange 0 the isCardPresent frames, 1 and 2 the
  // transmit frames of case-2 and case-4; on the pty the AT texts of the
  // two cases, as a modem answers them.
  se_bench::EchoFloor socketFloor, ptyFloor;
  {
    std::vector<se_bench::Exchange> frames = {frameExchange(3, nullptr, nullptr, 1)};
    std::vector<se_bench::Exchange> texts;
    for (int k = 0; k < 2; ++k) {
      frames.push_back(frameExchange(4, &simCases[k].command, &simCases[k].response, 0));
      texts.push_back(textExchange(modemCommands[k] + "\r", modemAnswers[k] + "\r\nOK\r\n"));
    }
    if (!socketFloor.startSocket(frames) || !ptyFloor.startPty(texts)) fail("cannot start the transport floors");
    g_children.push_back(socketFloor.pid());
    g_children.push_back(ptyFloor.pid());
  }

  auto viaRpc = [](const sp<ISecureElement>& se, const Case& c) {
    bool same = false;
    auto r = se->transmit(c.command, [&](const hidl_vec<uint8_t>& rsp) {
      same = rsp.size() == c.response.size() && std::equal(rsp.begin(), rsp.end(), c.response.begin());
    });
    return r.isOk() && same;
  };

  // Log lines of the SIM path: the radio buffer is the SIM side's alone.
  const std::string daemonLog = o.daemonLog.empty() ? root.path() + "/daemon.log" : "";
  const size_t radioBefore = daemonLog.empty() ? 0 : countLines(daemonLog, "[radio] ");
  size_t simCalls = 0;

  Series rpcFloor;
  Series libFloor[2], modemFloor[2], eseTx[2], simTx[2];
  Series socketRpc, socketTx[2], ptyTx[2];
  std::vector<Probe> probes;
  probes.push_back({"isCardPresent", &rpcFloor, [&] {
                      auto r = ese->isCardPresent();
                      return r.isOk() && static_cast<bool>(r);
                    }});
  probes.push_back({"socket isCardPresent", &socketRpc, [&] { return socketFloor.roundTrip(0); }});
  for (int k = 0; k < 2; ++k) {
    probes.push_back({std::string("socket ") + simCases[k].name, &socketTx[k],
                      [&, k] { return socketFloor.roundTrip(1 + k); }});
    probes.push_back({std::string("pty ") + simCases[k].name, &ptyTx[k], [&, k] { return ptyFloor.roundTrip(k); }});
  }
  for (int k = 0; k < 2; ++k) {
    probes.push_back({std::string("library ") + libCases[k].name, &libFloor[k],
                      [&, k] { return lib.transmit(libCases[k].command) == libCases[k].response; }});
    probes.push_back({std::string("eSE1 ") + eseCases[k].name, &eseTx[k], [&, k] { return viaRpc(ese, eseCases[k]); }});
    probes.push_back({std::string("modem ") + modemCases[k].name, &modemFloor[k], [&, k] {
                        return port.command(modemCommands[k], &lines) && lines.size() == 1 &&
                               lines[0] == modemAnswers[k];
                      }});
    probes.push_back({std::string("SIM1 ") + simCases[k].name, &simTx[k], [&, k] {
                        ++simCalls;
                        return viaRpc(sim, simCases[k]);
                      }});
  }
  for (Probe& p : probes) p.series->samples.reserve(o.count);
  std::vector<size_t> order(probes.size());
  for (size_t i = 0; i < order.size(); ++i) order[i] = i;
  std::mt19937 shuffle(20261206);
  const size_t warmup = std::max<size_t>(o.count / 20, 20);
  for (size_t turn = 0; turn < warmup + o.count; ++turn) {
    std::shuffle(order.begin(), order.end(), shuffle);
    for (size_t i : order) {
      Probe& p = probes[i];
      int64_t t0 = nowNanos();
      bool ok = p.op();
      int64_t t = nowNanos() - t0;
      if (!ok) fail("wrong answer: " + p.name);
      if (turn >= warmup) p.series->samples.push_back(t);
    }
  }
  const double radioLinesPerCall =
      daemonLog.empty() ? -1 : static_cast<double>(countLines(daemonLog, "[radio] ") - radioBefore) / simCalls;

  // Modem choice and one log line, in a helper that resolves its paths
  // under the same root.
  Stats select, logLine;
  double choiceLinesPerCall = 0;
  {
    int p[2];
    if (pipe(p) != 0) fail("pipe");
    const std::string helperLog = root.path() + "/bench-select.log";
    Child helper({o.binDir + "/se-bench-select", std::to_string(o.count)}, root.path(), p[1], helperLog);
    close(p[1]);
    std::string first = readLine(p[0], 60000);
    std::string second = readLine(p[0], 60000);
    close(p[0]);
    size_t selectCalls = 0, logCalls = 0;
    if (helper.wait() != 0 ||
        sscanf(first.c_str(), "select %zu %lf %lf %lf %zu", &select.count, &select.medianUs, &select.p99Us,
               &select.perSecond, &selectCalls) != 5 ||
        sscanf(second.c_str(), "log %zu %lf %lf %lf %zu", &logLine.count, &logLine.medianUs, &logLine.p99Us,
               &logLine.perSecond, &logCalls) != 5 ||
        selectCalls == 0) {
      fail("modem choice helper failed: " + first);
    }
    choiceLinesPerCall = static_cast<double>(countLines(helperLog, " QvAtChannel: ")) / selectCalls;
  }

  auto status = procStatus(daemon.pid());
  const std::string loadAfter = loadAverage();

  // ---- the table
  char date[64];
  time_t now = time(nullptr);
  strftime(date, sizeof(date), "%Y-%m-%d %H:%M UTC", gmtime(&now));
  struct utsname un;
  uname(&un);
  printf("se-bench, %s; %ld CPUs, %s; %s %s\n", date, sysconf(_SC_NPROCESSORS_ONLN), cpuModel().c_str(),
         un.sysname, un.release);
  printf("load average before %s, after %s; daemon log to %s\n\n", loadBefore.c_str(), loadAfter.c_str(),
         o.daemonLog.empty() ? "a file" : o.daemonLog.c_str());
  printf("| %-52s | %6s | %9s | %9s | %8s |\n", "measurement", "n", "median us", "p99 us", "per s");
  printf("|%s|%s|%s|%s|%s|\n", std::string(54, '-').c_str(), std::string(8, '-').c_str(),
         std::string(11, '-').c_str(), std::string(11, '-').c_str(), std::string(10, '-').c_str());
  row("socket round trip: isCardPresent frames", socketRpc.stats());
  for (int k = 0; k < 2; ++k) row(std::string("socket round trip: transmit ") + simCases[k].name, socketTx[k].stats());
  for (int k = 0; k < 2; ++k) row(std::string("pty round trip: AT+CGLA text ") + simCases[k].name, ptyTx[k].stats());
  row("RPC floor: isCardPresent on eSE1", rpcFloor.stats());
  for (int k = 0; k < 2; ++k) row(std::string("library floor: ") + libCases[k].name, libFloor[k].stats());
  for (int k = 0; k < 2; ++k) row(std::string("modem floor: AT+CGLA ") + modemCases[k].name, modemFloor[k].stats());
  for (int k = 0; k < 2; ++k) row(std::string("eSE1 transmit ") + eseCases[k].name, eseTx[k].stats());
  for (int k = 0; k < 2; ++k) row(std::string("SIM1 transmit ") + simCases[k].name, simTx[k].stats());
  row("SIM modem choice (communication_which_modem)", select);
  row("one log line into a file", logLine);

  const double rpc = rpcFloor.stats().medianUs;
  printf("\n| %-52s | %14s | %14s |\n", "ratio of medians", "case-2", "case-4");
  printf("|%s|%s|%s|\n", std::string(54, '-').c_str(), std::string(16, '-').c_str(), std::string(16, '-').c_str());
  double eseRatio[2], simRatio[2];
  for (int k = 0; k < 2; ++k) {
    eseRatio[k] = eseTx[k].stats().medianUs / (rpc + libFloor[k].stats().medianUs);
    simRatio[k] = simTx[k].stats().medianUs / (rpc + modemFloor[k].stats().medianUs);
  }
  printf("| %-52s | %14.2f | %14.2f |\n", "eSE1 transmit / (RPC floor + library floor)", eseRatio[0], eseRatio[1]);
  printf("| %-52s | %14.2f | %14.2f |\n", "SIM1 transmit / (RPC floor + modem floor)", simRatio[0], simRatio[1]);
  // Against the transports alone.
  const double socketRpcUs = socketRpc.stats().medianUs;
  printf("| %-52s | %14.2f | %14s |\n", "RPC floor / socket round trip", rpc / socketRpcUs, "");
  for (int k = 0; k < 2; ++k) {
    eseRatio[k] = eseTx[k].stats().medianUs / (socketTx[k].stats().medianUs + libFloor[k].stats().medianUs);
    simRatio[k] = simTx[k].stats().medianUs / (socketTx[k].stats().medianUs + ptyTx[k].stats().medianUs);
  }
  printf("| %-52s | %14.2f | %14.2f |\n", "eSE1 transmit / (socket round trip + library floor)", eseRatio[0],
         eseRatio[1]);
  printf("| %-52s | %14.2f | %14.2f |\n", "SIM1 transmit / (socket round trip + pty round trip)", simRatio[0],
         simRatio[1]);


  // Where a SIM1 exchange spends what the floors do not explain.
  if (radioLinesPerCall >= 0) {
    printf("\nSIM1 transmit, what the floors leave (medians, us):\n");
    const double lines = radioLinesPerCall - choiceLinesPerCall;
    for (int k = 0; k < 2; ++k) {
      const double total = simTx[k].stats().medianUs;
      const double floors = rpc + modemFloor[k].stats().medianUs;
      const double logs = lines * logLine.medianUs;
      printf("  %-15s %7.1f = floors %.1f + modem choice %.1f (%.0f log lines in it) + %.0f other log lines ~%.1f"
             " + rest %.1f (hand-offs to the worker and reader threads and back, AT text)\n",
             simCases[k].name, total, floors, select.medianUs, choiceLinesPerCall, lines, logs,
             total - floors - select.medianUs - logs);
    }
  }

  printf("\nstart-up to both instances registered: median %.1f ms, max %.1f ms over %d launches\n",
         startup.medianUs / 1000.0, startupMax / 1e6, o.startups);
  printf("daemon after the run: VmRSS %s, VmHWM %s, threads %s\n", status["VmRSS"].c_str(),
         status["VmHWM"].c_str(), status["Threads"].c_str());
  if (o.keep) printf("device roots kept: %s %s\n", root.path().c_str(), floorRoot.path().c_str());
  fflush(stdout);

  // The client's connections go before the daemon.
  ese.clear();
  sim.clear();
  socketFloor.stop();
  ptyFloor.stop();
  daemon.stop();
  modem.stop();
  floorModem.stop();
  return 0;
}

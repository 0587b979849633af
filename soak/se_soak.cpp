// Soak check: many APDU exchanges through each instance of the real daemon,
// with the modem simulator sending unsolicited lines and cutting its answers
// into pieces. Reports the daemon's resident memory and open descriptors at
// the start and the end of each instance's run and fails when either grew
// beyond a small allowance, or when any exchange failed or came back altered.
//
//   se_soak [--build DIR] [--count N] [--instances eSE1,SIM1] [--rss-kb K]
//           [--fds N] [--split N] [--unsol N] [--daemon-log FILE] [--keep]
#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <host/rpc_host.h>

#include <dirent.h>
#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElement;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;

namespace {

struct Options {
  std::string build = "build";
  long count = 100000;
  std::vector<std::string> instances = {"eSE1", "SIM1"};
  long rssAllowanceKb = 2048;
  long fdAllowance = 0;
  long split = 16;
  long unsol = 5;
  long warmup = 1000;
  std::string daemonLog = "/dev/null";
  bool keep = false;
};

// The applet that answers INS 01 with the command's data and 90 00.
const std::vector<uint8_t> kEchoAid = {0xA0, 0x00, 0x00, 0x00, 0x01, 0x01};

class Child {
 public:
  Child() = default;
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;
  ~Child() { stop(); }

  // Starts argv with `env` added; standard output goes to a pipe (readLine)
  // and standard error to `errPath`.
  bool start(const std::vector<std::string>& argv, const std::vector<std::string>& env,
             const std::string& errPath) {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return false;
    pid_t parent = getpid();
    pid_ = fork();
    if (pid_ < 0) return false;
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);
      if (getppid() != parent) _exit(127);
      dup2(fds[1], 1);
      int err = open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (err >= 0) dup2(err, 2);
      for (const std::string& e : env) putenv(const_cast<char*>(e.c_str()));
      std::vector<char*> args;
      for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
      args.push_back(nullptr);
      execv(args[0], args.data());
      _exit(127);
    }
    close(fds[1]);
    out_ = fds[0];
    return true;
  }

  // One line of standard output, waiting at most timeoutMs.
  std::optional<std::string> readLine(int timeoutMs) {
    std::string line;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                      deadline - std::chrono::steady_clock::now()).count();
      if (left <= 0) return std::nullopt;
      pollfd p{out_, POLLIN, 0};
      if (poll(&p, 1, static_cast<int>(left)) != 1) continue;
      char c;
      if (read(out_, &c, 1) != 1) return std::nullopt;
      if (c == '\n') return line;
      line += c;
    }
  }

  bool alive() const { return pid_ > 0 && kill(pid_, 0) == 0; }
  pid_t pid() const { return pid_; }

  void stop() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      int status = 0;
      for (int i = 0; i < 200; ++i) {
        if (waitpid(pid_, &status, WNOHANG) == pid_) {
          pid_ = -1;
          break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
      if (pid_ > 0) {
        kill(pid_, SIGKILL);
        waitpid(pid_, &status, 0);
        pid_ = -1;
      }
    }
    if (out_ >= 0) close(out_);
    out_ = -1;
  }

 private:
  pid_t pid_ = -1;
  int out_ = -1;
};

struct Usage {
  long rssKb = -1;
  long fds = -1;
};

Usage usageOf(pid_t pid) {
  Usage u;
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) u.rssKb = std::strtol(line.c_str() + 6, nullptr, 10);
  }
  DIR* d = opendir(("/proc/" + std::to_string(pid) + "/fd").c_str());
  if (d != nullptr) {
    long n = 0;
    while (dirent* e = readdir(d)) {
      if (e->d_name[0] != '.') ++n;
    }
    closedir(d);
    u.fds = n;
  }
  return u;
}

class StateCallback : public ISecureElementHalCallback {
 public:
  Return<void> onStateChange(bool connected) override {
    state = connected;
    return Void();
  }
  std::optional<bool> state;
};

std::string hex(const std::vector<uint8_t>& v) {
  std::string s;
  char b[4];
  for (uint8_t x : v) {
    snprintf(b, sizeof(b), "%02X", x);
    s += b;
  }
  return s;
}

// Runs the exchanges on one instance; false on any failure.
bool soakInstance(const Options& o, const std::string& name, const Child& daemon) {
  sp<ISecureElement> se = ISecureElement::getService(name);
  if (se == nullptr) {
    fprintf(stderr, "%s: not registered\n", name.c_str());
    return false;
  }
  ::android::host::setCallTimeout(se, 30000);
  sp<StateCallback> cb = new StateCallback();
  if (!se->init(cb).isOk()) {
    fprintf(stderr, "%s: init failed in transport\n", name.c_str());
    return false;
  }
  while (!cb->state) {
    if (::android::host::pollIncomingCalls(se, 20000) <= 0) break;
  }
  if (!cb->state || !*cb->state) {
    fprintf(stderr, "%s: not connected after init\n", name.c_str());
    return false;
  }

  uint8_t channel = 0xFF;
  SecureElementStatus status = SecureElementStatus::FAILED;
  auto r = se->openLogicalChannel(hidl_vec<uint8_t>(kEchoAid), 0x00,
                                  [&](const LogicalChannelResponse& resp, SecureElementStatus st) {
                                    channel = resp.channelNumber;
                                    status = st;
                                  });
  if (!r.isOk() || status != SecureElementStatus::SUCCESS || channel == 0 || channel > 3) {
    fprintf(stderr, "%s: open of the echo applet failed (status %d, channel %d)\n", name.c_str(),
            static_cast<int>(status), channel);
    return false;
  }

  // Each command carries its sequence number, so a lost, repeated or
  // altered answer is caught.
  long bad = 0;
  auto exchange = [&](uint32_t seq) {
    std::vector<uint8_t> cmd = {channel, 0x01, 0x00, 0x00, 0x04,
                                static_cast<uint8_t>(seq >> 24), static_cast<uint8_t>(seq >> 16),
                                static_cast<uint8_t>(seq >> 8), static_cast<uint8_t>(seq)};
    std::vector<uint8_t> want(cmd.begin() + 5, cmd.end());
    want.push_back(0x90);
    want.push_back(0x00);
    std::vector<uint8_t> got;
    auto t = se->transmit(hidl_vec<uint8_t>(cmd), [&](const hidl_vec<uint8_t>& resp) {
      got.assign(resp.begin(), resp.end());
    });
    if (!t.isOk()) {
      fprintf(stderr, "%s: exchange %u: transport error\n", name.c_str(), seq);
      return false;
    }
    if (got != want) {
      if (bad < 5) {
        fprintf(stderr, "%s: exchange %u: got %s, want %s\n", name.c_str(), seq, hex(got).c_str(),
                hex(want).c_str());
      }
      ++bad;
    }
    return true;
  };

  uint32_t seq = 0;
  for (long i = 0; i < o.warmup; ++i) {
    if (!exchange(seq++)) return false;
  }
  const Usage start = usageOf(daemon.pid());
  const auto t0 = std::chrono::steady_clock::now();
  printf("%s: start  rss %ld kB  fds %ld\n", name.c_str(), start.rssKb, start.fds);
  fflush(stdout);
  const long step = o.count >= 10 ? o.count / 10 : 1;
  for (long i = 1; i <= o.count; ++i) {
    if (!exchange(seq++)) return false;
    if (i % step == 0 && i != o.count) {
      Usage u = usageOf(daemon.pid());
      printf("%s: %7ld  rss %ld kB  fds %ld\n", name.c_str(), i, u.rssKb, u.fds);
      fflush(stdout);
    }
  }
  const double secs =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
  const Usage end = usageOf(daemon.pid());
  printf("%s: end    rss %ld kB  fds %ld  (%ld exchanges in %.1f s, %.0f/s, %ld wrong)\n",
         name.c_str(), end.rssKb, end.fds, o.count, secs, o.count / secs, bad);

  Return<SecureElementStatus> closed = se->closeChannel(channel);
  bool ok = bad == 0;
  if (!closed.isOk() || closed != SecureElementStatus::SUCCESS) {
    fprintf(stderr, "%s: close of channel %d failed\n", name.c_str(), channel);
    ok = false;
  }
  if (start.rssKb < 0 || end.rssKb < 0 || start.fds < 0 || end.fds < 0) {
    fprintf(stderr, "%s: could not read the daemon's usage\n", name.c_str());
    return false;
  }
  if (end.rssKb - start.rssKb > o.rssAllowanceKb) {
    fprintf(stderr, "%s: FAIL resident memory grew by %ld kB (allowance %ld kB)\n", name.c_str(),
            end.rssKb - start.rssKb, o.rssAllowanceKb);
    ok = false;
  }
  if (end.fds - start.fds > o.fdAllowance) {
    fprintf(stderr, "%s: FAIL open descriptors grew by %ld (allowance %ld)\n", name.c_str(),
            end.fds - start.fds, o.fdAllowance);
    ok = false;
  }
  return ok;
}

bool parseLongArg(const char* s, long min, long* out) {
  char* end = nullptr;
  errno = 0;
  long v = std::strtol(s, &end, 10);
  if (errno != 0 || end == s || *end != '\0' || v < min) return false;
  *out = v;
  return true;
}

int usage(const char* why) {
  if (why) fprintf(stderr, "se_soak: %s\n", why);
  fprintf(stderr,
          "usage: se_soak [--build DIR] [--count N] [--instances eSE1,SIM1] [--rss-kb K]\n"
          "               [--fds N] [--split N] [--unsol N] [--warmup N]\n"
          "               [--daemon-log FILE] [--keep]\n"
          "  --build DIR        build folder with bin/ and lib/ (default build)\n"
          "  --count N          exchanges per instance (default 100000)\n"
          "  --rss-kb K         allowed growth of resident memory (default 2048 kB)\n"
          "  --fds N            allowed growth of open descriptors (default 0)\n"
          "  --split N          modem-sim writes answers in N-byte pieces (default 16)\n"
          "  --unsol N          modem-sim sends an unsolicited line every N answers (default 5)\n"
          "  --warmup N         exchanges before the start figures (default 1000)\n"
          "  --daemon-log FILE  the daemon's standard error (default /dev/null)\n"
          "  --keep             keep the temporary device root\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  enum { kBuild = 1, kCount, kInstances, kRss, kFds, kSplit, kUnsol, kWarmup, kLog, kKeep, kHelp };
  const option longOpts[] = {
      {"build", required_argument, nullptr, kBuild},   {"count", required_argument, nullptr, kCount},
      {"instances", required_argument, nullptr, kInstances},
      {"rss-kb", required_argument, nullptr, kRss},    {"fds", required_argument, nullptr, kFds},
      {"split", required_argument, nullptr, kSplit},   {"unsol", required_argument, nullptr, kUnsol},
      {"warmup", required_argument, nullptr, kWarmup},
      {"daemon-log", required_argument, nullptr, kLog}, {"keep", no_argument, nullptr, kKeep},
      {"help", no_argument, nullptr, kHelp},           {nullptr, 0, nullptr, 0}};
  int c;
  while ((c = getopt_long(argc, argv, "", longOpts, nullptr)) != -1) {
    switch (c) {
      case kBuild: o.build = optarg; break;
      case kCount: if (!parseLongArg(optarg, 1, &o.count)) return usage("--count takes a positive number"); break;
      case kInstances: {
        o.instances.clear();
        std::stringstream ss(optarg);
        std::string item;
        while (std::getline(ss, item, ',')) {
          if (!item.empty()) o.instances.push_back(item);
        }
        if (o.instances.empty()) return usage("--instances takes names");
        break;
      }
      case kRss: if (!parseLongArg(optarg, 0, &o.rssAllowanceKb)) return usage("--rss-kb takes kB"); break;
      case kFds: if (!parseLongArg(optarg, 0, &o.fdAllowance)) return usage("--fds takes a count"); break;
      case kSplit: if (!parseLongArg(optarg, 1, &o.split)) return usage("--split takes a size"); break;
      case kUnsol: if (!parseLongArg(optarg, 1, &o.unsol)) return usage("--unsol takes a count"); break;
      case kWarmup: if (!parseLongArg(optarg, 0, &o.warmup)) return usage("--warmup takes a count"); break;
      case kLog: o.daemonLog = optarg; break;
      case kKeep: o.keep = true; break;
      case kHelp: usage(nullptr); return 0;
      default: return usage(nullptr);
    }
  }
  if (optind != argc) return usage("unexpected argument");
  signal(SIGPIPE, SIG_IGN);

  const std::string build = std::filesystem::absolute(o.build).string();
  char tmpl[] = "/tmp/se-soak-XXXXXX";
  if (mkdtemp(tmpl) == nullptr) {
    perror("se_soak: mkdtemp");
    return 1;
  }
  const std::string root = tmpl;
  setenv("SE_DEVICE_ROOT", root.c_str(), 1);

  int rc = 1;
  {
    Child modem;
    Child daemon;
    if (!modem.start({build + "/bin/modem-sim", "--root", root, "--split", std::to_string(o.split),
                      "--unsol", std::to_string(o.unsol)},
                     {}, root + "/modem-sim.err") ||
        !modem.readLine(20000)) {
      fprintf(stderr, "se_soak: modem-sim did not start (%s/bin/modem-sim)\n", build.c_str());
    } else {
      const char* oldLib = getenv("LD_LIBRARY_PATH");
      std::string lib = "LD_LIBRARY_PATH=" + build + "/lib" + (oldLib ? std::string(":") + oldLib : "");
      std::string dev = "SE_DEVICE_ROOT=" + root;
      if (!daemon.start({build + "/bin/qvese@1.0-service"}, {lib, dev}, o.daemonLog)) {
        fprintf(stderr, "se_soak: the daemon did not start\n");
      } else {
        // The daemon is ready once every instance asked for has its socket.
        bool ready = false;
        for (int i = 0; i < 1000 && !ready && daemon.alive(); ++i) {
          std::vector<std::string> up = ::android::host::listServices();
          ready = true;
          for (const std::string& n : o.instances) {
            bool found = false;
            for (const std::string& u : up) found = found || u == n;
            ready = ready && found;
          }
          if (!ready) std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        if (!ready) {
          fprintf(stderr, "se_soak: the daemon did not register every instance\n");
        } else {
          printf("daemon pid %d, modem-sim --split %ld --unsol %ld, %ld exchanges per instance\n",
                 daemon.pid(), o.split, o.unsol, o.count);
          bool ok = true;
          for (const std::string& n : o.instances) ok = soakInstance(o, n, daemon) && ok;
          if (!daemon.alive()) {
            fprintf(stderr, "se_soak: the daemon died\n");
            ok = false;
          }
          printf("soak %s\n", ok ? "PASSED" : "FAILED");
          rc = ok ? 0 : 1;
        }
      }
    }
  }
  if (!o.keep) {
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
  } else {
    printf("device root kept: %s\n", root.c_str());
  }
  return rc;
}

#pragma once
// se-bench's setup: its options, failing cleanly, temporary device roots and
// the processes it starts.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <string>
#include <vector>

namespace se_bench {

// What a failure must not leave behind: the processes started and the
// temporary roots made so far.
extern std::vector<pid_t> g_children;
extern std::vector<std::string> g_roots;
extern bool g_keepRoots;
// Standard error as it was at start: the library floor sends the real one to a log.
extern int g_errFd;

[[noreturn]] void fail(const std::string& what);

struct Options {
  std::string binDir;
  std::string libDir;
  size_t count = 10000;  // timed exchanges per case
  int startups = 7;
  bool keep = false;
  std::string daemonLog;  // empty: daemon.log in the device root
  std::string tmpDir;     // where the temporary device roots go
};

Options parseOptions(int argc, char** argv);

void writeFile(const std::string& path, const std::string& text);

// A temporary device root laid out as a single-modem phone: the NFC side
// switched to SIM 1, and the eSE of type 1.
class DeviceRoot {
 public:
  DeviceRoot(const std::string& tmpDir, bool keep) : mKeep(keep) {
    std::string tmpl = tmpDir + "/se-bench.XXXXXX";
    if (mkdtemp(&tmpl[0]) == nullptr) fail("mkdtemp in " + tmpDir + ": " + strerror(errno));
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
std::string readLine(int fd, int timeoutMs);

Child startModemSim(const Options& o, const std::string& root);

// Starts the daemon in `root`; the time until both instances accept
// connections in *startupNanos.
Child startDaemon(const Options& o, const std::string& root, int64_t* startupNanos,
                  const std::string& log = "");

}  // namespace se_bench

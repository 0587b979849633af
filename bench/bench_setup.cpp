#include "bench_setup.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <host/unix_socket.h>

#include <cstdio>
#include <fstream>

#include "bench_util.h"

namespace se_bench {

std::vector<pid_t> g_children;
std::vector<std::string> g_roots;
bool g_keepRoots = false;
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

namespace {

const char kUsage[] =
    "usage: se-bench [--bin DIR] [--lib DIR] [--count N]\n"
    "                [--startups N] [--daemon-log FILE] [--tmpdir DIR] [--keep]\n"
    "  --bin DIR      folder of qvese@1.0-service, modem-sim, se-bench-select\n"
    "                 (default: this program's folder)\n"
    "  --lib DIR      folder of libese_qv_hal.so (default: DIR/../lib)\n"
    "  --count N      timed exchanges per case (default 10000)\n"
    "  --startups N   daemon launches timed for start-up (default 7)\n"
    "  --daemon-log F where the measured daemon's log goes (default: daemon.log\n"
    "                 in its device root; /dev/null shows what logging costs)\n"
    "  --tmpdir DIR   where the temporary device roots are made (default:\n"
    "                 $TMPDIR, else /tmp); any depth works\n"
    "  --keep         keep the temporary device roots and their logs\n";

std::string selfDir() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof(buf) - 1);
  if (n <= 0) return ".";
  buf[n] = '\0';
  return std::filesystem::path(buf).parent_path().string();
}

}  // namespace

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
    } else if (a == "--tmpdir") {
      o.tmpDir = value();
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
  if (o.tmpDir.empty()) {
    const char* env = getenv("TMPDIR");
    o.tmpDir = env && *env ? env : "/tmp";
  }
  return o;
}

// ---------------------------------------------------------------------------
// Device roots and child processes

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::trunc);
  out << text;
  if (!out) fail("cannot write " + path);
}

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

namespace {

// Reached relative to its folder where the path is long (a deep --tmpdir).
bool accepts(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  std::string error;
  bool ok = android::host::connectUnixAt(fd, path, &error);
  close(fd);
  return ok;
}

}  // namespace

Child startDaemon(const Options& o, const std::string& root, int64_t* startupNanos,
                  const std::string& log) {
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

}  // namespace se_bench

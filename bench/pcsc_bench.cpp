// se-bench-pcsc: what one APDU costs on "eSE1" when the vendor library is
// the PC/SC one (build/lib/pcsc) and the card is card-vpcd in vpcd's
// reader, against its floor: the same APDU straight through SCardTransmit
// from this process to the same card. A third case, isCardPresent on eSE1,
// is the RPC hop alone.
//
// pcscd: the one running, else one started here in the foreground with a
// reader configuration of its own (vpcd on a free port). The cases take
// turns exchange by exchange in a shuffled order, as in se-bench.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>
#include <winscard.h>

#include <android/hardware/secure_element/1.0/ISecureElement.h>
#include <host/rpc_host.h>
#include <host/unix_socket.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "bench_cases.h"
#include "bench_setup.h"
#include "bench_util.h"
#include "card_applets.h"

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::secure_element::V1_0::ISecureElement;
using Bytes = std::vector<uint8_t>;
using se_bench::nowNanos;
using se_bench::Stats;

namespace {

using se_bench::Case;
using se_bench::casesFor;
using se_bench::fail;
using se_bench::g_children;
std::string g_root;  // also in se_bench::g_roots, removed on failure

const char kUsage[] =
    "usage: se-bench-pcsc [--bin DIR] [--count N] [--keep]\n"
    "  --bin DIR   folder of qvese@1.0-service and card-vpcd (default: this\n"
    "              program's folder); the PC/SC library is in DIR/../lib/pcsc\n"
    "  --count N   timed exchanges per case (default 3000)\n"
    "  --keep      keep the temporary device root and its logs\n";

std::string selfDir() {
  char buf[4096];
  const ssize_t n = readlink("/proc/self/exe", buf, sizeof(buf) - 1);
  if (n <= 0) return ".";
  buf[n] = '\0';
  return std::filesystem::path(buf).parent_path().string();
}

void sleepMs(int ms) {
  struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
  nanosleep(&ts, nullptr);
}

// Starts argv with the given extra environment; output into `logPath`.
pid_t spawn(const std::vector<std::string>& argv, const std::vector<std::string>& env, const std::string& logPath) {
  std::vector<char*> args;
  for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  const pid_t pid = fork();
  if (pid < 0) fail("fork");
  if (pid == 0) {
    const int devNull = ::open("/dev/null", O_RDWR);
    const int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND, 0644);
    dup2(devNull, STDIN_FILENO);
    dup2(log, STDOUT_FILENO);
    dup2(log, STDERR_FILENO);
    for (const auto& e : env) putenv(const_cast<char*>(e.c_str()));
    execv(args[0], args.data());
    _exit(127);
  }
  g_children.push_back(pid);
  return pid;
}

void stop(pid_t pid) {
  kill(pid, SIGTERM);
  waitpid(pid, nullptr, 0);
  g_children.erase(std::remove(g_children.begin(), g_children.end(), pid), g_children.end());
}

bool fileHas(const std::string& path, const std::string& text) {
  std::ifstream in(path);
  std::string all((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  return all.find(text) != std::string::npos;
}

// Polls `ok` every few milliseconds for up to `ms`.
void waitUntil(const std::function<bool()>& ok, int ms, const std::string& what) {
  const int64_t deadline = nowNanos() + int64_t(ms) * 1000000;
  while (!ok()) {
    if (nowNanos() > deadline) fail("gave up waiting for " + what);
    sleepMs(2);
  }
}

bool unixAccepts(const std::string& path) {
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  std::string error;
  const bool ok = fd >= 0 && android::host::connectUnixAt(fd, path, &error);
  if (fd >= 0) close(fd);
  return ok;
}

int freePortPair() {
  for (int attempt = 0; attempt < 50; ++attempt) {
    int port = 0;
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof(a);
    if (bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)) == 0 &&
        getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0) {
      port = ntohs(a.sin_port);
    }
    close(fd);
    const int next = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    a.sin_port = htons(static_cast<uint16_t>(port + 1));
    const bool free = port > 0 && port < 65535 && bind(next, reinterpret_cast<sockaddr*>(&a), sizeof(a)) == 0;
    close(next);
    if (free) return port;
  }
  fail("no two free TCP ports in a row");
}

// The floor: this process's own PC/SC connection to the same card, shared
// with the daemon's, on a logical channel of its own.
class DirectCard {
 public:
  explicit DirectCard(const std::string& reader) {
    if (SCardEstablishContext(SCARD_SCOPE_SYSTEM, nullptr, nullptr, &ctx_) != SCARD_S_SUCCESS) fail("no pcscd");
    const LONG rv = SCardConnect(ctx_, reader.c_str(), SCARD_SHARE_SHARED, SCARD_PROTOCOL_T0 | SCARD_PROTOCOL_T1,
                                 &card_, &protocol_);
    if (rv != SCARD_S_SUCCESS) fail(std::string("SCardConnect: ") + pcsc_stringify_error(rv));
  }
  ~DirectCard() {
    SCardDisconnect(card_, SCARD_LEAVE_CARD);
    SCardReleaseContext(ctx_);
  }
  Bytes transmit(const Bytes& cmd) {
    uint8_t buf[MAX_BUFFER_SIZE_EXTENDED];
    DWORD len = sizeof(buf);
    const LONG rv = SCardTransmit(card_, protocol_ == SCARD_PROTOCOL_T1 ? SCARD_PCI_T1 : SCARD_PCI_T0, cmd.data(),
                                  static_cast<DWORD>(cmd.size()), nullptr, buf, &len);
    if (rv != SCARD_S_SUCCESS) fail(std::string("SCardTransmit: ") + pcsc_stringify_error(rv));
    return Bytes(buf, buf + len);
  }
  uint8_t openEcho() {
    const Bytes open = transmit({0x00, 0x70, 0x00, 0x00, 0x01});
    if (open.size() != 3 || open[1] != 0x90) fail("MANAGE CHANNEL open on the direct connection");
    Bytes select = {open[0], 0xA4, 0x04, 0x00, static_cast<uint8_t>(se_card::aid::kEcho.size())};
    select.insert(select.end(), se_card::aid::kEcho.begin(), se_card::aid::kEcho.end());
    const Bytes r = transmit(select);
    if (r.size() < 2 || r[r.size() - 2] != 0x90) fail("SELECT of the echo applet on the direct connection");
    return open[0];
  }

 private:
  SCARDCONTEXT ctx_ = 0;
  SCARDHANDLE card_ = 0;
  DWORD protocol_ = 0;
};

struct Series {
  std::vector<int64_t> samples;
  Stats stats() const {
    int64_t sum = 0;
    for (int64_t v : samples) sum += v;
    return se_bench::statsOf(samples, sum);
  }
};

void row(const std::string& what, const Stats& s) {
  printf("| %-52s | %6zu | %9.1f | %9.1f | %8.0f |\n", what.c_str(), s.count, s.medianUs, s.p99Us, s.perSecond);
}

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  std::string binDir = selfDir();
  size_t count = 3000;
  for (int i = 1; i < argc; ++i) {
    const std::string a = argv[i];
    if (a == "--bin" && i + 1 < argc) {
      binDir = argv[++i];
    } else if (a == "--count" && i + 1 < argc) {
      count = strtoul(argv[++i], nullptr, 10);
      if (count == 0) fail("--count takes a number >= 1");
    } else if (a == "--keep") {
      se_bench::g_keepRoots = true;
    } else if (a == "--help" || a == "-h") {
      fputs(kUsage, stdout);
      return 0;
    } else {
      fail("unknown option " + a + "\n" + kUsage);
    }
  }

  char tmpl[] = "/tmp/se-bench-pcsc.XXXXXX";
  if (mkdtemp(tmpl) == nullptr) fail("mkdtemp");
  g_root = tmpl;
  se_bench::g_roots.push_back(g_root);
  const std::string reader = "Virtual PCD 00 00";

  // pcscd, vpcd's reader and the card.
  int port = 35963;
  pid_t pcscd = -1;
  if (!unixAccepts("/run/pcscd/pcscd.comm")) {
    port = freePortPair();
    std::filesystem::create_directories(g_root + "/reader.conf.d");
    std::ofstream(g_root + "/reader.conf.d/vpcd")
        << "FRIENDLYNAME \"Virtual PCD\"\nDEVICENAME /dev/null:" << port
        << "\nLIBPATH /usr/lib/pcsc/drivers/serial/libifdvpcd.so\nCHANNELID " << port << "\n";
    const std::string bin = access("/usr/sbin/pcscd", X_OK) == 0 ? "/usr/sbin/pcscd" : "/sbin/pcscd";
    pcscd = spawn({bin, "--foreground", "--info", "-c", g_root + "/reader.conf.d"}, {}, g_root + "/pcscd.log");
    waitUntil([&] { return fileHas(g_root + "/pcscd.log", "daemon ready") && unixAccepts("/run/pcscd/pcscd.comm"); },
              10000, "pcscd");
  }
  const pid_t card = spawn({binDir + "/card-vpcd", "--port", std::to_string(port)}, {}, g_root + "/card.log");
  waitUntil([&] { return fileHas(g_root + "/card.log", "# power on"); }, 10000, "pcscd to power the card up");

  // The daemon with the PC/SC library.
  std::ofstream(g_root + "/properties") << "vendor.ese_pcsc.reader=" << reader << "\n";
  const std::string envRoot = "SE_DEVICE_ROOT=" + g_root;
  const std::string envLib = "LD_LIBRARY_PATH=" + binDir + "/../lib/pcsc";
  const pid_t daemon = spawn({binDir + "/qvese@1.0-service"}, {envRoot, envLib}, g_root + "/daemon.log");
  waitUntil([&] { return unixAccepts(g_root + "/dev/socket/secure_element/eSE1"); }, 10000, "the daemon");
  if (!fileHas(g_root + "/daemon.log", "ese_pcsc: get_korva_exist_flag")) fail("the daemon did not load the PC/SC library");
  setenv("SE_DEVICE_ROOT", g_root.c_str(), 1);

  sp<ISecureElement> ese = se_bench::connectInstance("eSE1");
  const std::vector<Case> eseCases = casesFor(se_bench::openEcho(ese, "eSE1"));

  DirectCard direct(reader);
  const std::vector<Case> directCases = casesFor(direct.openEcho());

  Series rpcFloor, pcscFloor[2], eseTx[2];
  struct Probe {
    std::string name;
    Series* series;
    std::function<bool()> op;
  };
  std::vector<Probe> probes;
  probes.push_back({"isCardPresent", &rpcFloor, [&] {
                      auto r = ese->isCardPresent();
                      return r.isOk() && static_cast<bool>(r);
                    }});
  for (int k = 0; k < 2; ++k) {
    probes.push_back({std::string("SCardTransmit ") + directCases[k].name, &pcscFloor[k],
                      [&, k] { return direct.transmit(directCases[k].command) == directCases[k].response; }});
    probes.push_back({std::string("eSE1 ") + eseCases[k].name, &eseTx[k], [&, k] {
                        bool same = false;
                        auto r = ese->transmit(eseCases[k].command, [&](const hidl_vec<uint8_t>& rsp) {
                          same = rsp.size() == eseCases[k].response.size() &&
                                 std::equal(rsp.begin(), rsp.end(), eseCases[k].response.begin());
                        });
                        return r.isOk() && same;
                      }});
  }
  std::vector<size_t> order(probes.size());
  for (size_t i = 0; i < order.size(); ++i) order[i] = i;
  std::mt19937 shuffle(20261206);
  const size_t warmup = std::max<size_t>(count / 20, 20);
  for (size_t turn = 0; turn < warmup + count; ++turn) {
    std::shuffle(order.begin(), order.end(), shuffle);
    for (size_t i : order) {
      Probe& p = probes[i];
      const int64_t t0 = nowNanos();
      const bool ok = p.op();
      const int64_t t = nowNanos() - t0;
      if (!ok) fail("wrong answer: " + p.name);
      if (turn >= warmup) p.series->samples.push_back(t);
    }
  }

  char date[64];
  const time_t now = time(nullptr);
  strftime(date, sizeof(date), "%Y-%m-%d %H:%M UTC", gmtime(&now));
  double load[3] = {0, 0, 0};
  getloadavg(load, 3);
  printf("se-bench-pcsc, %s; %ld CPUs; load average %.2f; pcscd %s, card-vpcd on vpcd port %d\n\n", date,
         sysconf(_SC_NPROCESSORS_ONLN), load[0], pcscd > 0 ? "started here" : "already running", port);
  printf("| %-52s | %6s | %9s | %9s | %8s |\n", "measurement", "n", "median us", "p99 us", "per s");
  printf("|%s|%s|%s|%s|%s|\n", std::string(54, '-').c_str(), std::string(8, '-').c_str(),
         std::string(11, '-').c_str(), std::string(11, '-').c_str(), std::string(10, '-').c_str());
  row("RPC floor: isCardPresent on eSE1", rpcFloor.stats());
  for (int k = 0; k < 2; ++k) row(std::string("PC/SC floor: SCardTransmit ") + directCases[k].name, pcscFloor[k].stats());
  for (int k = 0; k < 2; ++k) row(std::string("eSE1 transmit through PC/SC ") + eseCases[k].name, eseTx[k].stats());
  printf("\n| %-52s | %14s | %14s |\n", "ratio of medians", "case-2", "case-4");
  printf("|%s|%s|%s|\n", std::string(54, '-').c_str(), std::string(16, '-').c_str(), std::string(16, '-').c_str());
  double ratio[2];
  for (int k = 0; k < 2; ++k) {
    ratio[k] = eseTx[k].stats().medianUs / (rpcFloor.stats().medianUs + pcscFloor[k].stats().medianUs);
  }
  printf("| %-52s | %14.2f | %14.2f |\n", "eSE1 through PC/SC / (RPC floor + PC/SC floor)", ratio[0], ratio[1]);
  if (se_bench::g_keepRoots) printf("device root kept: %s\n", g_root.c_str());
  fflush(stdout);

  ese.clear();
  stop(daemon);
  stop(card);
  if (pcscd > 0) stop(pcscd);
  std::error_code ec;
  if (!se_bench::g_keepRoots) std::filesystem::remove_all(g_root, ec);
  return 0;
}

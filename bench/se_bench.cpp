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
#include <signal.h>
#include <stdlib.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "bench_cases.h"
#include "bench_report.h"
#include "bench_setup.h"
#include "bench_util.h"
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
using se_bench::Case;
using se_bench::casesFor;
using se_bench::Child;
using se_bench::connectInstance;
using se_bench::countLines;
using se_bench::cpuModel;
using se_bench::DeviceRoot;
using se_bench::fail;
using se_bench::frameExchange;
using se_bench::g_children;
using se_bench::g_errFd;
using se_bench::g_keepRoots;
using se_bench::hexOf;
using se_bench::Library;
using se_bench::loadAverage;
using se_bench::ModemPort;
using se_bench::openEcho;
using se_bench::Options;
using se_bench::parseOptions;
using se_bench::procStatus;
using se_bench::readLine;
using se_bench::row;
using se_bench::startDaemon;
using se_bench::startModemSim;
using se_bench::textExchange;

namespace {

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
    DeviceRoot root(o.tmpDir, false);
    int64_t t = 0;
    Child d = startDaemon(o, root.path(), &t);
    startups.push_back(t);
    d.stop();
  }
  Stats startup = se_bench::statsOf(startups, 0);
  int64_t startupMax = *std::max_element(startups.begin(), startups.end());

  // The daemon with its modem, and a second modem for the direct floor.
  DeviceRoot root(o.tmpDir, o.keep);
  DeviceRoot floorRoot(o.tmpDir, o.keep);
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

#include "chaos_run.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdarg.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <filesystem>
#include <memory>
#include <mutex>
#include <random>
#include <thread>

#include "chaos_audit.h"
#include "chaos_client.h"
#include "chaos_env.h"
#include "chaos_judge.h"
#include "chaos_pcsc.h"
#include "chaos_plan.h"
#include "chaos_relay.h"
#include "chaos_report.h"

namespace chaos {

namespace {

std::atomic<bool> g_stop{false};
// Calls are judged this long after they ended: every start line of a call
// that overlapped them has arrived by then.
constexpr int64_t kJudgeLagNs = 2000 * kMs;
// Allowances for the daemon's figures between the start and the end.
constexpr long kRssAllowanceKb = 2048;
constexpr long kFdAllowance = 2;
constexpr long kThreadAllowance = 0;

struct SlotState {
  Slot slot;
  int index = 0;
  bool probe = false;
  bool nudge = false;
  int gen = -1;
  Proc proc;
  int fd = -1;
  std::string buf;
  bool inCall = false;
  Kind callKind = Kind::Init;  // the call under way, while inCall
  bool killed = false;
  int64_t respawnAt = 0;
  int64_t killBy = 0;  // kill at the next call start, or at this time
};

class Run {
 public:
  explicit Run(const RunOptions& o) : o_(o), plan_(makePlan(o.seed, int64_t(o.seconds) * 1000, o.pcsc)) {
    bounds_.hangMs = o.hangMs;
  }
  ~Run() { tearDown(); }

  int go() {
    printf("chaos: seed %llu, %d s%s\n", static_cast<unsigned long long>(o_.seed), o_.seconds,
           o_.pcsc ? ", eSE1 through PC/SC" : "");
    fflush(stdout);
    if (!setUp()) {
      fprintf(stderr, "chaos: setup failed: %s\n", setupError_.c_str());
      return 2;
    }
    judge_ = std::make_unique<Judge>(o_.seed, bounds_, o_.pcsc, monoNanos(), stdout);
    if (!warmUp()) return finish(false);
    start_ = healthOf(daemon_.pid());
    origin_ = monoNanos();
    judge_ = std::make_unique<Judge>(o_.seed, bounds_, o_.pcsc, origin_, stdout, o_.shown);
    calls_ = fopen((root_ + "/calls.log").c_str(), "w");
    judge_->traceTo(calls_);
    {
      // The daemon's and modem-sim's logs carry the wall clock.
      struct timespec wall;
      clock_gettime(CLOCK_REALTIME, &wall);
      struct tm tm;
      localtime_r(&wall.tv_sec, &tm);
      logf(origin_, "start: wall clock %02d:%02d:%02d.%03ld", tm.tm_hour, tm.tm_min, tm.tm_sec, wall.tv_nsec / 1000000);
      originMsOfDay_ = ((int64_t(tm.tm_hour) * 60 + tm.tm_min) * 60 + tm.tm_sec) * 1000 + wall.tv_nsec / 1000000;
    }
    chaosPhase();
    return finish(true);
  }

 private:
  // ---------------------------------------------------------------- setup
  bool setUp() {
    root_ = makeTempDir("se-chaos");
    if (root_.empty()) return fail("mkdtemp");
    setenv("SE_DEVICE_ROOT", root_.c_str(), 1);
    std::error_code ec;
    std::filesystem::create_directories(root_ + "/sys/nfc", ec);
    std::filesystem::create_directories(root_ + "/dev", ec);
    std::filesystem::create_directories(root_ + "/modem", ec);
    writeFile(root_ + "/sys/nfc/nfc_sim_switch", "1\n");
    writeFile(root_ + "/sys/nfc/nfc_card_num", "1\n");
    writeFile(root_ + "/sys/nfc/nfc_wired_ese_type", "0\n");
    props_ = std::make_unique<Properties>(root_ + "/properties");
    props_->set("ro.odm.config.modem_number", "1");
    props_->set("persist.odm.radio.sim_slot_cfg", "0,1");
    props_->set("vendor.ese_sim.type", "1");
    props_->set("vendor.secure_element.sim.hang_ms", std::to_string(o_.hangMs));
    props_->set("vendor.secure_element.ese.hang_ms", std::to_string(o_.hangMs));
    if (!props_->write()) return fail("cannot write the properties");
    log_ = fopen((root_ + "/chaos.log").c_str(), "w");
    if (log_ == nullptr) return fail("cannot write chaos.log");

    if (!startModem()) return false;
    std::string err;
    if (!relay_.start(root_ + "/dev/appvcom18", root_ + "/modem/dev/appvcom18", &err)) return fail("relay: " + err);
    if (o_.pcsc) {
      pcsc_ = std::make_unique<PcscEnv>(o_.binDir, root_);
      if (!pcsc_->start(&err)) return fail("PC/SC: " + err);
      props_->set("vendor.ese_pcsc.reader", pcsc_->readerName());
      props_->write();
    }
    return startDaemon();
  }

  bool fail(const std::string& what) {
    setupError_ = what;
    return false;
  }

  bool startModem() {
    int p[2];
    if (pipe2(p, O_CLOEXEC) != 0) return fail("pipe");
    const bool ok = modem_.start({o_.binDir + "/modem-sim", "--root", root_ + "/modem", "--log", root_ + "/modem.log",
                                  "--channels-file", root_ + "/modem-channels"},
                                 {}, p[1], root_ + "/modem-sim.err");
    close(p[1]);
    const std::string ready = ok ? readLine(p[0], 10000) : "";
    close(p[0]);
    if (ready.find("ready") == std::string::npos) return fail("modem-sim did not come up (" + root_ + "/modem-sim.err)");
    return true;
  }

  bool startDaemon() {
    const std::string lib = o_.pcsc ? o_.pcscLibDir : o_.libDir;
    if (!daemon_.start({o_.binDir + "/qvese@1.0-service"},
                       {"SE_DEVICE_ROOT=" + root_, "LD_LIBRARY_PATH=" + lib}, -1, root_ + "/daemon.log")) {
      return fail("cannot start the daemon");
    }
    const std::vector<std::string> sockets = {
        "secure_element/eSE1", "secure_element/SIM1",
        "aidl/android.hardware.secure_element.ISecureElement/eSE1",
        "aidl/android.hardware.secure_element.ISecureElement/SIM1"};
    const int64_t deadline = monoNanos() + 10000 * kMs;
    for (const std::string& s : sockets) {
      while (access((root_ + "/dev/socket/" + s).c_str(), F_OK) != 0) {
        if (!daemon_.running() || monoNanos() > deadline) {
          return fail("the daemon did not register " + s + " (" + root_ + "/daemon.log)");
        }
        usleep(20000);
      }
    }
    return true;
  }

  // Each instance over each interface once, on healthy devices: everything
  // the daemon makes on first use (the modem's worker, its port's reader)
  // exists before the figures are taken.
  bool warmUp() {
    int k = 0;
    for (Inst inst : {Inst::Ese, Inst::Sim}) {
      for (Iface iface : {Iface::Hidl, Iface::Aidl}) {
        auto s = std::make_unique<SlotState>();
        s->slot = {inst, iface};
        s->index = 100 + k++;
        s->probe = true;
        probes_.push_back(std::move(s));
      }
    }
    for (auto& p : probes_) {
      spawn(*p, monoNanos());
      const int64_t deadline = monoNanos() + 30000 * kMs;
      while (p->fd >= 0 && monoNanos() < deadline && !g_stop) pump(50);
    }
    if (g_stop) return false;
    usleep(500000);
    judge_->judgeUpTo(INT64_MAX);
    if (judge_->wrong() > 0 || judge_->calls() < 20) {
      fprintf(stdout, "chaos: the healthy devices did not answer right before any fault; see %s\n", root_.c_str());
      keep_ = true;
      return false;
    }
    return true;
  }

  // ---------------------------------------------------------------- clients
  void spawn(SlotState& s, int64_t now) {
    int p[2];
    if (pipe2(p, O_CLOEXEC) != 0) return;
    ++s.gen;
    ClientArgs a;
    a.slot = s.index;
    a.gen = s.gen;
    a.seed = plan_.clientSeed(s.index, s.gen);
    a.inst = s.slot.inst;
    a.iface = s.slot.iface;
    a.fd = 3;
    a.probe = s.probe && !s.nudge;
    a.nudge = s.nudge;
    std::vector<std::string> argv = {o_.self};
    for (const std::string& w : clientArgv(a)) argv.push_back(w);
    if (!s.proc.start(argv, {}, -1, root_ + "/clients.err", p[1])) {
      close(p[0]);
      close(p[1]);
      s.respawnAt = now + 1000 * kMs;
      return;
    }
    close(p[1]);
    fcntl(p[0], F_SETFL, O_NONBLOCK);
    s.fd = p[0];
    s.buf.clear();
    s.inCall = s.killed = false;
    s.killBy = 0;
  }

  std::vector<SlotState*> allSlots() {
    std::vector<SlotState*> v;
    for (auto& s : slots_) v.push_back(s.get());
    for (auto& s : probes_) v.push_back(s.get());
    return v;
  }

  void pump(int timeoutMs) {
    std::vector<SlotState*> open;
    std::vector<pollfd> fds;
    for (SlotState* s : allSlots()) {
      if (s->fd < 0) continue;
      open.push_back(s);
      fds.push_back({s->fd, POLLIN, 0});
    }
    if (fds.empty()) {
      usleep(static_cast<useconds_t>(timeoutMs) * 1000);
      return;
    }
    if (poll(fds.data(), fds.size(), timeoutMs) <= 0) return;
    for (size_t i = 0; i < fds.size(); ++i) {
      if (!fds[i].revents) continue;
      SlotState& s = *open[i];
      char buf[8192];
      const ssize_t n = read(s.fd, buf, sizeof(buf));
      if (n > 0) {
        s.buf.append(buf, static_cast<size_t>(n));
        size_t nl;
        while ((nl = s.buf.find('\n')) != std::string::npos) {
          const std::string line = s.buf.substr(0, nl);
          s.buf.erase(0, nl + 1);
          handleLine(s, line);
        }
      } else if (n == 0 || errno != EAGAIN) {
        gone(s);
      }
    }
  }

  void handleLine(SlotState& s, const std::string& line) {
    if (line.rfind("S ", 0) == 0) {
      int slot = 0, gen = 0, ch = -1;
      long seq = 0;
      long long t0 = 0;
      char kind[16] = {0};
      if (sscanf(line.c_str(), "S %d %d %ld %15s %lld %d", &slot, &gen, &seq, kind, &t0, &ch) >= 5) {
        Kind k;
        if (parseKind(kind, &k)) {
          judge_->callStarted(slot, gen, seq, k, s.slot.inst, ch, t0);
          s.callKind = k;
        }
      }
      s.inCall = true;
      return;
    }
    if (line.rfind("E ", 0) == 0) {
      CallRecord r;
      if (decodeRecord(line, &r)) {
        judge_->callEnded(r);
      } else {
        fprintf(stdout, "chaos: unreadable record from client %d: %s\n", s.index, line.c_str());
      }
      s.inCall = false;
    }
  }

  // The client's pipe ended: it left or was killed.
  void gone(SlotState& s) {
    close(s.fd);
    s.fd = -1;
    int status = 0;
    for (int i = 0; i < 200 && s.proc.running(&status); ++i) usleep(10000);
    if (s.proc.running()) s.proc.stop(100);
    const int64_t now = monoNanos();
    if (!s.killed) judge_->clientGone(s.index, s.gen, s.slot.inst, now, s.inCall);
    s.respawnAt = now + (50 + static_cast<int64_t>(rng_() % 250)) * kMs;
  }

  void killClient(SlotState& s, int64_t now) {
    s.proc.kill(SIGKILL);
    s.killed = true;
    judge_->clientGone(s.index, s.gen, s.slot.inst, now, s.inCall);
    logf(now, "kill client %d.%d pid %d (%s %s)%s%s", s.index, s.gen, static_cast<int>(s.proc.pid()),
         instName(s.slot.inst), ifaceName(s.slot.iface), s.inCall ? " in the middle of a call: " : "",
         s.inCall ? kindName(s.callKind) : "");
    s.killBy = 0;
  }

  // ---------------------------------------------------------------- faults
  void logf(int64_t t, const char* fmt, ...) {
    char text[256];
    va_list ap;
    va_start(ap, fmt);
    vsnprintf(text, sizeof(text), fmt, ap);
    va_end(ap);
    std::lock_guard<std::mutex> l(logMu_);
    const double s = static_cast<double>(t - origin_) / 1e9;
    if (log_) {
      fprintf(log_, "[%+10.3f s] %s\n", s, text);
      fflush(log_);
    }
    if (o_.verbose) {
      printf("chaos: [%+10.3f s] %s\n", s, text);
      fflush(stdout);
    }
  }

  void setLib(const char* name, const std::string& value) {
    if (value.empty()) {
      props_->clear(name);
    } else {
      props_->set(name, value);
    }
    props_->write();
  }

  void applyFault(const Fault& f, bool on) {
    std::string err;
    char hex[8];
    switch (f.kind) {
      case FaultKind::ModemSilence: relay_.setSilent(on); break;
      case FaultKind::ModemSlow: relay_.setSlowMs(on ? f.a : 0); break;
      case FaultKind::ModemPieces: relay_.setPieceBytes(on ? f.a : 0); break;
      case FaultKind::ModemUnsol: relay_.setUnsolLines(on ? f.a : 0); break;
      case FaultKind::ModemBare: relay_.setBare(on); break;
      case FaultKind::ModemPortLost:
        if (on) {
          relay_.losePort();
        } else if (!relay_.restorePort(&err)) {
          logf(monoNanos(), "relay: %s", err.c_str());
        }
        break;
      case FaultKind::ModemRestart:
        if (on) {
          relay_.losePort();
          modem_.stop();
          if (!startModem() || !relay_.reconnectModem(root_ + "/modem/dev/appvcom18", &err)) {
            logf(monoNanos(), "modem restart failed: %s %s", setupError_.c_str(), err.c_str());
          }
        } else if (!relay_.restorePort(&err)) {
          logf(monoNanos(), "relay: %s", err.c_str());
        }
        break;
      case FaultKind::LibHang: setLib("vendor.ese_sim.hang_exchange", on ? "1" : ""); break;
      case FaultKind::LibFail:
        snprintf(hex, sizeof(hex), "%04X", static_cast<unsigned>(f.a));
        setLib("vendor.ese_sim.fail_exchange", !on ? "" : f.a == 0 ? "1" : hex);
        break;
      case FaultKind::LibSlow:
        snprintf(hex, sizeof(hex), "%02X", static_cast<unsigned>(f.a));
        props_->set("vendor.ese_sim.slow_p1", hex);
        setLib("vendor.ese_sim.slow_ms", on ? std::to_string(f.b) : "");
        if (!on) setLib("vendor.ese_sim.slow_p1", "");
        break;
      case FaultKind::CardOut:
      case FaultKind::OtherReset:
        if (pcsc_ && !pcsc_->apply(f.kind, on, &err)) logf(monoNanos(), "PC/SC: %s", err.c_str());
        break;
    }
  }

  void faultThread() {
    struct Ev {
      int64_t atMs;
      bool on;
      size_t i;
    };
    std::vector<Ev> evs;
    for (size_t i = 0; i < plan_.faults.size(); ++i) {
      evs.push_back({plan_.faults[i].startMs, true, i});
      evs.push_back({plan_.faults[i].endMs, false, i});
    }
    std::stable_sort(evs.begin(), evs.end(), [](const Ev& a, const Ev& b) {
      return a.atMs != b.atMs ? a.atMs < b.atMs : (!a.on && b.on);
    });
    std::vector<bool> active(plan_.faults.size(), false);
    for (const Ev& e : evs) {
      {
        std::unique_lock<std::mutex> l(faultMu_);
        faultCv_.wait_until(l, std::chrono::steady_clock::time_point(std::chrono::nanoseconds(origin_ + e.atMs * kMs)),
                            [&] { return faultStop_; });
        if (faultStop_) break;
      }
      const Fault& f = plan_.faults[e.i];
      if (e.on) {
        const int64_t t = monoNanos();
        judge_->faultStarted(f, t);
        applyFault(f, true);
        active[e.i] = true;
        logf(t, "start %s", describeFault(f).c_str());
      } else {
        applyFault(f, false);
        const int64_t t = monoNanos();
        judge_->faultEnded(f, t);
        active[e.i] = false;
        logf(t, "end   %s", describeFault(f).c_str());
      }
    }
    // Stopped early: heal what is still on.
    for (size_t i = 0; i < active.size(); ++i) {
      if (!active[i]) continue;
      applyFault(plan_.faults[i], false);
      const int64_t t = monoNanos();
      judge_->faultEnded(plan_.faults[i], t);
      logf(t, "end   %s (stopped)", describeFault(plan_.faults[i]).c_str());
    }
    // A program is sent its parent-death signal when the thread that started
    // it ends, not the process: the modem-sim or card-vpcd this thread
    // restarted would be killed with it. So it stays until the run is torn
    // down, after those programs were stopped.
    std::unique_lock<std::mutex> l(faultMu_);
    faultsHealed_ = true;
    faultCv_.notify_all();
    faultCv_.wait(l, [&] { return faultExit_; });
  }

  void endFaultThread() {
    if (!faults_.joinable()) return;
    {
      std::lock_guard<std::mutex> l(faultMu_);
      faultStop_ = faultExit_ = true;
    }
    faultCv_.notify_all();
    faults_.join();
  }

  // ---------------------------------------------------------------- phases
  void chaosPhase() {
    for (size_t i = 0; i < plan_.slots.size(); ++i) {
      auto s = std::make_unique<SlotState>();
      s->slot = plan_.slots[i];
      s->index = static_cast<int>(i);
      slots_.push_back(std::move(s));
    }
    rng_.seed(plan_.clientSeed(-1, 0));
    faults_ = std::thread([this] { faultThread(); });
    const int64_t end = origin_ + int64_t(o_.seconds) * 1000 * kMs;
    size_t nextKill = 0;
    int64_t nextNote = origin_ + 30000 * kMs;
    int64_t nextLossCheck = origin_;
    while (!g_stop) {
      const int64_t now = monoNanos();
      if (now >= end) break;
      for (auto& s : slots_) {
        if (s->fd < 0 && now >= s->respawnAt) spawn(*s, now);
        if (s->fd >= 0 && s->killBy != 0 && !s->killed && (s->inCall || now >= s->killBy)) killClient(*s, now);
      }
      while (nextKill < plan_.kills.size() && origin_ + plan_.kills[nextKill].atMs * kMs <= now) {
        SlotState& s = *slots_[static_cast<size_t>(plan_.kills[nextKill++].slot)];
        // Killed at its next call's start (mid-call), or within 1.5 s anyway.
        if (s.fd >= 0 && !s.killed) s.killBy = now + 1500 * kMs;
      }
      pump(5);
      judge_->judgeUpTo(now - kJudgeLagNs);
      if (now >= nextLossCheck) {
        portLosses_.check(*judge_, root_ + "/modem-channels", now, [this] { pump(0); });
        nextLossCheck = now + 500 * kMs;
      }
      int status = 0;
      if (!daemon_.running(&status)) {
        daemonDied_ = true;
        printf("chaos: VIOLATION seed %llu at %s: the daemon exited (status %d); faults active:%s\n",
               static_cast<unsigned long long>(o_.seed), judge_->at(now).c_str(), status, activeFaults(now).c_str());
        break;
      }
      if (now >= nextNote) {
        printf("chaos: %s: %ld calls judged, %ld wrong, %ld over bound\n", judge_->at(now).c_str(), judge_->calls(),
               judge_->wrong(), judge_->over());
        fflush(stdout);
        nextNote += (o_.seconds > 300 ? 300000 : 30000) * kMs;
      }
    }
    {
      std::unique_lock<std::mutex> l(faultMu_);
      faultStop_ = true;
      faultCv_.notify_all();
      faultCv_.wait(l, [&] { return faultsHealed_; });
    }
    // Every client goes; their deaths are the daemon's to handle.
    const int64_t now = monoNanos();
    for (auto& s : slots_) {
      if (s->fd >= 0 && !s->killed) killClient(*s, now);
    }
    const int64_t drain = monoNanos() + 3000 * kMs;
    while (monoNanos() < drain) pump(20);
    judge_->judgeUpTo(INT64_MAX);
  }

  std::string activeFaults(int64_t now) const {
    std::string s;
    for (const FaultSpan& f : judge_->faults()) {
      if (f.start <= now && (f.end == INT64_MAX || f.end >= now)) s += " " + describeFault(f.fault);
    }
    return s.empty() ? " none" : s;
  }

  int finish(bool ran) {
    Summary sum;
    sum.seed = o_.seed;
    sum.seconds = o_.seconds;
    sum.start = start_;
    long open = 0;
    if (g_stop) ran = false;  // interrupted: stop everything, check nothing more
    if (ran && !daemonDied_) {
      // Devices healed, clients gone: nudge each instance once (a call on a
      // device that answers runs the closes queued for it), then wait for the
      // simulators' reports to show no channel open.
      probes_.clear();
      int k = 0;
      for (Inst inst : {Inst::Ese, Inst::Sim}) {
        auto s = std::make_unique<SlotState>();
        s->slot = {inst, Iface::Hidl};
        s->index = 200 + k++;
        s->probe = true;
        s->nudge = true;
        probes_.push_back(std::move(s));
      }
      for (auto& p : probes_) {
        spawn(*p, monoNanos());
        const int64_t deadline = monoNanos() + 30000 * kMs;
        while (p->fd >= 0 && monoNanos() < deadline) pump(50);
      }
      const int64_t deadline = monoNanos() + 20000 * kMs;
      do {
        open = channelsOpen();
        if (open == 0) break;
        usleep(100000);
      } while (monoNanos() < deadline);
      if (open > 0) {
        const std::string ese = o_.pcsc ? std::to_string(pcsc_ ? pcsc_->openChannels() : -1) + " on the card"
                                         : "\"" + firstLine(eseReport()) + "\"";
        printf("chaos: VIOLATION seed %llu: %ld channel(s) left open after every client went (eSE: %s, modem: "
               "\"%s\")\n",
               static_cast<unsigned long long>(o_.seed), open, ese.c_str(), firstLine(root_ + "/modem-channels").c_str());
      }
      usleep(500000);
      sum.end = healthOf(daemon_.pid());
      judge_->judgeUpTo(INT64_MAX);
      judgeGiveUps(*judge_, root_ + "/daemon.log", origin_, originMsOfDay_);
    }
    sum.leftOpen = open + portLosses_.kept();
    sum.faults = static_cast<long>(judge_->faults().size());
    bool healthy = ran && !daemonDied_;
    if (healthy) {
      const bool grew = sum.end.rssKb - sum.start.rssKb > kRssAllowanceKb || sum.end.fds - sum.start.fds > kFdAllowance ||
                        sum.end.threads - sum.start.threads > kThreadAllowance || sum.end.rssKb < 0;
      if (grew) {
        printf("chaos: VIOLATION seed %llu: the daemon's figures grew beyond the allowance (RSS +%ld kB, fds +%ld, "
               "threads +%ld)\n",
               static_cast<unsigned long long>(o_.seed), kRssAllowanceKb, kFdAllowance, kThreadAllowance);
        std::string added;
        for (long tid : sum.end.tids) {
          if (std::find(sum.start.tids.begin(), sum.start.tids.end(), tid) == sum.start.tids.end()) {
            added += " " + std::to_string(tid);
          }
        }
        if (!added.empty()) printf("chaos: threads not there at the start (daemon.log's thread ids):%s\n", added.c_str());
        healthy = false;
      }
    }
    if (relay_.dropped() > 0) {
      printf("chaos: SOAK FAULT: %ld command(s) reached the relay with no modem-sim behind it\n", relay_.dropped());
      healthy = false;
    }
    if (g_stop) printf("chaos: interrupted\n");
    portLosses_.report(stdout);
    printReport(stdout, *judge_, sum);
    // A fault window without a right answer is noted only (see the judge);
    // service that does not come back after an outage fails the run.
    const bool served = judge_->service().late == 0;
    const bool pass = healthy && served && !g_stop && judge_->wrong() == 0 && judge_->over() == 0 &&
                      sum.leftOpen == 0;
    if (!pass && !g_stop) keep_ = true;
    if (keep_ || o_.keep) printf("chaos: device root kept: %s (chaos.log, daemon.log)\n", root_.c_str());
    return pass ? 0 : 1;
  }

  std::string eseReport() const { return root_ + "/data/vendor/ese_sim/open_channels"; }

  static std::string firstLine(const std::string& path) {
    FILE* f = fopen(path.c_str(), "r");
    if (!f) return "(none)";
    char b[256] = {0};
    if (!fgets(b, sizeof(b), f)) b[0] = 0;
    fclose(f);
    std::string s = b;
    while (!s.empty() && s.back() == '\n') s.pop_back();
    return s;
  }

  long channelsOpen() const {
    long n = 0;
    const int modem = openChannelsIn(root_ + "/modem-channels");
    if (modem > 0) n += modem;
    const int ese = o_.pcsc ? (pcsc_ ? pcsc_->openChannels() : 0) : openChannelsIn(eseReport());
    if (ese > 0) n += ese;
    return n;
  }

  void tearDown() {
    for (SlotState* s : allSlots()) {
      if (s->fd >= 0) close(s->fd);
      s->proc.stop(200);
    }
    daemon_.stop();
    relay_.stop();
    modem_.stop();
    pcsc_.reset();
    endFaultThread();
    if (log_) fclose(log_);
    log_ = nullptr;
    judge_.reset();
    if (calls_) fclose(calls_);
    calls_ = nullptr;
    std::error_code ec;
    if (!root_.empty() && !keep_ && !o_.keep) std::filesystem::remove_all(root_, ec);
  }

  RunOptions o_;
  Plan plan_;
  BoundConfig bounds_;
  std::string root_;
  std::string setupError_;
  std::unique_ptr<Properties> props_;
  FILE* log_ = nullptr;
  FILE* calls_ = nullptr;  // every judged call (calls.log)
  std::mutex logMu_;
  Proc modem_;
  Proc daemon_;
  ModemRelay relay_;
  std::unique_ptr<PcscEnv> pcsc_;
  std::unique_ptr<Judge> judge_;
  std::vector<std::unique_ptr<SlotState>> slots_;
  std::vector<std::unique_ptr<SlotState>> probes_;
  std::mt19937_64 rng_;
  int64_t origin_ = 0;
  PortLossCheck portLosses_{o_.seed};
  int64_t originMsOfDay_ = 0;  // the chaos phase's start by the logs' wall clock
  Health start_;
  bool daemonDied_ = false;
  bool keep_ = false;
  std::mutex faultMu_;
  std::condition_variable faultCv_;
  bool faultStop_ = false;
  bool faultsHealed_ = false;
  bool faultExit_ = false;
  std::thread faults_;
};

}  // namespace

void requestStop() { g_stop = true; }

int runChaos(const RunOptions& o) {
  RunOptions opts = o;
  opts.hangMs = o.hangMs;
  Run run(opts);
  return run.go();
}

}  // namespace chaos

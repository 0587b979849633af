// modem-sim: a modem's AT port on a pty, answering for a virtual UICC.
#include <errno.h>
#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <termios.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "at_responder.h"

namespace {

const char kUsage[] =
    "usage: modem-sim --root DIR [options]\n"
    "\n"
    "Opens a pty pair (in raw mode unless --tty-defaults), links DIR/dev/appvcom18\n"
    "(modem 0) or DIR/dev/appvcom34 (modem 1) to its slave, prints one ready line\n"
    "and answers AT commands for a virtual UICC until SIGTERM or SIGINT, then\n"
    "removes the link.\n"
    "\n"
    "Commands: AT, AT^CARDTYPE?, AT^CARDATR, AT+CPIN?, AT+CCHO=\"AID\",\n"
    "AT+CCHP=\"AID\",P2, AT+CGLA=SESSION,LEN,\"HEX\", AT+CSIM=LEN,\"HEX\",\n"
    "AT+CCHC=SESSION. Anything else, malformed parameters or a wrong length\n"
    "field: ERROR. Open errors: +CME ERROR: 716 (no such applet), 717 (no channel\n"
    "free), 760 (card error); with the card absent AT+CPIN? and every card command\n"
    "give +CME ERROR: 10.\n"
    "Session id of channel c: 256 + c (see --session-base).\n"
    "\n"
    "options:\n"
    "  --root DIR          device root (default $SE_DEVICE_ROOT, else /)\n"
    "  --modem 0|1         which modem port to provide (default 0); run two\n"
    "                      processes for two modems\n"
    "  --card-absent       no card: ^CARDTYPE: 0,0,0, card commands fail\n"
    "  --atr HEX           the card's ATR (default 3B868001532D53494D + TCK)\n"
    "  --channels N        channels of the card, basic included (1-20, default 20)\n"
    "  --session-base N    session id = N + channel (default 256)\n"
    "  --bare-open         answer AT+CCHO and AT+CCHP with the session id alone\n"
    "                      on its line (the plain 3GPP TS 27.007 form), no\n"
    "                      +CCHO:/+CCHP: prefix\n"
    "  --short-length      malformed +CGLA:/+CSIM: answers: the length field\n"
    "                      counts two characters fewer than the text holds\n"
    "  --delay MS          wait MS milliseconds before each answer\n"
    "  --split N           write answers in pieces of N bytes with short pauses\n"
    "  --unsol EVERY       before the final line of every EVERY-th answer, send an\n"
    "                      unsolicited line (+CREG: 1, ^RSSI: 20, +CGREG: 1,\n"
    "                      ^MODE: 5,4, RING, +CEREG: 1, +CMTI: \"SM\",3, ^BOOT:... in\n"
    "                      turn)\n"
    "  --sms-pairs         also send a +CMT: line and its PDU line there (every\n"
    "                      answer unless --unsol gives EVERY)\n"
    "  --silent-on PREFIX  never answer a command starting with PREFIX (any case)\n"
    "  --close-after N     close the port (and remove the link) after N commands\n"
    "  --channels-file F   keep in F the card's open logical channels: one line,\n"
    "                      the numbers in ascending order separated by blanks\n"
    "                      (empty: none; the basic channel is not listed),\n"
    "                      rewritten (write and rename) whenever they change\n"
    "  --log FILE          log every line received (\"< ...\") and sent (\"> ...\")\n"
    "                      and events (\"# ...\") to FILE (default stderr)\n"
    "  --help              this text\n"
    "\n"
    "habits of real modems (a USB modem's AT port, as plugged in):\n"
    "  --tty-defaults      leave the pty in the kernel's default terminal settings\n"
    "                      (echo, canonical lines, CR/NL mapping) for the client\n"
    "                      to set, as a /dev/ttyUSB* or /dev/ttyACM* port is\n"
    "  --echo              echo each command line before its answer (ATE1), the\n"
    "                      answer lines framed CR LF ... CR LF\n"
    "  --errors FORM       error results: numeric (+CME ERROR: 10, AT+CMEE=1; the\n"
    "                      default), verbose (+CME ERROR: SIM not inserted,\n"
    "                      AT+CMEE=2; vendor codes read \"unknown\") or bare (ERROR,\n"
    "                      AT+CMEE=0)\n"
    "  --no-vendor-queries AT^CARDTYPE? and AT^CARDATR are unknown commands (ERROR);\n"
    "                      presence only by AT+CPIN?\n"
    "  --profile usb       all four: --tty-defaults --echo --errors verbose\n"
    "                      --no-vendor-queries\n";

volatile sig_atomic_t g_stop = 0;
int g_wakePipe[2] = {-1, -1};

void onSignal(int) {
  g_stop = 1;
  const char b = 1;
  ssize_t ignored = write(g_wakePipe[1], &b, 1);
  (void)ignored;
}

struct Options {
  std::string root;
  int modem = 0;
  modem_sim::ResponderOptions responder;
  long delayMs = 0;
  long split = 0;
  long unsolEvery = 0;
  bool smsPairs = false;
  std::string silentOn;
  long closeAfter = 0;
  std::string logPath;
  bool ttyDefaults = false;
  bool echo = false;
  std::string channelsFile;
};

bool parseLong(const char* s, long min, long max, long& out) {
  char* end = nullptr;
  errno = 0;
  long v = strtol(s, &end, 0);
  if (errno != 0 || end == s || *end != '\0' || v < min || v > max) return false;
  out = v;
  return true;
}

bool parseErrors(const char* s, modem_sim::ResponderOptions::Errors& out) {
  using Errors = modem_sim::ResponderOptions::Errors;
  if (strcmp(s, "numeric") == 0) {
    out = Errors::kNumeric;
  } else if (strcmp(s, "verbose") == 0) {
    out = Errors::kVerbose;
  } else if (strcmp(s, "bare") == 0) {
    out = Errors::kBare;
  } else {
    return false;
  }
  return true;
}

FILE* g_log = stderr;

void logLine(const char* mark, const std::string& text) {
  fprintf(g_log, "%s %s\n", mark, text.c_str());
  fflush(g_log);
}

void sleepMs(long ms) {
  struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
  while (!g_stop && nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
}

bool writeAll(int fd, const char* p, size_t n) {
  while (n > 0) {
    ssize_t w = write(fd, p, n);
    if (w < 0) {
      if (errno == EINTR && !g_stop) continue;
      return false;
    }
    p += w;
    n -= static_cast<size_t>(w);
  }
  return true;
}

// What common modems report on their own, in turn: registration, signal,
// mode and boot reports, a call and a stored SMS.
const char* const kUnsolicited[] = {"+CREG: 1",    "^RSSI: 20",   "+CGREG: 1",       "^MODE: 5,4",
                                    "RING",        "+CEREG: 1",   "+CMTI: \"SM\",3",
                                    "^BOOT:20975085,0,0,0,75"};
constexpr unsigned kUnsolicitedCount = sizeof(kUnsolicited) / sizeof(kUnsolicited[0]);

class Modem {
 public:
  explicit Modem(const Options& o) : o_(o), responder_(o.responder) {}

  bool open() {
    master_ = posix_openpt(O_RDWR | O_NOCTTY);
    if (master_ < 0 || grantpt(master_) != 0 || unlockpt(master_) != 0) return fail("posix_openpt");
    char name[128];
    if (ptsname_r(master_, name, sizeof(name)) != 0) return fail("ptsname_r");
    ptsName_ = name;
    // Our own slave descriptor keeps the pty alive (and raw) while the
    // daemon closes and reopens the port.
    slave_ = ::open(name, O_RDWR | O_NOCTTY);
    if (slave_ < 0) return fail("open slave");
    if (!o_.ttyDefaults) {
      struct termios t;
      if (tcgetattr(slave_, &t) != 0) return fail("tcgetattr");
      cfmakeraw(&t);
      if (tcsetattr(slave_, TCSANOW, &t) != 0) return fail("tcsetattr");
    }

    const std::string dev = o_.root + "/dev";
    if (mkdir(dev.c_str(), 0755) != 0 && errno != EEXIST) return fail("mkdir " + dev);
    linkPath_ = dev + (o_.modem == 0 ? "/appvcom18" : "/appvcom34");
    struct stat st;
    if (lstat(linkPath_.c_str(), &st) == 0) {
      if (!S_ISLNK(st.st_mode)) return fail(linkPath_ + " exists and is not a link");
      unlink(linkPath_.c_str());
    }
    if (symlink(name, linkPath_.c_str()) != 0) return fail("symlink " + linkPath_);
    return true;
  }

  void run() {
    char buf[4096];
    while (!g_stop) {
      struct pollfd fds[2] = {{g_wakePipe[0], POLLIN, 0}, {master_, POLLIN, 0}};
      const nfds_t n = master_ >= 0 ? 2 : 1;
      if (poll(fds, n, -1) < 0) {
        if (errno == EINTR) continue;
        perror("modem-sim: poll");
        return;
      }
      if (g_stop) return;
      if (n < 2 || !(fds[1].revents & (POLLIN | POLLHUP | POLLERR))) continue;
      ssize_t r = read(master_, buf, sizeof(buf));
      if (r < 0 && (errno == EINTR || errno == EAGAIN)) continue;
      if (r <= 0) {
        // No slave left open (cannot happen while we hold ours): wait a bit.
        sleepMs(20);
        continue;
      }
      for (ssize_t i = 0; i < r && master_ >= 0 && !g_stop; ++i) feed(buf[i]);
    }
  }

  void shutdown() { closePort(); }

  // Rewrites --channels-file when the card's open channels changed (and once
  // at start), so a watcher never reads a half-written list.
  void reportChannels() {
    if (o_.channelsFile.empty()) return;
    std::string now;
    for (int c = 1; c < se_card::kMaxChannels; ++c) {
      if (!responder_.card().isChannelOpen(c)) continue;
      if (!now.empty()) now += ' ';
      now += std::to_string(c);
    }
    if (reported_ && now == lastChannels_) return;
    const std::string tmp = o_.channelsFile + ".tmp";
    const std::string text = now + "\n";
    const int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    const bool written = fd >= 0 && writeAll(fd, text.data(), text.size());
    if (fd >= 0) close(fd);
    if (!written || rename(tmp.c_str(), o_.channelsFile.c_str()) != 0) {
      logLine("#", "cannot write " + o_.channelsFile + ": " + strerror(errno));
      return;
    }
    reported_ = true;
    lastChannels_ = now;
  }

 private:
  static constexpr size_t kMaxLine = 4096;

  bool fail(const std::string& what) {
    fprintf(stderr, "modem-sim: %s: %s\n", what.c_str(), strerror(errno));
    return false;
  }

  // Lines end at CR or LF; empty lines (the LF of a CR LF) are skipped. An
  // over-long line is dropped whole and answered with ERROR at its end.
  void feed(char c) {
    if (c == '\r' || c == '\n') {
      if (overflow_) {
        logLine("#", "over-long line dropped");
        overflow_ = false;
        answer({"ERROR"});
      } else if (!partial_.empty()) {
        std::string line;
        line.swap(partial_);
        command(line);
      }
      return;
    }
    if (overflow_) return;
    if (partial_.size() >= kMaxLine) {
      overflow_ = true;
      partial_.clear();
      return;
    }
    partial_.push_back(c);
  }

  void command(const std::string& line) {
    logLine("<", line);
    ++commands_;
    if (o_.echo) {
      // The characters as they came, with the CR that ended them.
      logLine(">", line + " (echo)");
      if (!writeAll(master_, (line + "\r").data(), line.size() + 1)) {
        logLine("#", std::string("write failed: ") + strerror(errno));
      }
    }
    if (!o_.silentOn.empty() && strncasecmp(line.c_str(), o_.silentOn.c_str(), o_.silentOn.size()) == 0) {
      logLine("#", "silent on this command");
    } else {
      answer(responder_.handle(line));
    }
    reportChannels();
    if (o_.closeAfter > 0 && commands_ >= o_.closeAfter) {
      logLine("#", "closing the port after " + std::to_string(commands_) + " commands");
      awaitDrained();
      closePort();
    }
  }

  void answer(std::vector<std::string> lines) {
    ++answers_;
    const long every = o_.unsolEvery > 0 ? o_.unsolEvery : (o_.smsPairs ? 1 : 0);
    if (every > 0 && answers_ % every == 0) {
      std::vector<std::string> extra;
      if (o_.unsolEvery > 0) extra.push_back(kUnsolicited[unsolTurn_++ % kUnsolicitedCount]);
      if (o_.smsPairs) {
        extra.push_back("+CMT: ,24");
        extra.push_back("0011000B916407281553F80000AA0BE8329BFD4697D9EC377D");
      }
      lines.insert(lines.end() - 1, extra.begin(), extra.end());
    }
    if (o_.delayMs > 0) sleepMs(o_.delayMs);
    std::string out;
    for (const std::string& l : lines) {
      logLine(">", l);
      // Verbose result framing (ATV1) as a modem with echo on sends it.
      if (o_.echo) out += "\r\n";
      out += l;
      out += "\r\n";
    }
    const size_t piece = o_.split > 0 ? static_cast<size_t>(o_.split) : out.size();
    for (size_t off = 0; off < out.size() && !g_stop; off += piece) {
      if (off > 0) sleepMs(2);
      if (!writeAll(master_, out.data() + off, std::min(piece, out.size() - off))) {
        logLine("#", std::string("write failed: ") + strerror(errno));
        return;
      }
    }
  }

  // Closing the master drops what the client has not read yet. The pty moves
  // written bytes to the slave side asynchronously, so an empty queue right
  // after the write proves nothing: allow 100 ms, then wait (up to a second)
  // until the client has taken everything.
  void awaitDrained() {
    for (int i = 0; i < 200 && !g_stop && slave_ >= 0; ++i) {
      int pending = 0;
      if (ioctl(slave_, FIONREAD, &pending) != 0) return;
      if (pending == 0 && i >= 20) return;
      sleepMs(5);
    }
  }

  void closePort() {
    if (!linkPath_.empty()) {
      // Remove the link only while it is still ours.
      char target[256];
      ssize_t n = readlink(linkPath_.c_str(), target, sizeof(target) - 1);
      if (n >= 0) {
        target[n] = '\0';
        if (ptsName_ == target) unlink(linkPath_.c_str());
      }
      linkPath_.clear();
    }
    if (slave_ >= 0) close(slave_);
    if (master_ >= 0) close(master_);
    slave_ = master_ = -1;
  }

  Options o_;
  modem_sim::AtResponder responder_;
  int master_ = -1;
  int slave_ = -1;
  std::string ptsName_;
  std::string linkPath_;
  std::string partial_;
  bool overflow_ = false;
  long commands_ = 0;
  long answers_ = 0;
  unsigned unsolTurn_ = 0;
  bool reported_ = false;
  std::string lastChannels_;

 public:
  const std::string& ptsName() const { return ptsName_; }
};

int usageError(const char* msg) {
  fprintf(stderr, "modem-sim: %s\n\n%s", msg, kUsage);
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  enum {
    kRoot = 1000, kModem, kCardAbsent, kAtr, kChannels, kSessionBase, kDelay, kSplit, kUnsol, kSms, kSilent,
    kCloseAfter, kLog, kHelp, kBareOpen, kShortLength, kTtyDefaults, kEcho, kErrors, kNoVendor, kProfile,
    kChannelsFile
  };
  static const struct option longOpts[] = {
      {"root", required_argument, nullptr, kRoot},
      {"modem", required_argument, nullptr, kModem},
      {"card-absent", no_argument, nullptr, kCardAbsent},
      {"atr", required_argument, nullptr, kAtr},
      {"channels", required_argument, nullptr, kChannels},
      {"session-base", required_argument, nullptr, kSessionBase},
      {"bare-open", no_argument, nullptr, kBareOpen},
      {"short-length", no_argument, nullptr, kShortLength},
      {"delay", required_argument, nullptr, kDelay},
      {"split", required_argument, nullptr, kSplit},
      {"unsol", required_argument, nullptr, kUnsol},
      {"sms-pairs", no_argument, nullptr, kSms},
      {"silent-on", required_argument, nullptr, kSilent},
      {"close-after", required_argument, nullptr, kCloseAfter},
      {"log", required_argument, nullptr, kLog},
      {"tty-defaults", no_argument, nullptr, kTtyDefaults},
      {"echo", no_argument, nullptr, kEcho},
      {"errors", required_argument, nullptr, kErrors},
      {"no-vendor-queries", no_argument, nullptr, kNoVendor},
      {"profile", required_argument, nullptr, kProfile},
      {"channels-file", required_argument, nullptr, kChannelsFile},
      {"help", no_argument, nullptr, kHelp},
      {nullptr, 0, nullptr, 0},
  };
  Options o;
  const char* envRoot = getenv("SE_DEVICE_ROOT");
  o.root = envRoot ? envRoot : "";
  int opt;
  long v = 0;
  while ((opt = getopt_long(argc, argv, "", longOpts, nullptr)) != -1) {
    switch (opt) {
      case kRoot: o.root = optarg; break;
      case kModem:
        if (!parseLong(optarg, 0, 1, v)) return usageError("--modem takes 0 or 1");
        o.modem = static_cast<int>(v);
        break;
      case kCardAbsent: o.responder.cardAbsent = true; break;
      case kAtr:
        if (!modem_sim::decodeHex(optarg, o.responder.atr) || o.responder.atr.empty() ||
            o.responder.atr.size() > 1024)
          return usageError("--atr takes 1 to 1024 bytes in hex");
        break;
      case kChannels:
        if (!parseLong(optarg, 1, se_card::kMaxChannels, v)) return usageError("--channels takes 1 to 20");
        o.responder.channels = static_cast<int>(v);
        break;
      case kSessionBase:
        if (!parseLong(optarg, 0, 1000000, v)) return usageError("--session-base takes 0 to 1000000");
        o.responder.sessionBase = static_cast<int>(v);
        break;
      case kBareOpen: o.responder.bareOpen = true; break;
      case kShortLength: o.responder.shortLength = true; break;
      case kDelay:
        if (!parseLong(optarg, 0, 3600000, o.delayMs)) return usageError("--delay takes milliseconds");
        break;
      case kSplit:
        if (!parseLong(optarg, 1, 1 << 20, o.split)) return usageError("--split takes a positive size");
        break;
      case kUnsol:
        if (!parseLong(optarg, 1, 1 << 30, o.unsolEvery)) return usageError("--unsol takes a positive count");
        break;
      case kSms: o.smsPairs = true; break;
      case kSilent:
        if (*optarg == '\0') return usageError("--silent-on takes a prefix");
        o.silentOn = optarg;
        break;
      case kCloseAfter:
        if (!parseLong(optarg, 1, 1L << 40, o.closeAfter)) return usageError("--close-after takes a positive count");
        break;
      case kLog: o.logPath = optarg; break;
      case kTtyDefaults: o.ttyDefaults = true; break;
      case kEcho: o.echo = true; break;
      case kErrors:
        if (!parseErrors(optarg, o.responder.errors)) return usageError("--errors takes numeric, verbose or bare");
        break;
      case kNoVendor: o.responder.vendorQueries = false; break;
      case kProfile:
        if (strcmp(optarg, "usb") != 0) return usageError("--profile takes usb");
        o.ttyDefaults = true;
        o.echo = true;
        o.responder.errors = modem_sim::ResponderOptions::Errors::kVerbose;
        o.responder.vendorQueries = false;
        break;
      case kChannelsFile: o.channelsFile = optarg; break;
      case kHelp: fputs(kUsage, stdout); return 0;
      default: return usageError("unknown option");
    }
  }
  if (optind < argc) return usageError("unexpected argument");
  while (!o.root.empty() && o.root.back() == '/') o.root.pop_back();

  if (!o.logPath.empty()) {
    g_log = fopen(o.logPath.c_str(), "a");
    if (g_log == nullptr) {
      fprintf(stderr, "modem-sim: cannot open log %s: %s\n", o.logPath.c_str(), strerror(errno));
      return 1;
    }
  }
  if (pipe2(g_wakePipe, O_CLOEXEC | O_NONBLOCK) != 0) {
    perror("modem-sim: pipe2");
    return 1;
  }
  struct sigaction sa;
  memset(&sa, 0, sizeof(sa));
  sa.sa_handler = onSignal;
  sigemptyset(&sa.sa_mask);
  sigaction(SIGTERM, &sa, nullptr);
  sigaction(SIGINT, &sa, nullptr);
  signal(SIGPIPE, SIG_IGN);
  signal(SIGHUP, SIG_IGN);

  Modem modem(o);
  if (!modem.open()) {
    modem.shutdown();
    return 1;
  }
  modem.reportChannels();
  printf("modem-sim: modem %d ready on %s\n", o.modem, modem.ptsName().c_str());
  fflush(stdout);
  logLine("#", "modem " + std::to_string(o.modem) + " ready on " + modem.ptsName());
  modem.run();
  modem.shutdown();
  logLine("#", "stopped");
  if (g_log != stderr) fclose(g_log);
  return 0;
}

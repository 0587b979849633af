// se-chaos: the chaos soak. Many clients on both instances over HIDL and
// AIDL, faults injected at random times into the modem and the eSE library,
// every answer and every call's time checked, channels and the daemon's
// figures checked at the end. scripts/chaos.sh builds and runs it.
#include <getopt.h>
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <string>
#include <vector>

#include "chaos_client.h"
#include "chaos_pcsc.h"
#include "chaos_run.h"

namespace {

const char kUsage[] =
    "usage: se-chaos [--seconds N] [--seed S] [--pcsc] [--hang-ms MS] [--bin DIR]\n"
    "                [--lib DIR] [--keep] [--verbose] [--show N]\n"
    "\n"
    "Starts modem-sim behind a fault-injecting relay, the daemon with the simulated\n"
    "eSE library (or, with --pcsc, the PC/SC library, pcscd and card-vpcd) in a fresh\n"
    "device root, and eight clients (each instance, HIDL and AIDL, two of each) that\n"
    "run random valid call sequences, exit or get killed mid-call, and come back.\n"
    "Faults start and end at random (the seed fixes when): modem silence, slow\n"
    "answers, answers in pieces, unsolicited lines, the port lost, the modem\n"
    "restarted, bare open answers; a hung, failing or slow eSE library; with\n"
    "--pcsc the card pulled out and another application resetting it.\n"
    "Every answer is checked against the virtual card, every call against the\n"
    "latency bound of the faults around it; at the end no channel may be left\n"
    "open and the daemon's memory, descriptors and threads must be where they\n"
    "started. The report's last line is the summary; exit status 1 on any\n"
    "violation, 2 when the run could not be set up.\n"
    "\n"
    "  --seconds N   length of the chaos phase (default 60)\n"
    "  --seed S      the schedule's seed (default: from the clock); printed first\n"
    "  --pcsc        eSE1 through PC/SC (skipped, exit 0, where pcscd or vpcd is missing)\n"
    "  --hang-ms MS  the daemon's hang bound set for the run (default 3000)\n"
    "  --bin DIR     folder of qvese@1.0-service, modem-sim, card-vpcd (default: this\n"
    "                program's folder)\n"
    "  --lib DIR     folder of the simulated libese_qv_hal.so (default: DIR/../lib)\n"
    "  --keep        keep the device root (it is kept anyway when a check fails)\n"
    "  --verbose     print every fault's start and end and every kill as they happen\n"
    "                (they always go to chaos.log in the device root)\n"
    "  --show N      violations printed in full (default 20; all are counted)\n"
    "  --help        this text\n";

std::string selfPath() {
  char buf[4096];
  const ssize_t n = readlink("/proc/self/exe", buf, sizeof(buf) - 1);
  if (n <= 0) return "";
  buf[n] = '\0';
  return buf;
}

void onSignal(int) { chaos::requestStop(); }

bool parseNumber(const char* s, unsigned long long max, unsigned long long* out) {
  char* end = nullptr;
  errno = 0;
  const unsigned long long v = strtoull(s, &end, 10);
  if (errno != 0 || end == s || *end != '\0' || v > max || *s == '-') return false;
  *out = v;
  return true;
}

int usageError(const std::string& why) {
  fprintf(stderr, "se-chaos: %s\n\n%s", why.c_str(), kUsage);
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1 && std::string(argv[1]) == "--client") {
    chaos::ClientArgs a;
    if (!chaos::parseClientArgv(std::vector<std::string>(argv + 1, argv + argc), &a)) return 2;
    return chaos::runClient(a);
  }
  chaos::RunOptions o;
  o.seed = static_cast<uint64_t>(time(nullptr)) % 1000000;
  enum { kSeconds = 1000, kSeed, kPcsc, kHang, kBin, kLib, kKeep, kVerbose, kShow, kHelp };
  static const option longOpts[] = {
      {"seconds", required_argument, nullptr, kSeconds}, {"seed", required_argument, nullptr, kSeed},
      {"pcsc", no_argument, nullptr, kPcsc},             {"hang-ms", required_argument, nullptr, kHang},
      {"bin", required_argument, nullptr, kBin},         {"lib", required_argument, nullptr, kLib},
      {"keep", no_argument, nullptr, kKeep},             {"verbose", no_argument, nullptr, kVerbose},
      {"show", required_argument, nullptr, kShow},
      {"help", no_argument, nullptr, kHelp},             {nullptr, 0, nullptr, 0}};
  int c;
  unsigned long long v = 0;
  while ((c = getopt_long(argc, argv, "", longOpts, nullptr)) != -1) {
    switch (c) {
      case kSeconds:
        if (!parseNumber(optarg, 86400, &v) || v < 5) return usageError("--seconds takes 5 to 86400");
        o.seconds = static_cast<int>(v);
        break;
      case kSeed:
        if (!parseNumber(optarg, ~0ULL, &v)) return usageError("--seed takes a number");
        o.seed = v;
        break;
      case kPcsc: o.pcsc = true; break;
      case kHang:
        if (!parseNumber(optarg, 60000, &v) || v < 100) return usageError("--hang-ms takes 100 to 60000");
        o.hangMs = static_cast<int>(v);
        break;
      case kBin: o.binDir = optarg; break;
      case kLib: o.libDir = optarg; break;
      case kKeep: o.keep = true; break;
      case kVerbose: o.verbose = true; break;
      case kShow:
        if (!parseNumber(optarg, 1000000, &v)) return usageError("--show takes a count");
        o.shown = static_cast<int>(v);
        break;
      case kHelp: fputs(kUsage, stdout); return 0;
      default: return usageError("unknown option");
    }
  }
  if (optind < argc) return usageError(std::string("unexpected argument ") + argv[optind]);
  o.self = selfPath();
  if (o.binDir.empty()) o.binDir = std::filesystem::path(o.self).parent_path().string();
  o.binDir = std::filesystem::absolute(o.binDir).string();
  if (o.libDir.empty()) o.libDir = o.binDir + "/../lib";
  o.libDir = std::filesystem::absolute(o.libDir).lexically_normal().string();
  o.pcscLibDir = o.libDir + "/pcsc";
  if (o.pcsc) {
    const std::string why = chaos::PcscEnv::unavailable();
    if (!why.empty()) {
      printf("chaos: seed %llu: --pcsc skipped: %s\n", static_cast<unsigned long long>(o.seed), why.c_str());
      return 0;
    }
  }
  struct sigaction sa = {};
  sa.sa_handler = onSignal;
  sigaction(SIGINT, &sa, nullptr);
  sigaction(SIGTERM, &sa, nullptr);
  signal(SIGPIPE, SIG_IGN);
  return chaos::runChaos(o);
}

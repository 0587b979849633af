// se-bench-select: times communication_which_modem in-process, with the
// device root taken from SE_DEVICE_ROOT as the daemon does, and one log line
// of the kind the SIM path writes. A separate program because resolving
// open() under the device root applies to every open() of the program that
// links it.
//
// Prints two lines:
//   "select <count> <median us> <p99 us> <per second> <calls made>"
//   "log <count> <median us> <p99 us> <per second> <calls made>"
#include <android/log.h>

#include <cstdio>
#include <cstdlib>

#include "bench_util.h"
#include "modem_select.h"

namespace {
void print(const char* what, const se_bench::Stats& s, size_t calls) {
  fprintf(stdout, "%s %zu %.2f %.2f %.0f %zu\n", what, s.count, s.medianUs, s.p99Us, s.perSecond, calls);
}
}  // namespace

int main(int argc, char** argv) {
  long count = argc > 1 ? strtol(argv[1], nullptr, 10) : 2000;
  if (count < 1) count = 1;
  const size_t n = static_cast<size_t>(count);
  const size_t warmup = n / 10;
  // The bench's device root is laid out as a single-modem phone.
  bool wrong = false;
  se_bench::Stats select = se_bench::measure(warmup, n, [&] {
    if (communication_which_modem() != 0) wrong = true;
  });
  if (wrong) {
    fprintf(stdout, "error: communication_which_modem did not choose modem 0\n");
    return 1;
  }
  print("select", select, warmup + n);
  se_bench::Stats log = se_bench::measure(warmup, n, [] {
    __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_DEBUG, "se-bench", "%s, resp finish", "asyncCmdPush");
  });
  print("log", log, warmup + n);
  return 0;
}

// se-bench-select: times communication_which_modem in-process, with the
// device root taken from SE_DEVICE_ROOT as the daemon does. A separate
// program because resolving open() under the device root applies to every
// open() of the program that links it.
//
// Prints one line: "select <count> <median us> <p99 us> <per second>".
#include <cstdio>
#include <cstdlib>

#include "bench_util.h"
#include "modem_select.h"

int main(int argc, char** argv) {
  long count = argc > 1 ? strtol(argv[1], nullptr, 10) : 2000;
  if (count < 1) count = 1;
  int expected = 0;
  bool wrong = false;
  se_bench::Stats s = se_bench::measure(count / 10, static_cast<size_t>(count), [&] {
    if (communication_which_modem() != expected) wrong = true;
  });
  if (wrong) {
    fprintf(stdout, "select error: communication_which_modem did not choose modem %d\n", expected);
    return 1;
  }
  fprintf(stdout, "select %zu %.2f %.2f %.0f\n", s.count, s.medianUs, s.p99Us, s.perSecond);
  return 0;
}

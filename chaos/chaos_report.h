#pragma once
// The report at the end of a chaos run; its last line is the summary.
#include <cstdio>
#include <string>

#include "chaos_env.h"
#include "chaos_judge.h"

namespace chaos {

struct Summary {
  uint64_t seed = 0;
  int seconds = 0;
  long faults = 0;
  long leftOpen = 0;
  Health start, end;
};

void printReport(FILE* out, const Judge& judge, const Summary& s);
// chaos: seed S, N s, C calls, F faults, W wrong, B over bound, L channels
// left open, RSS a->b kB, fds a->b, threads a->b
std::string summaryLine(const Judge& judge, const Summary& s);

}  // namespace chaos

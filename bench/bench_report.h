#pragma once
// se-bench's report: the machine it ran on, what the daemon's logs and
// status show, and the table's rows.
#include <sys/types.h>

#include <map>
#include <string>

#include "bench_util.h"

namespace se_bench {

std::string cpuModel();
std::string loadAverage();

// Lines of `path` that contain `needle`.
size_t countLines(const std::string& path, const std::string& needle);
std::map<std::string, std::string> procStatus(pid_t pid);
void row(const std::string& what, const Stats& s);

}  // namespace se_bench

#include "bench_report.h"

#include <cstdio>
#include <fstream>

namespace se_bench {

std::string cpuModel() {
  std::ifstream in("/proc/cpuinfo");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("model name", 0) == 0) {
      size_t colon = line.find(':');
      if (colon != std::string::npos) return line.substr(colon + 2);
    }
  }
  return "unknown";
}

std::string loadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string a, b, c;
  in >> a >> b >> c;
  return a + " " + b + " " + c;
}

size_t countLines(const std::string& path, const std::string& needle) {
  std::ifstream in(path);
  std::string line;
  size_t n = 0;
  while (std::getline(in, line)) {
    if (line.find(needle) != std::string::npos) ++n;
  }
  return n;
}

std::map<std::string, std::string> procStatus(pid_t pid) {
  std::map<std::string, std::string> out;
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    std::string v = line.substr(colon + 1);
    size_t b = v.find_first_not_of(" \t");
    out[line.substr(0, colon)] = b == std::string::npos ? "" : v.substr(b);
  }
  return out;
}

void row(const std::string& what, const Stats& s) {
  printf("| %-52s | %6zu | %9.1f | %9.1f | %8.0f |\n", what.c_str(), s.count, s.medianUs, s.p99Us,
         s.perSecond);
}

}  // namespace se_bench

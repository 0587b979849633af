#include "port_open_seam.h"

#include <fcntl.h>

#include <map>
#include <mutex>

#include "async_cmd.h"

namespace {
std::mutex g_m;
std::function<void(const std::string&, int)> g_hook;
std::map<std::string, int> g_attempts;
}  // namespace

namespace sim_test {
void setBeforeOpen(std::function<void(const std::string&, int)> hook) {
  std::lock_guard<std::mutex> g(g_m);
  g_hook = std::move(hook);
  g_attempts.clear();
}
}  // namespace sim_test

int asyncCmdOpenPort(const char* path) {
  std::function<void(const std::string&, int)> hook;
  int attempt;
  {
    std::lock_guard<std::mutex> g(g_m);
    hook = g_hook;
    attempt = ++g_attempts[path];
  }
  if (hook) hook(path, attempt);
  const int fd = open(path, O_RDWR | O_NOCTTY);
  if (fd >= 0) (void)asyncCmdRawTerminal(fd, path);
  return fd;
}

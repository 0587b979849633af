#pragma once
// What a chaos run stands on: its device root and properties file, the
// processes it starts, and the daemon's health figures.
#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace chaos {

// A started program. Dies with the soak (parent-death signal), is stopped
// with SIGTERM then SIGKILL.
class Proc {
 public:
  Proc() = default;
  ~Proc() { stop(); }
  Proc(const Proc&) = delete;
  Proc& operator=(const Proc&) = delete;

  // `outFd`: its standard output (-1: /dev/null); `extraFd` is handed over
  // as descriptor 3 when >= 0. Standard error goes to `errPath`.
  bool start(const std::vector<std::string>& argv, const std::vector<std::string>& env, int outFd,
             const std::string& errPath, int extraFd = -1);
  // SIGTERM, SIGKILL after `graceMs`; waits.
  void stop(int graceMs = 2000);
  void kill(int sig);
  // Reaps it if it ended; true while it runs. *status gets the wait status.
  bool running(int* status = nullptr);
  pid_t pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
};

// The properties file the daemon and the simulated library read on each
// call: fixed lines and the faults' switches, rewritten whole (write, then
// rename) so a reader never sees half of it.
class Properties {
 public:
  explicit Properties(std::string path) : path_(std::move(path)) {}
  void set(const std::string& name, const std::string& value);
  void clear(const std::string& name);
  bool write() const;

 private:
  std::string path_;
  std::map<std::string, std::string> values_;
};

struct Health {
  long rssKb = -1;
  long fds = -1;
  long threads = -1;
  std::vector<long> tids;  // the threads' ids, as the daemon's log lines show them
};
Health healthOf(pid_t pid);

// The channels listed in a simulator's open-channel report (one line of
// numbers); -1 when it cannot be read.
int openChannelsIn(const std::string& path);
// The channel numbers of such a report; false when there is none.
bool channelListIn(const std::string& path, std::vector<int>* channels);

bool writeFile(const std::string& path, const std::string& text);
// One line from `fd` within `timeoutMs` ("" on time-out or end).
std::string readLine(int fd, int timeoutMs);
// A fresh folder under /tmp.
std::string makeTempDir(const char* prefix);

}  // namespace chaos

#pragma once
// Shared harness for tests that run the real programs: a temporary device
// root, child processes on pipes, the daemon, modem-sim and secli. Waits are
// on what a child writes (a condition its reader thread signals), never on a
// clock alone. Every child is killed and reaped by its owner's destructor and
// dies with the test process (parent-death signal) should that crash.
#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace se_test {

constexpr int kGenerousMs = 20000;

// The programs under test, as built next to the tests.
extern const char* const kDaemon;
extern const char* const kSecli;
extern const char* const kModemSim;

// A fresh folder to serve as SE_DEVICE_ROOT, removed with everything in it.
// With `length`, the folder is made that deep (at least that many characters
// in its path), as a user's build or temporary folder may be.
class TempRoot {
 public:
  explicit TempRoot(size_t length = 0);
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;

  const std::string& path() const { return path_; }
  std::string at(const std::string& rel) const { return path_ + "/" + rel; }
  // Folders on the way are made as needed.
  void write(const std::string& rel, const std::string& content) const;
  void append(const std::string& rel, const std::string& content) const;
  void property(const std::string& nameValue) const { append("properties", nameValue + "\n"); }

 private:
  std::string top_;  // what mkdtemp made, removed whole
  std::string path_;
};

// Everything a child writes to one pipe.
class Output {
 public:
  explicit Output(int fd);
  ~Output();
  Output(const Output&) = delete;
  Output& operator=(const Output&) = delete;

  std::string text();
  size_t size();
  bool waitFor(const std::string& needle, size_t from = 0, int ms = kGenerousMs);
  // The next complete line at or after byte *pos; *pos moves past it.
  // False at once when the child's output has ended without one.
  bool nextLine(size_t* pos, std::string* line, int ms = kGenerousMs);
  bool waitEof(int ms = kGenerousMs);

 private:
  void run();
  int fd_;
  std::mutex mu_;
  std::condition_variable cv_;
  std::string text_;
  bool eof_ = false;
  std::thread thread_;
};

// One child with its standard input, output and error on pipes and
// SE_DEVICE_ROOT set to `root`.
class Process {
 public:
  Process(const std::vector<std::string>& argv, const std::string& root);
  ~Process();
  Process(const Process&) = delete;
  Process& operator=(const Process&) = delete;

  void write(const std::string& text);
  void closeStdin();
  void stop(int sig);  // sends `sig`, reaps; the output is complete after

  // Exit code once the child ended on its own (128 + signal when killed);
  // -1 when it did not end within `ms`.
  int waitExit(int ms = kGenerousMs);
  bool running();
  Output& out() { return *out_; }
  Output& err() { return *err_; }

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
  int status_ = 0;
  int stdin_ = -1;
  std::unique_ptr<Output> out_;
  std::unique_ptr<Output> err_;
};

// The daemon; waits until it has registered every instance, HIDL and AIDL
// (the AIDL "SIM1" comes last).
std::unique_ptr<Process> startDaemon(const TempRoot& root);
// modem-sim for modem 0 or 1, logging on its standard error; waits for its
// ready line.
std::unique_ptr<Process> startModem(const TempRoot& root, int modem,
                                    const std::vector<std::string>& extra = {});

// secli reading commands from its standard input, one JSON line back for
// each, so that a test can use one answer in the next command.
class SecliSession {
 public:
  SecliSession(const TempRoot& root, const std::string& instance,
               const std::vector<std::string>& extra = {});
  ~SecliSession();
  std::string call(const std::string& command, int ms = kGenerousMs);
  // Sends without waiting; `answer` collects it later.
  void send(const std::string& command);
  bool answer(std::string* line, int ms = kGenerousMs);
  Process& process() { return proc_; }

 private:
  Process proc_;
  size_t pos_ = 0;
};

// Runs one secli command line to its end; its exit code, output in *out.
int secli(const TempRoot& root, const std::vector<std::string>& args, std::string* out,
          std::string* err = nullptr);

// The value of `name` in one flat JSON object, quotes removed.
std::string field(const std::string& json, const std::string& name);
std::string hexByte(int v);
size_t countOf(const std::string& text, const std::string& needle);
// A sanitizer build reports into the process's standard error and may go on
// running; such a report fails the test.
void expectNoSanitizerReport(const std::string& who, const std::string& text);

// For the end-to-end suites: the daemon and modem-sim on one root. Stops the
// daemon first (no port in use when the modem goes), checks it for sanitizer
// reports and prints both logs when the test has failed.
struct System {
  System() = default;
  explicit System(size_t rootLength) : root(rootLength) {}
  ~System();
  TempRoot root;
  std::unique_ptr<Process> modem;
  std::unique_ptr<Process> daemon;
};
constexpr const char* kEchoApplet = "A00000000101";
// An open of the echo applet; its channel, or -1.
int openEcho(SecliSession& s);
std::string echoCommand(int channel, const std::string& byte);
// The echo applet's response to one byte on `channel`.
std::string echo(SecliSession& s, int channel, const std::string& byte);
long msSince(std::chrono::steady_clock::time_point t0);

}  // namespace se_test

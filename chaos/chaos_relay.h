#pragma once
// The modem's port as the daemon sees it, with faults: a pty of the relay's
// own, linked where the daemon opens the modem, and modem-sim's port behind
// it. Commands go through as they come; answers are cut into lines and can be
// held back (silence), delayed (slow), written in pieces, preceded by
// unsolicited lines, or rewritten to the bare form of AT+CCHO/AT+CCHP. The
// port can be lost (between commands, as a hang-up) and given back on a new
// pty, and the modem behind it can be swapped (a restarted modem-sim).
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <mutex>
#include <string>
#include <thread>

namespace chaos {

class ModemRelay {
 public:
  ModemRelay() = default;
  ~ModemRelay() { stop(); }
  ModemRelay(const ModemRelay&) = delete;
  ModemRelay& operator=(const ModemRelay&) = delete;

  // `link`: the path the daemon opens; `modemPort`: modem-sim's port.
  bool start(const std::string& link, const std::string& modemPort, std::string* error);
  void stop();

  void setSilent(bool on);
  void setSlowMs(int ms);       // 0: off
  void setPieceBytes(int n);    // 0: off
  void setUnsolLines(int n);    // 0: off
  void setBare(bool on);

  // Stops taking commands, lets the answer in flight through, then closes
  // the pty and removes the link. Returns once the port is gone.
  void losePort();
  // A new pty at the link.
  bool restorePort(std::string* error);
  // The modem behind was restarted: open its port again.
  bool reconnectModem(const std::string& modemPort, std::string* error);

  long commands() const { return commands_; }
  // Commands that found no modem behind the relay (modem-sim gone outside a
  // restart): a fault of the soak itself, which the daemon would wait out.
  long dropped() const { return dropped_; }

 private:
  struct Chunk {
    std::string bytes;
    int64_t notBefore = 0;  // monoNanos()
  };

  bool openPty(std::string* error);
  void closePty();
  void run();
  void fromDaemon();
  void fromModem();
  void queueLine(std::string line);
  void flushDue();
  void wake();

  std::string link_;
  std::thread thread_;
  int wakePipe_[2] = {-1, -1};
  std::atomic<bool> stop_{false};

  std::mutex mu_;  // guards everything below, and the descriptors while the thread changes them
  std::condition_variable cv_;
  int master_ = -1;
  int slave_ = -1;  // ours: keeps the pty raw and open while the daemon reopens it
  int modem_ = -1;
  bool silent_ = false;
  int slowMs_ = 0;
  int pieces_ = 0;
  int unsol_ = 0;
  bool bare_ = false;
  bool losing_ = false;
  int64_t loseDeadline_ = 0;
  bool lost_ = false;
  int pending_ = 0;         // commands sent to the modem and not yet finally answered
  bool lineOpen_ = false;   // the daemon's current command line is not finished
  bool answering_ = false;  // an answer's first line has gone out
  bool writeBlocked_ = false;
  std::string fromModem_;
  std::deque<Chunk> out_;
  unsigned unsolTurn_ = 0;
  std::atomic<long> commands_{0};
  std::atomic<long> dropped_{0};
};

}  // namespace chaos

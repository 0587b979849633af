#pragma once
// How both fronts share the RPC pool with their device.
//
// The pool serves two independent devices, a modem and an eSE library, each
// of which can be slow (a card generating a key, a modem answering every few
// seconds) or dead (a silent modem, a library call that never returns). One
// gate per front keeps the two apart and keeps every caller of a slow but
// healthy device served:
//
// - Admission: a front lets at most `maxCallers` callers in at once (the one
//   using the device and those waiting for it, both interfaces counted), one
//   fewer than the pool has threads, so the other front always finds a
//   thread. A caller beyond that fails at once with its usual failure.
// - Waiting: an admitted caller waits for the device as long as the call
//   using it makes progress (the front says what progress is: an answer line
//   from the modem, a library call returning). It gives up only once that
//   call has gone without progress for the hang bound (a system property,
//   10 s by default), a time healthy devices never reach.
// - Cleanups: a close that cannot run now (a death notice never waits; a
//   caller gave up; the device failed) is queued and run by whoever next has
//   the device, before that caller's own work, or by the holder as it lets go.
//   One that fails because the device does not answer stays queued and is
//   tried again once a second until it runs. Nothing is dropped.
// - Owners: channels are recorded with the process that opened them. A
//   client's death closes its channels; so does finding its process gone,
//   checked at every call and, for clients without a death link (they never
//   called init), once a second while they hold channels.
#include <pthread.h>
#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <set>
#include <mutex>
#include <string>
#include <thread>
#include <condition_variable>

// Threads of each RPC pool (the joining thread counted): four, so that each
// instance can be given all but one of them.
constexpr size_t kRpcPoolThreads = 4;
constexpr size_t kCallersPerInstance = kRpcPoolThreads - 1;

class DeviceGate {
 public:
  // How long the device call now in flight has gone without progress, in
  // microseconds; 0 when no device call is in flight.
  using SilenceFn = int64_t (*)();
  enum class Outcome { kDone, kRetry };
  using Cleanup = std::function<Outcome()>;
  // Closes one channel; called with the device held.
  using ChannelCloser = std::function<Outcome(uint8_t channel)>;

  struct Config {
    const char* device;        // the instance's name, for log lines
    int logBuffer;             // LOG_ID_MAIN or LOG_ID_RADIO
    const char* tag;           // the front's log tag
    pthread_mutex_t* lock;     // the front's own lock: held while the device is in use,
                               // taken only by the caller the gate lets in
    size_t maxCallers;         // admission limit
    const char* hangProperty;  // property holding the hang bound in ms
    SilenceFn silence;
    ChannelCloser closeChannel;
  };

  static constexpr int64_t kDefaultHangMillis = 10000;

  explicit DeviceGate(Config config);
  // Waits for the janitor thread (the product's gates are never destroyed).
  ~DeviceGate();
  DeviceGate(const DeviceGate&) = delete;
  DeviceGate& operator=(const DeviceGate&) = delete;

  // One caller's stay in the front: admitted on creation (ok() false when
  // refused), optionally holding the device. Ends both when destroyed.
  class Pass {
   public:
    Pass(Pass&& other) noexcept;
    Pass& operator=(Pass&&) = delete;
    Pass(const Pass&) = delete;
    ~Pass();
    bool ok() const { return admitted_ && (!wantsDevice_ || holding_); }
    // Waits for the device (see the header comment); false, logged, when it
    // gave up. Runs the queued cleanups before returning true.
    bool hold(const char* op);
    // Lets the device go, running what was queued meanwhile first.
    void release();

   private:
    friend class DeviceGate;
    Pass(DeviceGate* gate, bool admitted, bool counted, bool wantsDevice);
    DeviceGate* gate_;
    bool admitted_;
    bool counted_;
    bool wantsDevice_;
    bool holding_ = false;
  };

  // Admission only: for operations that use the device in pieces (init).
  Pass admit(const char* op);
  // Admission and the device, for one operation.
  Pass enter(const char* op);

  // Queues `cleanup` and runs it now if the device is free; never waits.
  // `channel` names the channel a close is for (-1: none), so that
  // forgetChannels can drop it.
  void defer(Cleanup cleanup, const std::string& what, int channel = -1);
  // With the device held: true when nothing is queued any more.
  bool idle() const;

  // The channel table of owners (channel -> pid), kept under the device.
  void opened(uint8_t channel, pid_t owner);
  void closed(uint8_t channel);
  // The device dropped every channel (the eSE library closed): owners and
  // queued channel closes go.
  void forgetChannels();
  // `client` has a death link: its death will be told, so its channels need
  // no looking after.
  void linked(pid_t client);
  // Queues the close of every channel `owner` opened; never waits.
  void clientDied(pid_t owner);
  // Whether `channel` has an owner: a channel the device dropped (the eSE
  // library closed) has none, and nothing is owed to it.
  bool owned(uint8_t channel) const;
  // Whether `channel` belongs to a live client other than `caller`: an
  // init's sweep leaves such a channel alone.
  bool heldByAnother(uint8_t channel, pid_t caller) const;

  // Admitted callers now (tests and logs).
  size_t callers() const { return callers_.load(); }

 private:
  struct Entry {
    Cleanup cleanup;
    std::string what;
    bool retried = false;
    int channel = -1;
  };

  bool admitOne(const char* op);
  // The device for this thread without waiting; false when another has it.
  bool tryAcquire();
  bool acquire(const char* op);
  void releaseDevice();
  // With the device held: runs the queue and closes channels of owners whose
  // process is gone.
  void drainHeld();
  // The janitor: a thread that lives only while a cleanup is owed or a
  // channel is open. Once a second it runs what is owed and looks for owners
  // that went without a death notice (a client that never called init).
  void wakeJanitorLocked();
  void janitorLoop();
  bool janitorHasWork();
  // Whether the janitor has anything to look after: owed cleanups, or
  // channels of clients that have no death link. queueLock_ held.
  bool janitorNeededLocked() const;
  int64_t hangMicros() const;

  const Config config_;
  std::atomic<size_t> callers_{0};

  mutable std::mutex queueLock_;  // guards what follows
  // Whether a caller has the device; it also holds the front's lock then.
  bool busy_ = false;
  std::condition_variable waitCv_;  // the device let go
  std::deque<Entry> queue_;
  std::map<uint8_t, pid_t> owners_;
  std::set<pid_t> linked_;
  bool janitorRunning_ = false;
  bool stopping_ = false;
  std::condition_variable janitorCv_;
};

// What the caller of the current operation is, and how the operation ended,
// for this thread. The AIDL face sets the caller for the HIDL front it calls
// and reads back whether the call failed, as HIDL's result types cannot
// always tell (a false presence, an empty ATR).
namespace se_call {
// The calling process: the one set by Scope, else the platform's.
pid_t callerPid();
void markFailed();
bool failed();

class Scope {
 public:
  explicit Scope(pid_t caller);
  ~Scope();
  Scope(const Scope&) = delete;
  Scope& operator=(const Scope&) = delete;

 private:
  pid_t previousCaller_;
  bool previousFailed_;
};
}  // namespace se_call

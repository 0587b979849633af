#include "se_device_gate.h"

#include <errno.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <cstdlib>
#include <thread>
#include <utility>
#include <vector>

#include <cutils/properties.h>
#include <hwbinder/IPCThreadState.h>
#include <log/log.h>

#include "se_delay.h"

namespace {

// A waiter looks at the holder's progress at least this often, so that it
// notices a device call that stops answering while it waits.
constexpr int64_t kRecheckMicros = 250000;
// Queued cleanups the device refused are tried again this often, and owners
// looked at.
constexpr uint64_t kJanitorMicros = 1000000;

// The gate this thread has been admitted to, and how deeply: an operation
// that calls another of its own front (init's sweep, the AIDL face calling
// the HIDL front) counts once.
thread_local const DeviceGate* tlGate = nullptr;
thread_local int tlDepth = 0;

thread_local pid_t tlCaller = 0;
thread_local bool tlFailed = false;

bool processGone(pid_t pid) { return pid > 0 && kill(pid, 0) != 0 && errno == ESRCH; }

}  // namespace

#define GATE_LOG(prio, ...) __android_log_buf_print(config_.logBuffer, prio, config_.tag, __VA_ARGS__)

DeviceGate::DeviceGate(Config config) : config_(std::move(config)) {}

DeviceGate::~DeviceGate() {
  {
    std::lock_guard<std::mutex> g(queueLock_);
    stopping_ = true;
  }
  janitorCv_.notify_all();
  std::unique_lock<std::mutex> l(queueLock_);
  janitorCv_.wait(l, [this] { return !janitorRunning_; });
}

DeviceGate::Pass::Pass(DeviceGate* gate, bool admitted, bool counted, bool wantsDevice)
    : gate_(gate), admitted_(admitted), counted_(counted), wantsDevice_(wantsDevice) {}

DeviceGate::Pass::Pass(Pass&& other) noexcept
    : gate_(other.gate_),
      admitted_(other.admitted_),
      counted_(other.counted_),
      wantsDevice_(other.wantsDevice_),
      holding_(other.holding_) {
  other.admitted_ = false;
  other.holding_ = false;
}

DeviceGate::Pass::~Pass() {
  release();
  if (!admitted_) return;
  if (--tlDepth == 0) tlGate = nullptr;
  if (counted_) gate_->callers_.fetch_sub(1);
}

bool DeviceGate::Pass::hold(const char* op) {
  if (!admitted_) return false;
  if (!holding_) holding_ = gate_->acquire(op);
  return holding_;
}

void DeviceGate::Pass::release() {
  if (!holding_) return;
  holding_ = false;
  gate_->releaseDevice();
}

bool DeviceGate::admitOne(const char* op) {
  size_t now = callers_.load();
  do {
    if (now >= config_.maxCallers) {
      GATE_LOG(ANDROID_LOG_ERROR, "%s, %s busy with %zu callers: call refused", op, config_.device,
               now);
      se_call::markFailed();
      return false;
    }
  } while (!callers_.compare_exchange_weak(now, now + 1));
  return true;
}

DeviceGate::Pass DeviceGate::admit(const char* op) {
  if (tlGate == this) {
    ++tlDepth;
    return Pass(this, true, false, false);
  }
  if (!admitOne(op)) return Pass(this, false, false, false);
  tlGate = this;
  tlDepth = 1;
  return Pass(this, true, true, false);
}

DeviceGate::Pass DeviceGate::enter(const char* op) {
  Pass pass = admit(op);
  pass.wantsDevice_ = true;
  pass.hold(op);
  return pass;
}

int64_t DeviceGate::hangMicros() const {
  char value[PROPERTY_VALUE_MAX] = {0};
  property_get(config_.hangProperty, value, "");
  char* end = nullptr;
  const long long ms = std::strtoll(value, &end, 10);
  if (value[0] == '\0' || end == nullptr || *end != '\0' || ms <= 0) return kDefaultHangMillis * 1000;
  return static_cast<int64_t>(ms) * 1000;
}

bool DeviceGate::tryAcquire() {
  {
    std::lock_guard<std::mutex> g(queueLock_);
    if (busy_) return false;
    busy_ = true;
  }
  // Only the holder of busy_ takes the front's lock: it never waits here.
  pthread_mutex_lock(config_.lock);
  return true;
}

bool DeviceGate::acquire(const char* op) {
  {
    std::unique_lock<std::mutex> l(queueLock_);
    if (busy_) {
      GATE_LOG(ANDROID_LOG_DEBUG, "%s, %s busy: waiting (%zu callers)", op, config_.device,
               callers_.load());
    }
    while (busy_) {
      const int64_t bound = hangMicros();
      const int64_t silent = config_.silence();
      if (silent >= bound) {
        l.unlock();
        GATE_LOG(ANDROID_LOG_ERROR, "%s, %s without progress for %lld ms: call given up", op,
                 config_.device, static_cast<long long>(silent / 1000));
        se_call::markFailed();
        return false;
      }
      const int64_t wait = bound - silent < kRecheckMicros ? bound - silent : kRecheckMicros;
      waitCv_.wait_for(l, std::chrono::microseconds(wait));
    }
    busy_ = true;
  }
  pthread_mutex_lock(config_.lock);
  drainHeld();
  return true;
}

void DeviceGate::releaseDevice() {
  for (;;) {
    drainHeld();
    pthread_mutex_unlock(config_.lock);
    {
      std::lock_guard<std::mutex> g(queueLock_);
      busy_ = false;
      waitCv_.notify_one();
      // A cleanup queued after the drain by a thread that found the device
      // taken is this thread's to run: that thread did not wait for it.
      bool fresh = false;
      for (const Entry& e : queue_) fresh = fresh || !e.retried;
      if (!fresh) return;
    }
    if (!tryAcquire()) return;  // its holder runs them
  }
}

void DeviceGate::defer(Cleanup cleanup, const std::string& what, int channel) {
  {
    std::lock_guard<std::mutex> g(queueLock_);
    // One owed close of a channel is enough, however many callers owe it.
    for (const Entry& e : queue_) {
      if (channel >= 0 && e.channel == channel) return;
    }
    queue_.push_back(Entry{std::move(cleanup), what, false, channel});
  }
  if (tryAcquire()) {
    releaseDevice();
    return;
  }
  GATE_LOG(ANDROID_LOG_INFO, "%s, %s busy: queued until it is free", what.c_str(), config_.device);
}

bool DeviceGate::idle() const {
  std::lock_guard<std::mutex> g(queueLock_);
  return queue_.empty();
}

void DeviceGate::drainHeld() {
  std::vector<Entry> again;
  for (;;) {
    Entry e;
    {
      std::lock_guard<std::mutex> g(queueLock_);
      if (queue_.empty()) break;
      e = std::move(queue_.front());
      queue_.pop_front();
    }
    GATE_LOG(ANDROID_LOG_INFO, "%s, %s: queued cleanup runs now", e.what.c_str(), config_.device);
    if (e.cleanup() == Outcome::kRetry) {
      if (!e.retried) {
        GATE_LOG(ANDROID_LOG_ERROR, "%s, %s does not answer: tried again every second",
                 e.what.c_str(), config_.device);
      }
      e.retried = true;
      again.push_back(std::move(e));
    }
  }

  std::vector<std::pair<uint8_t, pid_t>> vanished;
  {
    std::lock_guard<std::mutex> g(queueLock_);
    // A linked client's death is told; only the others are looked for (a
    // system call each, on every call that has the device).
    for (auto it = owners_.begin(); it != owners_.end();) {
      if (linked_.count(it->second) == 0 && processGone(it->second)) {
        vanished.emplace_back(it->first, it->second);
        it = owners_.erase(it);
      } else {
        ++it;
      }
    }
  }
  for (const auto& v : vanished) {
    GATE_LOG(ANDROID_LOG_INFO, "channel %u, %s: its client %d is gone, closing it",
             static_cast<unsigned>(v.first), config_.device, static_cast<int>(v.second));
    const uint8_t channel = v.first;
    if (config_.closeChannel(channel) == Outcome::kRetry) {
      ChannelCloser close = config_.closeChannel;
      again.push_back(Entry{[close, channel] { return close(channel); },
                            "close of channel " + std::to_string(channel), true, channel});
    }
  }

  if (again.empty()) return;
  std::lock_guard<std::mutex> g(queueLock_);
  for (Entry& e : again) queue_.push_back(std::move(e));
  wakeJanitorLocked();
}

bool DeviceGate::janitorNeededLocked() const {
  if (!queue_.empty()) return true;
  for (const auto& o : owners_) {
    if (linked_.count(o.second) == 0) return true;
  }
  return false;
}

void DeviceGate::wakeJanitorLocked() {
  if (janitorRunning_ || stopping_ || !janitorNeededLocked()) return;
  janitorRunning_ = true;
  // Detached: it clears the flag under the lock as its last step, which is
  // what the destructor waits for.
  std::thread([this] { janitorLoop(); }).detach();
}

bool DeviceGate::janitorHasWork() {
  std::vector<pid_t> owners;
  {
    std::lock_guard<std::mutex> g(queueLock_);
    if (!queue_.empty()) return true;
    for (const auto& o : owners_) {
      if (linked_.count(o.second) == 0) owners.push_back(o.second);
    }
  }
  for (pid_t pid : owners) {
    if (processGone(pid)) return true;
  }
  return false;
}

void DeviceGate::janitorLoop() {
  const auto pause = std::chrono::microseconds(se_delay::scaledMicros(kJanitorMicros));
  for (;;) {
    {
      std::unique_lock<std::mutex> l(queueLock_);
      janitorCv_.wait_for(l, pause, [this] { return stopping_ || !janitorNeededLocked(); });
      if (stopping_ || !janitorNeededLocked()) {
        janitorRunning_ = false;
        janitorCv_.notify_all();
        return;
      }
    }
    // A caller that has the device drains at its end anyway.
    if (janitorHasWork() && tryAcquire()) releaseDevice();
  }
}

void DeviceGate::opened(uint8_t channel, pid_t owner) {
  std::lock_guard<std::mutex> g(queueLock_);
  owners_[channel] = owner;
  wakeJanitorLocked();
}

void DeviceGate::closed(uint8_t channel) {
  std::lock_guard<std::mutex> g(queueLock_);
  owners_.erase(channel);
  if (!janitorNeededLocked()) janitorCv_.notify_all();
}

void DeviceGate::linked(pid_t client) {
  std::lock_guard<std::mutex> g(queueLock_);
  linked_.insert(client);
  if (!janitorNeededLocked()) janitorCv_.notify_all();
}

void DeviceGate::forgetChannels() {
  std::lock_guard<std::mutex> g(queueLock_);
  owners_.clear();
  for (auto it = queue_.begin(); it != queue_.end();) {
    it = it->channel >= 0 ? queue_.erase(it) : it + 1;
  }
  if (!janitorNeededLocked()) janitorCv_.notify_all();
}

bool DeviceGate::owned(uint8_t channel) const {
  std::lock_guard<std::mutex> g(queueLock_);
  return owners_.count(channel) != 0;
}

bool DeviceGate::heldByAnother(uint8_t channel, pid_t caller) const {
  std::lock_guard<std::mutex> g(queueLock_);
  auto it = owners_.find(channel);
  return it != owners_.end() && it->second != caller && !processGone(it->second);
}

void DeviceGate::clientDied(pid_t owner) {
  std::vector<uint8_t> channels;
  {
    std::lock_guard<std::mutex> g(queueLock_);
    linked_.erase(owner);
    for (const auto& o : owners_) {
      if (o.second == owner) channels.push_back(o.first);
    }
  }
  for (uint8_t channel : channels) {
    ChannelCloser close = config_.closeChannel;
    defer([this, close, channel, owner]() {
            // Reopened by another client meanwhile: no longer the dead one's.
            {
              std::lock_guard<std::mutex> g(queueLock_);
              auto it = owners_.find(channel);
              if (it == owners_.end() || it->second != owner) return Outcome::kDone;
            }
            return close(channel);
          },
          "serviceDied, close of channel " + std::to_string(channel), channel);
  }
}

namespace se_call {

pid_t callerPid() {
  if (tlCaller != 0) return tlCaller;
  return ::android::hardware::IPCThreadState::self()->getCallingPid();
}

void markFailed() { tlFailed = true; }
bool failed() { return tlFailed; }

Scope::Scope(pid_t caller) : previousCaller_(tlCaller), previousFailed_(tlFailed) {
  tlCaller = caller;
  tlFailed = false;
}

Scope::~Scope() {
  tlCaller = previousCaller_;
  tlFailed = previousFailed_;
}

}  // namespace se_call

#pragma once
// The server's thread pool and the epoll set its idle threads wait in.
#include "rpc_server_conn.h"

#include <sys/epoll.h>

#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

namespace android {
namespace host {
namespace rpc {

constexpr size_t kMaxConnections = 256;
// Calls of one connection queued or running at once; beyond this the pool
// stops reading that connection until some finish.
constexpr int kMaxInflightPerConnection = 8;
constexpr size_t kReadChunk = 65536;
// Events a pool thread takes from the kernel at once.
constexpr int kEventsAtOnce = 32;
// Reads of a connection whose peer has stopped sending, in one turn.
constexpr int kReadRoundsToEnd = 64;

// The server's pool. There is no I/O thread: the idle pool threads all wait
// for input in one epoll set, and the kernel wakes one of them per event.
// Every socket is armed for one event at a time, so one thread reads a
// connection at once; it arms it again once it has read, then runs the
// call it read itself. A call therefore costs no hand-over between threads
// and no thread is woken but the one that runs it. At most mMaxThreads
// calls (and death notices) run at once, the joining thread being one of
// the pool; calls beyond that wait in the queue. A thread in a call to a
// client reads that client's connection itself while it waits for the
// answer, so the answer is read even when every pool thread is busy.
class Host {
 public:
  static Host& get() {
    static Host* host = new Host();  // outlives static destructors and detached users
    return *host;
  }

  void configure(size_t maxThreads, bool callerWillJoin);
  status_t add(const std::string& dir, const std::string& name, const sp<IBase>& service,
               StubFn stub);
  void join();
  void readWhileWaiting(const std::shared_ptr<ServerConn>& c, int wakeFd, int64_t deadline);
  void drop(const std::shared_ptr<ServerConn>& c);
  void shutdownHost();

 private:
  Host() = default;

  // What an epoll event stands for: the low two bits the kind, the rest a
  // connection id or a listener's index.
  enum Kind : uint64_t { kConn = 0, kListener = 1, kStop = 2, kWork = 3 };
  static uint64_t listenerKey(size_t index) { return (uint64_t(index) << 2) | kListener; }
  // A connection is armed for input and for its peer's end of sending.
  static constexpr uint32_t kConnEvents = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;

  bool control(int op, int fd, uint64_t key, uint32_t events = EPOLLIN | EPOLLONESHOT);
  bool startLocked();
  void spawnWorkersLocked();
  void workerLoop();
  void run(Task& task, std::unique_lock<std::mutex>& lk);
  void handle(const epoll_event& ev, std::unique_lock<std::mutex>& lk);
  void armLocked(ServerConn& c);
  void relock(std::unique_lock<std::mutex>& lk);
  void doneHandling();
  void queue(std::vector<Task>& fresh);
  void signalWork();
  void acceptSome(Listener* l);
  bool readConn(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh, bool toEnd);
  bool readChunk(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh);
  void closeConnLocked(const std::shared_ptr<ServerConn>& c, std::vector<Task>* fresh);

  std::mutex mLock;
  std::condition_variable mJoinCv;  // joiners leaving, readers done at shutdown
  std::deque<Task> mTasks;
  size_t mMaxThreads = 1;
  bool mCallerJoins = false;
  size_t mSpawned = 0;
  size_t mBusy = 0;
  size_t mWaiting = 0;   // pool threads in epoll_wait
  size_t mHandling = 0;  // threads reading a socket without the lock
  int mActiveJoiners = 0;
  bool mRunning = false;
  bool mStopping = false;
  std::vector<std::thread> mWorkers;
  std::vector<std::unique_ptr<Listener>> mListeners;
  std::map<uint64_t, std::shared_ptr<ServerConn>> mConns;
  uint64_t mNextConnId = 0;
  UniqueFd mEpoll;
  UniqueFd mStopFd;
  UniqueFd mWorkFd;
};

}  // namespace rpc
}  // namespace host
}  // namespace android

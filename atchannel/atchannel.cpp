// The AT command channel's contexts and reader: one context per modem port,
// bound to the thread that opened it, and a reader thread that sorts the
// port's lines. The sender is in atchannel_send.cpp.
#include "atchannel.h"

#include <android/log.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <securec.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <new>

#include "at_line.h"
#include "at_tok.h"
#include "atchannel_internal.h"
#include "se_delay.h"

namespace {

// Pause after a zero-byte read before the port is read again.
constexpr uint64_t kEofRetryMicros = 1000000ULL;
// How long at_close waits for the port's reader to leave.
constexpr time_t kReaderLeaveSeconds = 1;
constexpr int32_t kModemSlots = AT_MODEM_SLOTS;

pthread_key_t ac_key;
pthread_once_t ac_key_once = PTHREAD_ONCE_INIT;
bool g_keyMade = false;  // written only inside the once-control

pthread_attr_t reader_thread_attrs[kModemSlots];
bool g_attrInited[kModemSlots];
pthread_mutex_t g_attrLock = PTHREAD_MUTEX_INITIALIZER;

// Every context ever made (see AtContext::next_made).
pthread_mutex_t g_registryLock = PTHREAD_MUTEX_INITIALIZER;
AtContext* g_madeContexts = nullptr;

// at_open calls per modem index over the process's life: a worker that ends
// and a new one that opens the port again see different numbers.
std::atomic<uint32_t> g_opens[kModemSlots];

// The context this thread reads for, when it is a reader thread.
thread_local AtContext* t_readerOf = nullptr;
// True while the reader runs the unsolicited handler with command_lock held.
thread_local bool t_inLockedHandler = false;

const char* errText(int err, char* buf, size_t len) {
  // GNU strerror_r may return a static text instead of filling buf.
  return strerror_r(err, buf, len);
}

void make_key() { g_keyMade = pthread_key_create(&ac_key, nullptr) == 0; }

bool keyReady() { return pthread_once(&ac_key_once, make_key) == 0 && g_keyMade; }

int32_t currentFd(AtContext* ac) {
  MutexGuard g(&ac->port_lock);
  return ac->fd;
}

void destroyContextSync(AtContext* ac) {
  pthread_cond_destroy(&ac->reader_gone_cond);
  pthread_mutex_destroy(&ac->port_lock);
  pthread_cond_destroy(&ac->command_cond);
  pthread_condattr_destroy(&ac->command_cond_attr);
  pthread_cond_destroy(&ac->request_cond);
  pthread_mutex_destroy(&ac->request_lock);
  pthread_mutex_destroy(&ac->command_lock);
}

// Creates and binds the calling thread's context, or finds the one it has.
AtContext* InitializeAtContext(int32_t fd, int32_t index) {
  if (!keyReady()) {
    AT_LOGE("[m%d][ch:%d] pthread_once failed!", index, fd);
    AT_LOGE("m%d_%d>InitializeAtContext failed!", index, fd);
    return nullptr;
  }
  if (pthread_getspecific(ac_key) != nullptr) {
    AT_LOGD("[m%d][ch:%d] ac is not null", index, fd);
  } else {
    AT_LOGD("[m%d][ch:%d] ac is null, will malloc", index, fd);
    std::unique_ptr<AtContext> fresh(new (std::nothrow) AtContext());
    if (!fresh) {
      AT_LOGE("malloc atcontext failed\n");
      AT_LOGE("m%d_%d>InitializeAtContext failed!", index, fd);
      return nullptr;
    }
    AtContext* ac = fresh.get();
    ac->index = index;
    ac->fd = -1;  // at_open sets the port once any earlier reader is gone
    ac->reader_fd = -1;
    at_line_reset(ac->line_buf, &ac->line_cur, &ac->read_end);
    pthread_mutex_init(&ac->command_lock, nullptr);
    pthread_mutex_init(&ac->request_lock, nullptr);
    pthread_cond_init(&ac->request_cond, nullptr);
    pthread_condattr_init(&ac->command_cond_attr);
    pthread_condattr_setclock(&ac->command_cond_attr, CLOCK_MONOTONIC);
    pthread_cond_init(&ac->command_cond, &ac->command_cond_attr);
    pthread_mutex_init(&ac->port_lock, nullptr);
    // Timed on the monotonic clock as well: a clock step does not stretch
    // or cut the wait for the reader's end.
    pthread_cond_init(&ac->reader_gone_cond, &ac->command_cond_attr);
    ac->wake_fd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (ac->wake_fd < 0) {
      destroyContextSync(ac);
      AT_LOGE("m%d_%d>InitializeAtContext failed!", index, fd);
      return nullptr;
    }
    if (pthread_setspecific(ac_key, ac) != 0) {
      AT_LOGE("[m%d][ch:%d] pthread_setspecific failed!", index, fd);
      close(ac->wake_fd);
      destroyContextSync(ac);
      AT_LOGE("m%d_%d>InitializeAtContext failed!", index, fd);
      return nullptr;
    }
    // Bound to the thread from now on; the record lives until the process
    // ends, since a detached reader may still hold it after at_close.
    MutexGuard registry(&g_registryLock);
    ac->next_made = g_madeContexts;
    g_madeContexts = fresh.release();
  }
  AtContext* ac = getAtContext();
  if (ac == nullptr) AT_LOGE("getAtContext return null pointer!");
  return ac;
}

void wakeReader(AtContext* ac) {
  uint64_t one = 1;
  ssize_t n = write(ac->wake_fd, &one, sizeof(one));
  (void)n;  // a full counter still wakes the reader
}

void drainWake(AtContext* ac) {
  uint64_t count = 0;
  ssize_t n = read(ac->wake_fd, &count, sizeof(count));
  (void)n;
}

// Marks the channel closed, closes the port and wakes the reader. The port
// is closed with command_lock and port_lock held: a sender writes only under
// command_lock after checking reader_closed, the reader reads only under
// port_lock after checking fd, so neither touches a number reused since.
void closePort(AtContext* ac, bool commandLockHeld) {
  int32_t failedFd = -1;
  {
    MutexGuard command(&ac->command_lock, !commandLockHeld);
    if (ac->reader_closed == 0) {
      ac->reader_closed = 1;
      pthread_cond_signal(&ac->command_cond);
    }
    MutexGuard port(&ac->port_lock);
    if (ac->fd >= 0 && close(ac->fd) != 0) failedFd = ac->fd;
    ac->fd = -1;
  }
  wakeReader(ac);
  if (failedFd >= 0) {
    AT_LOGE("m%d_%d>failed to close fd %d!", static_cast<int32_t>(g_ulModemId), ac->index, failedFd);
  }
}

// A reused context gets a new reader only after the previous one has left
// the record, so that two readers never share the input buffer.
void retirePreviousReader(AtContext* ac) {
  bool running;
  {
    MutexGuard g(&ac->port_lock);
    running = ac->reader_running != 0;
  }
  if (running || currentFd(ac) >= 0) closePort(ac, false);
  MutexGuard g(&ac->port_lock);
  while (ac->reader_running != 0) pthread_cond_wait(&ac->reader_gone_cond, &ac->port_lock);
}

void* readerMain(void* arg) { return readerLoop(static_cast<AtContext*>(arg)); }

void readerGone(AtContext* ac) {
  {
    MutexGuard g(&ac->command_lock);
    if (ac->reader_closed == 0) {
      ac->reader_closed = 1;
      pthread_cond_signal(&ac->command_cond);
    }
  }
  AT_LOGI("[m%d][ch:%d] < reader close.\n", ac->index, currentFd(ac));
  MutexGuard g(&ac->port_lock);
  if (ac->reader_fd >= 0) close(ac->reader_fd);
  ac->reader_fd = -1;
  ac->reader_running = 0;
  pthread_cond_broadcast(&ac->reader_gone_cond);
  // The record must not be touched after this point: a new at_open may
  // already be reusing it.
}

void handleUnsolicited(AtContext* ac, const char* line, bool lockHeld) {
  if (ac->unsol_handler == nullptr) return;
  t_inLockedHandler = lockHeld;
  ac->unsol_handler(line, nullptr);
  t_inLockedHandler = false;
}

// Sorts one line; command_lock is held. True when it ended the command in
// flight: the caller wakes the sender once it has let go of the lock.
bool processLine(AtContext* ac, const char* line) {
  ATResponse* r = ac->response;
  // Once the final response is in, the command takes no more lines, even if
  // its sender has not woken yet.
  int32_t pending = (r != nullptr && r->final_response == nullptr) ? 1 : 0;
  AtLineKind kind = at_classify_line(line, pending, ac->command_type,
                                     (pending && r->p_intermediates != nullptr) ? 1 : 0,
                                     ac->response_prefix);
  switch (kind) {
    case AT_KIND_FINAL_SUCCESS:
    case AT_KIND_FINAL_ERROR:
      at_note_answer(ac->index);
      r->success = kind == AT_KIND_FINAL_SUCCESS ? 1 : 0;
      r->final_response = strdup(line);
      return true;
    case AT_KIND_INTERMEDIATE: {
      at_note_answer(ac->index);
      auto* node = static_cast<ATResponseLine*>(calloc(1, sizeof(ATResponseLine)));
      char* text = strdup(line);
      if (node == nullptr || text == nullptr) {
        free(node);
        free(text);
        break;
      }
      node->text = text;
      node->next = r->p_intermediates;
      r->p_intermediates = node;
      break;
    }
    case AT_KIND_UNSOLICITED:
      handleUnsolicited(ac, line, true);
      break;
  }
  return false;
}

int32_t readPort(void* arg, char* dest, int32_t max_len) {
  auto* ac = static_cast<AtContext*>(arg);
  int32_t n = sync_read(ac->reader_fd, dest, max_len);
  if (n > 0) ac->eof_count = 0;
  return n;
}

void waitForWake(AtContext* ac, uint64_t micros) {
  struct pollfd pfd = {ac->wake_fd, POLLIN, 0};
  uint64_t ms = micros / 1000;
  int timeout = ms == 0 ? 1 : (ms > 60000 ? 60000 : static_cast<int>(ms));
  int rc = poll(&pfd, 1, timeout);
  (void)rc;  // the caller reads again either way
}

}  // namespace

// ---- context registry ------------------------------------------------------

AtContext* getAtContext() {
  AtContext* ac = nullptr;
  if (keyReady()) ac = static_cast<AtContext*>(pthread_getspecific(ac_key));
  if (ac == nullptr) AT_LOGE("%s, m%d ac is NULL", "getAtContext", static_cast<int32_t>(g_ulModemId));
  return ac;
}

int32_t get_ac_index(void) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("%s:getAtContext return null pointer!", "get_ac_index");
    return -1;
  }
  AT_LOGD("%s:ac->index=%d,%d,%d", "get_ac_index", ac->index, static_cast<int32_t>(g_ulModemId), currentFd(ac));
  return ac->index;
}

// ---- reader ------------------------------------------------------------------

int32_t at_open(int32_t fd, AtUnsolHandler h, int32_t index) {
  if (index < 0 || index >= kModemSlots) {
    // Only two reader slots exist; any other index would write past them.
    AT_LOGE("[m%d][ch:%d] index out of range!", index, fd);
    return -1;
  }
  AtContext* ac = InitializeAtContext(fd, index);
  if (ac == nullptr) return -1;
  if (t_readerOf == ac) {
    // The reader cannot wait for itself to leave the record.
    AT_LOGE("m%d_%d>at_open on the reader thread refused!", index, fd);
    return -1;
  }
  retirePreviousReader(ac);

  int32_t readerFd = -1;
  if (fd >= 0) {
    int flags = fcntl(fd, F_GETFL);
    if (flags >= 0) (void)fcntl(fd, F_SETFL, flags | O_NONBLOCK);
    readerFd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (readerFd < 0) {
      AT_LOGE("m%d_%d>ReaderLoop create error!", index, fd);
      close(fd);
      return -1;
    }
  }
  {
    MutexGuard command(&ac->command_lock);
    MutexGuard port(&ac->port_lock);
    ac->index = index;
    ac->fd = fd;
    ac->reader_fd = readerFd;
  }
  AT_LOGD("at_open = ac->fd=%d,ac->index=%d", fd, index);
  ac->unsol_handler = h;
  ac->open_count = ++g_opens[index];
  {
    MutexGuard g(&ac->command_lock);
    ac->reader_closed = 0;
    ac->response_prefix = nullptr;
    at_response_free(ac->response);
    ac->response = nullptr;
  }
  AT_LOGD("%s,ac->index=%d,g_ulModemId=%d", "at_open", index, static_cast<int32_t>(g_ulModemId));
  drainWake(ac);
  ac->eof_count = 0;

  int rc;
  {
    MutexGuard attrs(&g_attrLock);
    if (!g_attrInited[index]) {
      pthread_attr_init(&reader_thread_attrs[index]);
      g_attrInited[index] = true;
    }
    pthread_attr_setdetachstate(&reader_thread_attrs[index], PTHREAD_CREATE_DETACHED);
    MutexGuard port(&ac->port_lock);
    ac->reader_running = 1;
    rc = pthread_create(&ac->reader_thread, &reader_thread_attrs[index], readerMain, ac);
    if (rc != 0) {
      ac->reader_running = 0;
      if (ac->reader_fd >= 0) close(ac->reader_fd);
      ac->reader_fd = -1;
    }
  }
  if (rc != 0) {
    AT_LOGE("m%d_%d>ReaderLoop create error!", index, fd);
    // Without a reader no answer could come: commands end at once with -3.
    MutexGuard g(&ac->command_lock);
    ac->reader_closed = 1;
    return -1;
  }
  return 0;
}

void at_close(void) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) return;
  // The unsolicited handler runs with command_lock held; a close from there
  // must not take it again.
  closePort(ac, t_inLockedHandler && t_readerOf == ac);
  AT_LOGI("m%d_%d>at close.", static_cast<int32_t>(g_ulModemId), ac->index);
  // request_lock stays: a command issued after the close still takes it and
  // must find a valid mutex (it then ends with -3).
  {
    MutexGuard attrs(&g_attrLock);
    if (g_attrInited[ac->index]) {
      pthread_attr_destroy(&reader_thread_attrs[ac->index]);
      g_attrInited[ac->index] = false;
    }
  }
  // The reader was woken above and leaves at once; waiting for it means a
  // closed port has no thread left reading or logging for it. The wait is
  // bounded, so that a driver whose read blocks cannot stall the close; the
  // reader itself (closing from its handler) cannot wait for its own end.
  if (t_readerOf != ac) {
    struct timespec deadline;
    clock_gettime(CLOCK_MONOTONIC, &deadline);
    deadline.tv_sec += kReaderLeaveSeconds;
    MutexGuard g(&ac->port_lock);
    while (ac->reader_running != 0) {
      if (pthread_cond_timedwait(&ac->reader_gone_cond, &ac->port_lock, &deadline) == ETIMEDOUT) {
        AT_LOGE("m%d_%d>reader still busy after close", static_cast<int32_t>(g_ulModemId), ac->index);
        break;
      }
    }
  }
}

void* readerLoop(AtContext* ac) {
  AtContext* bound = nullptr;
  if (keyReady() && pthread_setspecific(ac_key, ac) == 0) bound = getAtContext();
  if (bound == nullptr) {
    if (keyReady()) AT_LOGE("getAtContext return null pointer!");
    readerGone(ac);
    return nullptr;
  }
  t_readerOf = ac;
  at_line_reset(ac->line_buf, &ac->line_cur, &ac->read_end);

  for (;;) {
    char* line = readline(1);
    if (line == nullptr) break;
    if (at_is_sms_unsolicited(line)) {
      CharBuf first(strdup(line));
      if (!first) {
        AT_LOGE("strdup line return null pointer!");
        continue;
      }
      char* second = readline(0);
      if (second == nullptr) break;
      if (ac->unsol_handler != nullptr) ac->unsol_handler(first.get(), second);
      continue;
    }
    bool ended;
    {
      MutexGuard g(&ac->command_lock);
      ended = processLine(ac, line);
    }
    // After the unlock: the sender does not wake only to wait for the lock.
    // Its condition was set under the lock, so a late or spare signal finds
    // it either gone or still waiting with reason.
    if (ended) pthread_cond_signal(&ac->command_cond);
  }
  readerGone(ac);
  return nullptr;
}

char* readline(int32_t log_plain) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("getAtContext return null pointer!");
    return nullptr;
  }
  char* line = nullptr;
  for (;;) {
    int32_t rc = at_line_next(ac->line_buf, &ac->line_cur, &ac->read_end, readPort, ac, &line);
    if (rc == AT_LINE_READY) break;
    if (rc == AT_LINE_READ_ERROR) {
      char buf[128];
      AT_LOGE("atchannel: read error %s", errText(errno, buf, sizeof(buf)));
      return nullptr;
    }
    {
      MutexGuard g(&ac->command_lock);
      if (ac->reader_closed != 0) return nullptr;
    }
    // End of file. Reading again at once would spin on a port whose writer
    // is gone; pause (a close cuts the pause short), and take a second end
    // of file in a row as the port being gone for good.
    if (++ac->eof_count >= 2) {
      AT_LOGE("atchannel: port stays at end of file");
      return nullptr;
    }
    waitForWake(ac, se_delay::scaledMicros(kEofRetryMicros));
  }

  int32_t fd = currentFd(ac);
  const char* word = at_mask_find(line);
  if (word != nullptr) {
    AT_LOGI("m%d_%d<%s: ***\n", ac->index, fd, word);
  } else if ((log_plain & 1) != 0) {
    AT_LOGI("m%d_%d<%s\n", ac->index, fd, line);
  } else {
    AT_LOGI("m%d_%d<: ***\n", ac->index, fd);
  }
  return line;
}

int32_t sync_read(int32_t fd, char* dest, int32_t max_len) {
  if (fd < 0) {
    AT_LOGE("Read FD is invalid\n");
    errno = EBADF;
    return -1;
  }
  memset_s(dest, static_cast<size_t>(max_len), 0, static_cast<size_t>(max_len));
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    errno = EBADF;
    return -1;
  }
  for (;;) {
    // poll() rather than select(): no FD_SETSIZE limit on the port number.
    struct pollfd pfd[2] = {{fd, POLLIN, 0}, {ac->wake_fd, POLLIN, 0}};
    int rc = poll(pfd, 2, -1);
    if (rc < 0) {
      if (errno == EINTR) {
        char buf[128];
        AT_LOGE("sync_read error %s", errText(EINTR, buf, sizeof(buf)));
        continue;
      }
      return -1;
    }
    bool portReady = (pfd[0].revents & (POLLIN | POLLHUP | POLLERR)) != 0;
    bool woken = (pfd[1].revents & POLLIN) != 0;

    if (currentFd(ac) < 0) {
      // Closed while we waited.
      AT_LOGE("Read FD is invalid\n");
      errno = EBADF;
      return -1;
    }
    if (!portReady) {
      if (woken) {
        drainWake(ac);  // a stray wake-up with the port still open
        continue;
      }
      AT_LOGE("Read FD is not set\n");
      errno = EBADF;
      return -1;
    }
    // `fd` is the reader's own duplicate, so no lock is held across the
    // read: a driver whose read blocks cannot stall get_ac_index or at_close.
    ssize_t n;
    do {
      n = read(fd, dest, static_cast<size_t>(max_len));
    } while (n < 0 && errno == EINTR);
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) continue;  // nothing after all
    if (n < 0) {
      int saved = errno;
      AT_LOGE("Read error \n");
      errno = saved;
      return -1;
    }
    return static_cast<int32_t>(n);
  }
}

uint32_t at_open_count(void) {
  if (!keyReady()) return 0;
  auto* ac = static_cast<AtContext*>(pthread_getspecific(ac_key));
  return ac == nullptr ? 0 : ac->open_count;
}

int32_t at_is_closed(void) {
  if (!keyReady()) return 1;
  auto* ac = static_cast<AtContext*>(pthread_getspecific(ac_key));
  if (ac == nullptr) return 1;
  MutexGuard g(&ac->command_lock);
  return ac->reader_closed > 0 ? 1 : 0;
}

#pragma once
// Inside of the AT channel: the per-port record and the steps the public
// operations are built from. Only the channel's own sources include this.
#include <android/log.h>
#include <pthread.h>

#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <memory>

#include "at_line.h"
#include "atchannel.h"

// Modem indexes 0 and 1: one reader slot and one silence record each.
#define AT_MODEM_SLOTS 2

#define AT_TAG "atchannel"
#define AT_LOGD(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_DEBUG, AT_TAG, __VA_ARGS__)
#define AT_LOGI(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_INFO, AT_TAG, __VA_ARGS__)
#define AT_LOGE(...) __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_ERROR, AT_TAG, __VA_ARGS__)

// Holds a mutex for one scope (none when `take` is false).
class MutexGuard {
 public:
  explicit MutexGuard(pthread_mutex_t* m, bool take = true) : m_(take ? m : nullptr) {
    if (m_ != nullptr) pthread_mutex_lock(m_);
  }
  ~MutexGuard() {
    if (m_ != nullptr) pthread_mutex_unlock(m_);
  }
  MutexGuard(const MutexGuard&) = delete;
  MutexGuard& operator=(const MutexGuard&) = delete;

 private:
  pthread_mutex_t* m_;
};

struct FreeDeleter {
  void operator()(void* p) const { free(p); }
};
using CharBuf = std::unique_ptr<char, FreeDeleter>;

struct AtContext {
  pthread_t reader_thread;
  int32_t index;
  int32_t fd;
  AtUnsolHandler unsol_handler;
  char line_buf[AT_LINE_BUF_SIZE];
  char* line_cur;
  pthread_mutex_t request_lock;
  pthread_mutex_t command_lock;
  pthread_cond_t request_cond;
  pthread_cond_t command_cond;
  pthread_condattr_t command_cond_attr;
  int32_t command_type;
  const char* response_prefix;
  ATResponse* response;
  AtTimeoutCallback on_timeout;
  int32_t reader_closed;
  char* read_end;

  // Guards the port descriptor against being closed, and its number reused,
  // while the reader reads it; also `reader_thread` and `reader_running`.
  // `fd` changes only with both this and `command_lock` held.
  pthread_mutex_t port_lock;
  pthread_cond_t reader_gone_cond;  // broadcast when a reader has left the record
  int32_t reader_running;
  // Counter descriptor signalled by at_close, polled by the reader beside the
  // port so that a close wakes it at once. Lives as long as the record.
  int32_t wake_fd;
  // Reader-only: zero-byte reads in a row since the last data.
  int32_t eof_count;
  // The reader's own descriptor of the port (a duplicate of `fd`), so that
  // it reads without port_lock: closing `fd` can never hand its number to
  // someone else under a read. Closed by the reader when it ends.
  int32_t reader_fd;
  // Which at_open of this modem index bound the current port (counted over
  // the process): a new number means a newly opened port. Written and read
  // only by the owning thread.
  uint32_t open_count;
  // Every context ever made, so that records outliving their threads stay
  // reachable (they are never freed). Guarded by the registry's lock.
  AtContext* next_made;
};

// The calling thread's context, or null after logging that there is none.
AtContext* getAtContext();
// The reader got a line of the pending command's answer on modem `index`.
void at_note_answer(int32_t index);

void* readerLoop(AtContext* ac);
char* readline(int32_t log_plain);
int32_t sync_read(int32_t fd, char* dest, int32_t max_len);

int32_t at_send_command_full(const char* command, int32_t type, const char* responsePrefix,
                             ATResponse** pp_outResponse);
int32_t at_send_command_full_nolock(const char* command, int32_t type,
                                    const char* responsePrefix, ATResponse** pp_outResponse);
// Writes the command and its CR, giving up when `deadline` (monotonic)
// passes with the port still not taking the bytes.
int32_t writeline(const char* s, const struct timespec* deadline);

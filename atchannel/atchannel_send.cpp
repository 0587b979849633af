// The AT command sender: writes one command at a time to the calling
// thread's port and waits for its final response, which the reader hands
// over through the context.
#include <errno.h>
#include <poll.h>
#include <securec.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "at_line.h"
#include "atchannel.h"
#include "atchannel_internal.h"
#include "se_delay.h"

namespace {

constexpr uint64_t kCommandTimeoutMicros = 600ULL * 1000000ULL;
constexpr uint64_t kWriteRetryMicros = 1000000ULL;
constexpr int32_t kWriteAttempts = 5;
// Command lines up to this long (with CR) are written from the stack.
constexpr size_t kStackLineSize = 1024;

// Per modem slot: when the pending command started (monotonic microseconds,
// 0 while none is pending) and when a line of its answer last came. Written
// by the port's worker and reader, read by any thread.
std::atomic<int64_t> g_pendingSince[AT_MODEM_SLOTS];
std::atomic<int64_t> g_lastAnswer[AT_MODEM_SLOTS];

int64_t monotonicMicros() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<int64_t>(now.tv_sec) * 1000000 + now.tv_nsec / 1000;
}

struct timespec deadlineAfter(uint64_t micros) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  uint64_t nsec = static_cast<uint64_t>(now.tv_nsec) + (micros % 1000000ULL) * 1000ULL;
  struct timespec t;
  t.tv_sec = now.tv_sec + static_cast<time_t>(micros / 1000000ULL) +
             static_cast<time_t>(nsec / 1000000000ULL);
  t.tv_nsec = static_cast<long>(nsec % 1000000000ULL);
  return t;
}

void reverseIntermediates(ATResponse* r) {
  ATResponseLine* prev = nullptr;
  ATResponseLine* cur = r->p_intermediates;
  while (cur != nullptr) {
    ATResponseLine* next = cur->next;
    cur->next = prev;
    prev = cur;
    cur = next;
  }
  r->p_intermediates = prev;
}

// Milliseconds from now until `deadline` (monotonic), 0 once it has passed.
int msUntil(const struct timespec* deadline) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  int64_t ms = (static_cast<int64_t>(deadline->tv_sec) - now.tv_sec) * 1000 +
               (deadline->tv_nsec - now.tv_nsec) / 1000000;
  if (ms <= 0) return 0;
  return ms > INT32_MAX ? INT32_MAX : static_cast<int>(ms);
}

// One write attempt: 0 written, -3 channel closed, -4 the port took no
// bytes until the deadline, -1 failed. The port is non-blocking: a modem
// that stops reading must not hold command_lock past the deadline.
int32_t writeAttempt(const char* s, size_t len, const struct timespec* deadline) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("getAtContext return null pointer!");
    return -1;
  }
  if (ac->fd < 0 || ac->reader_closed > 0) {
    AT_LOGE("writeline error,errno:%d", -3);
    return -3;
  }
  const char* word = at_mask_find(s);
  if (word != nullptr) {
    AT_LOGI("m%d_%d>AT+%s=***\n", ac->index, ac->fd, word);
  } else {
    AT_LOGI("m%d_%d>%s\n", ac->index, ac->fd, s);
  }
  // The line and its CR in one write; on the stack when it fits, as every
  // command of the SIM requests does.
  size_t size = len + 2;
  char stackLine[kStackLineSize];
  CharBuf heapLine;
  char* line = stackLine;
  if (size > sizeof(stackLine)) {
    heapLine.reset(static_cast<char*>(calloc(size, 1)));
    if (!heapLine) {
      AT_LOGD("malloc tmp failed\n");
      return -1;
    }
    line = heapLine.get();
  }
  if (snprintf_s(line, size, size - 1, "%s\r", s) != static_cast<int>(len + 1)) return -1;
  size_t done = 0;
  while (done < len + 1) {
    ssize_t n = write(ac->fd, line + done, len + 1 - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      struct pollfd pfd = {ac->fd, POLLOUT, 0};
      int rc = poll(&pfd, 1, msUntil(deadline));
      if (rc == 0) {
        AT_LOGE("m%d_%d>write timed out", ac->index, ac->fd);
        return AT_ERROR_TIMEOUT;
      }
      if (rc < 0 && errno != EINTR) return -1;
      continue;
    }
    if (n <= 0) return -1;
    done += static_cast<size_t>(n);
  }
  return 0;
}

// Writes the command, then waits for the end of its exchange. command_lock
// and request_lock are held.
int32_t exchange(AtContext* ac, const char* command, int32_t type, const char* prefix,
                 ATResponse** out) {
  if (ac->response != nullptr) return AT_ERROR_COMMAND_PENDING;
  ac->command_type = type;
  // The write and the wait for the answer share one deadline.
  struct timespec deadline = deadlineAfter(se_delay::scaledMicros(kCommandTimeoutMicros));
  g_pendingSince[ac->index] = monotonicMicros();
  int32_t err = writeline(command, &deadline);
  if (err < 0) return err;

  ac->response_prefix = prefix;
  ac->response = static_cast<ATResponse*>(calloc(1, sizeof(ATResponse)));
  if (ac->response == nullptr) return AT_ERROR_GENERIC;

  while (ac->response->final_response == nullptr && ac->reader_closed == 0) {
    int rc = pthread_cond_timedwait(&ac->command_cond, &ac->command_lock, &deadline);
    if (rc == ETIMEDOUT) {
      if (ac->response->final_response == nullptr && ac->reader_closed == 0) {
        return AT_ERROR_TIMEOUT;
      }
      break;
    }
  }

  if (out != nullptr) {
    reverseIntermediates(ac->response);
    *out = ac->response;
  } else {
    at_response_free(ac->response);
  }
  ac->response = nullptr;
  return ac->reader_closed > 0 ? AT_ERROR_CHANNEL_CLOSED : AT_OK;
}

}  // namespace

void at_note_answer(int32_t index) {
  if (index >= 0 && index < AT_MODEM_SLOTS) g_lastAnswer[index] = monotonicMicros();
}

int32_t writeline(const char* s, const struct timespec* deadline) {
  size_t len = strlen(s);
  for (int32_t attempt = 0; attempt < kWriteAttempts; ++attempt) {
    int32_t rc = writeAttempt(s, len, deadline);
    if (rc == 0) return AT_OK;
    if (rc == AT_ERROR_CHANNEL_CLOSED || rc == AT_ERROR_TIMEOUT) return rc;
    AT_LOGE("writeline error,errno:%d", -1);
    se_delay::sleepMicros(kWriteRetryMicros);
  }
  return AT_ERROR_WRITE_FAILED;
}

int32_t at_send_command_full_nolock(const char* command, int32_t type, const char* responsePrefix,
                                    ATResponse** pp_outResponse) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("getAtContext return null pointer!");
    return AT_ERROR_GENERIC;
  }
  int rc;
  while ((rc = pthread_mutex_trylock(&ac->request_lock)) != 0) {
    if (rc != EBUSY) return AT_ERROR_GENERIC;
    pthread_cond_wait(&ac->request_cond, &ac->command_lock);
  }
  int32_t err = exchange(ac, command, type, responsePrefix, pp_outResponse);
  g_pendingSince[ac->index] = 0;
  if (ac->response != nullptr) {
    at_response_free(ac->response);
    ac->response = nullptr;
  }
  ac->response_prefix = nullptr;
  pthread_cond_broadcast(&ac->request_cond);
  pthread_mutex_unlock(&ac->request_lock);
  return err;
}

int32_t at_send_command_full(const char* command, int32_t type, const char* responsePrefix,
                             ATResponse** pp_outResponse) {
  // Callers release *out on every path; never leave it unset.
  if (pp_outResponse != nullptr) *pp_outResponse = nullptr;
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("getAtContext return null pointer!");
    return AT_ERROR_GENERIC;
  }
  if (command == nullptr) return AT_ERROR_GENERIC;
  {
    MutexGuard g(&ac->port_lock);
    if (pthread_equal(pthread_self(), ac->reader_thread)) return AT_ERROR_INVALID_THREAD;
  }
  int32_t err;
  {
    MutexGuard g(&ac->command_lock);
    err = at_send_command_full_nolock(command, type, responsePrefix, pp_outResponse);
  }
  if ((err == AT_ERROR_TIMEOUT || err == AT_ERROR_WRITE_FAILED) && ac->on_timeout != nullptr) {
    int32_t probe;
    {
      MutexGuard g(&ac->command_lock);
      probe = at_send_command_full_nolock("AT", at_type_none, nullptr, nullptr);
    }
    if (probe < 0) {
      ac->on_timeout();
      AT_LOGE("m%d_%d< timeout.", static_cast<int32_t>(g_ulModemId), ac->index);
    }
  }
  return err;
}

int32_t at_send_command(const char* command, ATResponse** pp_outResponse) {
  return at_send_command_full(command, at_type_none, nullptr, pp_outResponse);
}

namespace {

int32_t sendSingleline(const char* command, int32_t type, const char* responsePrefix,
                       ATResponse** pp_outResponse) {
  int32_t err = at_send_command_full(command, type, responsePrefix, pp_outResponse);
  if (pp_outResponse != nullptr && err == AT_OK && *pp_outResponse != nullptr &&
      (*pp_outResponse)->success > 0 && (*pp_outResponse)->p_intermediates == nullptr) {
    at_response_free(*pp_outResponse);
    *pp_outResponse = nullptr;
    return AT_ERROR_INVALID_RESPONSE;
  }
  return err;
}

}  // namespace

int32_t at_send_command_singleline(const char* command, const char* responsePrefix,
                                   ATResponse** pp_outResponse) {
  return sendSingleline(command, at_type_singleline, responsePrefix, pp_outResponse);
}

int32_t at_send_command_singleline_or_numeric(const char* command, const char* responsePrefix,
                                              ATResponse** pp_outResponse) {
  return sendSingleline(command, at_type_singleline_or_numeric, responsePrefix, pp_outResponse);
}

void at_set_on_timeout(AtTimeoutCallback onTimeout) {
  AtContext* ac = getAtContext();
  if (ac == nullptr) {
    AT_LOGE("getAtContext return null pointer!");
    return;
  }
  ac->on_timeout = onTimeout;
}

int64_t at_silence_micros(int32_t index) {
  if (index < 0 || index >= AT_MODEM_SLOTS) return 0;
  int64_t since = g_pendingSince[index];
  if (since == 0) return 0;
  int64_t last = g_lastAnswer[index];
  int64_t silent = monotonicMicros() - (last > since ? last : since);
  return silent > 0 ? silent : 0;
}

// Log stand-in: logcat threadtime layout on standard error, plus an optional
// in-memory capture for tests.
#include <android/log.h>
#include <host/log_capture.h>

#include <sys/syscall.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstdarg>
#include <cstdio>
#include <ctime>
#include <mutex>
#include <string>
#include <vector>

namespace {

struct CaptureState {
  std::mutex lock;
  int active = 0;  // number of live LogCapture objects
  bool quiet = false;
  std::vector<android::host::LogRecord> records;
};

CaptureState& capture() {
  static CaptureState* state = new CaptureState();  // lives past static destructors
  return *state;
}

const char* bufferName(int bufID) {
  switch (bufID) {
    case LOG_ID_RADIO: return "radio";
    case LOG_ID_EVENTS: return "events";
    case LOG_ID_SYSTEM: return "system";
    case LOG_ID_CRASH: return "crash";
    default: return "main";
  }
}

char priorityLetter(int prio) {
  switch (prio) {
    case ANDROID_LOG_VERBOSE: return 'V';
    case ANDROID_LOG_DEBUG: return 'D';
    case ANDROID_LOG_INFO: return 'I';
    case ANDROID_LOG_WARN: return 'W';
    case ANDROID_LOG_ERROR: return 'E';
    case ANDROID_LOG_FATAL: return 'F';
    default: return 'D';
  }
}

int emit(int bufID, int prio, const char* tag, const char* text) {
  if (tag == nullptr) tag = "";
  if (text == nullptr) text = "";
  bool quiet = false;
  {
    CaptureState& c = capture();
    std::lock_guard<std::mutex> g(c.lock);
    if (c.active > 0) {
      c.records.push_back({bufID, prio, tag, text});
      quiet = c.quiet;
    }
  }
  if (quiet) return 1;

  struct timeval tv;
  gettimeofday(&tv, nullptr);
  struct tm tmv;
  localtime_r(&tv.tv_sec, &tmv);
  std::string body(text);
  if (!body.empty() && body.back() == '\n') body.pop_back();
  char head[96];
  snprintf(head, sizeof(head), "[%s] %02d-%02d %02d:%02d:%02d.%03d %5d %5d %c ", bufferName(bufID),
           tmv.tm_mon + 1, tmv.tm_mday, tmv.tm_hour, tmv.tm_min, tmv.tm_sec,
           static_cast<int>(tv.tv_usec / 1000), static_cast<int>(getpid()),
           static_cast<int>(syscall(SYS_gettid)), priorityLetter(prio));
  std::string line = std::string(head) + tag + ": " + body + "\n";
  // One write per record keeps lines from different threads whole.
  ssize_t unused = write(STDERR_FILENO, line.data(), line.size());
  (void)unused;
  return 1;
}

std::string vformat(const char* fmt, va_list ap) {
  if (fmt == nullptr) return "";
  va_list copy;
  va_copy(copy, ap);
  char small[512];
  int n = vsnprintf(small, sizeof(small), fmt, copy);
  va_end(copy);
  if (n < 0) return "";
  if (static_cast<size_t>(n) < sizeof(small)) return std::string(small, n);
  std::string big(static_cast<size_t>(n) + 1, '\0');
  vsnprintf(&big[0], big.size(), fmt, ap);
  big.resize(n);
  return big;
}

}  // namespace

extern "C" int __android_log_write(int prio, const char* tag, const char* text) {
  return emit(LOG_ID_MAIN, prio, tag, text);
}

extern "C" int __android_log_buf_write(int bufID, int prio, const char* tag, const char* text) {
  return emit(bufID, prio, tag, text);
}

extern "C" int __android_log_print(int prio, const char* tag, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  std::string text = vformat(fmt, ap);
  va_end(ap);
  return emit(LOG_ID_MAIN, prio, tag, text.c_str());
}

extern "C" int __android_log_buf_print(int bufID, int prio, const char* tag, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  std::string text = vformat(fmt, ap);
  va_end(ap);
  return emit(bufID, prio, tag, text.c_str());
}

namespace android {
namespace host {

LogCapture::LogCapture(bool quiet) {
  CaptureState& c = capture();
  std::lock_guard<std::mutex> g(c.lock);
  if (c.active++ == 0) c.records.clear();
  c.quiet = quiet;
}

LogCapture::~LogCapture() {
  CaptureState& c = capture();
  std::lock_guard<std::mutex> g(c.lock);
  if (--c.active == 0) {
    c.records.clear();
    c.quiet = false;
  }
}

std::vector<LogRecord> LogCapture::records() const {
  CaptureState& c = capture();
  std::lock_guard<std::mutex> g(c.lock);
  return c.records;
}

void LogCapture::clear() {
  CaptureState& c = capture();
  std::lock_guard<std::mutex> g(c.lock);
  c.records.clear();
}

std::vector<LogRecord> LogCapture::find(const std::string& needle, const std::string& tag) const {
  std::vector<LogRecord> out;
  for (auto& r : records()) {
    if ((tag.empty() || r.tag == tag) && r.text.find(needle) != std::string::npos) out.push_back(r);
  }
  return out;
}

}  // namespace host
}  // namespace android

#pragma once
// Test seam of the log stand-in: while a LogCapture lives, every record is
// also kept in memory, so tests can assert what was logged.
#include <string>
#include <vector>

namespace android {
namespace host {

struct LogRecord {
  int buffer;    // LOG_ID_MAIN or LOG_ID_RADIO
  int priority;  // ANDROID_LOG_*
  std::string tag;
  std::string text;  // the formatted message, trailing newline kept as given
};

class LogCapture {
 public:
  // With quiet, records are not written to standard error while captured.
  explicit LogCapture(bool quiet = true);
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<LogRecord> records() const;
  void clear();
  // Records whose text contains `needle` (and whose tag equals `tag` unless empty).
  std::vector<LogRecord> find(const std::string& needle, const std::string& tag = "") const;
  bool contains(const std::string& needle, const std::string& tag = "") const {
    return !find(needle, tag).empty();
  }
};

}  // namespace host
}  // namespace android

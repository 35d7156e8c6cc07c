// Captures the lines the library writes to the system log, for the lifetime
// of the object. Not thread-safe: one capture at a time.
#ifndef QUVAIDX_TESTS_SUPPORT_LOG_CAPTURE_H_
#define QUVAIDX_TESTS_SUPPORT_LOG_CAPTURE_H_

#include <string>
#include <vector>

#include "util/hooks.h"

namespace quvaidx::test {

struct LogLine {
  int priority;
  std::string text;
};

class LogCapture {
 public:
  // Starts capturing and sets g_log_level to `level`.
  explicit LogCapture(int level = 3);
  ~LogCapture();  // restores the previous sink and level

  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  const std::vector<LogLine>& lines() const;
  // Texts only, with the "module:line " prefix replaced by "module:N ".
  std::vector<std::string> Normalized() const;
  // Number of lines whose normalized text equals `text`.
  int Count(const std::string& text) const;
  void Clear();

 private:
  LogSink previous_sink_;
  int previous_level_;
};

// Replaces "name:123 " at the start of a log line with "name:N ".
std::string NormalizeLine(const std::string& line);

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_LOG_CAPTURE_H_

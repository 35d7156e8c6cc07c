#include "support/log_capture.h"

#include <ctype.h>

#include <algorithm>

#include "quvaidx/log.h"

namespace quvaidx::test {
namespace {

std::vector<LogLine>& Captured() {
  static std::vector<LogLine> lines;
  return lines;
}

void CaptureSink(int priority, const char* line) {
  Captured().push_back({priority, line});
}

}  // namespace

LogCapture::LogCapture(int level)
    : previous_sink_(SetLogSink(CaptureSink)), previous_level_(g_log_level) {
  Captured().clear();
  g_log_level = level;
}

LogCapture::~LogCapture() {
  SetLogSink(previous_sink_);
  g_log_level = previous_level_;
  Captured().clear();
}

const std::vector<LogLine>& LogCapture::lines() const { return Captured(); }

std::vector<std::string> LogCapture::Normalized() const {
  std::vector<std::string> out;
  for (const LogLine& line : Captured())
    out.push_back(NormalizeLine(line.text));
  return out;
}

int LogCapture::Count(const std::string& text) const {
  std::vector<std::string> all = Normalized();
  return static_cast<int>(std::count(all.begin(), all.end(), text));
}

void LogCapture::Clear() { Captured().clear(); }

std::string NormalizeLine(const std::string& line) {
  size_t colon = line.find(':'), end = colon + 1;
  if (colon == std::string::npos) return line;
  while (end < line.size() && isdigit(static_cast<unsigned char>(line[end])))
    ++end;
  if (end == colon + 1) return line;
  return line.substr(0, colon + 1) + "N" + line.substr(end);
}

}  // namespace quvaidx::test

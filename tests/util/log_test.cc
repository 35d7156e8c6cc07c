#include "quvaidx/log.h"

#include <syslog.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/log_capture.h"

namespace {

// Lines above the threshold are dropped; what passes is written at error
// priority whatever its level, its arguments unchanged (never a format),
// cut at 16383 bytes. JSON follows the message with its line feed, cut to
// fit the line, or dropped when the message fills it.
TEST(LogTest, ThresholdPriorityArgumentsAndBounds) {
  quvaidx::test::LogCapture log;  // threshold 3, as at start-up
  Json::Value task(Json::objectValue);
  task["command"] = "SCAN";
  AppLogError(4, "%s:%d warning", "m", 1);
  AppLogJson(4, task, "%s", "warning");
  AppLogError(3, "%s:%d open %s", "m", 2, "/share/a%20b%s%n");
  ChageLogLevel(7);
  EXPECT_EQ(g_log_level, 7);
  AppLogError(7, "%s", std::string(20000, 'x').c_str());
  AppLogJson(7, task, "%s:%d got ", "m", 5);
  AppLogJson(3, task, "%s", std::string(16380, 'z').c_str());
  AppLogJson(3, task, "%s", std::string(16390, 'y').c_str());
  ChageLogLevel(2);
  AppLogError(3, "%s", "error");
  AppLogJson(3, task, "%s", "json");
  const std::vector<std::string> expected = {
      "m:2 open /share/a%20b%s%n", std::string(16383, 'x'),
      "m:5 got {\"command\":\"SCAN\"}\n", std::string(16380, 'z') + "{\"c",
      std::string(16383, 'y')};
  ASSERT_EQ(log.lines().size(), expected.size());
  for (size_t i = 0; i < expected.size(); ++i) {
    EXPECT_EQ(log.lines()[i].text, expected[i]) << i;
    EXPECT_EQ(log.lines()[i].priority, LOG_ERR) << i;
  }
}

}  // namespace

#include "quvaidx/log.h"

#include <syslog.h>

#include <string>

#include <gtest/gtest.h>

#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;

// Lines above the threshold are dropped; what passes is written at error
// priority whatever its level.
TEST(LogTest, ThresholdDecidesAndPriorityIsError) {
  LogCapture log;  // threshold 3, as at start-up
  AppLogError(4, "%s:%d warning", "m", 1);
  AppLogError(3, "%s:%d error", "m", 2);
  ChageLogLevel(7);
  EXPECT_EQ(g_log_level, 7);
  AppLogError(7, "%s:%d debug", "m", 3);
  ChageLogLevel(2);
  AppLogError(3, "%s", "error");
  Json::Value value(Json::objectValue);
  AppLogJson(3, value, "%s", "json");
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.lines()[0].text, "m:2 error");
  EXPECT_EQ(log.lines()[1].text, "m:3 debug");
  EXPECT_EQ(log.lines()[1].priority, LOG_ERR);
}

TEST(LogTest, ArgumentsAreWrittenUnchangedAndCutAt16383Bytes) {
  LogCapture log;
  AppLogError(3, "%s:%d open %s", "m", 1, "/share/a%20b%s%n");
  AppLogError(3, "%s", std::string(20000, 'x').c_str());
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.lines()[0].text, "m:1 open /share/a%20b%s%n");
  EXPECT_EQ(log.lines()[1].text, std::string(16383, 'x'));
}

// JSON follows the message with its line feed, cut to fit the line, or
// dropped when the message fills it.
TEST(LogTest, JsonFollowsTheMessage) {
  LogCapture log;
  Json::Value task(Json::objectValue);
  task["command"] = "SCAN";
  task["n"] = 2;
  AppLogJson(3, task, "%s:%d got ", "m", 5);
  AppLogJson(3, task, "%s", std::string(16380, 'z').c_str());
  AppLogJson(3, task, "%s", std::string(16390, 'y').c_str());
  ASSERT_EQ(log.lines().size(), 3u);
  EXPECT_EQ(log.lines()[0].text, "m:5 got {\"command\":\"SCAN\",\"n\":2}\n");
  EXPECT_EQ(log.lines()[1].text, std::string(16380, 'z') + "{\"c");
  EXPECT_EQ(log.lines()[2].text, std::string(16383, 'y'));
}

}  // namespace

#include "quvaidx/log.h"

#include <syslog.h>

#include <string>

#include <gtest/gtest.h>

#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;

TEST(LogTest, LinesAboveTheThresholdAreDropped) {
  LogCapture log;  // threshold 3, as at start-up
  AppLogError(7, "%s:%d debug", "m", 1);
  AppLogError(6, "%s:%d progress", "m", 2);
  AppLogError(3, "%s:%d error", "m", 3);
  AppLogError(0, "%s:%d emergency", "m", 4);
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.lines()[0].text, "m:3 error");
  EXPECT_EQ(log.lines()[1].text, "m:4 emergency");
}

TEST(LogTest, RaisedLevelStillLogsAtErrorPriority) {
  LogCapture log;
  ChageLogLevel(7);
  EXPECT_EQ(g_log_level, 7);
  AppLogError(7, "%s:%d [Error] connect server: %d, %s", "quvaidx_ipc_core", 10,
              0, "/tmp/x");
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].priority, LOG_ERR);
  EXPECT_EQ(log.lines()[0].text,
            "quvaidx_ipc_core:10 [Error] connect server: 0, /tmp/x");
}

TEST(LogTest, LoweredLevelSilencesErrors) {
  LogCapture log;
  ChageLogLevel(2);
  AppLogError(3, "%s", "error");
  Json::Value value(Json::objectValue);
  AppLogJson(3, value, "%s", "json");
  EXPECT_TRUE(log.lines().empty());
}

TEST(LogTest, LongMessageIsCutAt16383Bytes) {
  LogCapture log;
  std::string message(20000, 'x');
  AppLogError(3, "%s", message.c_str());
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].text, std::string(16383, 'x'));
}

TEST(LogTest, PercentInArgumentIsWrittenUnchanged) {
  LogCapture log;
  AppLogError(3, "%s:%d open %s", "m", 1, "/share/a%20b%s%n");
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].text, "m:1 open /share/a%20b%s%n");
}

TEST(LogTest, JsonFollowsTheMessageWithItsLineFeed) {
  LogCapture log;
  Json::Value empty(Json::objectValue);
  AppLogJson(3, empty, "%s:%d task ", "m", 5);
  Json::Value task(Json::objectValue);
  task["command"] = "SCAN";
  task["n"] = 2;
  AppLogJson(3, task, "%s", "got ");
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.lines()[0].text, "m:5 task {}\n");
  EXPECT_EQ(log.lines()[1].text, "got {\"command\":\"SCAN\",\"n\":2}\n");
}

TEST(LogTest, JsonIsDroppedWhenTheMessageFillsTheLine) {
  LogCapture log;
  std::string message(16390, 'y');
  Json::Value value(Json::objectValue);
  value["k"] = "v";
  AppLogJson(3, value, "%s", message.c_str());
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].text, std::string(16383, 'y'));
}

TEST(LogTest, JsonIsCutToFitTheLine) {
  LogCapture log;
  std::string message(16380, 'z');
  Json::Value value(Json::objectValue);
  value["key"] = "value";
  AppLogJson(3, value, "%s", message.c_str());
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].text, message + "{\"k");
}

}  // namespace

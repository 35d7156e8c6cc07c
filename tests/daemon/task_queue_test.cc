// Task queues on real System V message queues, removed in TearDown.
#include "quvaidx/task_queue.h"

#include <fcntl.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace quvaidx::test {
namespace {

// A task whose compact JSON text, line feed included, is `size` bytes.
Json::Value TaskOfTextSize(size_t size) {
  Json::Value task(Json::objectValue);
  task["k"] = std::string(size - 9, 't');
  return task;
}

Json::Value Task(int n) {
  Json::Value task;
  task["n"] = n;
  return task;
}

class TaskQueueTest : public ::testing::Test {
 protected:
  void SetUp() override {
    close(open(key_file_.c_str(), O_CREAT | O_WRONLY, 0600));
    id_ = CreateMessageQueue(key_file_.c_str(), kProject, 64);
    ASSERT_GE(id_, 0);
  }
  void TearDown() override { DeleteMessageQueue(key_file_.c_str(), kProject); }

  static constexpr int kProject = 7;
  TempDir dir_;
  std::string key_file_ = dir_.File("queue.key");
  int id_ = -1;
  FakeSleep sleep_;
};

// The text area is the smallest size class that holds the zero byte; 8192
// bytes of text fit none.
TEST_F(TaskQueueTest, TextAreaSizeClasses) {
  LogCapture log;
  const std::pair<size_t, unsigned> kAreas[] = {
      {1023, 1024}, {1024, 4096}, {4096, 8192}, {8191, 8192}};
  for (const auto& [text, area] : kAreas) {
    ASSERT_EQ(PushTaskToQueue(id_, TaskOfTextSize(text), 1), 0) << text;
    struct msqid_ds status;
    ASSERT_EQ(msgctl(id_, IPC_STAT, &status), 0);
    EXPECT_EQ(status.__msg_cbytes, area) << text;
    Json::Value out;
    ASSERT_EQ(PopTaskFromQueue(id_, 0, false, 1, out), 0);
    EXPECT_EQ(out, TaskOfTextSize(text));
  }
  EXPECT_EQ(PushTaskToQueue(id_, TaskOfTextSize(8192), 1), -1);
  EXPECT_EQ(GetNumOfMessageInQueue(id_), 0);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.Normalized()[0].substr(0, 52),
            "quvaidx_daemon:N [Error] message is too big: {\"k\":\"t");
}

// A positive type pops exactly that type, a negative one the lowest type up
// to its size, zero the oldest; a push needs a type above zero.
TEST_F(TaskQueueTest, TypesSelectAsTheSystemDoes) {
  LogCapture log;
  for (int type : {5, 2, 9, 2})
    ASSERT_EQ(PushTaskToQueue(id_, Task(type), type), 0);
  Json::Value out;
  ASSERT_EQ(PopTaskFromQueue(id_, 9, false, 1, out), 0);  // exactly 9
  EXPECT_EQ(out["n"].asInt(), 9);
  ASSERT_EQ(PopTaskFromQueue(id_, -6, false, 1, out), 0);  // lowest <= 6
  EXPECT_EQ(out["n"].asInt(), 2);
  ASSERT_EQ(PopTaskFromQueue(id_, 0, false, 1, out), 0);  // oldest
  EXPECT_EQ(out["n"].asInt(), 5);
  EXPECT_EQ(GetNumOfMessageInQueue(id_), 1);
  EXPECT_EQ(PopTaskFromQueue(id_, 3, false, 1, out), -1);  // none of type 3
  EXPECT_EQ(PushTaskToQueue(id_, Task(1), 0), -1);
  EXPECT_EQ(PushTaskToQueue(id_, Task(1), -3), -1);
  EXPECT_EQ(log.Count("quvaidx_daemon:N [Error] msgsnd: Invalid argument"), 2);
}

// A non-blocking pop sleeps once per attempt, a blocking one waits for a push
// or the queue's removal; a pop from a removed queue fails at once, logged.
TEST_F(TaskQueueTest, PopWaitsAsAsked) {
  LogCapture log;
  Json::Value out;
  EXPECT_EQ(PopTaskFromQueue(id_, 0, false, 3, out), -1);
  EXPECT_EQ(sleep_.calls(), 3);
  EXPECT_EQ(PopTaskFromQueue(id_, 0, false, 0, out), -1);
  EXPECT_EQ(sleep_.calls(), 3);
  EXPECT_TRUE(log.lines().empty());
  struct {
    long type;
    char text[1024];
  } raw = {1, "not json at all"};  // still taken off the queue, quietly
  ASSERT_EQ(msgsnd(id_, &raw, sizeof(raw.text), 0), 0);
  EXPECT_EQ(PopTaskFromQueue(id_, 0, false, 1, out), 0);
  EXPECT_EQ(GetNumOfMessageInQueue(id_), 0);
  std::thread pusher([&] {
    usleep(50 * 1000);
    PushTaskToQueue(id_, Task(42), 4);
  });
  EXPECT_EQ(PopTaskFromQueue(id_, 4, true, 0, out), 0);
  pusher.join();
  EXPECT_EQ(out["n"].asInt(), 42);
  std::thread remover([&] {
    usleep(50 * 1000);
    DeleteMessageQueue(key_file_.c_str(), kProject);
  });
  EXPECT_EQ(PopTaskFromQueue(id_, 0, true, 1, out), -1);
  remover.join();
  EXPECT_EQ(PopTaskFromQueue(id_, 0, false, 5, out), -1);  // no queue: at once
  EXPECT_EQ(sleep_.calls(), 3);
  EXPECT_EQ(log.Normalized(),
            (std::vector<std::string>{
                "quvaidx_daemon:N [Error] msgrcv: Identifier removed",
                "quvaidx_daemon:N [Error] msgrcv: Invalid argument"}));
  EXPECT_EQ(GetNumOfMessageInQueue(id_), -1);
}

TEST_F(TaskQueueTest, CreateDiscardsWhatAnEarlierRunLeftAndMissingOnesFail) {
  ASSERT_EQ(PushTaskToQueue(id_, Task(1), 1), 0);
  int fresh = CreateMessageQueue(key_file_.c_str(), kProject, 2);
  ASSERT_GE(fresh, 0);
  EXPECT_EQ(GetNumOfMessageInQueue(fresh), 0);
  EXPECT_EQ(GetNumOfMessageInQueue(id_), -1);  // the old queue is gone
  struct msqid_ds status;
  ASSERT_EQ(msgctl(fresh, IPC_STAT, &status), 0);
  EXPECT_EQ(status.msg_qbytes, 2048u);
  id_ = fresh;
  LogCapture log;  // only calls without a queue or a key file fail, logged
  EXPECT_EQ(GetMessageQueue(key_file_.c_str(), kProject), fresh);
  EXPECT_TRUE(log.lines().empty());
  ASSERT_EQ(DeleteMessageQueue(key_file_.c_str(), kProject), 0);
  EXPECT_EQ(DeleteMessageQueue(key_file_.c_str(), kProject), 0);
  EXPECT_EQ(GetMessageQueue(key_file_.c_str(), kProject), -1);
  EXPECT_EQ(GetNumOfMessageInQueue(-1), -1);
  std::string missing = dir_.File("missing");
  EXPECT_EQ(CreateMessageQueue(missing.c_str(), 1, 64), -1);
  EXPECT_EQ(GetMessageQueue(missing.c_str(), 1), -1);
  EXPECT_EQ(DeleteMessageQueue(missing.c_str(), 1), -1);
  EXPECT_EQ(log.Count("quvaidx_daemon:N [Error] ftok: No such file or "
                      "directory"),
            3);
}

}  // namespace
}  // namespace quvaidx::test

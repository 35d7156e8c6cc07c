// Process statistics on this process, on a missing pid, and the /proc
// parsers on chosen texts.
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "util/proc_parse.h"

namespace {

pid_t DeadPid() {
  pid_t child = fork();
  if (child == 0) _exit(0);
  waitpid(child, nullptr, 0);
  return child;
}

TEST(ProcStatsTest, OwnProcess) {
  // What "ls -l /proc/PID/fd | wc -l" prints for a caller asking about
  // itself: its descriptors, the pipe of the command, the header line.
  int open_now = quvaidx::test::OpenDescriptorCount();
  EXPECT_EQ(GetFileDescriptorNum(getpid()), open_now + 2);
  long rss = 0;
  long vmsize = 0;
  ASSERT_EQ(GetMemoryUsagekb(getpid(), rss, vmsize), 0);
  EXPECT_GT(rss, 0);
  EXPECT_GE(vmsize, rss);
  long total = 0;
  ASSERT_EQ(GetTotalMemory(total), 0);
  EXPECT_GT(total, rss);
}

TEST(ProcStatsTest, MissingProcess) {
  pid_t dead = DeadPid();
  EXPECT_EQ(GetFileDescriptorNum(dead), 0);
  long rss = 7;
  long vmsize = 7;
  EXPECT_EQ(GetMemoryUsagekb(dead, rss, vmsize), -1);
  EXPECT_EQ(rss, -1);
  EXPECT_EQ(vmsize, -1);
}

TEST(ProcParseTest, StatusLines) {
  const struct {
    std::string text;
    bool found;
    long rss;
    long vmsize;
  } kCases[] = {
      {"Name:\tx\nVmSize:\t  2048 kB\nVmRSS:\t   512 kB\n", true, 512, 2048},
      {"Name:\tkthreadd\nState:\tS\n", false, -1, -1},  // a kernel thread
      {"VmRSS:\nVmSize:\t9 kB\n", true, -1, 9},          // label, no number
      {"VmSize: 3 kB", false, -1, 3},                    // no VmRSS at all
      {"xVmRSS: 1 kB\nVmSize:x 2 kB\n", true, 1, 2},     // found anywhere
      {"VmRSS:\t-5 kB\nVmSize:\t+6 kB\n", true, -5, 6},
  };
  for (const auto& c : kCases) {
    long rss = 0;
    long vmsize = 0;
    EXPECT_EQ(quvaidx::ParseProcStatus(c.text.data(), c.text.size(), &rss,
                                       &vmsize),
              c.found)
        << c.text;
    EXPECT_EQ(rss, c.rss) << c.text;
    EXPECT_EQ(vmsize, c.vmsize) << c.text;
  }
}

TEST(ProcParseTest, LinesBeyondTheFirst4096BytesAreNotSeen) {
  std::string text = std::string(4090, 'x') + "\nVmRSS: 1 kB\nVmSize: 2 kB\n";
  long rss = 0;
  long vmsize = 0;
  EXPECT_FALSE(
      quvaidx::ParseProcStatus(text.data(), text.size(), &rss, &vmsize));
  long total = 0;
  std::string meminfo = std::string(4095, ' ') + "\nMemTotal: 5 kB\n";
  EXPECT_FALSE(quvaidx::ParseMemInfo(meminfo.data(), meminfo.size(), &total));
}

TEST(ProcParseTest, MemTotal) {
  std::string text = "MemFree: 1 kB\nMemTotal:  24000000 kB\nMemTotal: 3\n";
  long total = 0;
  EXPECT_TRUE(quvaidx::ParseMemInfo(text.data(), text.size(), &total));
  EXPECT_EQ(total, 24000000);
  EXPECT_FALSE(quvaidx::ParseMemInfo("", 0, &total));
  EXPECT_EQ(total, -1);
}

}  // namespace

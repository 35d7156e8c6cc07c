// Process statistics of this process and of a missing pid, and the /proc
// parsers on chosen texts.
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "util/proc_parse.h"

namespace {

// What "ls -l /proc/PID/fd | wc -l" prints: the descriptors, the command's
// pipe and the header line. A missing process has none and no memory.
TEST(ProcStatsTest, OwnAndMissingProcess) {
  quvaidx::test::FdLeakCheck leaks;  // the listing is closed again
  EXPECT_EQ(GetFileDescriptorNum(getpid()),
            quvaidx::test::OpenDescriptorCount() + 2);
  EXPECT_TRUE(leaks.NoLeak());
  long rss = 0, vmsize = 0, total = 0;
  ASSERT_EQ(GetMemoryUsagekb(getpid(), rss, vmsize), 0);
  EXPECT_GT(rss, 0);
  EXPECT_GE(vmsize, rss);
  ASSERT_EQ(GetTotalMemory(total), 0);
  EXPECT_GT(total, rss);
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  waitpid(dead, nullptr, 0);
  EXPECT_EQ(GetFileDescriptorNum(dead), 0);
  EXPECT_EQ(GetMemoryUsagekb(dead, rss, vmsize), -1);
  EXPECT_EQ(rss, -1);
  EXPECT_EQ(vmsize, -1);
}

// A label is found anywhere in a line, and counts without a number; only
// the first 4 KiB are read; the first MemTotal counts.
TEST(ProcParseTest, StatusAndMemInfoLines) {
  const std::tuple<std::string, bool, long, long> kCases[] = {
      {"Name:\tx\nVmSize:\t  2048 kB\nVmRSS:\t   512 kB\n", true, 512, 2048},
      {"Name:\tkthreadd\nState:\tS\n", false, -1, -1},  // a kernel thread
      {"VmRSS:\nVmSize:\t9 kB\n", true, -1, 9},         // label, no number
      {"xVmRSS: 1 kB\nVmSize:x 2 kB\n", true, 1, 2},    // found anywhere
      {"VmRSS: 1 kB\n", false, 1, -1},
      {std::string(4090, 'x') + "\nVmRSS: 1 kB\n", false, -1, -1}};  // > 4 KiB
  for (const auto& [text, found, expected_rss, expected_vmsize] : kCases) {
    SCOPED_TRACE(text.substr(0, 40));
    long rss = 0, vmsize = 0;
    EXPECT_EQ(quvaidx::ParseProcStatus(text.data(), text.size(), &rss, &vmsize),
              found);
    EXPECT_EQ(rss, expected_rss);
    EXPECT_EQ(vmsize, expected_vmsize);
  }
  std::string text = "MemFree: 1 kB\nMemTotal:  24000000 kB\nMemTotal: 3\n";
  long total = 0;
  EXPECT_TRUE(quvaidx::ParseMemInfo(text.data(), text.size(), &total));
  EXPECT_EQ(total, 24000000);
  EXPECT_FALSE(quvaidx::ParseMemInfo("", 0, &total));
  EXPECT_EQ(total, -1);
  text = std::string(4095, ' ') + "\nMemTotal: 5 kB\n";
  EXPECT_FALSE(quvaidx::ParseMemInfo(text.data(), text.size(), &total));
}

}  // namespace

#include <errno.h>
#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(BootStepTest, MissingFileCountsAsBooted) {
  HostEtc etc;
  EXPECT_EQ(QUVASystemGetBootStep(), QUVA_BOOT_STEP_READY);
}

TEST(BootStepTest, FileContents) {
  HostEtc etc;
  struct Case {
    const char* text;
    int step;
  } cases[] = {{"4", 4},    {"2\n", 2},        {" 3 \r\n", 3}, {"0", 0},
               {"", -1},    {"\n", -1},        {"four", -1},   {"-1", -1},
               {"4 4", -1}, {"2147483648", -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    WriteFile(etc.File("boot_step"), c.text);
    EXPECT_EQ(QUVASystemGetBootStep(), c.step);
    if (c.step < 0) {
      EXPECT_EQ(QLIBCErrGet(), EINVAL);
    }
  }
}

TEST(BootStepTest, DirectoryInPlaceOfFileIsAFailureNotBooted) {
  HostEtc etc;
  ASSERT_EQ(mkdir(etc.File("boot_step").c_str(), 0755), 0);
  EXPECT_EQ(QUVASystemGetBootStep(), -1);
  EXPECT_EQ(QLIBCErrGet(), EISDIR);
}

TEST(BootStepTest, EnvironmentIsReadOnEveryCall) {
  HostEtc first;
  WriteFile(first.File("boot_step"), "1");
  EXPECT_EQ(QUVASystemGetBootStep(), 1);
  {
    HostEtc second;
    WriteFile(second.File("boot_step"), "3");
    EXPECT_EQ(QUVASystemGetBootStep(), 3);
  }
  EXPECT_EQ(QUVASystemGetBootStep(), 1);
}

TEST(ErrorStackTest, FailureRecordsCodeFileAndLine) {
  char buffer[16];
  EXPECT_EQ(QUVAEADirPath(7, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_STREQ(QLIBCErrorGetFile(), "ea_dir.cc");
  EXPECT_GT(QLIBCErrorGetLine(), 0);
}

TEST(ErrorStackTest, SuccessKeepsTheLastFailure) {
  char buffer[64];
  EXPECT_EQ(QUVAGetFSType("/nonexistent/x", 0), -1);
  int line = QLIBCErrorGetLine();
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, sizeof buffer), 0);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_STREQ(QLIBCErrorGetFile(), "fs_type.cc");
  EXPECT_EQ(QLIBCErrorGetLine(), line);
}

TEST(ErrorStackTest, EachThreadHasItsOwn) {
  EXPECT_EQ(QUVAGetFSType("/nonexistent/x", 0), -1);
  int other_code = -1;
  const char* other_file = nullptr;
  std::thread([&] {
    other_code = QLIBCErrGet();
    other_file = QLIBCErrorGetFile();
    EXPECT_EQ(QUVAEAIsHiddenDir(nullptr), 0);
    char buffer[4];
    QUVAEADirPath(0, "/a/long-name", buffer, sizeof buffer);  // ERANGE
  }).join();
  EXPECT_EQ(other_code, 0);
  EXPECT_STREQ(other_file, "");
  EXPECT_EQ(QLIBCErrGet(), ENOENT) << "the other thread's failure stays there";
}

}  // namespace
}  // namespace quvahost::test

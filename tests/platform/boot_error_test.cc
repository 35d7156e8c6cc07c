#include <errno.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <thread>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(BootStepTest, FileContents) {
  HostEtc etc;
  EXPECT_EQ(QUVASystemGetBootStep(), QUVA_BOOT_STEP_READY);  // no file
  const struct {
    const char* text;
    int step;
  } cases[] = {{" 3 \r\n", 3}, {"0", 0},    {"", -1},
               {"four", -1},   {"4 4", -1}, {"2147483648", -1}};
  for (const auto& c : cases) {
    WriteFile(etc.File("boot_step"), c.text);
    EXPECT_EQ(QUVASystemGetBootStep(), c.step) << c.text;
    EXPECT_TRUE(c.step >= 0 || QLIBCErrGet() == EINVAL);
  }
  {
    HostEtc other;  // the directory is looked up on every call
    ASSERT_EQ(mkdir(other.File("boot_step").c_str(), 0755), 0);
    EXPECT_EQ(QUVASystemGetBootStep(), -1) << "a directory is not booted";
    EXPECT_EQ(QLIBCErrGet(), EISDIR);
  }
  EXPECT_EQ(QUVASystemGetBootStep(), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

TEST(ErrorStackTest, LastFailureOfThisThreadWithFileAndLine) {
  char buffer[64];
  EXPECT_EQ(QUVAEADirPath(7, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_STREQ(QLIBCErrorGetFile(), "ea_dir.cc");
  EXPECT_EQ(QUVAGetFSType("/nonexistent/x", 0), -1);
  int line = QLIBCErrorGetLine();
  EXPECT_GT(line, 0);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, sizeof buffer), 0);
  int other_code = -1;
  const char* other_file = nullptr;
  std::thread([&] {
    other_code = QLIBCErrGet();
    other_file = QLIBCErrorGetFile();
    QUVAEADirPath(0, "/a/long-name", buffer, 4);  // ERANGE
  }).join();
  EXPECT_EQ(other_code, 0);
  EXPECT_STREQ(other_file, "");
  EXPECT_EQ(QLIBCErrGet(), ENOENT) << "kept after success and other threads";
  EXPECT_STREQ(QLIBCErrorGetFile(), "fs_type.cc");
  EXPECT_EQ(QLIBCErrorGetLine(), line);
}

}  // namespace
}  // namespace quvahost::test

// What tests of host callers rely on the fake for.
#include "support/fake_host.h"

#include <errno.h>
#include <gtest/gtest.h>

#include "host_test_util.h"

namespace quvahost::test {
namespace {

TEST(FakeHostTest, FailsAnswersCountsAndRestores) {
  HostEtc etc;
  {
    FakeHost host;
    host.Fail(HostOp::kGetFSType, ENAMETOOLONG);
    errno = 0;
    EXPECT_EQ(QUVAGetFSType("/", 0), -1);
    EXPECT_EQ(errno, ENAMETOOLONG);
    EXPECT_EQ(QLIBCErrGet(), ENAMETOOLONG);
    EXPECT_STREQ(QLIBCErrorGetFile(), "fake_host.cc");
    host.Fail(HostOp::kUnicodeUTF8ForwardNChar);
    EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar("abc", 1), nullptr);
    host.AddShare("video", "/vol1/video", 0);
    host.Fail(HostOp::kShareGet, EIO, -3);
    ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
    EXPECT_EQ(QUVAShareGet("video", &record), -3);
    EXPECT_EQ(record, nullptr);
    host.Answer(HostOp::kSystemGetBootStep, {2, 3});
    EXPECT_EQ(QUVASystemGetBootStep(), 2);
    EXPECT_EQ(QUVASystemGetBootStep(), 3);
    EXPECT_EQ(QUVASystemGetBootStep(), 3);
    EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), 3);
    host.Pass(HostOp::kSystemGetBootStep);
    EXPECT_EQ(QUVASystemGetBootStep(), 4);
    host.Fail(HostOp::kEAIsHiddenDir);
  }
  EXPECT_EQ(QUVAEAIsHiddenDir(".quvameta"), 1);
}

TEST(FakeHostTest, SharesFollowThePathRulesAndRecordsAreCounted) {
  FakeHost host;
  host.AddShare("video", "/vol1/video/", 0);
  host.AddShare("movies", "/vol1/video/movies", 0);
  ShareRecord* record = nullptr;
  ASSERT_EQ(QUVAShareGetByAttrStr("/vol1/video/movies/a.mkv", 1, &record), 0);
  EXPECT_STREQ(record->szName, "movies");
  EXPECT_EQ(host.OutstandingShareRecords(), 1);
  QUVAShareFree(record);
  EXPECT_EQ(QUVAShareGetByAttrStr("/vol1/videos", 1, &record), -1);
  ASSERT_EQ(QUVAShareGet("video", &record), 0);
  EXPECT_STREQ(record->szPath, "/vol1/video");
  record->uStatus = 0x20;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  EXPECT_EQ(host.OutstandingShareRecords(), 0);
  ASSERT_EQ(host.ShareUpdates().size(), 1u);
  EXPECT_EQ(host.ShareStatus("video"), 0x20u);
}

}  // namespace
}  // namespace quvahost::test

// Tests of the fault and answer layer itself: what later tests of host
// callers rely on.
#include "support/fake_host.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(FakeHostTest, PassesThroughAndCounts) {
  HostEtc etc;
  FakeHost host;
  EXPECT_EQ(QUVASystemGetBootStep(), 4);
  EXPECT_EQ(QUVAEAIsHiddenDir(".quvameta"), 1);
  EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), 1);
  EXPECT_EQ(host.Calls(HostOp::kEAIsHiddenDir), 1);
  EXPECT_EQ(host.Calls(HostOp::kGetFSType), 0);
}

TEST(FakeHostTest, FailSetsResultErrnoAndErrorStack) {
  FakeHost host;
  host.Fail(HostOp::kGetFSType, ENAMETOOLONG);
  errno = 0;
  EXPECT_EQ(QUVAGetFSType("/", 0), -1);
  EXPECT_EQ(errno, ENAMETOOLONG);
  EXPECT_EQ(QLIBCErrGet(), ENAMETOOLONG);
  EXPECT_STREQ(QLIBCErrorGetFile(), "fake_host.cc");
  EXPECT_GT(QLIBCErrorGetLine(), 0);
  host.Fail(HostOp::kShareUpdate, EIO, -3);
  ShareRecord record{};
  EXPECT_EQ(QUVAShareUpdate(&record), -3);
}

TEST(FakeHostTest, FailedPointerOperationReturnsNull) {
  FakeHost host;
  host.Fail(HostOp::kUnicodeUTF8ForwardNChar);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar("abc", 1), nullptr);
}

TEST(FakeHostTest, FailedShareLookupNullsTheRecord) {
  FakeHost host;
  host.AddShare("video", "/vol1/video", 0);
  host.Fail(HostOp::kShareGet);
  ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
  EXPECT_EQ(QUVAShareGet("video", &record), -1);
  EXPECT_EQ(record, nullptr);
}

TEST(FakeHostTest, FailNthFailsOnlyThatCall) {
  FakeHost host;
  host.FailNth(HostOp::kEAIsHiddenDir, 2, EIO, 0);
  host.FailNth(HostOp::kGetFSType, 2);
  EXPECT_GE(QUVAGetFSType("/", 0), 0);
  EXPECT_EQ(QUVAGetFSType("/", 0), -1);
  EXPECT_GE(QUVAGetFSType("/", 0), 0);
}

TEST(FakeHostTest, AnswersInSequenceLastRepeats) {
  FakeHost host;
  host.Answer(HostOp::kSystemGetBootStep, {2, 3, 4});
  EXPECT_EQ(QUVASystemGetBootStep(), 2);
  EXPECT_EQ(QUVASystemGetBootStep(), 3);
  EXPECT_EQ(QUVASystemGetBootStep(), 4);
  EXPECT_EQ(QUVASystemGetBootStep(), 4);
  host.Answer(HostOp::kGetFSType, {12});
  EXPECT_EQ(QUVAGetFSType("/nonexistent", 0), 12);
  host.Answer(HostOp::kErrGet, {0x1234});
  EXPECT_EQ(QLIBCErrGet(), 0x1234);
}

TEST(FakeHostTest, PassRemovesFailureAndAnswer) {
  HostEtc etc;
  FakeHost host;
  host.Answer(HostOp::kSystemGetBootStep, {1});
  host.Pass(HostOp::kSystemGetBootStep);
  EXPECT_EQ(QUVASystemGetBootStep(), 4);
  host.AnswerCodePage(3);
  host.Pass(HostOp::kCodePageGet);
  int code_page = 0;
  EXPECT_EQ(QLIBCCodePageGet(1, &code_page), -1);  // no host.conf
}

TEST(FakeHostTest, DestructorRestoresTheStandIn) {
  {
    FakeHost host;
    host.Fail(HostOp::kEAIsHiddenDir);
    host.Answer(HostOp::kFSIsRemoteFS, {0});
    EXPECT_EQ(QUVAEAIsHiddenDir(".quvameta"), -1);
    EXPECT_EQ(QUVAFSIsRemoteFS(QUVA_FS_NFS), 0);
  }
  EXPECT_EQ(QUVAEAIsHiddenDir(".quvameta"), 1);
  EXPECT_EQ(QUVAFSIsRemoteFS(QUVA_FS_NFS), 1);
}

TEST(FakeHostTest, TypedAnswers) {
  FakeHost host;
  host.AnswerEADirPath("/x/.meta/y");
  char buffer[64];
  EXPECT_EQ(QUVAEADirPath(0, "/whatever", buffer, sizeof buffer), 0);
  EXPECT_STREQ(buffer, "/x/.meta/y");
  EXPECT_EQ(QUVAEADirPath(0, "/whatever", buffer, 5), -1);

  host.AnswerCodePage(11);
  int code_page = 0;
  EXPECT_EQ(QLIBCCodePageGet(1, &code_page), 0);
  EXPECT_EQ(code_page, 11);

  QLIBCFileStatRecord answer{};
  answer.uMode = 0040755;
  answer.llCTime = 1425719103;
  host.AnswerFileStat(answer);
  QLIBCFileStatRecord record{};
  EXPECT_EQ(QLIBCFileStat("/nonexistent", 9, &record), 0);
  EXPECT_EQ(record.llCTime, 1425719103);

  host.AnswerFileLine("/a/b");
  EXPECT_EQ(QLIBCFileGetLine("/nonexistent", "/a/b", buffer, 64, 0x404), 1);
  EXPECT_STREQ(buffer, "/a/b");

  host.AnswerSectionValue("guid-1");
  EXPECT_EQ(QLIBCFileGetSectionValue("/x", "s", "guid", buffer, 64), 6);
  EXPECT_STREQ(buffer, "guid-1");

  host.AnswerConversion(HostOp::kUnicodeStrCPToUTF8, "aé");
  EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(1, "x", buffer, 3), 1);
  EXPECT_STREQ(buffer, "a");
  host.AnswerConversion(HostOp::kUnicodeStrUTF16ToUTF8, "ok");
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8("x", buffer, 64), 2);
  EXPECT_STREQ(buffer, "ok");
}

TEST(FakeHostTest, InMemorySharesFollowThePathRules) {
  FakeHost host;
  host.AddShare("video", "/vol1/video/", 0x20);
  host.AddShare("movies", "/vol1/video/movies", 0);
  ShareRecord* record = nullptr;
  ASSERT_EQ(QUVAShareGetByAttrStr("/vol1/video/movies/a.mkv", 1, &record), 0);
  EXPECT_STREQ(record->szName, "movies");
  QUVAShareFree(record);
  ASSERT_EQ(QUVAShareGet("video", &record), 0);
  EXPECT_STREQ(record->szPath, "/vol1/video");
  EXPECT_EQ(record->uStatus, 0x20u);
  QUVAShareFree(record);
  EXPECT_EQ(QUVAShareGetByAttrStr("/vol1/videos", 1, &record), -1);
  EXPECT_EQ(record, nullptr);
  EXPECT_EQ(QUVAShareGet("photo", &record), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
}

TEST(FakeHostTest, InMemoryUpdatesAreRecordedAndStored) {
  FakeHost host;
  host.AddShare("video", "/vol1/video", 0);
  ShareRecord* record = nullptr;
  ASSERT_EQ(QUVAShareGet("video", &record), 0);
  record->uStatus |= QUVA_SHARE_STATUS_INDEXED;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  ASSERT_EQ(host.ShareUpdates().size(), 1u);
  EXPECT_EQ(host.ShareUpdates()[0].first, "video");
  EXPECT_EQ(host.ShareUpdates()[0].second, 0x20u);
  EXPECT_EQ(host.ShareStatus("video"), 0x20u);
}

TEST(FakeHostTest, OutstandingRecordsRevealALeak) {
  FakeHost host;
  host.AddShare("video", "/vol1/video", 0);
  ShareRecord* first = nullptr;
  ShareRecord* second = nullptr;
  ASSERT_EQ(QUVAShareGet("video", &first), 0);
  ASSERT_EQ(QUVAShareGetByAttrStr("/vol1/video/a", 1, &second), 0);
  EXPECT_EQ(host.OutstandingShareRecords(), 2);
  QUVAShareFree(first);
  QUVAShareFree(nullptr);
  EXPECT_EQ(host.OutstandingShareRecords(), 1);
  QUVAShareFree(second);
  EXPECT_EQ(host.OutstandingShareRecords(), 0);
}

TEST(FakeHostTest, RealShareFileRecordsAreCountedToo) {
  HostEtc etc;
  WriteFile(etc.File("shares.conf"), "[video]\npath = /vol1/video\n");
  FakeHost host;
  ShareRecord* record = nullptr;
  ASSERT_EQ(QUVAShareGet("video", &record), 0);
  EXPECT_EQ(host.OutstandingShareRecords(), 1);
  QUVAShareFree(record);
  EXPECT_EQ(host.OutstandingShareRecords(), 0);
}

TEST(FakeHostTest, SetLastErrorFillsTheErrorStack) {
  FakeHost::SetLastError(0x2A, "somewhere.c", 77);
  EXPECT_EQ(QLIBCErrGet(), 0x2A);
  EXPECT_STREQ(QLIBCErrorGetFile(), "somewhere.c");
  EXPECT_EQ(QLIBCErrorGetLine(), 77);
}

}  // namespace
}  // namespace quvahost::test

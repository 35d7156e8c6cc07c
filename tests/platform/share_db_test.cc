#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

const char kDatabase[] =
    "# shares of this machine\n"
    "[video]\n"
    "path = /vol1/video\n"
    "status = 0x20\n"
    "\n"
    "[movies]\n"
    "path = /vol1/video/movies/\n"
    "; no status: not indexed\n"
    "[music]\n"
    "  path=/vol1//music  \n"
    "status = 1\n"
    "[video]\n"
    "path = /elsewhere\n"
    "[broken-relative]\n"
    "path = vol1/relative\n"
    "[broken-dotdot]\n"
    "path = /vol1/../etc\n"
    "[broken-status]\n"
    "path = /vol1/status\n"
    "status = twenty\n"
    "[no-path]\n"
    "status = 0x20\n";

class ShareDbTest : public ::testing::Test {
 protected:
  void SetUp() override { WriteFile(etc_.File("shares.conf"), kDatabase); }
  std::string DbPath() const { return etc_.File("shares.conf"); }
  HostEtc etc_;
};

struct Found {
  int result;
  std::string name, path;
  unsigned status;
};

Found Get(const char* name) {
  ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
  Found found{QUVAShareGet(name, &record), "", "", 0};
  if (record != nullptr) {
    found.name = record->szName;
    found.path = record->szPath;
    found.status = record->uStatus;
  }
  QUVAShareFree(record);
  return found;
}

Found GetByPath(const char* path) {
  ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
  Found found{QUVAShareGetByAttrStr(path, QUVA_SHARE_ATTR_PATH, &record), "",
              "", 0};
  if (record != nullptr) {
    found.name = record->szName;
    found.path = record->szPath;
    found.status = record->uStatus;
  }
  QUVAShareFree(record);
  return found;
}

TEST_F(ShareDbTest, GetFillsNamePathAndStatus) {
  Found video = Get("video");
  EXPECT_EQ(video.result, 0);
  EXPECT_EQ(video.name, "video");
  EXPECT_EQ(video.path, "/vol1/video");
  EXPECT_EQ(video.status, 0x20u);
}

TEST_F(ShareDbTest, PathIsNormalizedAndStatusDefaultsToZero) {
  EXPECT_EQ(Get("movies").path, "/vol1/video/movies");
  EXPECT_EQ(Get("movies").status, 0u);
  EXPECT_EQ(Get("music").path, "/vol1/music");
  EXPECT_EQ(Get("music").status, 1u);
}

TEST_F(ShareDbTest, RepeatedSectionDoesNotOverrideFirst) {
  EXPECT_EQ(Get("video").path, "/vol1/video");
}

TEST_F(ShareDbTest, BadOrUnknownSharesAreNotFoundAndRecordIsNull) {
  for (const char* name : {"photo", "Video", "broken-relative", "broken-dotdot",
                           "broken-status", "no-path", ""}) {
    SCOPED_TRACE(name);
    ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
    EXPECT_EQ(QUVAShareGet(name, &record), -1);
    EXPECT_EQ(record, nullptr);
    EXPECT_EQ(QLIBCErrGet(), ENOENT);
  }
}

TEST_F(ShareDbTest, NullArgumentsFailWithEinval) {
  ShareRecord* record = nullptr;
  EXPECT_EQ(QUVAShareGet(nullptr, &record), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QUVAShareGet("video", nullptr), -1);
  EXPECT_EQ(QUVAShareGetByAttrStr(nullptr, 1, &record), -1);
  EXPECT_EQ(QUVAShareUpdate(nullptr), -1);
  QUVAShareFree(nullptr);  // must not crash
}

TEST_F(ShareDbTest, MissingDatabaseFindsNothing) {
  unlink(DbPath().c_str());
  ShareRecord* record = nullptr;
  EXPECT_EQ(QUVAShareGet("video", &record), -1);
  EXPECT_EQ(record, nullptr);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
}

TEST_F(ShareDbTest, StatusValueForms) {
  struct Case {
    const char* text;
    bool valid;
    unsigned status;
  } cases[] = {{"0x20", true, 0x20},
               {"0X2a", true, 0x2A},
               {"32", true, 32},
               {"0", true, 0},
               {"4294967295", true, 0xFFFFFFFFu},
               {"4294967296", false, 0},
               {"0x", false, 0},
               {"-1", false, 0},
               {"0x1g", false, 0},
               {"", false, 0},
               {"1 2", false, 0}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    WriteFile(DbPath(),
              std::string("[s]\npath = /s\nstatus = ") + c.text + "\n");
    Found found = Get("s");
    EXPECT_EQ(found.result, c.valid ? 0 : -1);
    if (c.valid) {
      EXPECT_EQ(found.status, c.status);
    }
  }
}

TEST_F(ShareDbTest, LookupByPathMatchesWholeComponentsLongestFirst) {
  struct Case {
    const char* path;
    const char* share;  // null: no share holds it
  } cases[] = {
      {"/vol1/video", "video"},
      {"/vol1/video/", "video"},
      {"/vol1/video/a.mkv", "video"},
      {"/vol1/video//a.mkv", "video"},
      {"/vol1/videos/a.mkv", nullptr},
      {"/vol1/vide", nullptr},
      {"/vol1/video/movies", "movies"},
      {"/vol1/video/movies/x/y.mkv", "movies"},
      {"/vol1/video/./movies/x", "movies"},
      {"/vol1/video/moviesX", "video"},
      {"/vol1//music/a.mp3", "music"},
      {"/vol1", nullptr},
      {"/", nullptr},
      {"/vol1/video/../music", nullptr},
      {"vol1/video", nullptr},
      {"/vol1/relative/x", nullptr},
      {"/vol1/status/x", nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path);
    Found found = GetByPath(c.path);
    if (c.share == nullptr) {
      EXPECT_EQ(found.result, -1);
      EXPECT_EQ(found.name, "");
    } else {
      EXPECT_EQ(found.result, 0);
      EXPECT_EQ(found.name, c.share);
    }
  }
}

TEST_F(ShareDbTest, LookupByPathRejectsOtherAttributes) {
  ShareRecord* record = nullptr;
  EXPECT_EQ(QUVAShareGetByAttrStr("/vol1/video", 0, &record), -1);
  EXPECT_EQ(QUVAShareGetByAttrStr("/vol1/video", 2, &record), -1);
  EXPECT_EQ(record, nullptr);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

TEST_F(ShareDbTest, RootShareHoldsEverything) {
  WriteFile(DbPath(), "[root]\npath = /\n[a]\npath = /a\n");
  EXPECT_EQ(GetByPath("/b/c").name, "root");
  EXPECT_EQ(GetByPath("/a/c").name, "a");
}

ShareRecord* Fetch(const char* name) {
  ShareRecord* record = nullptr;
  EXPECT_EQ(QUVAShareGet(name, &record), 0);
  return record;
}

TEST_F(ShareDbTest, UpdateRewritesOnlyTheStatusLine) {
  ShareRecord* record = Fetch("video");
  record->uStatus &= ~QUVA_SHARE_STATUS_INDEXED;
  strcpy(record->szPath, "/not/written");
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  std::string expected = kDatabase;
  expected.replace(expected.find("status = 0x20"), 13, "status = 0x0");
  EXPECT_EQ(ReadFile(DbPath()), expected);
  EXPECT_EQ(Get("video").status, 0u);
  EXPECT_EQ(Get("video").path, "/vol1/video");
}

TEST_F(ShareDbTest, UpdateAddsStatusLineWhenSectionHasNone) {
  ShareRecord* record = Fetch("movies");
  record->uStatus = QUVA_SHARE_STATUS_INDEXED;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  EXPECT_EQ(Get("movies").status, 0x20u);
  std::string text = ReadFile(DbPath());
  EXPECT_NE(text.find("[movies]\nstatus = 0x20\npath = /vol1/video/movies/\n"),
            std::string::npos);
}

TEST_F(ShareDbTest, UpdateKeepsFileWithoutFinalLineEnd) {
  WriteFile(DbPath(), "[a]\npath = /a");
  ShareRecord* record = Fetch("a");
  record->uStatus = 5;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  EXPECT_EQ(ReadFile(DbPath()), "[a]\nstatus = 0x5\npath = /a");
}

TEST_F(ShareDbTest, UpdateOfUnknownShareFailsAndChangesNothing) {
  ShareRecord record{};
  strcpy(record.szName, "photo");
  EXPECT_EQ(QUVAShareUpdate(&record), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(ReadFile(DbPath()), kDatabase);
}

TEST_F(ShareDbTest, UpdateRejectsUnterminatedName) {
  ShareRecord record;
  memset(&record, 'v', sizeof record);
  EXPECT_EQ(QUVAShareUpdate(&record), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(ReadFile(DbPath()), kDatabase);
}

TEST_F(ShareDbTest, UpdateKeepsModeAndLeavesNoTemporaryFile) {
  chmod(DbPath().c_str(), 0640);
  ShareRecord* record = Fetch("music");
  record->uStatus = 0x21;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  struct stat st;
  ASSERT_EQ(stat(DbPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  int entries = 0;
  for (const auto& entry : std::filesystem::directory_iterator(etc_.path())) {
    std::string name = entry.path().filename();
    EXPECT_TRUE(name == "shares.conf" || name == "shares.conf.lock") << name;
    ++entries;
  }
  EXPECT_EQ(entries, 2);
}

TEST_F(ShareDbTest, UpdateThroughSymbolicLinkKeepsTheLink) {
  std::string target = etc_.File("real.conf");
  rename(DbPath().c_str(), target.c_str());
  ASSERT_EQ(symlink(target.c_str(), DbPath().c_str()), 0);
  ShareRecord* record = Fetch("video");
  record->uStatus = 0;
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  struct stat st;
  ASSERT_EQ(lstat(DbPath().c_str(), &st), 0);
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  EXPECT_EQ(Get("video").status, 0u);
}

// Several processes flip the status of their own share many times while
// the parent reads: no update is lost and no read sees a broken file.
TEST_F(ShareDbTest, ConcurrentUpdatesFromProcessesLoseNothing) {
  const int kWriters = 4, kRounds = 25;
  std::string db;
  for (int w = 0; w < kWriters; ++w) {
    db += "[s" + std::to_string(w) + "]\npath = /s" + std::to_string(w) +
          "\nstatus = 0\n";
  }
  WriteFile(DbPath(), db);
  pid_t children[kWriters];
  for (int w = 0; w < kWriters; ++w) {
    children[w] = fork();
    ASSERT_GE(children[w], 0);
    if (children[w] == 0) {
      std::string name = "s" + std::to_string(w);
      for (int round = 1; round <= kRounds; ++round) {
        ShareRecord* record = nullptr;
        if (QUVAShareGet(name.c_str(), &record) != 0) _exit(1);
        record->uStatus = static_cast<unsigned>(round);
        if (QUVAShareUpdate(record) != 0) _exit(2);
        QUVAShareFree(record);
      }
      _exit(0);
    }
  }
  int bad_reads = 0;
  for (int i = 0; i < 200; ++i) {
    if (Get("s0").result != 0 || Get("s3").result != 0) ++bad_reads;
  }
  for (pid_t child : children) {
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  EXPECT_EQ(bad_reads, 0);
  for (int w = 0; w < kWriters; ++w) {
    EXPECT_EQ(Get(("s" + std::to_string(w)).c_str()).status,
              static_cast<unsigned>(kRounds));
  }
}

}  // namespace
}  // namespace quvahost::test

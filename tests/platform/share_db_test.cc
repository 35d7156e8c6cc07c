#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <tuple>

#include "support/fake_host.h"

namespace quvahost::test {
namespace {

const char kDatabase[] =
    "# shares of this machine\npath = /before/any/section\n"
    "[video]\npath = /vol1/video\nstatus = 0x20\npath = /2nd\nstatus = 2\n\n"
    "[movies]\npath = /vol1/video/movies/\n; no status: not indexed\n"
    "[music]\n  path=/vol1//music  \nstatus = 1\n"
    "[video]\npath = /elsewhere\n"  // a repeated section does not override
    "[broken-relative]\npath = vol1/relative\n"
    "[broken-dotdot]\npath = /vol1/../etc\n"
    "[broken-status]\npath = /vol1/status\nstatus = twenty\n"
    "[no-path]\nstatus = 0x20\n"
    "[hex]\npath = /h\nstatus = 0X2a\n[max]\npath = /m\nstatus = 4294967295\n"
    "[hexA]\npath = /h\nstatus = 0xAf\n[hexF]\npath = /h\nstatus = 0XFa\n"
    "[hexG]\npath = /h\nstatus = 0xG\n[long]\npath = /l\nstatus = 00000000001\n"
    "[over]\npath = /o\nstatus = 4294967296\n[neg]\npath = /n\nstatus = -1\n"
    "[two]\npath = /t\nstatus = 1 2\n[empty]\npath = /e\nstatus =\n";

class ShareDbTest : public ::testing::Test {
 protected:
  void SetUp() override { WriteFile(Db(), kDatabase); }
  std::string Db() const { return etc_.File("shares.conf"); }
  HostEtc etc_;
};

struct Found {
  int result;
  std::string name, path;
  unsigned status;
};

// By name, or by path when `by_path`; the record must be null on failure.
Found Get(const char* key, bool by_path = false) {
  ShareRecord* record = reinterpret_cast<ShareRecord*>(0x1);
  Found found{by_path
                  ? QUVAShareGetByAttrStr(key, QUVA_SHARE_ATTR_PATH, &record)
                  : QUVAShareGet(key, &record),
              "", "", 0};
  EXPECT_EQ(found.result == 0, record != nullptr) << key;
  if (record != nullptr) {
    found = {found.result, record->szName, record->szPath, record->uStatus};
  }
  QUVAShareFree(record);
  return found;
}

// Only the first section of a name counts; a share with a bad path or
// status is not found.
TEST_F(ShareDbTest, GetReadsTheFirstValidSectionNormalized) {
  const std::tuple<const char*, const char*, unsigned> found[] = {
      {"video", "/vol1/video", 0x20},
      {"movies", "/vol1/video/movies", 0},
      {"music", "/vol1/music", 1},
      {"hex", "/h", 0x2A},
      {"max", "/m", 0xFFFFFFFF},
      {"hexA", "/h", 0xAF},
      {"hexF", "/h", 0xFA}};
  for (const auto& [name, path, status] : found) {
    Found got = Get(name);
    EXPECT_EQ(std::make_tuple(got.result, got.path, got.status),
              std::make_tuple(0, std::string(path), status))
        << name;
  }
  for (const char* name :
       {"hexG", "long", "Video", "broken-relative", "broken-dotdot",
        "broken-status", "no-path", "over", "neg", "two", "empty"}) {
    Found got = Get(name);
    EXPECT_EQ(std::make_tuple(got.result, got.path, got.status),
              std::make_tuple(-1, std::string(), 0u))
        << name;
    EXPECT_EQ(QLIBCErrGet(), ENOENT) << name;
  }
  unlink(Db().c_str());
  EXPECT_EQ(Get("video").result, -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
}

TEST_F(ShareDbTest, LookupByPathMatchesWholeComponentsLongestFirst) {
  const std::pair<const char*, const char*> cases[] = {
      // "": no share
      {"/vol1/video//a.mkv", "video"},
      {"/vol1/videos/a.mkv", ""},
      {"/vol1/video/./movies/x", "movies"},
      {"/vol1/video/../music", ""},
      {"vol1/video", ""}};
  for (const auto& [path, share] : cases)
    EXPECT_EQ(Get(path, true).name, share) << path;
  WriteFile(Db(), "[root]\npath = /\n[a]\npath = /a\n");
  EXPECT_EQ(Get("/b/c", true).name, "root");
  EXPECT_EQ(Get("/a/c", true).name, "a");
}

// A share whose name or path would fill its record field, terminator
// included, is no valid share; one byte less fits.
TEST_F(ShareDbTest, NamesAndPathsFitTheRecord) {
  const std::string name(QUVA_SHARE_NAME_SIZE - 1, 'n');
  const std::string path = "/" + std::string(QUVA_SHARE_PATH_SIZE - 2, 'p');
  const std::tuple<std::string, std::string, int> cases[] = {
      {name, "/a", 0},
      {name + "n", "/a", -1},
      {"p", path, 0},
      {"p", path + "p", -1}};
  for (const auto& [share, share_path, result] : cases) {
    WriteFile(Db(), "[" + share + "]\npath = " + share_path + "\n");
    Found found = Get(share.c_str());
    EXPECT_EQ(found.result, result) << share.size() << " " << share_path.size();
    EXPECT_EQ(found.path, result == 0 ? share_path : "");
    EXPECT_TRUE(result == 0 || QLIBCErrGet() == ENOENT);
  }
}

// Updates `name` to `status` (with a scribbled path) and returns the file.
std::string Update(const std::string& db, const char* name, unsigned status) {
  ShareRecord* record = nullptr;
  EXPECT_EQ(QUVAShareGet(name, &record), 0);
  if (record == nullptr) return "";
  record->uStatus = status;
  strcpy(record->szPath, "/not/written");
  EXPECT_EQ(QUVAShareUpdate(record), 0);
  QUVAShareFree(record);
  return ReadFile(db);
}

// Refused calls change nothing; an update rewrites or adds the status line.
TEST_F(ShareDbTest, UpdateRewritesOrAddsOnlyTheStatusLine) {
  ShareRecord* out = nullptr;
  EXPECT_EQ(QUVAShareGet("video", nullptr), -1);
  EXPECT_EQ(QUVAShareGetByAttrStr("/vol1/video", 2, &out), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(out, nullptr);
  ShareRecord record{};
  strcpy(record.szName, "photo");
  EXPECT_EQ(QUVAShareUpdate(&record), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  memset(&record, 'v', sizeof record);  // unterminated name
  EXPECT_EQ(QUVAShareUpdate(&record), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QUVAShareUpdate(nullptr), -1);
  EXPECT_EQ(ReadFile(Db()), kDatabase);
  std::string expected = kDatabase;
  expected.replace(expected.find("status = 0x20"), 13, "status = 0x0");
  EXPECT_EQ(Update(Db(), "video", 0), expected);
  EXPECT_EQ(Get("video").path, "/vol1/video");
  EXPECT_NE(Update(Db(), "movies", 0x20)
                .find("[movies]\nstatus = 0x20\npath = /vol1/video/movies/\n"),
            std::string::npos);
  EXPECT_EQ(Get("movies").status, 0x20u);
  WriteFile(Db(), "[a]\npath = /a");  // no final line end
  EXPECT_EQ(Update(Db(), "a", 5), "[a]\nstatus = 0x5\npath = /a");
}

TEST_F(ShareDbTest, UpdateKeepsModeAndLinkAndLeavesNoTemporaryFile) {
  quvaidx::test::FdLeakCheck leaks;
  std::string target = etc_.File("real.conf");
  rename(Db().c_str(), target.c_str());
  ASSERT_EQ(symlink(target.c_str(), Db().c_str()), 0);
  chmod(target.c_str(), 0640);
  Update(Db(), "music", 0x21);
  struct stat st;
  ASSERT_EQ(lstat(Db().c_str(), &st), 0);
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  ASSERT_EQ(stat(target.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_EQ(Get("music").status, 0x21u);
  EXPECT_TRUE(leaks.NoLeak());
  std::filesystem::directory_iterator entries(etc_.path()), end;
  EXPECT_LE(std::distance(entries, end), 3) << "link, target and lock only";
}

// Two processes update their own share at the same time: no update is lost.
TEST_F(ShareDbTest, ConcurrentUpdatesFromProcessesLoseNothing) {
  WriteFile(Db(), "[s0]\npath = /s0\n[s1]\npath = /s1\n");
  pid_t child = fork();
  ASSERT_GE(child, 0);
  for (unsigned round = 1; round <= 20; ++round) {
    ShareRecord* record = nullptr;
    if (QUVAShareGet(child ? "s0" : "s1", &record) != 0) _exit(1);
    record->uStatus = round;
    if (QUVAShareUpdate(record) != 0 && child == 0) _exit(2);
    QUVAShareFree(record);
  }
  if (child == 0) _exit(0);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(Get("s0").status, 20u);
  EXPECT_EQ(Get("s1").status, 20u);
}

}  // namespace
}  // namespace quvahost::test

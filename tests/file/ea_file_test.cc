// Metadata side directories: host failures through the fake host, then the
// real stand-in on a real directory tree.
#include "quvaidx/ea_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <set>
#include <string>

#include <gtest/gtest.h>

#include "host_ops.h"

#include "quvaidx/path_rules.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

// The kind of entry at `path` (S_IFMT bits of lstat), 0 when there is none.
mode_t KindAt(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 ? st.st_mode & S_IFMT : 0;
}

// Names in directory `dir`.
std::set<std::string> Entries(const std::string& dir) {
  std::set<std::string> names;
  std::error_code ignored;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ignored)) {
    names.insert(entry.path().filename());
  }
  return names;
}

// Bad parameters never reach the host; a host failure is logged with the
// host's error by every caller.
TEST(EADirHostFailure, BadParametersNeverReachTheHostAndFailuresAreLogged) {
  LogCapture log;
  FakeHost host;
  char buf[64];
  for (auto* fn : {MakeEADir, GetEADirPath}) {
    EXPECT_EQ(-1, fn(nullptr, buf, sizeof(buf)));
    EXPECT_EQ(-1, fn("/v/a.jpg", nullptr, 16));
    EXPECT_EQ(-1, fn("/v/a.jpg", buf, 0));
  }
  EXPECT_EQ(6, log.Count("quvaidx_eafile:N Bad parameters."));
  EXPECT_EQ(0, host.Calls(HostOp::kEADirPath));
  host.Fail(HostOp::kEADirPath, ENAMETOOLONG);
  EXPECT_EQ(-1, MakeEADir("/v/a.jpg", buf, sizeof(buf)));
  EXPECT_EQ(-1, RemoveEAFile2("/v/a.jpg", "n1", "n2"));
  EXPECT_EQ(-1, GetEAFilePath("/v/a.jpg", "n1", "n2", buf, sizeof(buf)));
  EXPECT_EQ(-1, IsEAFileExist2("/v/a.jpg", "n1", "n2"));
  char line[256];
  snprintf(line, sizeof(line),
           "quvaidx_eafile:N QUVAEADirPath error [0x0024 %s:%d] on /v/a.jpg",
           QLIBCErrorGetFile(), QLIBCErrorGetLine());
  EXPECT_EQ(4, log.Count(line)) << log.lines().back().text;
  for (const auto& logged : log.lines()) EXPECT_EQ(LOG_ERR, logged.priority);
  EXPECT_EQ(-1, GetEADirPath("/v/a.jpg", buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Get ea dir path error. file path: "
                         "/v/a.jpg"));
}

TEST(EADirMaking, FailuresAreLoggedAndExistingDirNeedsNoCall) {
  TempDir dir;
  const std::string ea = dir.File(".quvameta/a.jpg");
  LogCapture log;
  FakeHost host;
  host.Fail(HostOp::kEAMKDir, EACCES);
  const std::string media = dir.File("a.jpg");
  char buf[4096];
  EXPECT_EQ(-1, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Make ea dir path error. eaDir "
                         "path: " +
                         ea));
  host.Pass(HostOp::kEAMKDir);
  EXPECT_EQ(0, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(ea, buf);
  EXPECT_EQ(0, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(2, host.Calls(HostOp::kEAMKDir)) << "made an existing directory";
  EXPECT_EQ(-1, MakeEADir(dir.File("missing/a.jpg").c_str(), buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Cannot mkdir " +
                         dir.File("missing/.quvameta") + ", error:2"));
}

// The real stand-in: the EA directory of <dir>/a.jpg is <dir>/.quvameta/a.jpg.
class RealTree : public ::testing::Test {
 protected:
  void SetUp() override { WriteFile(media_, "jpeg"); }
  TempDir dir_, outside_;
  std::string media_ = dir_.File("a.jpg"), hidden_ = dir_.File(".quvameta"),
              ea_ = hidden_ + "/a.jpg";
};

TEST_F(RealTree, BothFunctionsCreateTheDirectoriesAndKeepItems) {
  for (auto* fn : {MakeEADir, GetEADirPath}) {
    char buf[4096];
    ASSERT_EQ(0, fn(media_.c_str(), buf, sizeof(buf)));
    EXPECT_EQ(ea_, buf);
    EXPECT_EQ(1, IsDirExist(ea_.c_str()));
    WriteFile(ea_ + "/thumb", "data");
    EXPECT_EQ(0, fn(media_.c_str(), buf, sizeof(buf)));
    EXPECT_EQ(1, IsFileExist((ea_ + "/thumb").c_str(), nullptr));
    ASSERT_EQ(0, unlink((ea_ + "/thumb").c_str()));
    ASSERT_EQ(0, rmdir(ea_.c_str()));
  }
}

TEST_F(RealTree, ItemsArePreferredInOrderAndNeedTwoBytesToCount) {
  char buf[4096];
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf, sizeof(buf)));
  mkdir((ea_ + "/dir_item").c_str(), 0755);
  WriteFile(ea_ + "/one", "1");
  WriteFile(ea_ + "/big", "12345");
  WriteFile(ea_ + "/two", "12");
  const char* n1 = "big";
  int64_t size = -1;
  EXPECT_EQ(n1, IsEAFileExist(ea_.c_str(), &size, n1, "two"));  // pointer kept
  EXPECT_EQ(5, size);
  EXPECT_STREQ("two", IsEAFileExist(ea_.c_str(), &size, "dir_item", "two"));
  EXPECT_STREQ("one", IsEAFileExist(ea_.c_str(), &size, "one", "big"));
  EXPECT_EQ(1, size);
  const struct {
    const char *n1, *n2, *path;          // path null: not present
  } cases[] = {{"one", "big", nullptr},  // a 1-byte item hides the big one
               {"none", "two", "two"},
               {"dir_item", "none", nullptr}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.n1);
    char out[4096] = "untouched";
    EXPECT_EQ(c.path != nullptr, IsEAFileExist2(media_.c_str(), c.n1, c.n2));
    EXPECT_EQ(c.path ? 0 : -1,
              GetEAFilePath(media_.c_str(), c.n1, c.n2, out, sizeof(out)));
    EXPECT_EQ(c.path ? ea_ + "/" + c.path : "untouched", out);
  }
  char cut[8];
  EXPECT_EQ(0, GetEAFilePath(media_.c_str(), "big", nullptr, cut, sizeof(cut)));
  EXPECT_EQ(std::string(ea_, 0, 7), cut);
  EXPECT_EQ(-1, GetEAFilePath(media_.c_str(), "big", nullptr, cut, 0));
}

TEST_F(RealTree, RemoveCountsWhatWasThereAndSparesDirectories) {
  char buf[4096];
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf, sizeof(buf)));
  mkdir((ea_ + "/d").c_str(), 0755);
  for (int removed : {2, 1, 0}) {  // both items, the second, none
    if (removed == 2) WriteFile(ea_ + "/x", "1");
    if (removed >= 1) WriteFile(ea_ + "/y", "1");
    EXPECT_EQ(removed, RemoveEAFile2(media_.c_str(), "x", "y"));
    EXPECT_EQ(0, IsFileExist((ea_ + "/y").c_str(), nullptr));
  }
  EXPECT_EQ(0, RemoveEAFile(ea_.c_str(), "d", nullptr));
  EXPECT_EQ(1, IsDirExist((ea_ + "/d").c_str()));
  EXPECT_EQ(0, RemoveEAFile(nullptr, "x", "y"));
}

// An item path too long for the 4096-byte buffer, whose cut prefix names
// another, existing file: it must be neither found nor removed.
TEST_F(RealTree, OverlongItemPathNeverTouchesTheFileItsCutNames) {
  const std::string victim = dir_.File("victim");
  WriteFile(victim, "precious");
  std::string ea_dir = dir_.path();
  while (ea_dir.size() < 4088) ea_dir += 4088 - ea_dir.size() == 1 ? "/" : "/.";
  ASSERT_EQ(4095u, ea_dir.size() + 7);  // ea_dir + "/victim" fills 4095 chars
  EXPECT_EQ(nullptr,
            IsEAFileExist(ea_dir.c_str(), nullptr, "victimXYZ", nullptr));
  EXPECT_EQ(0, RemoveEAFile(ea_dir.c_str(), "victimXYZ", "victim_long_name"));
  EXPECT_EQ(1, IsFileExist(victim.c_str(), nullptr));
  EXPECT_STREQ("victim",
               IsEAFileExist(ea_dir.c_str(), nullptr, "victim", nullptr));
}

}  // namespace

// What a user may plant in a photo folder, where the metadata directory
// (.quvameta) or the EA directory (.quvameta/a.jpg) should be. `outside` is
// a directory the walk must never reach: it holds a file "victim".
struct Planted {
  const char* what;
  std::function<void(const std::string& hidden, const std::string& ea,
                     const std::string& outside)>
      plant;
  int error_open;    // errno without create, 0: opened
  int error_create;  // errno with create, 0: opened
  bool refused;      // a refusal is logged
};

const Planted kPlanted[] = {
    {"nothing", [](auto&, auto&, auto&) {}, ENOENT, 0, false},
    {"both directories",
     [](auto& hidden, auto& ea, auto&) {
       mkdir(hidden.c_str(), 0755);
       mkdir(ea.c_str(), 0755);
     },
     0, 0, false},
    {"metadata dir links to a directory elsewhere",
     [](auto& hidden, auto&, auto& outside) {
       symlink(outside.c_str(), hidden.c_str());
     },
     ELOOP, ELOOP, true},
    {"EA dir links to a directory elsewhere",
     [](auto& hidden, auto& ea, auto& outside) {
       mkdir(hidden.c_str(), 0755);
       symlink(outside.c_str(), ea.c_str());
     },
     ELOOP, ELOOP, true},
    {"EA dir links to a file elsewhere",
     [](auto& hidden, auto& ea, auto& outside) {
       mkdir(hidden.c_str(), 0755);
       symlink((outside + "/victim").c_str(), ea.c_str());
     },
     ELOOP, ELOOP, true},
    {"dangling link at the metadata dir",
     [](auto& hidden, auto&, auto& outside) {
       symlink((outside + "/new").c_str(), hidden.c_str());
     },
     ELOOP, ELOOP, true},
    {"dangling link at the EA dir",
     [](auto& hidden, auto& ea, auto& outside) {
       mkdir(hidden.c_str(), 0755);
       symlink((outside + "/new").c_str(), ea.c_str());
     },
     ELOOP, ELOOP, true},
    {"FIFO at the metadata dir",
     [](auto& hidden, auto&, auto&) { mkfifo(hidden.c_str(), 0666); }, ENOTDIR,
     ENOTDIR, true},
    {"FIFO at the EA dir",
     [](auto& hidden, auto& ea, auto&) {
       mkdir(hidden.c_str(), 0755);
       mkfifo(ea.c_str(), 0666);
     },
     ENOTDIR, ENOTDIR, true},
    {"regular file at the metadata dir",
     [](auto& hidden, auto&, auto&) { WriteFile(hidden, "in the way"); },
     ENOTDIR, 0, false},
    {"regular file at the EA dir",
     [](auto& hidden, auto& ea, auto&) {
       mkdir(hidden.c_str(), 0755);
       WriteFile(ea, "in the way");
     },
     ENOTDIR, 0, false},
};

// Every planted entry, without and with create, from the folder's path and
// from a descriptor of the folder: a link or special file is refused,
// logged and left in place, and nothing outside the folder changes.
TEST(OpenEADirWalk, PlantedEntriesAreRefusedOrReplacedNeverFollowed) {
  for (const Planted& c : kPlanted) {
    for (int create : {0, 1}) {
      for (bool by_fd : {false, true}) {
        SCOPED_TRACE(std::string(c.what) + (create ? ", create" : "") +
                     (by_fd ? ", folder fd" : ""));
        TempDir dir, outside;
        WriteFile(outside.File("victim"), "root's");
        const std::string hidden = dir.File(".quvameta");
        const std::string ea = hidden + "/a.jpg";
        c.plant(hidden, ea, outside.path());
        const mode_t hidden_kind = KindAt(hidden), ea_kind = KindAt(ea);
        const int folder = by_fd ? open(dir.path().c_str(), O_RDONLY) : -1;
        quvaidx::test::FdLeakCheck leaks;
        LogCapture log;
        errno = 0;
        const int fd = OpenEADir(dir.File("a.jpg").c_str(), folder, create);
        const int error = fd < 0 ? errno : 0;
        const int expected = create ? c.error_create : c.error_open;
        EXPECT_EQ(expected, error) << strerror(error);
        EXPECT_EQ(c.refused ? 1u : 0u, log.lines().size());
        if (fd >= 0) {
          struct stat opened, named;
          ASSERT_EQ(0, fstat(fd, &opened));
          ASSERT_EQ(0, lstat(ea.c_str(), &named));
          EXPECT_TRUE(S_ISDIR(named.st_mode));
          EXPECT_EQ(named.st_ino, opened.st_ino);
          EXPECT_EQ(FD_CLOEXEC, fcntl(fd, F_GETFD) & FD_CLOEXEC);
          close(fd);
        } else if (c.refused) {
          EXPECT_EQ(hidden_kind, KindAt(hidden)) << "removed";
          EXPECT_EQ(ea_kind, KindAt(ea)) << "removed";
        }
        EXPECT_TRUE(leaks.NoLeak());
        EXPECT_EQ(std::set<std::string>{"victim"}, Entries(outside.path()));
        EXPECT_EQ("root's", ReadFile(outside.File("victim")));
        if (folder >= 0) close(folder);
      }
    }
  }
}

// The walk starts at the descriptor: the folder's path in file_path is not
// opened then. Made directories take 0777 less the umask.
TEST(OpenEADirWalk, StartsAtTheGivenFolderAndMakesDirectoriesUnderTheUmask) {
  TempDir dir;
  const int folder = open(dir.path().c_str(), O_RDONLY | O_DIRECTORY);
  ASSERT_GE(folder, 0);
  const mode_t old_umask = umask(027);
  const int fd = OpenEADir("/no-such-folder/a.jpg", folder, 1);
  umask(old_umask);
  ASSERT_GE(fd, 0) << strerror(errno);
  close(fd);
  close(folder);
  for (const char* made : {".quvameta", ".quvameta/a.jpg"}) {
    struct stat st;
    ASSERT_EQ(0, lstat(dir.File(made).c_str(), &st));
    EXPECT_EQ(0750u, st.st_mode & 07777) << made;
  }
  errno = 0;
  EXPECT_EQ(-1, OpenEADir("/no-such-folder/a.jpg", -1, 1));
  EXPECT_EQ(ENOENT, errno);
}

// What the host answers for every file, set per case.
const char* g_host_answer = "";

int AnswerHostPath(int, const char*, char* buffer, int size) {
  snprintf(buffer, static_cast<size_t>(size), "%s", g_host_answer);
  return 0;
}

TEST(OpenEADirWalk, BadArgumentsAndHostPathsOutsideTheFolderAreEINVAL) {
  TempDir dir, outside;
  LogCapture log;
  errno = 0;
  EXPECT_EQ(-1, OpenEADir(nullptr, -1, 1));
  EXPECT_EQ(EINVAL, errno);
  errno = 0;
  EXPECT_EQ(-1, OpenEADir(dir.File("a.jpg").c_str(), -2, 1));
  EXPECT_EQ(EINVAL, errno);
  {
    FakeHost host;
    host.Fail(HostOp::kEADirPath, ENAMETOOLONG);
    errno = 0;
    EXPECT_EQ(-1, OpenEADir(dir.File("a.jpg").c_str(), -1, 1));
    EXPECT_EQ(EINVAL, errno);
  }
  const std::string answers[] = {
      outside.File(".quvameta/a.jpg"),  // another folder
      dir.File(".quvameta/sub/a.jpg"),  // deeper than two levels
      dir.File(".quvameta"),            // one level
      dir.File("../" + std::string(outside.path().substr(5)) + "/a.jpg"),
  };
  quvahost::HostOps ops{};
  ops.EADirPath = AnswerHostPath;
  const quvahost::HostOps previous = quvahost::SetHostOps(&ops);
  for (const std::string& answer : answers) {
    g_host_answer = answer.c_str();
    errno = 0;
    EXPECT_EQ(-1, OpenEADir(dir.File("a.jpg").c_str(), -1, 1)) << answer;
    EXPECT_EQ(EINVAL, errno) << answer;
  }
  quvahost::SetHostOps(&previous);
  EXPECT_TRUE(Entries(dir.path()).empty());
  EXPECT_TRUE(Entries(outside.path()).empty());
  EXPECT_EQ(5u, log.lines().size());  // the host failure and four answers
}

// MakeEADir and GetEADirPath on every planted entry: MakeEADir makes what
// OpenEADir with create would; GetEADirPath hands the host only what is
// missing, never a refused link or special file.
TEST(EADirMakingWalk, PlantedEntriesAreNeverFollowedByEitherMaker) {
  for (const Planted& c : kPlanted) {
    for (bool by_host : {false, true}) {
      SCOPED_TRACE(std::string(c.what) + (by_host ? ", GetEADirPath" : ""));
      TempDir dir, outside;
      WriteFile(outside.File("victim"), "root's");
      const std::string hidden = dir.File(".quvameta");
      const std::string ea = hidden + "/a.jpg";
      c.plant(hidden, ea, outside.path());
      const mode_t hidden_kind = KindAt(hidden), ea_kind = KindAt(ea);
      LogCapture log;
      FakeHost host;
      char buf[4096];
      const int result =
          by_host ? GetEADirPath(dir.File("a.jpg").c_str(), buf, sizeof(buf))
                  : MakeEADir(dir.File("a.jpg").c_str(), buf, sizeof(buf));
      // The host makes what is missing but replaces nothing in the way.
      const bool made = by_host ? c.error_open == 0 || c.error_open == ENOENT
                                : c.error_create == 0;
      EXPECT_EQ(made ? 0 : -1, result);
      EXPECT_EQ(ea, buf);
      if (made) {
        EXPECT_EQ(S_IFDIR, KindAt(ea));
      }
      if (c.refused) {
        EXPECT_EQ(hidden_kind, KindAt(hidden)) << "removed";
        EXPECT_EQ(ea_kind, KindAt(ea)) << "removed";
        EXPECT_EQ(0, host.Calls(HostOp::kEAMKDir));
        EXPECT_EQ(2u, log.lines().size());  // the refusal, then the failure
        const std::string failure =
            by_host ? "Make ea dir path error. eaDir path: " + ea
                    : ", error:" + std::to_string(c.error_create);
        EXPECT_NE(std::string::npos, log.lines().back().text.find(failure))
            << log.lines().back().text;
      }
      EXPECT_EQ(std::set<std::string>{"victim"}, Entries(outside.path()));
      EXPECT_EQ("root's", ReadFile(outside.File("victim")));
    }
  }
}

// The item functions where the metadata or EA directory, or an item, is
// planted. Items "x" and "y" (5 bytes) wait in the EA directory and in
// every place a followed link would lead; what is outside must stay unseen
// and unremoved.
struct ItemPlant {
  const char* what;
  // Plants in the folder; `outside` already holds x, y, a.jpg/x, a.jpg/y.
  std::function<void(const std::string& hidden, const std::string& ea,
                     const std::string& outside)>
      plant;
  int removed;        // RemoveEAFile(ea, "x", "y")
  const char* found;  // IsEAFileExist(ea, "x", "y"): "x", "y" or null
};

void MakeRealDirs(const std::string& hidden, const std::string& ea) {
  mkdir(hidden.c_str(), 0755);
  mkdir(ea.c_str(), 0755);
}

const ItemPlant kItemPlants[] = {
    {"real items",
     [](auto& hidden, auto& ea, auto&) {
       MakeRealDirs(hidden, ea);
       WriteFile(ea + "/x", "12345");
       WriteFile(ea + "/y", "12345");
     },
     2, "x"},
    {"metadata dir links elsewhere",
     [](auto& hidden, auto&, auto& outside) {
       symlink(outside.c_str(), hidden.c_str());
     },
     0, nullptr},
    {"EA dir links elsewhere",
     [](auto& hidden, auto& ea, auto& outside) {
       mkdir(hidden.c_str(), 0755);
       symlink(outside.c_str(), ea.c_str());
     },
     0, nullptr},
    {"dangling link at the metadata dir",
     [](auto& hidden, auto&, auto& outside) {
       symlink((outside + "/none").c_str(), hidden.c_str());
     },
     0, nullptr},
    {"FIFO at the EA dir",
     [](auto& hidden, auto& ea, auto&) {
       mkdir(hidden.c_str(), 0755);
       mkfifo(ea.c_str(), 0666);
     },
     0, nullptr},
    {"x links to a file elsewhere",
     [](auto& hidden, auto& ea, auto& outside) {
       MakeRealDirs(hidden, ea);
       symlink((outside + "/x").c_str(), (ea + "/x").c_str());
       WriteFile(ea + "/y", "12345");
     },
     1, "y"},
    {"x dangles, y links to a directory elsewhere",
     [](auto& hidden, auto& ea, auto& outside) {
       MakeRealDirs(hidden, ea);
       symlink((outside + "/none").c_str(), (ea + "/x").c_str());
       symlink((outside + "/a.jpg").c_str(), (ea + "/y").c_str());
     },
     0, nullptr},
};

TEST(EAItemsWalk, PlantedLinksAreNeitherItemsNorRemovedNorFollowed) {
  using Call = std::function<int(const char* media, const char* ea)>;
  const struct {
    const char* name;
    Call call;
    bool counts_removed;  // else: 1 when found, 0 when not
  } calls[] = {
      {"RemoveEAFile", [](auto, auto ea) { return RemoveEAFile(ea, "x", "y"); },
       true},
      {"RemoveEAFile2",
       [](auto media, auto) { return RemoveEAFile2(media, "x", "y"); }, true},
      {"IsEAFileExist",
       [](auto, auto ea) {
         return IsEAFileExist(ea, nullptr, "x", "y") != nullptr ? 1 : 0;
       },
       false},
      {"IsEAFileExist2",
       [](auto media, auto) { return IsEAFileExist2(media, "x", "y"); }, false},
      {"GetEAFilePath",
       [](auto media, auto) {
         char out[4096];
         return GetEAFilePath(media, "x", "y", out, sizeof(out)) == 0 ? 1 : 0;
       },
       false},
  };
  for (const ItemPlant& c : kItemPlants) {
    for (const auto& fn : calls) {
      SCOPED_TRACE(std::string(c.what) + ", " + fn.name);
      TempDir dir, outside;
      for (const char* name : {"x", "y", "a.jpg/x", "a.jpg/y"}) {
        mkdir(outside.File("a.jpg").c_str(), 0755);
        WriteFile(outside.File(name), "root's");
      }
      const std::string hidden = dir.File(".quvameta");
      const std::string ea = hidden + "/a.jpg";
      c.plant(hidden, ea, outside.path());
      const mode_t planted_x = KindAt(ea + "/x");
      LogCapture log;
      const int result = fn.call(dir.File("a.jpg").c_str(), ea.c_str());
      EXPECT_EQ(fn.counts_removed ? c.removed : c.found != nullptr, result);
      const bool refused = c.removed < 2;  // every other plant is refused
      EXPECT_EQ(refused, !log.lines().empty());
      for (const char* name : {"x", "y", "a.jpg/x", "a.jpg/y"}) {
        EXPECT_EQ("root's", ReadFile(outside.File(name))) << name;
      }
      if (S_ISLNK(planted_x)) {
        EXPECT_EQ(planted_x, KindAt(ea + "/x")) << "link removed";
      }
    }
    TempDir dir, outside;
    c.plant(dir.File(".quvameta"), dir.File(".quvameta/a.jpg"), outside.path());
    const std::string ea = dir.File(".quvameta/a.jpg");
    const char* x = "x";
    const char* y = "y";
    const char* found = IsEAFileExist(ea.c_str(), nullptr, x, y);
    EXPECT_EQ(c.found == nullptr ? nullptr
              : *c.found == 'x'  ? x
                                 : y,
              found)
        << c.what;
  }
}

// Metadata side directories: host failures through the fake host, then the
// real stand-in on a real directory tree.
#include "quvaidx/ea_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "host_ops.h"

#include "quvaidx/path_rules.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

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

// Everything under `dir`: each file's bytes, "/" for a directory.
std::map<std::string, std::string> Snapshot(const std::string& dir) {
  std::map<std::string, std::string> found;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
    found[entry.path()] = entry.is_directory() ? "/" : ReadFile(entry.path());
  }
  return found;
}

// errno after OpenEADir with create failed (returned -1), else 0.
int OpenErrno(const char* path, int folder) {
  errno = 0;
  return OpenEADir(path, folder, 1) == -1 ? errno : 0;
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
  EXPECT_EQ(4, log.Count("quvaidx_eafile:N QUVAEADirPath error [0x0024 " +
                         std::string(QLIBCErrorGetFile()) + ":" +
                         std::to_string(QLIBCErrorGetLine()) + "] on /v/a.jpg"))
      << log.lines().back().text;
  for (const auto& logged : log.lines()) EXPECT_EQ(LOG_ERR, logged.priority);
  EXPECT_EQ(-1, GetEADirPath("/v/a.jpg", buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Get ea dir path error. file path: "
                         "/v/a.jpg"));
}

// The real stand-in: the EA directory of <dir>/a.jpg is <dir>/.quvameta/a.jpg.
class RealTree : public ::testing::Test {
 protected:
  void SetUp() override { WriteFile(media_, "jpeg"); }
  TempDir dir_;
  std::string media_ = dir_.File("a.jpg"), ea_ = dir_.File(".quvameta/a.jpg");
  char buf_[4096];
};

// A failed mkdir is logged; a directory made or found takes one host call
// and keeps its items.
TEST_F(RealTree, MakersLogFailuresAndMakeOrKeepTheDirectory) {
  LogCapture log;
  {
    FakeHost host;
    host.Fail(HostOp::kEAMKDir, EACCES);
    EXPECT_EQ(-1, GetEADirPath(media_.c_str(), buf_, sizeof(buf_)));
    EXPECT_EQ(1, log.Count("quvaidx_eafile:N Make ea dir path error. eaDir "
                           "path: " +
                           ea_));
    host.Pass(HostOp::kEAMKDir);
    EXPECT_EQ(0, GetEADirPath(media_.c_str(), buf_, sizeof(buf_)));
    EXPECT_EQ(ea_, buf_);
    EXPECT_EQ(0, GetEADirPath(media_.c_str(), buf_, sizeof(buf_)));
    EXPECT_EQ(2, host.Calls(HostOp::kEAMKDir)) << "made an existing directory";
  }
  EXPECT_EQ(-1, MakeEADir(dir_.File("missing/a.jpg").c_str(), buf_, 4096));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Cannot mkdir " +
                         dir_.File("missing/.quvameta") + ", error:2"));
  ASSERT_EQ(0, rmdir(ea_.c_str()));
  for (auto* fn : {MakeEADir, GetEADirPath}) {
    ASSERT_EQ(0, fn(media_.c_str(), buf_, sizeof(buf_)));
    EXPECT_EQ(ea_, buf_);
    EXPECT_EQ(1, IsDirExist(ea_.c_str()));
    WriteFile(ea_ + "/thumb", "data");
    EXPECT_EQ(0, fn(media_.c_str(), buf_, sizeof(buf_)));
    EXPECT_EQ(1, IsFileExist((ea_ + "/thumb").c_str(), nullptr));
    ASSERT_EQ(0, unlink((ea_ + "/thumb").c_str()));
    ASSERT_EQ(0, rmdir(ea_.c_str()));
  }
}

TEST_F(RealTree, ItemsArePreferredInOrderAndNeedTwoBytesToCount) {
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf_, sizeof(buf_)));
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
  const std::tuple<const char*, const char*, const char*> cases[] = {
      {"one", "big", nullptr},  // a 1-byte item hides the big one
      {"none", "two", "two"},   // and the path found, null for none
      {"dir_item", "none", nullptr}};
  for (const auto& [n1, n2, path] : cases) {
    SCOPED_TRACE(n1);
    char out[4096] = "untouched";
    EXPECT_EQ(path != nullptr, IsEAFileExist2(media_.c_str(), n1, n2));
    EXPECT_EQ(path ? 0 : -1,
              GetEAFilePath(media_.c_str(), n1, n2, out, sizeof(out)));
    EXPECT_EQ(path ? ea_ + "/" + path : "untouched", out);
  }
  char cut[8];
  EXPECT_EQ(0, GetEAFilePath(media_.c_str(), "big", nullptr, cut, sizeof(cut)));
  EXPECT_EQ(std::string(ea_, 0, 7), cut);
  EXPECT_EQ(-1, GetEAFilePath(media_.c_str(), "big", nullptr, cut, 0));
}

// Removal counts what was there and spares directories. An item path too
// long for the 4096-byte buffer, whose cut prefix names another, existing
// file, is neither found nor removed.
TEST_F(RealTree, RemoveCountsItemsAndSparesDirectoriesAndCutPaths) {
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf_, sizeof(buf_)));
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

// What a user may plant where a directory or an item should be.
enum Plant { kNone, kDir, kFile, kToDir, kToFile, kDangling, kFifo };

// A photo folder with its metadata directory, EA directory and items x and
// y planted, and beside it `outside`, where a followed link would lead: the
// file "victim" and the directory "d" with items x, y, a.jpg/x, a.jpg/y.
class PlantedTree {
 public:
  PlantedTree(Plant hidden, Plant ea, Plant x = kNone, Plant y = kNone) {
    mkdir(outside_.File("d").c_str(), 0755);
    mkdir(outside_.File("d/a.jpg").c_str(), 0755);
    for (const char* name : {"victim", "d/x", "d/y", "d/a.jpg/x", "d/a.jpg/y"})
      WriteFile(outside_.File(name), name);
    outside_before_ = Snapshot(outside_.path());
    PlantAt(hidden_, hidden);
    PlantAt(ea_, ea);
    PlantAt(ea_ + "/x", x);
    PlantAt(ea_ + "/y", y);
    hidden_kind_ = KindAt(hidden_);
    ea_kind_ = KindAt(ea_);
  }

  // Nothing outside seen, changed or removed; with `refused`, the planted
  // entries are still there as they were.
  void ExpectUntouched(bool refused) const {
    EXPECT_EQ(outside_before_, Snapshot(outside_.path()));
    if (!refused) return;
    EXPECT_EQ(hidden_kind_, KindAt(hidden_)) << "removed";
    EXPECT_EQ(ea_kind_, KindAt(ea_)) << "removed";
  }

  TempDir dir_, outside_;  // first: the paths below are made from them
  std::string media_ = dir_.File("a.jpg"), hidden_ = dir_.File(".quvameta"),
              ea_ = hidden_ + "/a.jpg";

 private:
  void PlantAt(const std::string& path, Plant kind) const {
    if (kind == kDir) mkdir(path.c_str(), 0755);
    if (kind == kFile) WriteFile(path, "12345");
    if (kind == kFifo) mkfifo(path.c_str(), 0666);
    const char* to = kind == kToDir ? "d" : kind == kToFile ? "victim" : "none";
    if (kind == kToDir || kind == kToFile || kind == kDangling) {
      symlink(outside_.File(to).c_str(), path.c_str());
    }
  }

  std::map<std::string, std::string> outside_before_;
  mode_t hidden_kind_, ea_kind_;
};

// The metadata directory (.quvameta) and the EA directory (.quvameta/a.jpg)
// as a user may plant them; errno of OpenEADir without and with create (0:
// opened), and whether a refusal is logged.
const std::tuple<const char*, Plant, Plant, int, int, bool> kDirCases[] = {
    {"nothing", kNone, kNone, ENOENT, 0, false},
    {"both directories", kDir, kDir, 0, 0, false},
    {"metadata dir links elsewhere", kToDir, kNone, ELOOP, ELOOP, true},
    {"EA dir links elsewhere", kDir, kToDir, ELOOP, ELOOP, true},
    {"EA dir links to a file", kDir, kToFile, ELOOP, ELOOP, true},
    {"dangling link at the metadata dir", kDangling, kNone, ELOOP, ELOOP, true},
    {"dangling link at the EA dir", kDir, kDangling, ELOOP, ELOOP, true},
    {"FIFO at the metadata dir", kFifo, kNone, ENOTDIR, ENOTDIR, true},
    {"FIFO at the EA dir", kDir, kFifo, ENOTDIR, ENOTDIR, true},
    {"file at the metadata dir", kFile, kNone, ENOTDIR, 0, false},
    {"file at the EA dir", kDir, kFile, ENOTDIR, 0, false},
};

// Every planted entry, for OpenEADir without and with create, from the
// folder's path and from a descriptor of it, and for both makers: a link or
// special file is refused, logged and left in place, never followed; a
// regular file is replaced only when creating. A maker logs its failure
// after the refusal; GetEADirPath hands the host only what is missing.
TEST(EADirWalk, PlantedEntriesAreRefusedOrReplacedNeverFollowed) {
  const char* kCallers[] = {"OpenEADir",       "OpenEADir create",
                            "OpenEADir by fd", "OpenEADir create by fd",
                            "MakeEADir",       "GetEADirPath"};
  for (const auto& [what, hidden, ea, error_open, error_create, refused] :
       kDirCases) {
    for (int caller = 0; caller < 6; ++caller) {
      SCOPED_TRACE(std::string(what) + ", " + kCallers[caller]);
      PlantedTree tree(hidden, ea);
      const char* media = tree.media_.c_str();
      const bool create = caller & 1, by_host = caller == 5;
      const int folder =
          (caller & 6) == 2 ? open(tree.dir_.path().c_str(), O_RDONLY) : -1;
      quvaidx::test::FdLeakCheck leaks;
      LogCapture log;
      FakeHost host;
      char buf[4096];
      if (caller < 4) {
        errno = 0;
        const int fd = OpenEADir(media, folder, create);
        EXPECT_EQ(create ? error_create : error_open, fd < 0 ? errno : 0);
        EXPECT_EQ(refused ? 1u : 0u, log.lines().size());
        struct stat opened = {}, named = {};
        EXPECT_TRUE(fd < 0 ||
                    (fstat(fd, &opened) == 0 &&
                     lstat(tree.ea_.c_str(), &named) == 0 &&
                     S_ISDIR(named.st_mode) && named.st_ino == opened.st_ino &&
                     (fcntl(fd, F_GETFD) & FD_CLOEXEC) != 0));
        if (fd >= 0) close(fd);
      } else {
        const bool made = by_host ? error_open == 0 || error_open == ENOENT
                                  : error_create == 0;
        EXPECT_EQ(made ? 0 : -1, by_host ? GetEADirPath(media, buf, 4096)
                                         : MakeEADir(media, buf, 4096));
        EXPECT_EQ(tree.ea_, buf);
        EXPECT_TRUE(!made || KindAt(tree.ea_) == S_IFDIR);
        EXPECT_TRUE(!refused || host.Calls(HostOp::kEAMKDir) == 0);
        if (refused) {
          ASSERT_EQ(2u, log.lines().size());  // the refusal, then the failure
          EXPECT_NE(
              std::string::npos,
              log.lines()[1].text.find(
                  by_host ? "Make ea dir path error. eaDir path: " + tree.ea_
                          : ", error:" + std::to_string(error_create)));
        }
      }
      tree.ExpectUntouched(refused);
      EXPECT_TRUE(leaks.NoLeak());
      if (folder >= 0) close(folder);
    }
  }
}

// The walk starts at the descriptor: the folder's path in file_path is not
// opened then. Made directories take 0777 less the umask. Descriptor 0 is
// a descriptor like any other.
TEST(EADirWalk, StartsAtTheGivenFolderAndMakesDirectoriesUnderTheUmask) {
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
  EXPECT_EQ(ENOENT, OpenErrno("/no-such-folder/a.jpg", -1));
  // In a daemon whose standard input is closed, a directory may be fd 0.
  const std::string photo = dir.File("b.jpg");
  EXPECT_EQ(quvaidx::test::RunInChildProcess([&] {
              close(0);
              const int fd = OpenEADir(photo.c_str(), -1, 1);
              return fd == 0 ? 0 : 1;
            }),
            0);
}

// What the host answers for every file, set per case.
const char* g_host_answer = "";

int AnswerHostPath(int, const char*, char* buffer, int size) {
  snprintf(buffer, static_cast<size_t>(size), "%s", g_host_answer);
  return 0;
}

TEST(EADirWalk, BadArgumentsAndHostPathsOutsideTheFolderAreEINVAL) {
  TempDir dir, outside;
  LogCapture log;
  const std::string media = dir.File("a.jpg");
  EXPECT_EQ(EINVAL, OpenErrno(nullptr, -1));
  EXPECT_EQ(EINVAL, OpenErrno(media.c_str(), -2));
  {
    FakeHost host;
    host.Fail(HostOp::kEADirPath, ENAMETOOLONG);
    EXPECT_EQ(EINVAL, OpenErrno(media.c_str(), -1));
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
    EXPECT_EQ(EINVAL, OpenErrno(media.c_str(), -1)) << answer;
  }
  quvahost::SetHostOps(&previous);
  EXPECT_TRUE(Snapshot(dir.path()).empty());
  EXPECT_TRUE(Snapshot(outside.path()).empty());
  EXPECT_EQ(5u, log.lines().size());  // the host failure and four answers
}

// The item functions where the metadata or EA directory, or an item x or y,
// is planted: a link is neither an item nor removed nor followed.
TEST(EADirWalk, PlantedLinksAreNeitherItemsNorRemovedNorFollowed) {
  // what, planted hidden, ea, x, y; removed by RemoveEAFile(ea, "x", "y"),
  // found by IsEAFileExist(ea, "x", "y")
  const std::tuple<const char*, Plant, Plant, Plant, Plant, int, const char*>
      cases[] = {
          {"real items", kDir, kDir, kFile, kFile, 2, "x"},
          {"metadata dir links", kToDir, kNone, kNone, kNone, 0, nullptr},
          {"EA dir links", kDir, kToDir, kNone, kNone, 0, nullptr},
          {"dangling metadata dir", kDangling, kNone, kNone, kNone, 0, nullptr},
          {"FIFO at the EA dir", kDir, kFifo, kNone, kNone, 0, nullptr},
          {"x links to a file", kDir, kDir, kToFile, kFile, 1, "y"},
          {"x dangles, y links to a dir", kDir, kDir, kDangling, kToDir, 0,
           nullptr},
      };
  // The first two return what they removed, the others 1 when they found
  // an item.
  const std::function<int(const char* media, const char* ea)> calls[] = {
      [](auto, auto ea) { return RemoveEAFile(ea, "x", "y"); },
      [](auto m, auto) { return RemoveEAFile2(m, "x", "y"); },
      [](auto, auto ea) { return !!IsEAFileExist(ea, nullptr, "x", "y"); },
      [](auto m, auto) { return IsEAFileExist2(m, "x", "y"); },
      [](auto m, auto) {
        char out[4096];
        return GetEAFilePath(m, "x", "y", out, sizeof(out)) == 0 ? 1 : 0;
      },
  };
  for (const auto& [what, hidden, ea, x, y, removed, found] : cases) {
    for (size_t i = 0; i < std::size(calls); ++i) {
      SCOPED_TRACE(std::string(what) + ", call " + std::to_string(i));
      PlantedTree tree(hidden, ea, x, y);
      const mode_t x_kind = KindAt(tree.ea_ + "/x");
      LogCapture log;
      EXPECT_EQ(i < 2 ? removed : found != nullptr,
                calls[i](tree.media_.c_str(), tree.ea_.c_str()));
      EXPECT_EQ(removed < 2, !log.lines().empty());  // refusals logged
      tree.ExpectUntouched(false);
      EXPECT_TRUE(!S_ISLNK(x_kind) || x_kind == KindAt(tree.ea_ + "/x"))
          << "link removed";
    }
    PlantedTree tree(hidden, ea, x, y);
    const char *x_name = "x", *y_name = "y";
    EXPECT_EQ(!found          ? nullptr
              : *found == 'x' ? x_name
                              : y_name,
              IsEAFileExist(tree.ea_.c_str(), nullptr, x_name, y_name))
        << what;
  }
}

}  // namespace

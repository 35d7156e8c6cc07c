// The thumbnail daemon's work without the daemon: thumbnails of photos made
// here, and the queue walk with a stand-in for the thumbnail making.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "photo_fixtures.h"
#include "preview_names.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "thumb_worker.h"
#include "thumbnailer.h"

namespace quvaidx::daemon_test {
namespace {

using mkthumbd::MakePhotoThumbnails;
using mkthumbd::PhotoOutcome;
using mkthumbd::PhotoResult;
using mkthumbd::ThumbWorker;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;
using quvaidx_daemons::kAllThumbSizes;
using Did = ThumbWorker::Did;

// Moves the modification time of `path` 10 s ahead: a rewrite.
void Touch(const std::string& path) {
  std::filesystem::last_write_time(
      path,
      std::filesystem::file_time_type::clock::now() + std::chrono::seconds(10));
}

class ThumbnailerTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    std::string error;
    ASSERT_TRUE(mkthumbd::InitThumbnailer("mkthumbd_work_test", &error))
        << error;
  }
  std::string Photo(const std::string& name) const { return dir_.File(name); }

  TempDir dir_;
};

// Each size fits its square, none enlarged; every thumbnail is an 8-bit sRGB
// JPEG without metadata, also of a grey photo; transparency lies on white.
TEST_F(ThumbnailerTest, ThumbnailsFitTheirSquaresAsPlainSrgbJpegs) {
  // photo, its width, height and bands, the sizes of XL, B, M and S
  const std::tuple<const char*, int, int, int, const char*> cases[] = {
      {"wide.jpg", 1600, 1200, 3, "1280x960 640x480 320x240 120x90"},
      {"tiny.jpg", 100, 80, 3, "100x80 100x80 100x80 100x80"},
      {"grey.png", 300, 200, 1, "300x200 300x200 300x200 120x80"},
      {"clear.png", 300, 200, 4, "300x200 300x200 300x200 120x80"},
  };
  for (const auto& [name, width, height, bands, expected] : cases) {
    SCOPED_TRACE(name);
    const std::string photo = Photo(name);
    ASSERT_TRUE(WritePhoto(photo, width, height, kRed, kBlue, bands, 0));
    PhotoResult result = MakePhotoThumbnails(photo);
    EXPECT_EQ(result.made, kAllThumbSizes) << result.reason;
    std::string sizes;
    for (const char* label : {"XL", "B", "M", "S"}) {
      auto facts = ReadImage(ThumbItem(photo, label));
      sizes += std::to_string(facts.width) + "x" +
               std::to_string(facts.height) + (label[0] == 'S' ? "" : " ");
      EXPECT_EQ(facts.loader + std::to_string(facts.bands) +
                    (facts.srgb ? " sRGB" : "") +
                    (facts.has_metadata ? " metadata" : ""),
                "jpegload3 sRGB")
          << label;
    }
    EXPECT_EQ(sizes, expected);
  }
  EXPECT_TRUE(Near(ColourAt(ThumbItem(Photo("clear.png"), "M"), 0.5, 0.5),
                   {255, 255, 255}, 8));
}

// The orientation tag is applied: stored red on the left, shown as the tag
// says, red is on the case's side of the thumbnail.
TEST_F(ThumbnailerTest, ExifRotatedPhotosComeOutUpright) {
  if (!HaveExiftool()) GTEST_SKIP() << "exiftool (libimage-exiftool-perl)";
  // orientation, portrait, where red must be: left, right (180), top (90
  // clockwise), bottom (90 anticlockwise)
  const std::tuple<int, bool, double, double> cases[] = {{1, false, 0.15, 0.5},
                                                         {3, false, 0.85, 0.5},
                                                         {6, true, 0.5, 0.15},
                                                         {8, true, 0.5, 0.85}};
  std::vector<std::pair<std::string, int>> tags;
  for (const auto& [orientation, portrait, x, y] : cases) {
    tags.push_back(
        {Photo("o" + std::to_string(orientation) + ".jpg"), orientation});
    ASSERT_TRUE(WritePhoto(tags.back().first, 400, 200, kRed, kBlue));
  }
  ASSERT_TRUE(SetOrientations(tags));
  for (const auto& [orientation, portrait, x, y] : cases) {
    const std::string photo = Photo("o" + std::to_string(orientation) + ".jpg");
    ASSERT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kMade);
    for (const char* label : {"XL", "S"}) {
      SCOPED_TRACE("orientation " + std::to_string(orientation) + " " + label);
      auto facts = ReadImage(ThumbItem(photo, label));
      EXPECT_EQ(facts.height > facts.width, portrait);
      auto red = ColourAt(ThumbItem(photo, label), x, y);
      EXPECT_TRUE(Near(red, kRed)) << red.r << "," << red.g << "," << red.b;
    }
  }
}

// Only missing, 1-byte or stale thumbnails are made again (':' names count);
// each look removes killed writers' temporary files, and only those.
TEST_F(ThumbnailerTest, OnlyStaleOrMissingThumbnailsAreMadeAgain) {
  const std::string photo = Photo("p.jpg");
  const std::string ea = dir_.File(".quvameta/p.jpg/");
  ASSERT_TRUE(WritePhoto(photo, 800, 600, kRed, kBlue));
  ASSERT_EQ(MakePhotoThumbnails(photo).made, kAllThumbSizes);
  ASSERT_EQ(
      symlink(photo.c_str(), (ea + "QUVAPHOTO_THUMB_S.jpg.part-l1nk0").c_str()),
      0);
  const struct {
    const char* change;
    std::function<void()> make;
    PhotoOutcome outcome;
    int made;
  } steps[] = {
      {"none", [] {}, PhotoOutcome::kUpToDate, 0},
      {"M gone, S of 1 byte",
       [&] {
         unlink(ThumbItem(photo, "M").c_str());
         WriteFile(ThumbItem(photo, "S"), "x");
       },
       PhotoOutcome::kMade, 0x2 | 0x1},
      {"XL under its second name",
       [&] {
         rename(ThumbItem(photo, "XL").c_str(),
                (ea + "QUVAPHOTO:THUMB_XL.jpg").c_str());
       },
       PhotoOutcome::kUpToDate, 0},
      {"photo rewritten", [&] { Touch(photo); }, PhotoOutcome::kMade,
       kAllThumbSizes},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(step.change);
    step.make();
    WriteFile(ea + "QUVAPHOTO_THUMB_M.jpg.part-Ab12Cd", "half");
    WriteFile(ea + "other.part-x", "not ours");
    PhotoResult result = MakePhotoThumbnails(photo);
    EXPECT_EQ(result.outcome, step.outcome);
    EXPECT_EQ(result.made, step.made);
    EXPECT_NE(access((ea + "QUVAPHOTO_THUMB_M.jpg.part-Ab12Cd").c_str(), F_OK),
              0);
  }
  EXPECT_EQ(NamesUnder(ea),
            (std::vector<std::string>{
                "QUVAPHOTO:THUMB_XL.jpg", "QUVAPHOTO_THUMB_B.jpg",
                "QUVAPHOTO_THUMB_M.jpg", "QUVAPHOTO_THUMB_S.jpg",
                "QUVAPHOTO_THUMB_S.jpg.part-l1nk0", "QUVAPHOTO_THUMB_XL.jpg",
                "other.part-x"}));
}

// Unreadable photos, bombs, huge files, gone ones and non-regular ones (a
// FIFO is never waited on) are skipped at once with a reason, leaving nothing.
TEST_F(ThumbnailerTest, BadPhotosAreSkippedWithAReason) {
  ASSERT_TRUE(WritePhoto(Photo("whole.jpg"), 800, 600, kRed, kBlue));
  std::string whole = ReadFile(Photo("whole.jpg"));
  WriteFile(Photo("truncated.jpg"), whole.substr(0, whole.size() / 2));
  WriteFile(Photo("empty.jpg"), "");
  WriteFile(Photo("text.jpg"), "not a picture\n");
  ASSERT_TRUE(WritePngBomb(Photo("bomb.png"), 30000, 30000));
  ASSERT_EQ(symlink("whole.jpg", Photo("link.jpg").c_str()), 0);
  ASSERT_EQ(mkdir(Photo("folder.jpg").c_str(), 0755), 0);
  ASSERT_EQ(mkfifo(Photo("fifo.jpg").c_str(), 0644), 0);
  WriteFile(Photo("huge.jpg"), whole);  // a JPEG header, then 16 GiB of holes
  ASSERT_EQ(truncate(Photo("huge.jpg").c_str(), 16LL << 30), 0);
  const std::pair<const char*, const char*> cases[] = {
      {"truncated.jpg", "cannot read it"},
      {"empty.jpg", "cannot read it"},
      {"text.jpg", "cannot read it"},
      {"bomb.png", "30000 x 30000 pixels, more than the limit"},
      {"gone.jpg", "it is gone"},
      {"link.jpg", "not a regular file"},
      {"folder.jpg", "not a regular file"},
      {"fifo.jpg", "not a regular file"},
      {"huge.jpg", "a file of 16384 MiB, more than the decode limit"},
  };
  for (const auto& [name, reason] : cases) {
    SCOPED_TRACE(name);
    const auto started = std::chrono::steady_clock::now();
    PhotoResult result = MakePhotoThumbnails(Photo(name));
    EXPECT_LT(std::chrono::steady_clock::now() - started,
              std::chrono::seconds(2));
    EXPECT_EQ(result.outcome, PhotoOutcome::kSkipped);
    EXPECT_NE(result.reason.find(reason), std::string::npos) << result.reason;
    EXPECT_EQ(result.made, 0);
    EXPECT_TRUE(NamesUnder(dir_.File(".quvameta/") + name).empty());
  }
}

// An item that cannot be written (a folder there) or must not be (a link:
// neither followed nor replaced) is reported; the other sizes are made.
TEST_F(ThumbnailerTest, OneUnwritableItemDoesNotStopTheOthers) {
  const std::string photo = Photo("p.jpg");
  const std::string elsewhere = Photo("elsewhere.txt");
  ASSERT_TRUE(WritePhoto(photo, 800, 600, kRed, kBlue));
  WriteFile(elsewhere, "keep me");
  ASSERT_TRUE(std::filesystem::create_directories(ThumbItem(photo, "B")));
  ASSERT_EQ(symlink(elsewhere.c_str(), ThumbItem(photo, "M").c_str()), 0);
  PhotoResult result = MakePhotoThumbnails(photo);
  EXPECT_EQ(result.outcome, PhotoOutcome::kMade);
  EXPECT_EQ(result.made, 0x8 | 0x1);
  EXPECT_NE(result.reason.find("QUVAPHOTO_THUMB_"), std::string::npos)
      << result.reason;
  EXPECT_EQ(ReadImage(ThumbItem(photo, "S")).width, 120);
  EXPECT_EQ(ReadFile(elsewhere), "keep me");
  EXPECT_TRUE(std::filesystem::is_symlink(ThumbItem(photo, "M")));
}

// Decoders that hold the whole image are refused under a limit the streaming
// ones stay within (HEIF: bench/thumb_rss.sh).
TEST_F(ThumbnailerTest, DecodesThatWouldExceedTheMemoryLimitAreRefused) {
  // name with libvips save options; width; made
  const std::tuple<std::string, int, bool> cases[] = {
      {"base.jpg", 3000, true},
      {"prog.jpg[interlace,Q=95]", 3000, false},
      {"plain.png", 3000, true},
      {"pano.png", 30000, true},  // 200 lines of 30000: streams
      {"inter.png[interlace]", 3000, false},
      {"lossy.webp", 3000, true},
      {"lossless.webp[lossless]", 3000, false},
      {"g.gif", 3000, false},
      {"t.tif", 3000, false}};
  mkthumbd::PhotoLimits limits;
  limits.max_decode_bytes = 45LL << 20;
  for (const auto& [write, width, made] : cases) {
    const std::string name = write.substr(0, write.find('['));
    SCOPED_TRACE(name);
    ASSERT_TRUE(
        WritePlainPhoto(Photo(write), width, width > 3000 ? 200 : 2000, kRed));
    PhotoResult result = MakePhotoThumbnails(Photo(name), limits);
    EXPECT_EQ(result.made, made ? kAllThumbSizes : 0) << result.reason;
    EXPECT_EQ(result.reason.find("MiB to decode, more than the limit of 45") !=
                  std::string::npos,
              !made)
        << result.reason;
  }
}

// The queue walk, with a "thumbnail making" that records the photo and its
// file-system user and runs `also_`; folders live in the host's one share.
class ThumbWorkerTest : public ::testing::Test {
 protected:
  ThumbWorkerTest() {
    mkdir(share_.c_str(), 0755);
    WriteShares(dir_.File("etc"), {{"share", share_}});
    setenv("QUVA_HOST_ETC", dir_.File("etc").c_str(), 1);
  }
  ~ThumbWorkerTest() override { unsetenv("QUVA_HOST_ETC"); }

  ThumbWorker Worker() {
    return ThumbWorker(queue_, [this](int, const std::string& folder,
                                      const std::string& name) {
      made_.push_back(folder + "/" + name);
      as_.push_back(static_cast<unsigned>(syscall(SYS_setfsuid, -1)));
      if (also_) also_(folder + "/" + name);
      return PhotoResult{PhotoOutcome::kMade, kAllThumbSizes, ""};
    });
  }
  std::string Folder(const std::string& name) {
    mkdir(Path(name).c_str(), 0755);
    return Path(name);
  }
  std::string Path(const std::string& name) { return share_ + "/" + name; }
  void Drain(ThumbWorker& worker) {
    for (int i = 0; i < 1000 && worker.Step() != Did::kNothing; ++i) {
    }
  }

  TempDir dir_;
  std::string share_ = dir_.File("share");
  std::string queue_ = dir_.File("thumb.queue");
  std::vector<std::string> made_;
  std::vector<unsigned> as_;  // the file-system user of each making
  std::function<void(const std::string&)> also_;
};

// Only the folder's own web photos, in name order; entries that name no
// folder, a link, or lie outside the shares are dropped.
TEST_F(ThumbWorkerTest, MakesTheFoldersOwnPhotosAndRefusesOtherEntries) {
  std::string a = Folder("a");
  for (const char* name : {"b.JPG", "a.png", "c.gif", "notes.txt", "clip.mp4",
                           "._a.png", "raw.nef"}) {
    WriteFile(a + "/" + name, "x");
  }
  Folder("a/sub");
  WriteFile(a + "/sub/deeper.jpg", "x");
  symlink("a.png", (a + "/link.jpg").c_str());
  WriteFile(Path("file.jpg"), "x");
  symlink(a.c_str(), Path("link-to-a").c_str());
  mkdir(dir_.File("outside").c_str(), 0755);
  mkdir(dir_.File("outside/sub").c_str(), 0755);
  WriteFile(dir_.File("outside/sub/secret.jpg"), "x");
  symlink(dir_.File("outside").c_str(), Path("out").c_str());
  const std::vector<std::string> refused = {
      "relative/path",          Path("gone"),
      Path("file.jpg"),         Path("link-to-a"),
      dir_.File("outside/sub"), Path("out/sub"),
  };
  std::string queue = "\n";  // an empty line is no entry at all
  for (const std::string& entry : refused) queue += entry + "\n";
  WriteFile(queue_, queue + a + "\n" + a + "/\n");
  ThumbWorker worker = Worker();
  Drain(worker);
  std::vector<std::string> once = {a + "/a.png", a + "/b.JPG", a + "/c.gif",
                                   a + "/raw.nef"};
  std::vector<std::string> twice = once;
  twice.insert(twice.end(), once.begin(), once.end());
  EXPECT_EQ(made_, twice);
  EXPECT_EQ(ReadFile(queue_), "");
  EXPECT_EQ(worker.counts().entries_refused, static_cast<long>(refused.size()));
  EXPECT_EQ(worker.counts().photos_made, 8);
}

// A root worker lists and makes each folder's photos as the folder's owner:
// a folder its owner may not read is refused although root could.
TEST_F(ThumbWorkerTest, EachFolderIsWorkedAsItsOwner) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to work as others";
  const std::tuple<const char*, unsigned, unsigned> folders[] = {
      {"a", kUserA, 0755},
      {"b", kUserB, 0700},
      {"root", 0, 0700},
      {"unreadable", kUserA, 0300}};
  std::string queue;
  for (const auto& [name, uid, mode] : folders) {
    ASSERT_TRUE(MakeOwnedDir(Path(name), uid, uid, 0755));
    WriteFile(Path(name) + "/p.jpg", "x");
    ASSERT_TRUE(Own(Path(name), uid, uid, mode));
    queue += Path(name) + "\n";
  }
  WriteFile(queue_, queue);
  ThumbWorker worker = Worker();
  Drain(worker);
  EXPECT_EQ(made_, (std::vector<std::string>{Path("a/p.jpg"), Path("b/p.jpg"),
                                             Path("root/p.jpg")}));
  EXPECT_EQ(as_, (std::vector<unsigned>{kUserA, kUserB, 0}));
  EXPECT_EQ(worker.counts().entries_refused, 1);
  EXPECT_EQ(syscall(SYS_setfsuid, -1), 0);  // the worker's own is back
}

// A photo added or rewritten during the work (WriteThumbQueue skipped the
// folder as queued) sends it to the back; the worker's own metadata not.
TEST_F(ThumbWorkerTest, FolderChangedDuringTheWorkGoesToTheBack) {
  const struct {
    const char* change;
    std::function<void(const std::string& folder)> make;
    bool requeued;
  } cases[] = {
      {"photo added", [](auto& f) { WriteFile(f + "/new.jpg", "x"); }, true},
      {"photo rewritten", [](auto& f) { Touch(f + "/1.jpg"); }, true},
      {"non-photo added", [](auto& f) { WriteFile(f + "/notes.txt", "x"); },
       false},
      {"metadata directory made",
       [](auto& f) { mkdir((f + "/.quvameta").c_str(), 0755); }, false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.change);
    std::string folder = Folder(c.change);
    WriteFile(folder + "/1.jpg", "x");
    WriteFile(queue_, folder + "\n/other\n");
    also_ = [&](const std::string&) { c.make(folder); };
    ThumbWorker worker = Worker();
    for (int i = 0; i < 100 && worker.Step() != Did::kEntry; ++i) {
    }
    std::string entries = ReadFile(queue_);  // done entries become blank
    entries.erase(0, entries.find_first_not_of('\n'));
    EXPECT_EQ(entries, "/other\n" + (c.requeued ? folder + "\n" : ""));
    EXPECT_EQ(worker.counts().entries_requeued, c.requeued ? 1 : 0);
  }
}

}  // namespace
}  // namespace quvaidx::daemon_test

// The thumbnail daemon's work without the daemon around it: the libvips
// thumbnails of real photos made here (sizes, orientation, colour, what is
// kept, what is skipped, what a decode may take, who may read them), and
// the walk through the queue with a stand-in for the thumbnail making
// (which photos, which entries are served, as whom, when an entry leaves
// the queue).
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
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

namespace {

using mkthumbd::MakePhotoThumbnails;
using mkthumbd::PhotoOutcome;
using mkthumbd::PhotoResult;
using mkthumbd::ThumbWorker;
using quvaidx::daemon_test::ColourAt;
using quvaidx::daemon_test::kBlue;
using quvaidx::daemon_test::kRed;
using quvaidx::daemon_test::kUserA;
using quvaidx::daemon_test::kUserB;
using quvaidx::daemon_test::MakeOwnedDir;
using quvaidx::daemon_test::NamesUnder;
using quvaidx::daemon_test::Near;
using quvaidx::daemon_test::Own;
using quvaidx::daemon_test::ReadImage;
using quvaidx::daemon_test::ThumbItem;
using quvaidx::daemon_test::WritePhoto;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;
using quvaidx_daemons::kAllThumbSizes;
using Did = ThumbWorker::Did;

// Moves the modification time of `path` 10 s ahead: a rewrite.
void Touch(const std::string& path) {
  struct timespec later[2];
  clock_gettime(CLOCK_REALTIME, &later[0]);
  later[0].tv_sec += 10;
  later[1] = later[0];
  utimensat(AT_FDCWD, path.c_str(), later, 0);
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

// Each size fits its square and none is enlarged; every thumbnail is an
// 8-bit sRGB JPEG without the photo's metadata, also of a grey photo, and
// transparency lies on white, not black.
TEST_F(ThumbnailerTest, ThumbnailsFitTheirSquaresAsPlainSrgbJpegs) {
  struct Case {
    const char* photo;
    int width, height, bands;
    const char* sizes;  // XL, B, M, S
  } cases[] = {
      {"wide.jpg", 1600, 1200, 3, "1280x960 640x480 320x240 120x90"},
      {"tiny.jpg", 100, 80, 3, "100x80 100x80 100x80 100x80"},
      {"grey.png", 300, 200, 1, "300x200 300x200 300x200 120x80"},
      {"clear.png", 300, 200, 4, "300x200 300x200 300x200 120x80"},
  };
  for (const Case& c : cases) {
    const std::string photo = Photo(c.photo);
    ASSERT_TRUE(WritePhoto(photo, c.width, c.height, kRed, kBlue, c.bands, 0));
    PhotoResult result = MakePhotoThumbnails(photo);
    EXPECT_EQ(result.made, kAllThumbSizes) << c.photo << ": " << result.reason;
    std::string sizes;
    for (const char* label : {"XL", "B", "M", "S"}) {
      auto facts = ReadImage(ThumbItem(photo, label));
      sizes += std::to_string(facts.width) + "x" +
               std::to_string(facts.height) + (label[0] == 'S' ? "" : " ");
      EXPECT_TRUE(facts.loader == "jpegload" && facts.bands == 3 &&
                  facts.srgb && !facts.has_metadata)
          << c.photo << " " << label << ": " << facts.loader << ", "
          << facts.bands << " bands, sRGB " << facts.srgb << ", metadata "
          << facts.has_metadata;
    }
    EXPECT_EQ(sizes, c.sizes) << c.photo;
  }
  EXPECT_TRUE(Near(ColourAt(ThumbItem(Photo("clear.png"), "M"), 0.5, 0.5),
                   {255, 255, 255}, 8));
}

// A camera's orientation tag must be applied: the stored pixels have red on
// the left; shown as the tag says, red is on this side of the thumbnail.
TEST_F(ThumbnailerTest, ExifRotatedPhotosComeOutUpright) {
  if (!quvaidx::daemon_test::HaveExiftool()) {
    GTEST_SKIP() << "exiftool is not installed (libimage-exiftool-perl)";
  }
  struct Case {
    int orientation;
    bool portrait;
    double red_x, red_y;  // where red must be
  } cases[] = {
      {1, false, 0.15, 0.5},  // left
      {3, false, 0.85, 0.5},  // rotated 180: right
      {6, true, 0.5, 0.15},   // rotated 90 clockwise: top
      {8, true, 0.5, 0.85},   // rotated 90 anticlockwise: bottom
  };
  std::vector<std::pair<std::string, int>> tags;
  for (const Case& c : cases) {
    tags.push_back(
        {Photo("o" + std::to_string(c.orientation) + ".jpg"), c.orientation});
    ASSERT_TRUE(WritePhoto(tags.back().first, 400, 200, kRed, kBlue));
  }
  ASSERT_TRUE(quvaidx::daemon_test::SetOrientations(tags));
  for (const Case& c : cases) {
    const std::string photo =
        Photo("o" + std::to_string(c.orientation) + ".jpg");
    ASSERT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kMade);
    for (const char* label : {"XL", "S"}) {
      SCOPED_TRACE("orientation " + std::to_string(c.orientation) + " " +
                   label);
      auto facts = ReadImage(ThumbItem(photo, label));
      EXPECT_EQ(facts.height > facts.width, c.portrait);
      auto red = ColourAt(ThumbItem(photo, label), c.red_x, c.red_y);
      EXPECT_TRUE(Near(red, kRed)) << red.r << "," << red.g << "," << red.b;
    }
  }
}

// Thumbnails newer than their photo are kept; a missing or 1-byte one, or
// all of a photo rewritten since, are made again; the ':' name counts as
// present. Each look at the photo, up to date or not, removes the temporary
// files a killed daemon left beside its thumbnails, and only those: not
// another file, not a link that looks like one.
TEST_F(ThumbnailerTest, OnlyStaleOrMissingThumbnailsAreMadeAgain) {
  const std::string photo = Photo("p.jpg");
  const std::string ea = dir_.File(".quvameta/p.jpg/");
  ASSERT_TRUE(WritePhoto(photo, 800, 600, kRed, kBlue));
  ASSERT_EQ(MakePhotoThumbnails(photo).made, kAllThumbSizes);
  ASSERT_EQ(
      symlink(photo.c_str(), (ea + "QUVAPHOTO_THUMB_S.jpg.part-l1nk0").c_str()),
      0);
  struct Step {
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
  for (const Step& step : steps) {
    step.make();
    WriteFile(ea + "QUVAPHOTO_THUMB_M.jpg.part-Ab12Cd", "half");
    WriteFile(ea + "other.part-x", "not ours");
    PhotoResult result = MakePhotoThumbnails(photo);
    EXPECT_EQ(result.outcome, step.outcome) << step.change;
    EXPECT_EQ(result.made, step.made) << step.change;
    EXPECT_NE(access((ea + "QUVAPHOTO_THUMB_M.jpg.part-Ab12Cd").c_str(), F_OK),
              0)
        << step.change;
  }
  EXPECT_EQ(NamesUnder(ea),
            (std::vector<std::string>{
                "QUVAPHOTO:THUMB_XL.jpg", "QUVAPHOTO_THUMB_B.jpg",
                "QUVAPHOTO_THUMB_M.jpg", "QUVAPHOTO_THUMB_S.jpg",
                "QUVAPHOTO_THUMB_S.jpg.part-l1nk0", "QUVAPHOTO_THUMB_XL.jpg",
                "other.part-x"}));
}

// Photos libvips cannot read, bombs, files larger than a decode may take,
// and photos that are gone or are not regular files (a FIFO is never waited
// on) are skipped with a reason and leave nothing behind; a bomb is refused
// before it is decoded, a huge file before it is read.
TEST_F(ThumbnailerTest, BadPhotosAreSkippedWithAReason) {
  ASSERT_TRUE(WritePhoto(Photo("whole.jpg"), 800, 600, kRed, kBlue));
  std::string whole = ReadFile(Photo("whole.jpg"));
  WriteFile(Photo("truncated.jpg"), whole.substr(0, whole.size() / 2));
  WriteFile(Photo("empty.jpg"), "");
  WriteFile(Photo("text.jpg"), "not a picture\n");
  ASSERT_TRUE(
      quvaidx::daemon_test::WritePngBomb(Photo("bomb.png"), 30000, 30000));
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
    const auto started = std::chrono::steady_clock::now();
    PhotoResult result = MakePhotoThumbnails(Photo(name));
    EXPECT_LT(std::chrono::steady_clock::now() - started,
              std::chrono::seconds(2))
        << name;
    EXPECT_EQ(result.outcome, PhotoOutcome::kSkipped) << name;
    EXPECT_NE(result.reason.find(reason), std::string::npos)
        << name << ": " << result.reason;
    EXPECT_EQ(result.made, 0);
    EXPECT_TRUE(NamesUnder(dir_.File(".quvameta/") + name).empty()) << name;
  }
}

// An item that cannot be written (a folder stands in its place) or must not
// be (a link stands there: it is neither followed nor replaced) is
// reported, and the other sizes, the smaller ones too, are still made.
TEST_F(ThumbnailerTest, OneUnwritableItemDoesNotStopTheOthers) {
  const std::string photo = Photo("p.jpg");
  const std::string elsewhere = Photo("elsewhere.txt");
  ASSERT_TRUE(WritePhoto(photo, 800, 600, kRed, kBlue));
  WriteFile(elsewhere, "keep me");
  ASSERT_EQ(mkdir(dir_.File(".quvameta").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(dir_.File(".quvameta/p.jpg").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(ThumbItem(photo, "B").c_str(), 0755), 0);
  ASSERT_EQ(symlink(elsewhere.c_str(), ThumbItem(photo, "M").c_str()), 0);
  PhotoResult result = MakePhotoThumbnails(photo);
  EXPECT_EQ(result.outcome, PhotoOutcome::kMade);
  EXPECT_EQ(result.made, 0x8 | 0x1);
  EXPECT_NE(result.reason.find("QUVAPHOTO_THUMB_"), std::string::npos)
      << result.reason;
  EXPECT_EQ(ReadImage(ThumbItem(photo, "S")).width, 120);
  EXPECT_EQ(ReadFile(elsewhere), "keep me");
  struct stat st;
  EXPECT_TRUE(lstat(ThumbItem(photo, "M").c_str(), &st) == 0 &&
              S_ISLNK(st.st_mode));
}

// What a decode may take depends on the format, not on the pixels alone:
// of photos of one size, those whose decoder holds the whole image (a
// progressive JPEG, an interlaced PNG, a lossless WebP, a GIF, a TIFF) are
// refused under a limit that the streaming ones (a baseline JPEG, a plain
// PNG, a lossy WebP) stay within. (HEIF, held whole too, takes seconds to
// encode: bench/thumb_rss.sh measures it.)
TEST_F(ThumbnailerTest, DecodesThatWouldExceedTheMemoryLimitAreRefused) {
  struct Case {
    const char* write;  // name and libvips save options
    const char* name;
    int width, height;
    bool made;
  } cases[] = {
      {"base.jpg", "base.jpg", 3000, 2000, true},
      {"prog.jpg[interlace,Q=95]", "prog.jpg", 3000, 2000, false},
      {"plain.png", "plain.png", 3000, 2000, true},
      {"pano.png", "pano.png", 30000, 200, true},  // a few lines: streams
      {"inter.png[interlace]", "inter.png", 3000, 2000, false},
      {"lossy.webp", "lossy.webp", 3000, 2000, true},
      {"lossless.webp[lossless]", "lossless.webp", 3000, 2000, false},
      {"g.gif", "g.gif", 3000, 2000, false},
      {"t.tif", "t.tif", 3000, 2000, false},
  };
  mkthumbd::PhotoLimits limits;
  limits.max_decode_bytes = 45LL << 20;
  for (const Case& c : cases) {
    ASSERT_TRUE(quvaidx::daemon_test::WritePlainPhoto(Photo(c.write), c.width,
                                                      c.height, kRed))
        << c.name;
    PhotoResult result = MakePhotoThumbnails(Photo(c.name), limits);
    EXPECT_EQ(result.made, c.made ? kAllThumbSizes : 0)
        << c.name << ": " << result.reason;
    if (!c.made) {
      EXPECT_NE(result.reason.find("MiB to decode, more than the limit of 45"),
                std::string::npos)
          << c.name << ": " << result.reason;
    }
  }
}

// The queue walk, with a "thumbnail making" that records the photo and the
// file-system user it runs as, and then runs `also_` (which may change the
// folder under the work). Folders live in the one share of the host
// stand-in's database.
class ThumbWorkerTest : public ::testing::Test {
 protected:
  ThumbWorkerTest() {
    mkdir(share_.c_str(), 0755);
    quvaidx::daemon_test::WriteShares(dir_.File("etc"), {{"share", share_}});
    setenv("QUVA_HOST_ETC", dir_.File("etc").c_str(), 1);
  }
  ~ThumbWorkerTest() override { unsetenv("QUVA_HOST_ETC"); }

  ThumbWorker Worker() {
    return ThumbWorker(queue_, [this](int, const std::string& folder,
                                      const std::string& name) {
      made_.push_back(folder + "/" + name);
      as_.push_back(static_cast<unsigned>(syscall(SYS_setfsuid, -1)));
      if (also_) also_(folder + "/" + name);
      PhotoResult result;
      result.outcome = PhotoOutcome::kMade;
      result.made = kAllThumbSizes;
      return result;
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

// Only the web photos directly in the folder, in name order: no subfolder,
// link, AppleDouble file or other media; a final '/' changes nothing.
// Entries that name no folder, name it through a link, or lie outside the
// shares (also through a link on the way) are removed, and those behind
// them served.
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

// A root worker makes each folder's photos as the folder's owner, whoever
// that is, and lists the folder as the owner too: a folder its owner may
// not read is refused although root could read it.
TEST_F(ThumbWorkerTest, EachFolderIsWorkedAsItsOwner) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to work as others";
  const struct {
    const char* name;
    unsigned uid, mode;
  } folders[] = {
      {"a", kUserA, 0755},
      {"b", kUserB, 0700},
      {"root", 0, 0700},
      {"unreadable", kUserA, 0300},
  };
  std::string queue;
  for (const auto& f : folders) {
    ASSERT_TRUE(MakeOwnedDir(Path(f.name), f.uid, f.uid, 0755));
    WriteFile(Path(f.name) + "/p.jpg", "x");
    ASSERT_TRUE(Own(Path(f.name), f.uid, f.uid, f.mode));
    queue += Path(f.name) + "\n";
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

// A photo added to the folder or rewritten while the entry was worked on:
// WriteThumbQueue skipped the folder as still queued, so the worker must
// send it to the back itself. Its own metadata directories do not count.
TEST_F(ThumbWorkerTest, FolderChangedDuringTheWorkGoesToTheBack) {
  struct Case {
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
  for (const Case& c : cases) {
    std::string folder = Folder(c.change);
    WriteFile(folder + "/1.jpg", "x");
    WriteFile(queue_, folder + "\n/other\n");
    also_ = [&](const std::string&) { c.make(folder); };
    ThumbWorker worker = Worker();
    for (int i = 0; i < 100 && worker.Step() != Did::kEntry; ++i) {
    }
    std::string entries = ReadFile(queue_);  // done entries become blank
    entries.erase(0, entries.find_first_not_of('\n'));
    EXPECT_EQ(entries,
              c.requeued ? "/other\n" + folder + "\n" : std::string("/other\n"))
        << c.change;
    EXPECT_EQ(worker.counts().entries_requeued, c.requeued ? 1 : 0) << c.change;
  }
}

}  // namespace

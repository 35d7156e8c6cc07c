// The thumbnail daemon's libvips work on real photos made here: sizes,
// orientation, colour, metadata, what is kept and what is skipped.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "photo_fixtures.h"
#include "preview_names.h"
#include "support/fd_check.h"
#include "thumbnailer.h"

namespace {

using mkthumbd::MakePhotoThumbnails;
using mkthumbd::PhotoOutcome;
using mkthumbd::PhotoResult;
using quvaidx::daemon_test::ImageFacts;
using quvaidx::daemon_test::MeanColour;
using quvaidx::daemon_test::Near;
using quvaidx::daemon_test::ReadImage;
using quvaidx::daemon_test::Rgb;
using quvaidx::test::TempDir;
using quvaidx_daemons::kThumbSizes;

constexpr Rgb kRed = {230, 20, 20};
constexpr Rgb kBlue = {20, 20, 230};
constexpr Rgb kWhite = {255, 255, 255};

class ThumbnailerTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    std::string error;
    ASSERT_TRUE(mkthumbd::InitThumbnailer("thumbnailer_test", &error)) << error;
  }

  std::string Photo(const std::string& name) const { return dir_.File(name); }
  // The path of thumbnail `label` of photo `name` (first name).
  std::string Thumb(const std::string& name, const std::string& label) const {
    return dir_.File(".quvameta/" + name + "/QUVAPHOTO_THUMB_" + label +
                     ".jpg");
  }
  // Every file under the photos' EA directories, for leftover checks.
  std::vector<std::string> EAFiles(const std::string& name) const {
    std::vector<std::string> names;
    if (DIR* dir = opendir(dir_.File(".quvameta/" + name).c_str())) {
      while (struct dirent* entry = readdir(dir)) {
        if (entry->d_name[0] != '.') names.push_back(entry->d_name);
      }
      closedir(dir);
    }
    return names;
  }

  TempDir dir_;
};

// Each size fits its square, none is enlarged, every one is a plain 8-bit
// sRGB JPEG without the photo's metadata.
TEST_F(ThumbnailerTest, SizesFitTheirSquaresAndCarryNoMetadata) {
  ASSERT_TRUE(quvaidx::daemon_test::WriteSplitJpeg(Photo("wide.jpg"), 1600,
                                                   1200, kRed, kBlue));
  ASSERT_TRUE(quvaidx::daemon_test::WriteSplitJpeg(Photo("tiny.jpg"), 100, 80,
                                                   kRed, kBlue));
  struct Case {
    const char* photo;
    int sizes[4][2];  // XL, B, M, S
  } cases[] = {
      {"wide.jpg", {{1280, 960}, {640, 480}, {320, 240}, {120, 90}}},
      {"tiny.jpg", {{100, 80}, {100, 80}, {100, 80}, {100, 80}}},
  };
  for (const Case& c : cases) {
    PhotoResult result = MakePhotoThumbnails(Photo(c.photo));
    ASSERT_EQ(result.outcome, PhotoOutcome::kMade) << result.reason;
    EXPECT_EQ(result.made, quvaidx_daemons::kAllThumbSizes);
    for (int i = 0; i < 4; ++i) {
      ImageFacts facts = ReadImage(Thumb(c.photo, kThumbSizes[i].label));
      ASSERT_TRUE(facts.readable) << c.photo << " " << kThumbSizes[i].label;
      EXPECT_EQ(facts.loader, "jpegload");
      EXPECT_EQ(facts.width, c.sizes[i][0]) << kThumbSizes[i].label;
      EXPECT_EQ(facts.height, c.sizes[i][1]) << kThumbSizes[i].label;
      EXPECT_EQ(facts.bands, 3);
      EXPECT_TRUE(facts.srgb);
      EXPECT_FALSE(facts.has_metadata);
    }
  }
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
    double red_box[4];  // x, y, w, h of where red must be
  } cases[] = {
      {1, false, {0.0, 0.0, 0.3, 1.0}},  // left
      {3, false, {0.7, 0.0, 0.3, 1.0}},  // rotated 180: right
      {6, true, {0.0, 0.0, 1.0, 0.3}},   // rotated 90 clockwise: top
      {8, true, {0.0, 0.7, 1.0, 0.3}},   // rotated 90 anticlockwise: bottom
  };
  std::vector<std::pair<std::string, int>> tags;
  for (const Case& c : cases) {
    std::string name = "o" + std::to_string(c.orientation) + ".jpg";
    ASSERT_TRUE(quvaidx::daemon_test::WriteSplitJpeg(Photo(name), 400, 200,
                                                     kRed, kBlue));
    tags.push_back({Photo(name), c.orientation});
  }
  ASSERT_TRUE(quvaidx::daemon_test::SetOrientations(tags));
  for (const Case& c : cases) {
    std::string name = "o" + std::to_string(c.orientation) + ".jpg";
    ASSERT_EQ(MakePhotoThumbnails(Photo(name)).outcome, PhotoOutcome::kMade);
    for (const char* label : {"XL", "S"}) {
      ImageFacts facts = ReadImage(Thumb(name, label));
      EXPECT_EQ(facts.height > facts.width, c.portrait)
          << "orientation " << c.orientation << " " << label;
      Rgb red = MeanColour(Thumb(name, label), c.red_box[0], c.red_box[1],
                           c.red_box[2], c.red_box[3]);
      EXPECT_TRUE(Near(red, kRed))
          << "orientation " << c.orientation << " " << label << ": " << red.r
          << "," << red.g << "," << red.b;
    }
  }
}

// Grey and transparent photos still give sRGB colour thumbnails, with
// transparency on white rather than black.
TEST_F(ThumbnailerTest, GreyAndTransparentPhotosBecomeSrgbOnWhite) {
  ASSERT_TRUE(quvaidx::daemon_test::WritePng(Photo("grey.png"), 300, 200, 1,
                                             {128, 128, 128}));
  ASSERT_TRUE(
      quvaidx::daemon_test::WritePng(Photo("clear.png"), 300, 200, 4, kRed, 0));
  for (const char* name : {"grey.png", "clear.png"}) {
    ASSERT_EQ(MakePhotoThumbnails(Photo(name)).outcome, PhotoOutcome::kMade);
    ImageFacts facts = ReadImage(Thumb(name, "M"));
    EXPECT_EQ(facts.bands, 3) << name;
    EXPECT_TRUE(facts.srgb) << name;
  }
  EXPECT_TRUE(Near(MeanColour(Thumb("clear.png", "M"), 0, 0, 1, 1), kWhite, 8));
}

// Thumbnails newer than their photo are kept; a changed photo, a missing
// or a 1-byte thumbnail is made again; the ':' name counts as present.
TEST_F(ThumbnailerTest, OnlyStaleOrMissingThumbnailsAreMadeAgain) {
  const std::string photo = Photo("p.jpg");
  ASSERT_TRUE(
      quvaidx::daemon_test::WriteSplitJpeg(photo, 800, 600, kRed, kBlue));
  ASSERT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kMade);
  EXPECT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kUpToDate);

  unlink(Thumb("p.jpg", "M").c_str());
  quvaidx::test::WriteFile(Thumb("p.jpg", "S"), "x");  // 1 byte: no item
  PhotoResult result = MakePhotoThumbnails(photo);
  EXPECT_EQ(result.outcome, PhotoOutcome::kMade);
  EXPECT_EQ(result.made, 0x2 | 0x1);

  // Only the ':' form of XL, newer than the photo: present.
  const std::string second =
      dir_.File(".quvameta/p.jpg/QUVAPHOTO:THUMB_XL.jpg");
  ASSERT_EQ(rename(Thumb("p.jpg", "XL").c_str(), second.c_str()), 0);
  EXPECT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kUpToDate);

  // The photo rewritten after its thumbnails: all four again.
  struct timespec later[2];
  clock_gettime(CLOCK_REALTIME, &later[0]);
  later[0].tv_sec += 10;
  later[1] = later[0];
  ASSERT_EQ(utimensat(AT_FDCWD, photo.c_str(), later, 0), 0);
  result = MakePhotoThumbnails(photo);
  EXPECT_EQ(result.outcome, PhotoOutcome::kMade);
  EXPECT_EQ(result.made, quvaidx_daemons::kAllThumbSizes);
}

// Photos libvips cannot read, bombs, and photos that are gone or are not
// regular files are skipped with a reason, leave no thumbnail and no
// temporary file, and a bomb is refused before it is decoded.
TEST_F(ThumbnailerTest, BadPhotosAreSkippedWithAReason) {
  ASSERT_TRUE(quvaidx::daemon_test::WriteSplitJpeg(Photo("whole.jpg"), 800, 600,
                                                   kRed, kBlue));
  std::string whole = quvaidx::test::ReadFile(Photo("whole.jpg"));
  quvaidx::test::WriteFile(Photo("truncated.jpg"),
                           whole.substr(0, whole.size() / 2));
  quvaidx::test::WriteFile(Photo("empty.jpg"), "");
  quvaidx::test::WriteFile(Photo("text.jpg"), "not a picture\n");
  ASSERT_TRUE(
      quvaidx::daemon_test::WritePngBomb(Photo("bomb.png"), 30000, 30000));
  ASSERT_EQ(symlink("whole.jpg", Photo("link.jpg").c_str()), 0);
  ASSERT_EQ(mkdir(Photo("folder.jpg").c_str(), 0755), 0);
  struct Case {
    const char* name;
    const char* reason;
  } cases[] = {
      {"truncated.jpg", "cannot read it"},
      {"empty.jpg", "cannot read it"},
      {"text.jpg", "cannot read it"},
      {"bomb.png", "30000 x 30000 pixels, more than the limit"},
      {"gone.jpg", "it is gone"},
      {"link.jpg", "not a regular file"},
      {"folder.jpg", "not a regular file"},
  };
  for (const Case& c : cases) {
    const auto started = std::chrono::steady_clock::now();
    PhotoResult result = MakePhotoThumbnails(Photo(c.name));
    const double seconds = std::chrono::duration<double>(
                               std::chrono::steady_clock::now() - started)
                               .count();
    EXPECT_EQ(result.outcome, PhotoOutcome::kSkipped) << c.name;
    EXPECT_NE(result.reason.find(c.reason), std::string::npos)
        << c.name << ": " << result.reason;
    EXPECT_EQ(result.made, 0);
    EXPECT_TRUE(EAFiles(c.name).empty()) << c.name;
    EXPECT_LT(seconds, 2.0) << c.name;
  }
}

// An item that cannot be written (a folder stands in its place) is
// reported, and the other sizes are still made.
TEST_F(ThumbnailerTest, OneUnwritableItemDoesNotStopTheOthers) {
  const std::string photo = Photo("p.jpg");
  ASSERT_TRUE(
      quvaidx::daemon_test::WriteSplitJpeg(photo, 800, 600, kRed, kBlue));
  ASSERT_EQ(mkdir(dir_.File(".quvameta").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(dir_.File(".quvameta/p.jpg").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(Thumb("p.jpg", "B").c_str(), 0755), 0);
  PhotoResult result = MakePhotoThumbnails(photo);
  EXPECT_EQ(result.outcome, PhotoOutcome::kMade);
  EXPECT_EQ(result.made, 0x8 | 0x2 | 0x1);
  EXPECT_NE(result.reason.find("QUVAPHOTO_THUMB_B.jpg"), std::string::npos)
      << result.reason;
  EXPECT_EQ(ReadImage(Thumb("p.jpg", "S")).width, 120);
}

// A temporary file left by a daemon killed while writing goes when that
// photo is made again; files of others stay.
TEST_F(ThumbnailerTest, LeftoverTemporaryFilesAreRemoved) {
  const std::string photo = Photo("p.jpg");
  ASSERT_TRUE(
      quvaidx::daemon_test::WriteSplitJpeg(photo, 400, 300, kRed, kBlue));
  ASSERT_EQ(mkdir(dir_.File(".quvameta").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(dir_.File(".quvameta/p.jpg").c_str(), 0755), 0);
  quvaidx::test::WriteFile(
      dir_.File(".quvameta/p.jpg/QUVAPHOTO_THUMB_M.jpg.part-Ab12Cd"), "half");
  quvaidx::test::WriteFile(dir_.File(".quvameta/p.jpg/other.part-x"), "kept");
  ASSERT_EQ(MakePhotoThumbnails(photo).outcome, PhotoOutcome::kMade);
  std::vector<std::string> files = EAFiles("p.jpg");
  std::sort(files.begin(), files.end());
  EXPECT_EQ(files, (std::vector<std::string>{
                       "QUVAPHOTO_THUMB_B.jpg", "QUVAPHOTO_THUMB_M.jpg",
                       "QUVAPHOTO_THUMB_S.jpg", "QUVAPHOTO_THUMB_XL.jpg",
                       "other.part-x"}));
}

}  // namespace

// Photos made at test time for the preview daemons' tests: images of known
// content and a PNG decompression bomb written with libvips, EXIF
// orientations set with exiftool, and readers for what a thumbnail turned
// out to be. Nothing is copied in from elsewhere.
#ifndef QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_
#define QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_

#include <string>
#include <utility>
#include <vector>

namespace quvaidx::daemon_test {

struct Rgb {
  int r, g, b;
};
constexpr Rgb kRed = {230, 20, 20};
constexpr Rgb kBlue = {20, 20, 230};

// Writes a `width` x `height` image, in the format its name's suffix says,
// whose left half is `left` and right half `right`. `bands`: 3 RGB, 1 grey
// (the red channel), 4 RGB with `alpha` for every pixel. False on failure.
bool WritePhoto(const std::string& path, int width, int height, Rgb left,
                Rgb right, int bands = 3, int alpha = 255);

// Writes a `width` x `height` image of one colour, in the format its name's
// suffix says (options allowed), a strip at a time: never whole in memory.
bool WritePlainPhoto(const std::string& path, int width, int height,
                     Rgb colour);

// Writes a valid 1-bit grey PNG of `width` x `height` black pixels whose
// compressed data is tiny (about a thousandth): a decompression bomb.
bool WritePngBomb(const std::string& path, int width, int height);

// True when exiftool can be run.
bool HaveExiftool();
// Sets the EXIF orientation tag of each (file, value) with one exiftool run.
bool SetOrientations(const std::vector<std::pair<std::string, int>>& files);

// What an image file holds, as libvips reads it.
struct ImageFacts {
  bool readable = false;
  int width = 0;
  int height = 0;
  int bands = 0;
  bool srgb = false;          // interpretation sRGB
  bool has_metadata = false;  // EXIF, XMP, IPTC or an ICC profile
  std::string loader;         // "jpegload", ...
};
ImageFacts ReadImage(const std::string& path);

// The colour of the pixel at (x, y), in fractions of the width and height,
// of an RGB image file; {-1, -1, -1} when it cannot be read.
Rgb ColourAt(const std::string& path, double x, double y);

// True when `colour` is within `tolerance` of `expected` in every channel.
bool Near(Rgb colour, Rgb expected, int tolerance = 40);

// The thumbnail item `label` ("XL", "B", "M", "S"; first name) of `photo`.
std::string ThumbItem(const std::string& photo, const std::string& label);

// The paths under `dir`, recursively, sorted; relative to `dir`.
std::vector<std::string> NamesUnder(const std::string& dir);

// Writes the host stand-in's share database in `etc_dir` (what
// QUVA_HOST_ETC names): one share "<name>" for each (name, path).
void WriteShares(
    const std::string& etc_dir,
    const std::vector<std::pair<std::string, std::string>>& shares);

// Gives `path` (not following a link) the owner `uid`, group `gid` and, for
// anything but a link, `mode`. False when it cannot (the tests that need
// this run as root).
bool Own(const std::string& path, unsigned uid, unsigned gid, unsigned mode);

// Makes the directory `path` owned by `uid` and `gid` with `mode`.
bool MakeOwnedDir(const std::string& path, unsigned uid, unsigned gid,
                  unsigned mode = 0755);

// Users that tests run as: nobody, and one that the user database does not
// know (so it is in no group but its own).
constexpr unsigned kUserA = 65534;
constexpr unsigned kUserB = 65533;

}  // namespace quvaidx::daemon_test

#endif  // QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_

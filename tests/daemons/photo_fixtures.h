// Photos made at test time for the preview daemons' tests: JPEG and PNG
// files of known content written with libvips, EXIF orientations set with
// exiftool, a PNG decompression bomb written with zlib, and readers for
// what a thumbnail turned out to be. Nothing is copied in from elsewhere.
#ifndef QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_
#define QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_

#include <string>
#include <utility>
#include <vector>

namespace quvaidx::daemon_test {

struct Rgb {
  int r, g, b;
};

// Starts libvips for the fixtures (once per process; repeated calls are
// harmless). False when it cannot start.
bool StartVips();

// Writes a `width` x `height` JPEG (quality 90) whose left half is `left`
// and right half `right`. False on failure.
bool WriteSplitJpeg(const std::string& path, int width, int height, Rgb left,
                    Rgb right);

// Writes a PNG of one colour with `bands` bands: 1 grey, 3 RGB, 4 RGB and
// alpha (then `alpha` is the alpha of every pixel).
bool WritePng(const std::string& path, int width, int height, int bands,
              Rgb colour, int alpha = 255);

// Writes a valid 1-bit grey PNG of `width` x `height` black pixels, whose
// compressed data is tiny (about a thousandth of the pixels): a
// decompression bomb.
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

// The mean colour of the box (x, y, w, h), in fractions of the image's
// width and height, of an 8-bit RGB image file.
Rgb MeanColour(const std::string& path, double x, double y, double w, double h);

// True when `colour` is within `tolerance` of `expected` in every channel.
bool Near(Rgb colour, Rgb expected, int tolerance = 40);

}  // namespace quvaidx::daemon_test

#endif  // QUVAIDX_TESTS_DAEMONS_PHOTO_FIXTURES_H_

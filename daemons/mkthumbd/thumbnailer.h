// Making a photo's thumbnails with libvips.
//
// The sizes, item names and size-map bits are those of preview_names.h:
//
//   size  long side  item (in the photo's EA directory)  bit
//   XL    1280 px    QUVAPHOTO_THUMB_XL.jpg  (or QUVAPHOTO:THUMB_XL.jpg)  0x8
//   B      640 px    QUVAPHOTO_THUMB_B.jpg   (or QUVAPHOTO:THUMB_B.jpg)   0x4
//   M      320 px    QUVAPHOTO_THUMB_M.jpg   (or QUVAPHOTO:THUMB_M.jpg)   0x2
//   S      120 px    QUVAPHOTO_THUMB_S.jpg   (or QUVAPHOTO:THUMB_S.jpg)   0x1
//
// Every thumbnail fits a square of its long side and is never larger than
// the photo. It is upright (the EXIF orientation applied), in sRGB (an
// embedded ICC profile honoured, transparency flattened onto white), 8-bit,
// baseline JPEG of quality kJpegQuality, with no metadata at all (no EXIF,
// no ICC profile, no comments).
//
// One decode per photo. The photo is decoded once, with vips_thumbnail_image,
// at the size of the largest thumbnail it needs; a JPEG is decoded shrunk by
// libjpeg's DCT scaling (shrink-on-load) to the smallest size still at least
// that large (1/2, 1/4 or 1/8), other formats (PNG, GIF, TIFF), which have
// no such reduced decode, in one sequential pass. Each smaller thumbnail is
// then reduced from the one above it, in memory.
//
// What is made. A thumbnail counts as up to date when its item exists with
// at least 2 bytes and was modified after the photo; only the others are
// made, and a photo with all four up to date is not decoded at all.
//
// Writes. Each thumbnail is written to "<item>.part-XXXXXX" beside its item
// and renamed over it, so a reader never sees half a JPEG. The EA directory
// is made (MakeEADir) only when something is written.
// Temporary files left by a daemon killed in the middle are removed when
// that photo is next looked at.
//
// Bad photos. A photo that is gone, is not a regular file, cannot be read
// by libvips (truncated or corrupt data counts: no half-grey thumbnails), or
// has more than kMaxPhotoPixels pixels (a decompression bomb) is skipped,
// with the reason in the result.
//
// Memory. libvips runs with its operation cache off and one worker thread,
// the process with one malloc arena, and loaders that libvips marks untrusted
// (ImageMagick, MATLAB, FITS and the like) are blocked, so only its own JPEG,
// PNG, GIF, TIFF and WebP loaders read users' files. Memory then stays bounded
// by the largest thumbnail plus the decoder's window over the photo, whatever
// the photo's size, except for progressive JPEGs and interlaced PNGs, which
// libjpeg and libpng must hold whole: at most about 3 bytes per pixel for JPEG
// and 4 for PNG, which the pixel limit bounds (about 300 and 400 MB).
#ifndef QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_
#define QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_

#include <string>

namespace mkthumbd {

// Photos with more pixels than this (width times height, as stored) are
// skipped: 100 million, e.g. 10000 x 10000.
constexpr long long kMaxPhotoPixels = 100LL * 1000 * 1000;
// JPEG quality of every thumbnail.
constexpr int kJpegQuality = 80;

// Sets libvips up for the daemon: cache off, one worker thread, untrusted
// loaders blocked; and malloc to one arena. Call once, after the process has
// detached (libvips starts threads). False (with the reason in *error) when
// libvips cannot start.
bool InitThumbnailer(const char* program, std::string* error);
// Releases libvips's threads and memory at exit.
void ShutdownThumbnailer();

enum class PhotoOutcome {
  kMade,      // at least one thumbnail was written
  kUpToDate,  // every thumbnail was newer than the photo: nothing to do
  kSkipped,   // nothing written; `reason` says why
};

struct PhotoResult {
  PhotoOutcome outcome = PhotoOutcome::kSkipped;
  int made = 0;  // bits (preview_names.h) of the thumbnails written
  // For kSkipped: why, in a few words; for kMade, what failed after the
  // first thumbnail was written, if anything.
  std::string reason;
};

// Makes the thumbnails of `photo` (an absolute path) that are not up to
// date. `max_pixels` is the bomb limit (kMaxPhotoPixels in production).
// Logs nothing: the caller reports the result.
PhotoResult MakePhotoThumbnails(const std::string& photo,
                                long long max_pixels = kMaxPhotoPixels);

}  // namespace mkthumbd

#endif  // QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_

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
// Whose rights. Everything here happens with the calling thread's
// file-system identity, which the caller sets to the folder owner's
// (thumb_worker.h): the kernel decides what may be read and written. The
// photo is opened once, relative to its folder's descriptor, with
// O_NOFOLLOW and O_NONBLOCK (a link is no photo, and a FIFO never blocks),
// checked with fstat on that descriptor to be a regular file, and read from
// it into memory once: the header that the limits below are checked on and
// the pixels that are decoded come from those same bytes, so a photo
// changed or swapped meanwhile cannot slip past them.
//
// One decode per photo. The photo is decoded once, with vips_thumbnail_image,
// at the size of the largest thumbnail it needs; a JPEG is decoded shrunk by
// libjpeg's DCT scaling (shrink-on-load), a WebP by libwebp's scaled decode,
// to the smallest size still at least that large (1/2, 1/4 or 1/8); other
// formats (PNG, GIF, TIFF, HEIF), which have no such reduced decode, in one
// sequential pass. Each smaller thumbnail is then reduced from the one above
// it, in memory. Only libvips's JPEG, PNG, GIF, WebP, TIFF and HEIF loaders
// are used, whatever the photo's name says; other content is skipped.
//
// What is made. A thumbnail counts as up to date when its item is a regular
// file of at least 2 bytes modified after the photo; only the others are
// made, and a photo with all four up to date is not decoded at all.
//
// Writes. The EA directory is reached only through OpenEADir, from the
// folder's descriptor, without following a link at the metadata directory
// or below it, and made only when something is written. Each thumbnail is
// written to "<item>.part-XXXXXX" in it and renamed over its item, both
// relative to the EA directory's descriptor, so a reader never sees half a
// JPEG; a symbolic link at an item's name is refused, never replaced or
// followed. Temporary files left by a daemon killed in the middle (regular
// files only) are removed when that photo is next looked at.
//
// Who may read a thumbnail. Never more than may read the photo: each
// thumbnail gets the photo's owner and group, and the photo's read bits
// plus the owner's write bit (less the process's umask). The ownership is
// given on the temporary file's descriptor with the daemon's own identity
// (root, for CAP_CHOWN), the only thing done with it. Where it cannot be
// given (a daemon that is not root, a file system without owners), the
// thumbnail is readable by its owner alone, the identity that read the
// photo.
//
// Bad photos. A photo that is gone, is not a regular file, cannot be read
// (by the identity in force, or by libvips: truncated or corrupt data
// counts, no half-grey thumbnails), has more than `max_pixels` pixels (a
// decompression bomb) or would need more than `max_decode_bytes` to decode
// is skipped, with the reason in the result. Both limits are checked on the
// header before a pixel is decoded.
//
// Memory. libvips runs with its operation cache off and one worker thread,
// and the process with one malloc arena. What a decode takes is estimated
// from the header, by format (DecodePeakBytes): the photo's bytes, held
// once; libvips's window of about 2400 lines of the image as loaded (1600
// in floats for an image with transparency, which is resized
// premultiplied); and what the decoder must hold whole. A baseline JPEG
// (shrunk on load), a lossy WebP (scaled on load) and a non-interlaced PNG
// stream; a progressive JPEG holds every DCT coefficient (2 bytes a
// sample, 1.5 to 4 samples a pixel, however it is shrunk), an interlaced
// PNG, a GIF, a lossless WebP and a HEIF their whole decoded image, a HEIF
// its planes besides, and a TIFF counts as whole (it may be one strip).
// The factors were measured and rounded up, with an eighth more for the
// allocator. kMaxDecodeBytes keeps the daemon within the MemoryMax=512M of
// its systemd unit: at the limit, a 4:4:4 progressive JPEG of 52
// megapixels, a GIF of 41, a HEIF of 46, a lossless WebP of 70 and an
// interlaced 8-bit PNG of 74 still get thumbnails, with a peak of 333 to
// 357 MB (bench/thumb_rss.sh); what streams is bounded by the pixel limit
// alone.
#ifndef QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_
#define QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_

#include <sys/stat.h>

#include <string>

namespace mkthumbd {

// Photos with more pixels than this (width times height, as stored) are
// skipped: 100 million, e.g. 10000 x 10000.
constexpr long long kMaxPhotoPixels = 100LL * 1000 * 1000;
// Photos whose decode is estimated to need more than this are skipped:
// 384 MiB, beside the 20 to 30 MB that the daemon needs otherwise, leaves
// room under the unit's MemoryMax=512M for the estimate's error and the
// page cache of what is read and written.
constexpr long long kMaxDecodeBytes = 384LL << 20;
// JPEG quality of every thumbnail.
constexpr int kJpegQuality = 80;

// Sets libvips up for the daemon: cache off, one worker thread, untrusted
// loaders blocked; and malloc to one arena. Records the process's own
// identity, with which thumbnails are given their owners. Call once, after
// the process has detached (libvips starts threads). False (with the reason
// in *error) when libvips cannot start.
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

// The limits of one photo; the defaults are the daemon's.
struct PhotoLimits {
  long long max_pixels = kMaxPhotoPixels;
  long long max_decode_bytes = kMaxDecodeBytes;
};

// Makes the thumbnails that are not up to date of the photo `name`, an
// entry of the folder open as `folder_fd` (a directory opened for reading),
// whose path is `folder`. The path only tells the host where the EA
// directory lies (OpenEADir) and names the photo in results; every file is
// reached from the descriptor. Logs nothing: the caller reports the result.
PhotoResult MakePhotoThumbnails(int folder_fd, const std::string& folder,
                                const std::string& name,
                                const PhotoLimits& limits = PhotoLimits());

// The same for `photo`, an absolute path: opens its folder (links in the
// folder's own path are followed: the caller's business) and calls the
// above. For tools and benchmarks that start from a path.
PhotoResult MakePhotoThumbnails(const std::string& photo,
                                const PhotoLimits& limits = PhotoLimits());

// What the header of a photo says about its decode.
struct DecodeFacts {
  enum class Format { kJpeg, kPng, kGif, kWebp, kTiff, kHeif };
  Format format = Format::kJpeg;
  long long width = 0;  // as stored, before any shrink-on-load
  long long height = 0;
  int bands = 3;             // after decoding
  int sample_bytes = 1;      // per band: 1, 2 or 4
  bool alpha = false;        // transparency: resized premultiplied, in floats
  bool progressive = false;  // JPEG: multi-scan; PNG: interlaced
  bool subsampled = false;   // JPEG: chroma 4:2:0
  bool lossless = true;      // WebP: not one lossy image
  long long file_bytes = 0;  // the photo's size
  int shrink = 1;            // shrink-on-load of JPEG and WebP: 1, 2, 4, 8
};

// The most memory, in bytes, that decoding a photo with these facts down
// to its largest thumbnail may take, the photo's bytes included: what the
// decode limit is checked against.
long long DecodePeakBytes(const DecodeFacts& facts);

}  // namespace mkthumbd

#endif  // QUVAIDX_DAEMONS_MKTHUMBD_THUMBNAILER_H_

// The pixel size and EXIF of a photo, from exiv2.
//
// exiv2 decides by content whether a file is an image it reads (JPEG, TIFF
// and the TIFF-based camera RAW formats, CR2, CRW, ORF, RAF, RW2, MRW, PNG,
// WebP, GIF, BMP, PSD, JPEG 2000, ...). It reads through a BoundedReader
// and sees at most the first kMaxPhotoBytes of a file: the formats it reads
// as a whole (TIFF and the RAW formats) are copied into memory up to that
// size, never mapped, so a file that shrinks meanwhile cannot fault the
// daemon. No exception leaves these functions.
//
// Single-threaded per reader. exiv2's process-wide log level is set to
// silent on first use.
#ifndef MEDIAPARSERD_PHOTO_EXIF_H_
#define MEDIAPARSERD_PHOTO_EXIF_H_

#include <stdint.h>

#include <string>

#include "media_facts.h"
#include "peer_file.h"

namespace mediaparserd {

constexpr int64_t kMaxPhotoBytes = 64 << 20;

// True when the first bytes of a file (`head`, `size` bytes; 64 are
// enough for every format) are those of an image exiv2 reads.
bool LooksLikePhoto(const uint8_t* head, int64_t size);

enum class PhotoResult {
  kOk,        // *facts filled
  kNotPhoto,  // exiv2 does not read this content as an image
  kDamaged,   // it is such an image, but exiv2 failed to read it
  kStopped,   // the reader stopped (deadline, budget, read error)
};

// Reads the image behind `reader` (from offset 0). On kOk fills *facts and
// sets *format to the container name the record carries ("gif" for GIF,
// else "image2"); on kDamaged *detail holds exiv2's message.
PhotoResult ReadPhoto(BoundedReader* reader, PhotoFacts* facts,
                      std::string* format, std::string* detail);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_PHOTO_EXIF_H_

// What the media libraries tell about one file, as plain values.
//
// The readers (av_probe.h for libavformat, music_tags.h for TagLib,
// photo_exif.h for exiv2) copy what they learn into these structures and
// hold on to nothing of the libraries afterwards; record_fill.h turns them
// into the media record. Keeping the libraries' results in plain values lets
// the glue be tested and fuzzed with any value at all, also with values no
// library would give today (negative sizes, huge rates, absent streams).
//
// Numbers are kept as wide as the libraries give them, unchecked: the glue
// is the one place that bounds them to the record's fields.
#ifndef MEDIAPARSERD_MEDIA_FACTS_H_
#define MEDIAPARSERD_MEDIA_FACTS_H_

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

namespace mediaparserd {

// What a file is, decided by its content.
enum class MediaKind {
  kMusic,  // audio streams, no picture other than covers
  kVideo,  // at least one moving-picture stream
  kPhoto,  // a still image
};

// One stream of a container, as libavformat describes it.
struct StreamFacts {
  enum class Type { kAudio, kVideo, kCover, kOther };
  Type type = Type::kOther;  // kCover: a picture attached as cover art
  std::string codec;         // libavformat's codec name: "h264", "aac"
  int64_t profile = 0;       // codec profile; FFmpeg's -99 when unknown
  int64_t level = 0;         // codec level; FFmpeg's -99 when unknown
  // For AAC: the MPEG-4 audio object type (2 LC, 5 HE, ...), 0 unknown.
  int64_t aac_object_type = 0;
  int64_t bit_rate = 0;     // bits per second, 0 when unknown
  int64_t sample_rate = 0;  // audio: samples per second
  int64_t channels = 0;     // audio
  int64_t width = 0;        // video and covers: pixels
  int64_t height = 0;
  int64_t sar_num = 0;  // sample (pixel) aspect ratio; 0/0 when unknown
  int64_t sar_den = 0;
  int64_t frame_rate_num = 0;  // average frames per second; 0/0 unknown
  int64_t frame_rate_den = 0;
  // Degrees counterclockwise from the display matrix, as libavutil's
  // av_display_rotation_get gives them; has_rotation is false without one.
  bool has_rotation = false;
  double rotation = 0;
};

// A container and its streams.
struct ContainerFacts {
  std::string format;    // libavformat's input format name: "mp3", "wav"
  double duration = 0;   // seconds; 0 when unknown
  int64_t bit_rate = 0;  // the container's overall bits per second
  std::vector<StreamFacts> streams;
  // The container's own tags, keys in lower case ("title", "track"), values
  // as libavformat gives them (meant to be UTF-8).
  std::vector<std::pair<std::string, std::string>> tags;
};

// One tag text as the file stores it.
struct TagText {
  enum class Encoding {
    kBytes,  // 8-bit text of unknown code page (ID3v1, Latin-1 frames)
    kUTF16,  // UTF-16 code units, little-endian, no byte-order mark
    kUTF8,   // UTF-8
  };
  Encoding encoding = Encoding::kUTF8;
  std::string bytes;  // the text, without terminator
};

// The music tags TagLib reads. Empty texts and zero numbers are absent.
struct MusicTags {
  TagText title, artist, album, album_artist, genre, composer, comment;
  int64_t track = 0;
  int64_t disc = 0;
  int64_t year = 0;
};

// The EXIF (and pixel size) exiv2 reads from a photo.
struct PhotoFacts {
  std::string make, model;  // as stored, trailing blanks removed
  // ExposureTime and FNumber as rationals; a zero denominator is absent.
  int64_t exposure_num = 0, exposure_den = 0;
  int64_t fnumber_num = 0, fnumber_den = 0;
  int64_t iso = 0;
  std::string taken;  // DateTimeOriginal as stored: "YYYY:MM:DD HH:MM:SS"
  int64_t width = 0, height = 0;  // pixels
  int64_t orientation = 0;        // EXIF orientation 1 to 8; 0 when absent
};

// What the file system tells.
struct FileFacts {
  std::string path;     // as the peer named it
  uint64_t size = 0;    // bytes
  int64_t mtime = 0;    // seconds since the epoch
  std::string fs_uuid;  // of the file system that holds the file, or ""
};

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_MEDIA_FACTS_H_

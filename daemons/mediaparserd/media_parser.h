// The media parser: from a path a peer named to a media record.
//
// One Parse call opens the file (OpenPeerFile), decides what it is by its
// content and reads it with the library made for it:
//
//   1. a photo, if exiv2 reads its first bytes as an image: exiv2 gives the
//      pixel size and EXIF;
//   2. otherwise libavformat probes the content: a still-image format is a
//      photo (pixel size from its picture stream), a picture stream that is
//      not a cover makes a video, an audio stream music;
//   3. music gets its tags from TagLib when TagLib reads the container,
//      videos (and music TagLib does not read) from libavformat's tags;
//   4. the glue (record_fill.h) fills the record, with the file's status and
//      its file system's UUID, and MediaInfoValid cleans its texts.
//
// All reading of one request shares one deadline and one byte budget
// (ReadLimits). A file that is not media, that cannot be read, or whose
// reading stops at a limit is refused with a reason; nothing is answered
// with a zeroed record.
//
// Single-threaded: one MediaParser serves one request at a time.
#ifndef MEDIAPARSERD_MEDIA_PARSER_H_
#define MEDIAPARSERD_MEDIA_PARSER_H_

#include <stddef.h>
#include <stdint.h>

#include <string>

#include <quvaidx/mediainfo.h>

#include "av_probe.h"
#include "fs_uuid.h"
#include "media_facts.h"
#include "peer_file.h"

namespace mediaparserd {

struct ParserOptions {
  ReadLimits read;    // per request
  ProbeLimits probe;  // libavformat's probing and analysis
};

// What Parse learns about one file.
struct ParsedMedia {
  MediaKind kind = MediaKind::kMusic;
  __tag_QUVA_MEDIA_INFO record;  // after MediaInfoValid
  // Videos: rotation and pixel aspect ratio; others {0, 1, 1}.
  _VIDEO_METADATA_ video = {0, 1, 1};
  // Photos: the EXIF orientation (1 to 8), 0 when there is none. Not part
  // of any reply yet: thumbnails are to be turned by it.
  int32_t orientation = 0;
};

// Sets the media libraries' process-wide settings: libavformat and libavcodec
// log nothing and allocate no single block above `max_alloc` bytes; and the
// process's allocator keeps up to 4 MiB of freed memory instead of handing
// it back to the system after each request. Call once, before the first
// Parse, from the thread that parses.
void InitMediaLibraries(size_t max_alloc);

// The largest single allocation the daemon lets FFmpeg make.
constexpr size_t kDefaultMaxAlloc = 256u << 20;

class MediaParser {
 public:
  explicit MediaParser(const ParserOptions& options) : options_(options) {}

  // Parses the file at `path`. Returns true with *media filled; false with
  // *reason set to one readable line (*media unspecified):
  //   OpenPeerFile's reasons ("No such file or directory", "not a regular
  //   file", ...), "empty file", "not a media file", "no audio or video
  //   stream", "damaged image (...)", "damaged media file (...)",
  //   "gave up after 5000 ms (time limit)", "gave up after reading 128 MiB
  //   (read limit)", "read error: ...".
  // With `peer`, a file that process could not read itself is refused
  // ("Permission denied"; see peer_access.h).
  bool Parse(const std::string& path, ParsedMedia* media, std::string* reason,
             const PeerIdentity* peer = nullptr);

  const ParserOptions& options() const { return options_; }

 private:
  ParserOptions options_;
  FsUuidCache uuids_;
  BlockMemory blocks_;  // the readers' cached blocks, request after request
};

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_MEDIA_PARSER_H_

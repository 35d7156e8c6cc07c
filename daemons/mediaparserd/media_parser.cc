#include "media_parser.h"

#include <malloc.h>
#include <string.h>

extern "C" {
#include <libavutil/log.h>
#include <libavutil/mem.h>
}

#include "music_tags.h"
#include "photo_exif.h"
#include "record_fill.h"

namespace mediaparserd {
namespace {

// Freed memory the allocator keeps for the next request.
constexpr int kKeptFreeMemory = 4 << 20;

// Enough of the file's start for exiv2 to tell every image format.
constexpr int64_t kHeadBytes = 4096;

// Why reading stopped, for the peer.
std::string StopReason(const BoundedReader& reader,
                       const ParserOptions& options) {
  switch (reader.stop()) {
    case BoundedReader::Stop::kTime:
      return "gave up after " + std::to_string(options.read.time_ms) +
             " ms (time limit)";
    case BoundedReader::Stop::kBudget:
      return "gave up after reading " +
             std::to_string(options.read.bytes >> 20) + " MiB (read limit)";
    case BoundedReader::Stop::kError:
      return std::string("read error: ") + strerror(reader.error());
    case BoundedReader::Stop::kNone:
      break;
  }
  return "read error";
}

bool HasPhotoFacts(const PhotoFacts& photo) {
  return (photo.width > 0 && photo.height > 0) || !photo.make.empty() ||
         !photo.model.empty() || photo.exposure_den > 0 ||
         photo.fnumber_den > 0 || photo.iso > 0 || !photo.taken.empty();
}

// A still image libavformat recognised but could not size is as good as
// unreadable.
bool HasPictureSize(const ContainerFacts& container) {
  for (const StreamFacts& stream : container.streams) {
    if (stream.type == StreamFacts::Type::kVideo && stream.width > 0 &&
        stream.height > 0) {
      return true;
    }
  }
  return false;
}

}  // namespace

void InitMediaLibraries(size_t max_alloc) {
  av_log_set_level(AV_LOG_QUIET);
  av_max_alloc(max_alloc);
  // Every request allocates and frees a few hundred kilobytes (stream
  // buffers, probe buffers); returned to the system at once, they are
  // faulted in and zeroed again by the next request, which cost more than
  // the parsing itself. Up to kKeptFreeMemory stays with the process.
  mallopt(M_TRIM_THRESHOLD, kKeptFreeMemory);
}

bool MediaParser::Parse(const std::string& path, ParsedMedia* media,
                        std::string* reason, const PeerIdentity* peer) {
  PeerFile file;
  if (!OpenPeerFile(path, &file, reason, peer)) return false;
  const struct stat& status = file.status();
  if (status.st_size == 0) {
    *reason = "empty file";
    return false;
  }
  BoundedReader reader(file.fd(), status.st_size, options_.read, &blocks_);
  uint8_t head[kHeadBytes];
  int64_t head_size = reader.ReadAt(0, head, kHeadBytes);
  if (head_size <= 0) {
    *reason = head_size == 0 ? "empty file" : StopReason(reader, options_);
    return false;
  }

  ContainerFacts container;
  PhotoFacts photo;
  MusicTags tags;
  bool have_photo = false, have_tags = false;
  std::string image_detail;
  MediaKind kind = MediaKind::kMusic;
  if (LooksLikePhoto(head, head_size)) {
    switch (ReadPhoto(&reader, &photo, &container.format, &image_detail)) {
      case PhotoResult::kOk:
        have_photo = HasPhotoFacts(photo);
        if (!have_photo) image_detail = "no pixel size";
        break;
      case PhotoResult::kStopped:
        *reason = StopReason(reader, options_);
        return false;
      case PhotoResult::kNotPhoto:
      case PhotoResult::kDamaged:
        break;  // libavformat may still read it
    }
  }
  if (have_photo) {
    kind = MediaKind::kPhoto;
  } else {
    std::string detail;
    switch (ProbeContainer(&reader, options_.probe, &container, &detail)) {
      case ProbeResult::kOk:
        break;
      case ProbeResult::kNotMedia:
        *reason = image_detail.empty() ? "not a media file"
                                       : "damaged image (" + image_detail + ")";
        return false;
      case ProbeResult::kDamaged:
        *reason = "damaged media file (" + detail + ")";
        return false;
      case ProbeResult::kStopped:
        *reason = StopReason(reader, options_);
        return false;
    }
    if (!ClassifyContainer(container, &kind)) {
      *reason = "no audio or video stream";
      return false;
    }
    if (kind == MediaKind::kPhoto && !HasPictureSize(container)) {
      *reason = "damaged image (" +
                (image_detail.empty() ? "no pixel size" : image_detail) + ")";
      return false;
    }
    if (kind == MediaKind::kMusic) {
      have_tags = ReadMusicTags(&reader, container, &tags);
      if (reader.stop() != BoundedReader::Stop::kNone) {
        *reason = StopReason(reader, options_);
        return false;
      }
    }
  }

  FileFacts facts;
  facts.path = path;
  facts.size = static_cast<uint64_t>(status.st_size);
  facts.mtime = status.st_mtime;
  facts.fs_uuid = uuids_.Lookup(status.st_dev);
  FillRecord(kind, facts, container, have_tags ? &tags : nullptr,
             have_photo ? &photo : nullptr, &media->record);
  media->kind = kind;
  media->video = kind == MediaKind::kVideo ? VideoMetadataOf(container)
                                           : _VIDEO_METADATA_{0, 1, 1};
  media->orientation = have_photo
                           ? static_cast<int32_t>(photo.orientation >= 1 &&
                                                          photo.orientation <= 8
                                                      ? photo.orientation
                                                      : 0)
                           : 0;
  return true;
}

}  // namespace mediaparserd

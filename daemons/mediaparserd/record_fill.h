// The glue between what the media libraries tell (media_facts.h) and the
// media record the daemon answers with.
//
// Every number is bounded here to its field (negative counts and rates
// become 0, values beyond a field's range are clamped), every text is cut
// to its field without splitting a UTF-8 character, and tag texts are
// delivered as the file stores them so that MediaInfoValid, with the host's
// code page, decides what legacy bytes mean:
//
//   - 8-bit texts of unknown code page (ID3v1, ID3v2 frames declared
//     Latin-1, RIFF INFO) go in as their raw bytes, UTF-16 flag 0;
//   - UTF-16 texts go in as UTF-16 (little-endian, after a byte-order mark,
//     at most 125 code units) with the field's UTF-16 flag set;
//   - UTF-8 texts go in as they are.
//
// szAlbumArtist has no UTF-16 flag and MediaInfoValid does not re-encode
// it, so it is cleaned up on its own the same way (UTF-16 decoded, 8-bit
// text converted from the host's code page, or emptied). After FillRecord
// every text but szPath and szName is valid UTF-8.
//
// Functions here touch only their arguments (and the host's code-page
// setting, through MediaInfoValid); any thread may call them.
#ifndef MEDIAPARSERD_RECORD_FILL_H_
#define MEDIAPARSERD_RECORD_FILL_H_

#include <string>

#include <quvaidx/mediainfo.h>

#include "media_facts.h"

namespace mediaparserd {

// The kind of media a container holds, by its content: kPhoto for an image
// format, kVideo with a picture stream that is not a cover, kMusic with an
// audio stream. False when it holds none of them.
bool ClassifyContainer(const ContainerFacts& container, MediaKind* kind);

// The container name the record carries: libavformat's input format name,
// except that still-image formats ("jpeg_pipe", "png_pipe", "image2", ...)
// are all "image2", as the library's container table spells them.
std::string ContainerTypeName(const std::string& format);

// Zeroes *record and fills it for a file of `kind`:
//   - always: szPath, szName, fileSize, szDate and szMDate (modification
//     time, local, "YYYY-MM-DD HH:MM:SS"), szFsUUID, szContainerType;
//   - music and video: duration, rates, codecs, channels, frequency,
//     resolution, frame rate, profile, level, coverCount, and the tags:
//     from `tags` when given (music read by TagLib), else from the
//     container's own tags;
//   - photos: resolution (from `photo`, else the container's picture
//     stream), szMake, szModel, szExposure ("1/125", "2.5"), szAperture
//     ("2.8"), iso, szTakenTime ("YYYY-MM-DD HH:MM:SS").
// Then runs MediaInfoValid. `tags` and `photo` may be null.
void FillRecord(MediaKind kind, const FileFacts& file,
                const ContainerFacts& container, const MusicTags* tags,
                const PhotoFacts* photo, __tag_QUVA_MEDIA_INFO* record);

// The video metadata of a container: "rotation" is the clockwise turn that
// shows the first picture stream upright (0, 90, 180 or 270; 0 without a
// display matrix), "par" its sample aspect ratio, reduced, 1:1 when unknown.
_VIDEO_METADATA_ VideoMetadataOf(const ContainerFacts& container);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_RECORD_FILL_H_

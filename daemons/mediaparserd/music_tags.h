// The music tags of a file, from TagLib, each text as the file stores it.
//
// TagLib reads through a BoundedReader, so its reads stop at the request's
// deadline and byte budget (a read that would stop there reads nothing,
// which TagLib takes for the end of the file), and no single read asks for
// more than kMaxTagRead bytes. No exception leaves these functions.
//
// Single-threaded per reader; TagLib keeps no state between calls.
#ifndef MEDIAPARSERD_MUSIC_TAGS_H_
#define MEDIAPARSERD_MUSIC_TAGS_H_

#include <stdint.h>

#include "media_facts.h"
#include "peer_file.h"

namespace mediaparserd {

// The largest block a tag reader may read at once: a larger tag (such as an
// ID3v2 tag claiming hundreds of megabytes) reads as absent.
constexpr int64_t kMaxTagRead = 32 << 20;

// Reads the tags of a file whose container libavformat recognised (the
// reader is read from offset 0). The container's name picks TagLib's reader
// for it: MP3 (ID3v2, then APE, then ID3v1, field by field), FLAC, Ogg
// (Vorbis, Opus, FLAC, Speex), MP4, WAV (ID3v2, then RIFF INFO), AIFF, ASF,
// APE, WavPack, Musepack, TrueAudio. Texts keep their stored encoding:
// ID3v1, RIFF INFO and ID3v2 frames declared Latin-1 as raw bytes, UTF-16
// frames and ASF texts as UTF-16, the rest as UTF-8.
// Returns true with *tags filled (some fields may be empty); false when
// TagLib has no reader for the container, the file holds no tag TagLib
// reads, or TagLib failed, *tags then empty.
bool ReadMusicTags(BoundedReader* reader, const ContainerFacts& container,
                   MusicTags* tags);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_MUSIC_TAGS_H_

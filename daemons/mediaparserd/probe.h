// What the media parser learns about a file without decoding it: the
// file's status, its name and extension, the container its extension
// implies, and, for a file in the photo table (by its extension), the
// pixel size stated in its PNG, JPEG or GIF header.
#ifndef MEDIAPARSERD_PROBE_H_
#define MEDIAPARSERD_PROBE_H_

#include <string>

#include <quvaidx/mediainfo.h>

namespace mediaparserd {

// How many bytes from the start of a file the header parsers see. A JPEG
// whose frame header lies further in (behind large metadata segments)
// reports no pixel size.
constexpr size_t kHeaderBytes = 256 * 1024;

// Zeroes *record and fills it for the regular file at the absolute `path`:
// szPath, szName (the last path component), fileSize, szDate and szMDate
// (the modification time, local, "YYYY-MM-DD HH:MM:SS"), szContainerType
// (from the extension; empty when unknown) and resolutionX/Y (0 when no
// known header states them; only files whose extension puts them in the
// photo table are read), then runs MediaInfoValid on it.
// Returns true; or false with *reason set to one line (the system's error
// text, "path is not absolute", "not a regular file", "path too long"),
// the record then zeroed.
bool ProbeMediaFile(const std::string& path, __tag_QUVA_MEDIA_INFO* record,
                    std::string* reason);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_PROBE_H_

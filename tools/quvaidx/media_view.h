// The readable view of a media record for `quvaidx mediainfo`: labelled
// lines a person reads at a glance ("Duration     3:05", "Video        H.264
// High 1920x1080 25 fps"), only those the record fills.
#ifndef QUVAIDX_TOOLS_MEDIA_VIEW_H_
#define QUVAIDX_TOOLS_MEDIA_VIEW_H_

#include <string>
#include <vector>

#include "quvaidx/mediainfo.h"

namespace quvaidx_cli {

// What the view shows besides the record.
struct MediaViewExtras {
  std::string kind;   // the daemon's "media_type", or "" when it sent none
  std::string table;  // the media table of the file's extension
  bool has_video_metadata = false;  // the two below are known
  _VIDEO_METADATA_ video = {0, 1, 1};
};

// The labelled lines of `record`, each "Label        value" (the label
// padded to one column), in a fixed order: kind, tags, technical lines,
// photo lines, file lines.
std::vector<std::string> MediaViewLines(const __tag_QUVA_MEDIA_INFO& record,
                                        const MediaViewExtras& extras);

// "3:05", "1:02:03"; "0:00" below half a second.
std::string FormatDuration(double seconds);

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_MEDIA_VIEW_H_

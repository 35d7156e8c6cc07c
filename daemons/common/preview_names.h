// What the preview daemons make and answer about: the thumbnails of a photo
// and the preview plug-ins. The thumbnail daemon (quvamkthumbd) writes these
// files, the plug-in daemon (quvaindexplugind) reports them; both read this
// one table.
//
// A photo's thumbnails are JPEG items of the photo's EA directory (the
// library's MakeEADir / GetEAFilePath), each fitting a square of its long
// side (never enlarged: a photo smaller than the square keeps its size):
//
//   size  long side  first name              second name             bit
//   XL    1280 px    QUVAPHOTO_THUMB_XL.jpg  QUVAPHOTO:THUMB_XL.jpg  0x8
//   B      640 px    QUVAPHOTO_THUMB_B.jpg   QUVAPHOTO:THUMB_B.jpg   0x4
//   M      320 px    QUVAPHOTO_THUMB_M.jpg   QUVAPHOTO:THUMB_M.jpg   0x2
//   S      120 px    QUVAPHOTO_THUMB_S.jpg   QUVAPHOTO:THUMB_S.jpg   0x1
//
// As with the converted-video names, each item has two names, with '_' or
// ':' after QUVAPHOTO; the thumbnail daemon writes the first, and either
// counts as present (the first wins when both exist). A thumbnail's size
// map is the OR of the bits of the items present with at least 2 bytes;
// 0xF means all four.
#ifndef QUVAIDX_DAEMONS_COMMON_PREVIEW_NAMES_H_
#define QUVAIDX_DAEMONS_COMMON_PREVIEW_NAMES_H_

#include <quvaidx/paths.h>

namespace quvaidx_daemons {

struct ThumbSize {
  const char* label;        // "XL", "B", "M", "S"
  int long_side;            // pixels
  const char* name;         // first name, written by the thumbnail daemon
  const char* second_name;  // the ':' form
  int bit;                  // its bit in a size map
};

// Largest first: the thumbnail daemon derives each from the one before.
constexpr ThumbSize kThumbSizes[] = {
    {"XL", 1280, "QUVAPHOTO_THUMB_XL.jpg", "QUVAPHOTO:THUMB_XL.jpg", 0x8},
    {"B", 640, "QUVAPHOTO_THUMB_B.jpg", "QUVAPHOTO:THUMB_B.jpg", 0x4},
    {"M", 320, "QUVAPHOTO_THUMB_M.jpg", "QUVAPHOTO:THUMB_M.jpg", 0x2},
    {"S", 120, "QUVAPHOTO_THUMB_S.jpg", "QUVAPHOTO:THUMB_S.jpg", 0x1},
};

// The size map of a photo with every thumbnail.
constexpr int kAllThumbSizes = 0xF;

// The preview plug-ins: a name for GET_ALL_PLUGIN_NAME, the daemon that does
// its work and that daemon's pid file. A plug-in runs when its daemon is
// alive by the host's pid-file check.
struct PreviewPlugin {
  const char* name;
  const char* daemon;
  const char* pid_file;
};

constexpr PreviewPlugin kPreviewPlugins[] = {
    {"photo_thumbnail", QUVAIDX_THUMB_DAEMON, QUVAIDX_THUMB_PID_FILE},
    {"web_video", QUVAIDX_FLV_DAEMON, QUVAIDX_FLV_PID_FILE},
};

// The thumbnail daemon's queue.
constexpr char kThumbQueue[] = QUVAIDX_THUMB_QUEUE;

}  // namespace quvaidx_daemons

#endif  // QUVAIDX_DAEMONS_COMMON_PREVIEW_NAMES_H_

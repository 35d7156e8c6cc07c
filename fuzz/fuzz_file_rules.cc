// Feeds the file rules arbitrary names and paths, and checks each answer
// against a plain reference written here, independently of the library.
//
// Input layout:
//   byte 0: the output size handed to ConvertVideoTypeGet (taken mod 17,
//           so 0..16);
//   the rest: the text, up to its first zero byte.
//
// Checked properties:
//   - every extension predicate equals a naive loop over its list with an
//     ASCII case-insensitive compare written by hand;
//   - the path predicates equal the list test on QUVAIndexExtGet's answer,
//     which points just after the text's last '.';
//   - GetMediaTableTypeFromExt agrees with the Music, Video, Photo and
//     Playlist predicates, in that order;
//   - EntryNameShouldIndex and QUVAPathUnderRecyle equal their references;
//   - ConvertVideoTypeGet never writes at or beyond the output size, and
//     what it writes is the start of what a large buffer receives;
//   - a name that the codec tables map to a number maps back to itself.
// A mismatch aborts with a message.
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <string>

#include "file/ext_lists.h"
#include "quvaidx/codec_names.h"
#include "quvaidx/media_type.h"
#include "quvaidx/path_rules.h"
#include "util/hooks.h"

namespace {

using quvaidx::ext::List;

void Check(bool ok, const char* what, const std::string& input) {
  if (ok) return;
  fprintf(stderr, "fuzz_file_rules: %s for input \"%s\"\n", what,
          input.c_str());
  abort();
}

char Lower(char c) { return (c >= 'A' && c <= 'Z') ? c - 'A' + 'a' : c; }

int NaiveInList(const char* ext, List list) {
  if (ext == nullptr) return 0;
  for (const char* const* e = quvaidx::ext::ListEntries(list); *e; ++e) {
    size_t i = 0;
    while (ext[i] != '\0' && Lower(ext[i]) == (*e)[i]) ++i;
    if (ext[i] == '\0' && (*e)[i] == '\0') return 1;
  }
  return 0;
}

int ReferenceShouldIndex(const std::string& n) {
  if (n == "." || n == ".." || n.rfind("._", 0) == 0 || n == "#recycle" ||
      n == "#snapshot" || n == ".quvameta") {
    return 0;
  }
  size_t dot = n.rfind('.');
  return dot != std::string::npos && n.substr(dot) == ".app" ? 0 : 1;
}

int ReferenceUnderRecycle(const std::string& p) {
  size_t pos = std::string::npos;
  for (int i = 0; i < 3; ++i) {
    pos = p.find('/', pos == std::string::npos ? 0 : pos + 1);
    if (pos == std::string::npos) return 0;
  }
  std::string t = p.substr(pos);
  return t == "/#recycle" || t.rfind("/#recycle/", 0) == 0 ? 1 : 0;
}

void Quiet(int, const char*) {}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static bool once = (quvaidx::SetLogSink(Quiet), true);
  (void)once;
  if (size == 0) return 0;
  const int out_size = data[0] % 17;
  const std::string text(
      reinterpret_cast<const char*>(data + 1),
      strnlen(reinterpret_cast<const char*>(data + 1), size - 1));
  const char* s = text.c_str();

  // Extension predicates on the text taken as an extension.
  struct {
    int (*fn)(const char*);
    List list;
  } const by_ext[] = {
      {BlQUVAIndexIsVideoOnWeb, List::kVideoOnWeb},
      {BlQUVAIndexIsPhotoOnWeb, List::kPhotoOnWeb},
      {BlQUVAIndexIsRawImage, List::kRawImage},
      {BlQUVAIndexIsJpeg, List::kJpeg},
      {BlQUVAIndexIsVideo, List::kVideo},
      {BlQUVAIndexIsPhoto, List::kPhoto},
      {BlQUVAIndexIsPlaylist, List::kPlaylist},
      {BlQUVAIndexIsMusic, List::kMusic},
  };
  for (const auto& p : by_ext) {
    Check(p.fn(s) == NaiveInList(s, p.list), "extension predicate", text);
  }
  int expected_table = MEDIA_TABLE_NONE;
  if (BlQUVAIndexIsMusic(s)) {
    expected_table = MEDIA_TABLE_MUSIC;
  } else if (BlQUVAIndexIsVideo(s)) {
    expected_table = MEDIA_TABLE_VIDEO;
  } else if (BlQUVAIndexIsPhoto(s)) {
    expected_table = MEDIA_TABLE_PHOTO;
  } else if (BlQUVAIndexIsPlaylist(s)) {
    expected_table = MEDIA_TABLE_PLAYLIST;
  }
  Check(GetMediaTableTypeFromExt(s) == expected_table, "media table", text);

  // Path predicates on the text taken as a path.
  const char* ext = QUVAIndexExtGet(s);
  const char* dot = strrchr(s, '.');
  Check(ext == (dot ? dot + 1 : nullptr), "extension position", text);
  struct {
    int (*fn)(const char*);
    List list;
  } const by_path[] = {
      {BlQUVAIndexIsSubtitleFile, List::kSubtitle},
      {BlQUVAIndexIsVideoFile, List::kVideo},
      {BlQUVAIndexIsVideoOnWebFile, List::kVideoOnWeb},
      {BlQUVAIndexIsPhotoOnWebConvertFile, List::kPhotoOnWebConvert},
      {BlQUVAIndexIsPhotoOnWebFile, List::kPhotoOnWeb},
      {BlQUVAIndexIsMusicFile, List::kMusic},
  };
  for (const auto& p : by_path) {
    Check(p.fn(s) == NaiveInList(ext, p.list), "path predicate", text);
  }

  Check(EntryNameShouldIndex(s) == ReferenceShouldIndex(text), "entry name",
        text);
  Check(QUVAPathUnderRecyle(s) == ReferenceUnderRecycle(text), "recycle bin",
        text);

  // Converted-video names into small buffers, with a guard behind them.
  char large[64];
  const int large_rc = ConvertVideoTypeGet(s, large, sizeof(large));
  char small[32];
  memset(small, 0xA5, sizeof(small));
  const int small_rc = ConvertVideoTypeGet(s, small, out_size);
  Check(small_rc == large_rc, "converted-video result", text);
  for (size_t i = out_size; i < sizeof(small); ++i) {
    Check(static_cast<unsigned char>(small[i]) == 0xA5, "write beyond size",
          text);
  }
  if (out_size > 0 && large_rc >= 0) {
    Check(strncmp(small, large, out_size - 1) == 0 &&
              strlen(small) == std::min<size_t>(strlen(large), out_size - 1),
          "cut converted-video type", text);
  }

  if (int n = QUVAAacObjectTypeGet(s); n != 0) {
    Check(text == QUVAAacCodecNameGet(n), "aac round trip", text);
  }
  if (int n = QUVADlnaContainerTypeGet(s); n != 0) {
    Check(text == QUVADlnaContainerNameGet(n), "container round trip", text);
  }
  return 0;
}

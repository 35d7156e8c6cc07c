// MediaInfoValid: the re-encoding of a media record's tag texts to UTF-8,
// with its fallbacks and the control-character clean-up.
#include <string.h>
#include <syslog.h>

#include <string_view>

#include "mediainfo/json_read.h"
#include "quvahost/quvahost.h"
#include "quvaidx/text.h"
#include "util/log_internal.h"

namespace {

constexpr char kModule[] = "quvaidx_unicode";

// The host writes at most this many bytes, terminator included, which is
// also the size of every tag field.
constexpr int kScratchSize = kMediaTagSize;

// Copies the host's output into field[size], cut at a character boundary.
void StoreConverted(const char* scratch, char* field, int size) {
  size_t length = strnlen(scratch, kScratchSize);
  length = quvaidx::CutLength(scratch, length, static_cast<size_t>(size) - 1);
  memcpy(field, scratch, length);
  field[length] = '\0';
}

// Converts the UTF-16 text in field[size] to UTF-8 in place.
// Returns 0 when done or the field is empty, -1 when the host cannot
// convert it (the field is unchanged) or the field is null.
int ConvertUTF16FieldToUTF8(char* field, int size) {
  if (field == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s (%d) Bad parameter.", kModule, __LINE__);
    return -1;
  }
  if (field[0] == '\0') return 0;
  char scratch[kScratchSize];
  if (QLIBCUnicodeStrUTF16ToUTF8(field, scratch, kScratchSize) < 0) return -1;
  StoreConverted(scratch, field, size);
  return 0;
}

// As ConvertUTF16FieldToUTF8, from the system code page, which is asked
// for on every call.
int ConvertCodePageFieldToUTF8(char* field, int size) {
  int code_page = QUVAIndexCodePageGet();
  if (field == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s (%d) Bad parameter.", kModule, __LINE__);
    return -1;
  }
  if (field[0] == '\0') return 0;
  char scratch[kScratchSize];
  if (QLIBCUnicodeStrCPToUTF8(code_page, field, scratch, kScratchSize) < 0) {
    return -1;
  }
  StoreConverted(scratch, field, size);
  return 0;
}

// 1 when a byte of `text` is 1 to 31, else 0. Bytes 127 and up do not count.
int HasControlChar(const char* text) {
  for (const unsigned char* p = reinterpret_cast<const unsigned char*>(text);
       *p != '\0'; ++p) {
    if (*p < 32) return 1;
  }
  return 0;
}

// Writes `name` into field[kMediaTagSize], cut at a character boundary
// when it is UTF-8, so the fallback itself is clean.
void StoreName(std::string_view name, char* field) {
  size_t length =
      quvaidx::CutLength(name.data(), name.size(), kMediaTagSize - 1);
  memcpy(field, name.data(), length);
  field[length] = '\0';
}

// The file's name without its extension: the text after the last '/' of
// the path, ended at its last '.'. Empty without a '/'.
void FallbackTitle(std::string_view path, char* title) {
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return;
  StoreName(path.substr(slash + 1), title);
  char* dot = strrchr(title, '.');
  if (dot != nullptr) *dot = '\0';
}

// The name of the folder that holds the file: the component before the
// last one. Empty with fewer than two '/'.
void FallbackAlbum(std::string_view path, char* album) {
  path = path.substr(0, kMediaPathSize - 1);
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return;
  std::string_view folder = path.substr(0, slash);
  slash = folder.rfind('/');
  if (slash == std::string_view::npos) return;
  StoreName(folder.substr(slash + 1), album);
}

// Makes field[kMediaTagSize] a terminated text: a field without a zero byte
// is taken to end at its last byte.
void Terminate(char* field) {
  if (memchr(field, '\0', kMediaTagSize) == nullptr) {
    field[kMediaTagSize - 1] = '\0';
  }
}

enum class Fallback { kNone, kTitle, kAlbum };

void ReEncode(char* field, int32_t utf16_flag, Fallback fallback,
              std::string_view path) {
  if (TryUTF8ToUTF16(field) == 1) return;
  int result = utf16_flag != 0
                   ? ConvertUTF16FieldToUTF8(field, kMediaTagSize)
                   : ConvertCodePageFieldToUTF8(field, kMediaTagSize);
  if (result != -1) return;
  memset(field, 0, kMediaTagSize);
  if (fallback == Fallback::kTitle) FallbackTitle(path, field);
  if (fallback == Fallback::kAlbum) FallbackAlbum(path, field);
}

}  // namespace

extern "C" void MediaInfoValid(__tag_QUVA_MEDIA_INFO* record) {
  if (record == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s (%d) Bad parameter.", kModule, __LINE__);
    return;
  }
  __tag_QUVA_MEDIA_INFO& r = *record;
  for (char* field : {r.szTitle, r.szArtist, r.szComposer, r.szComment,
                      r.szAlbum, r.szGenre, r.szAlbumArtist}) {
    Terminate(field);
  }
  std::string_view path(r.szPath, strnlen(r.szPath, kMediaPathSize));

  ReEncode(r.szTitle, r.blTitleUTF16, Fallback::kTitle, path);
  ReEncode(r.szArtist, r.blArtistUTF16, Fallback::kNone, path);
  ReEncode(r.szComposer, r.blComposerUTF16, Fallback::kNone, path);
  ReEncode(r.szComment, r.blCommentUTF16, Fallback::kNone, path);
  ReEncode(r.szAlbum, r.blAlbumUTF16, Fallback::kAlbum, path);
  ReEncode(r.szGenre, r.blGenreUTF16, Fallback::kNone, path);

  for (char* field : {r.szAlbum, r.szArtist, r.szAlbumArtist, r.szComposer,
                      r.szComment, r.szGenre, r.szTitle}) {
    if (HasControlChar(field) == 1) field[0] = '\0';
  }
}

// MediaInfoValid: the re-encoding of a media record's tag texts to UTF-8,
// with its fallbacks and the control-character clean-up.
#include <stdint.h>
#include <string.h>
#include <syslog.h>

#include <string_view>

#include <unicode/ustring.h>

#include "quvahost/quvahost.h"
#include "quvaidx/text.h"
#include "util/log_internal.h"
#include "util/utf8_cut.h"

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

// One pass over a tag field: terminates a field that holds no zero byte at
// its last byte (as if it ended there), and tells its length and whether it
// holds a control character. Clean records, the common case, need nothing
// more than this and one validation per text.
struct FieldScan {
  size_t length;
  bool control;
};

FieldScan ScanField(char* field) {
  bool control = false;
  size_t i = 0;
  // Eight bytes at a time while none of them is below 32 (which includes
  // the terminator): the test below is exact for "some byte is below 32".
  constexpr uint64_t kOnes = 0x0101010101010101ull;
  constexpr uint64_t kHighBits = 0x8080808080808080ull;
  for (; i + 8 <= kMediaTagSize - 1; i += 8) {
    uint64_t word;
    memcpy(&word, field + i, sizeof(word));
    if (((word - kOnes * 32) & ~word & kHighBits) != 0) break;
  }
  for (; i < kMediaTagSize - 1; ++i) {
    unsigned char c = static_cast<unsigned char>(field[i]);
    if (c == '\0') return {i, control};
    control = control || c < 32;
  }
  field[kMediaTagSize - 1] = '\0';
  return {kMediaTagSize - 1, control};
}

// TryUTF8ToUTF16's test on a tag text whose length is known.
bool IsStrictUTF8(const char* text, size_t length) {
  if (length == 0) return true;
  UChar units[kMediaTagSize + 1];
  int32_t written = 0;
  UErrorCode status = U_ZERO_ERROR;
  u_strFromUTF8(units, static_cast<int32_t>(sizeof(units) / sizeof(units[0])),
                &written, text, static_cast<int32_t>(length), &status);
  return U_SUCCESS(status);
}

enum class Fallback { kNone, kTitle, kAlbum };

// Re-encodes a field that is not UTF-8. Returns whether it changed.
bool ReEncode(char* field, const FieldScan& scan, int32_t utf16_flag,
              Fallback fallback, const __tag_QUVA_MEDIA_INFO& record) {
  if (IsStrictUTF8(field, scan.length)) return false;
  int result = utf16_flag != 0
                   ? ConvertUTF16FieldToUTF8(field, kMediaTagSize)
                   : ConvertCodePageFieldToUTF8(field, kMediaTagSize);
  if (result != -1) return true;
  memset(field, 0, kMediaTagSize);
  std::string_view path(record.szPath, strnlen(record.szPath, kMediaPathSize));
  if (fallback == Fallback::kTitle) FallbackTitle(path, field);
  if (fallback == Fallback::kAlbum) FallbackAlbum(path, field);
  return true;
}

}  // namespace

extern "C" void MediaInfoValid(__tag_QUVA_MEDIA_INFO* record) {
  if (record == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s (%d) Bad parameter.", kModule, __LINE__);
    return;
  }
  __tag_QUVA_MEDIA_INFO& r = *record;
  struct Tag {
    char* field;
    const int32_t* utf16_flag;  // null: never re-encoded
    Fallback fallback;
    FieldScan scan;
  };
  // Re-encoding order first; szAlbumArtist is only cleaned.
  Tag tags[] = {
      {r.szTitle, &r.blTitleUTF16, Fallback::kTitle, {}},
      {r.szArtist, &r.blArtistUTF16, Fallback::kNone, {}},
      {r.szComposer, &r.blComposerUTF16, Fallback::kNone, {}},
      {r.szComment, &r.blCommentUTF16, Fallback::kNone, {}},
      {r.szAlbum, &r.blAlbumUTF16, Fallback::kAlbum, {}},
      {r.szGenre, &r.blGenreUTF16, Fallback::kNone, {}},
      {r.szAlbumArtist, nullptr, Fallback::kNone, {}},
  };
  for (Tag& tag : tags) tag.scan = ScanField(tag.field);
  for (Tag& tag : tags) {
    if (tag.utf16_flag != nullptr &&
        ReEncode(tag.field, tag.scan, *tag.utf16_flag, tag.fallback, r)) {
      tag.scan.control = HasControlChar(tag.field) == 1;
    }
  }
  // A text holding a control character is emptied.
  for (Tag& tag : tags) {
    if (tag.scan.control) tag.field[0] = '\0';
  }
}

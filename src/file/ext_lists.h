// The ten extension lists and the one membership test that every media-type
// predicate shares. Not exported; the fuzz target and the benchmark read
// the lists to compare the test with naive loops.
//
// The lists are written as lists: lowercase, in their stored order, closed
// by a null entry. Beside each one the compiler derives a table of 64-bit
// keys (the extension's bytes packed little-endian), so that a lookup folds
// the extension to lowercase once and then compares integers: no
// allocation, no locale, no string compares.
#ifndef QUVAIDX_FILE_EXT_LISTS_H_
#define QUVAIDX_FILE_EXT_LISTS_H_

#include <stddef.h>
#include <stdint.h>

namespace quvaidx::ext {

// clang-format off
inline constexpr const char* kVideoOnWeb[] = {
    "mpg", "mpeg", "avi", "wmv", "asf", "mov", "flv", "f4v", "3gp", "3g2",
    "mp4", "m4v", "qt", "divx", "xvid", "dat", "m2ts", "m2t", "mts",
    nullptr};

inline constexpr const char* kPhotoOnWeb[] = {
    "jpg", "jpeg", "jpe", "bmp", "png", "tif", "tiff", "gif",
    // the raw images
    "arw", "srf", "sr2", "dcr", "k25", "kdc", "cr2", "crw", "nef", "mrw",
    "ptx", "pef", "raf", "3fr", "erf", "mef", "mos", "orf", "rw2", "dng",
    "x3f", "raw",
    nullptr};

inline constexpr const char* kRawImage[] = {
    "arw", "srf", "sr2", "dcr", "k25", "kdc", "cr2", "crw", "nef", "mrw",
    "ptx", "pef", "raf", "3fr", "erf", "mef", "mos", "orf", "rw2", "dng",
    "x3f", "raw",
    nullptr};

inline constexpr const char* kJpeg[] = {
    "jpg", "jpeg", "jpe",
    nullptr};

inline constexpr const char* kVideo[] = {
    "mpg", "mpeg", "avi", "asf", "wmv", "mov", "flv", "f4v", "dat", "rm",
    "rmvb", "mp4", "divx", "xvid", "vob", "mkv", "ts", "m2ts", "m2t", "mts",
    "m4v", "3gp", "3g2", "qt", "swf", "dvr-ms", "vdr", "iso", "ifo", "srt",
    "ass", "ssa", "smi", "psb", "trp", "tp",
    nullptr};

inline constexpr const char* kPhoto[] = {
    "jpg", "jpeg", "jpe", "bmp", "png", "gif", "ico", "tif", "tiff", "psd",
    "ufo",
    // the raw images
    "arw", "srf", "sr2", "dcr", "k25", "kdc", "cr2", "crw", "nef", "mrw",
    "ptx", "pef", "raf", "3fr", "erf", "mef", "mos", "orf", "rw2", "dng",
    "x3f", "raw",
    nullptr};

inline constexpr const char* kPlaylist[] = {
    "m3u", "wpl", "pls",
    nullptr};

inline constexpr const char* kMusic[] = {
    "mp3", "mp1", "mp2", "mpa", "wma", "wav", "ogg", "m4a", "aac", "ac3",
    "ram", "ra", "m4p", "flac", "aiff", "aif", "pcm", "m4b", "ape", "dsf",
    "dff",
    nullptr};

inline constexpr const char* kSubtitle[] = {
    "srt", "ass", "ssa", "smi", "psb",
    nullptr};

inline constexpr const char* kPhotoOnWebConvert[] = {
    "jpg", "jpeg", "jpe", "bmp", "png", "tif", "tiff",
    // the raw images
    "arw", "srf", "sr2", "dcr", "k25", "kdc", "cr2", "crw", "nef", "mrw",
    "ptx", "pef", "raf", "3fr", "erf", "mef", "mos", "orf", "rw2", "dng",
    "x3f", "raw",
    nullptr};
// clang-format on

// Longest text a key holds. No list entry is longer, so a longer extension
// is in no list.
inline constexpr size_t kMaxKeyLength = 8;

// The key of an extension: its bytes, ASCII upper case folded to lower
// case, packed little-endian into 64 bits. 0 (no list entry has it) for an
// empty text and for a text longer than kMaxKeyLength. Reads no byte
// beyond the terminator, nor more than kMaxKeyLength + 1 bytes.
constexpr uint64_t FoldedKey(const char* text) {
  uint64_t key = 0;
  for (size_t i = 0; i <= kMaxKeyLength; ++i) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    if (c == 0) return key;
    if (i == kMaxKeyLength) return 0;
    if (c >= 'A' && c <= 'Z') c = static_cast<unsigned char>(c + ('a' - 'A'));
    key |= static_cast<uint64_t>(c) << (8 * i);
  }
  return 0;
}

// Number of entries before the closing null.
template <size_t N>
constexpr size_t ListLength(const char* const (&list)[N]) {
  size_t n = 0;
  while (n < N && list[n] != nullptr) ++n;
  return n;
}

// The keys of a list, in its order.
template <size_t N>
struct KeyTable {
  uint64_t keys[N] = {};
  size_t count = 0;
};

template <size_t N>
constexpr KeyTable<N> MakeKeyTable(const char* const (&list)[N]) {
  KeyTable<N> table;
  for (; list[table.count] != nullptr; ++table.count) {
    table.keys[table.count] = FoldedKey(list[table.count]);
  }
  return table;
}

// The lists by name, for the predicates.
enum class List {
  kVideoOnWeb,
  kPhotoOnWeb,
  kRawImage,
  kJpeg,
  kVideo,
  kPhoto,
  kPlaylist,
  kMusic,
  kSubtitle,
  kPhotoOnWebConvert,
  kCount
};

// The list itself (null-terminated), for comparisons with naive loops.
const char* const* ListEntries(List list);

// Whether the list holds an extension whose key is `key` (FoldedKey). Key
// 0 is in no list.
bool KeyInList(uint64_t key, List list);

// The membership test: 1 when `ext` equals an entry of `list` under ASCII
// case folding, else 0 (also for null).
int InList(const char* ext, List list);

}  // namespace quvaidx::ext

#endif  // QUVAIDX_FILE_EXT_LISTS_H_

#include "quvaidx/media_type.h"

#include <string.h>

#include "file/ext_lists.h"

namespace quvaidx::ext {
namespace {

struct ListInfo {
  const char* const* entries;
  const uint64_t* keys;
  size_t count;
};

// Key tables derived at compile time; the static_asserts keep the tables
// and the lists from drifting apart in length.
constexpr auto kVideoOnWebKeys = MakeKeyTable(kVideoOnWeb);
constexpr auto kPhotoOnWebKeys = MakeKeyTable(kPhotoOnWeb);
constexpr auto kRawImageKeys = MakeKeyTable(kRawImage);
constexpr auto kJpegKeys = MakeKeyTable(kJpeg);
constexpr auto kVideoKeys = MakeKeyTable(kVideo);
constexpr auto kPhotoKeys = MakeKeyTable(kPhoto);
constexpr auto kPlaylistKeys = MakeKeyTable(kPlaylist);
constexpr auto kMusicKeys = MakeKeyTable(kMusic);
constexpr auto kSubtitleKeys = MakeKeyTable(kSubtitle);
constexpr auto kPhotoOnWebConvertKeys = MakeKeyTable(kPhotoOnWebConvert);

static_assert(ListLength(kVideoOnWeb) == 19);
static_assert(ListLength(kPhotoOnWeb) == 30);
static_assert(ListLength(kRawImage) == 22);
static_assert(ListLength(kJpeg) == 3);
static_assert(ListLength(kVideo) == 36);
static_assert(ListLength(kPhoto) == 33);
static_assert(ListLength(kPlaylist) == 3);
static_assert(ListLength(kMusic) == 21);
static_assert(ListLength(kSubtitle) == 5);
static_assert(ListLength(kPhotoOnWebConvert) == 29);

// Every entry has a non-zero key, so key 0 (empty or overlong extension)
// matches nothing.
template <size_t N>
constexpr bool AllKeysNonZero(const KeyTable<N>& table) {
  for (size_t i = 0; i < table.count; ++i) {
    if (table.keys[i] == 0) return false;
  }
  return true;
}
static_assert(AllKeysNonZero(kVideoKeys) && AllKeysNonZero(kPhotoKeys) &&
              AllKeysNonZero(kMusicKeys) && AllKeysNonZero(kVideoOnWebKeys) &&
              AllKeysNonZero(kPhotoOnWebKeys) &&
              AllKeysNonZero(kPhotoOnWebConvertKeys) &&
              AllKeysNonZero(kRawImageKeys) && AllKeysNonZero(kJpegKeys) &&
              AllKeysNonZero(kPlaylistKeys) && AllKeysNonZero(kSubtitleKeys));

template <size_t N>
constexpr ListInfo Info(const char* const (&list)[N],
                        const KeyTable<N>& table) {
  return {list, table.keys, table.count};
}

// Indexed by List.
constexpr ListInfo kLists[] = {
    Info(kVideoOnWeb, kVideoOnWebKeys),
    Info(kPhotoOnWeb, kPhotoOnWebKeys),
    Info(kRawImage, kRawImageKeys),
    Info(kJpeg, kJpegKeys),
    Info(kVideo, kVideoKeys),
    Info(kPhoto, kPhotoKeys),
    Info(kPlaylist, kPlaylistKeys),
    Info(kMusic, kMusicKeys),
    Info(kSubtitle, kSubtitleKeys),
    Info(kPhotoOnWebConvert, kPhotoOnWebConvertKeys),
};
static_assert(sizeof(kLists) / sizeof(kLists[0]) ==
              static_cast<size_t>(List::kCount));

}  // namespace

const char* const* ListEntries(List list) {
  return kLists[static_cast<size_t>(list)].entries;
}

bool KeyInList(uint64_t key, List list) {
  if (key == 0) return false;
  const ListInfo& info = kLists[static_cast<size_t>(list)];
  for (size_t i = 0; i < info.count; ++i) {
    if (info.keys[i] == key) return true;
  }
  return false;
}

int InList(const char* ext, List list) {
  if (ext == nullptr) return 0;
  return KeyInList(FoldedKey(ext), list) ? 1 : 0;
}

}  // namespace quvaidx::ext

using quvaidx::ext::InList;
using quvaidx::ext::KeyInList;
using quvaidx::ext::List;

namespace {

int PathInList(const char* path, List list) {
  return InList(QUVAIndexExtGet(path), list);
}

}  // namespace

extern "C" {

const char* QUVAIndexExtGet(const char* path) {
  if (path == nullptr) return nullptr;
  const char* dot = strrchr(path, '.');
  return dot == nullptr ? nullptr : dot + 1;
}

int BlQUVAIndexIsVideoOnWeb(const char* ext) {
  return InList(ext, List::kVideoOnWeb);
}
int BlQUVAIndexIsPhotoOnWeb(const char* ext) {
  return InList(ext, List::kPhotoOnWeb);
}
int BlQUVAIndexIsRawImage(const char* ext) {
  return InList(ext, List::kRawImage);
}
int BlQUVAIndexIsJpeg(const char* ext) { return InList(ext, List::kJpeg); }
int BlQUVAIndexIsVideo(const char* ext) { return InList(ext, List::kVideo); }
int BlQUVAIndexIsPhoto(const char* ext) { return InList(ext, List::kPhoto); }
int BlQUVAIndexIsPlaylist(const char* ext) {
  return InList(ext, List::kPlaylist);
}
int BlQUVAIndexIsMusic(const char* ext) { return InList(ext, List::kMusic); }

int BlQUVAIndexIsSubtitleFile(const char* path) {
  return PathInList(path, List::kSubtitle);
}
int BlQUVAIndexIsVideoFile(const char* path) {
  return PathInList(path, List::kVideo);
}
int BlQUVAIndexIsVideoOnWebFile(const char* path) {
  return PathInList(path, List::kVideoOnWeb);
}
int BlQUVAIndexIsPhotoOnWebConvertFile(const char* path) {
  return PathInList(path, List::kPhotoOnWebConvert);
}
int BlQUVAIndexIsPhotoOnWebFile(const char* path) {
  return PathInList(path, List::kPhotoOnWeb);
}
int BlQUVAIndexIsMusicFile(const char* path) {
  return PathInList(path, List::kMusic);
}

int GetMediaTableTypeFromExt(const char* ext) {
  if (ext == nullptr) return MEDIA_TABLE_NONE;
  // One fold, then the four lists in the order that fixes the answer.
  const uint64_t key = quvaidx::ext::FoldedKey(ext);
  if (key == 0) return MEDIA_TABLE_NONE;
  if (KeyInList(key, List::kMusic)) return MEDIA_TABLE_MUSIC;
  if (KeyInList(key, List::kVideo)) return MEDIA_TABLE_VIDEO;
  if (KeyInList(key, List::kPhoto)) return MEDIA_TABLE_PHOTO;
  if (KeyInList(key, List::kPlaylist)) return MEDIA_TABLE_PLAYLIST;
  return MEDIA_TABLE_NONE;
}

}  // extern "C"

#include "record_fill.h"

#include <float.h>
#include <math.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <strings.h>
#include <time.h>

#include <numeric>
#include <string_view>

#include <quvaidx/codec_names.h>
#include <quvaidx/text.h>

namespace mediaparserd {
namespace {

// The largest UTF-16 text a tag field carries: a byte-order mark, 125 code
// units and a two-byte terminator fill 254 bytes, and the host reads at
// most that many.
constexpr size_t kMaxUTF16Units = (kMediaTagSize - 1 - 2 - 2) / 2;

// Counts, sizes and rates: negative ones are unknown (0), larger ones than
// the field holds are clamped.
int32_t Count(int64_t value) {
  if (value <= 0) return 0;
  return value > INT32_MAX ? INT32_MAX : static_cast<int32_t>(value);
}

uint32_t Rate(int64_t value) {
  if (value <= 0) return 0;
  return value > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(value);
}

int32_t Signed(int64_t value) {
  if (value < INT32_MIN) return INT32_MIN;
  return value > INT32_MAX ? INT32_MAX : static_cast<int32_t>(value);
}

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool IsValidUTF8(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    size_t extra;
    uint32_t cp;
    if (c < 0x80) {
      ++i;
      continue;
    } else if (c >= 0xC2 && c <= 0xDF) {
      extra = 1, cp = c & 0x1F;
    } else if (c >= 0xE0 && c <= 0xEF) {
      extra = 2, cp = c & 0x0F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      extra = 3, cp = c & 0x07;
    } else {
      return false;
    }
    if (text.size() - i <= extra) return false;
    for (size_t k = 1; k <= extra; ++k) {
      unsigned char next = static_cast<unsigned char>(text[i + k]);
      if ((next & 0xC0) != 0x80) return false;
      cp = cp << 6 | (next & 0x3F);
    }
    if ((extra == 2 && (cp < 0x800 || (cp >= 0xD800 && cp <= 0xDFFF))) ||
        (extra == 3 && (cp < 0x10000 || cp > 0x10FFFF))) {
      return false;
    }
    i += extra + 1;
  }
  return true;
}

// Writes `text` (up to its first zero byte) into field[capacity], cut to
// capacity - 1 bytes; UTF-8 text is cut before the character that does not
// fit, other bytes where the field ends. The field is zero-terminated.
void PutText(char* field, size_t capacity, std::string_view text) {
  text = text.substr(0, text.find('\0'));
  size_t length = text.size();
  if (length > capacity - 1) {
    length = capacity - 1;
    if (IsValidUTF8(text)) {
      while (length > 0 &&
             (static_cast<unsigned char>(text[length]) & 0xC0) == 0x80) {
        --length;
      }
    }
  }
  if (length > 0) memcpy(field, text.data(), length);
  field[length] = '\0';
}

// A name the libraries give (codec, container, file system UUID): ASCII in
// practice; anything that is not UTF-8 is left out rather than passed on.
void PutName(char* field, size_t capacity, std::string_view name) {
  name = name.substr(0, name.find('\0'));
  PutText(field, capacity, IsValidUTF8(name) ? name : std::string_view());
}

// Writes UTF-16LE code units (up to the first zero unit, at most
// kMaxUTF16Units, a pair never split) into a zeroed tag field after a
// byte-order mark, and sets the field's flag. Nothing for an empty text.
void PutUTF16(char* field, int32_t* flag, std::string_view units) {
  size_t count = 0;
  while (count < units.size() / 2 &&
         (units[2 * count] != '\0' || units[2 * count + 1] != '\0')) {
    ++count;
  }
  if (count > kMaxUTF16Units) {
    count = kMaxUTF16Units;
    unsigned high = static_cast<unsigned char>(units[2 * count - 1]);
    if (high >= 0xD8 && high <= 0xDB) --count;  // a lead surrogate
  }
  if (count == 0) return;
  field[0] = '\xFF';
  field[1] = '\xFE';
  memcpy(field + 2, units.data(), 2 * count);
  field[2 + 2 * count] = field[3 + 2 * count] = '\0';
  *flag = 1;
}

// Whether `byte` starts a two-byte character in the double-byte code page
// `page` of the host's numbering (11 Shift-JIS, 12 GBK, 13 Big5, 14
// Korean); false for the single-byte ones.
bool IsLeadByte(int page, unsigned char byte) {
  if (page == 11) return (byte >= 0x81 && byte <= 0x9F) || byte >= 0xE0;
  return page >= 12 && page <= 14 && byte >= 0x81 && byte <= 0xFE;
}

// Writes 8-bit text of unknown code page into field[capacity]. Text that is
// too long is cut where a character of the host's code page ends: a cut
// inside a double-byte character would make the whole text fail to
// convert, and the field fall back to a name.
void PutLegacy(char* field, size_t capacity, std::string_view text) {
  text = text.substr(0, text.find('\0'));
  if (text.size() > capacity - 1 && !IsValidUTF8(text)) {
    int page = QUVAIndexCodePageGet();
    size_t end = 0;
    while (end < text.size()) {
      size_t width =
          IsLeadByte(page, static_cast<unsigned char>(text[end])) ? 2 : 1;
      if (end + width > capacity - 1) break;
      end += width;
    }
    text = text.substr(0, end);
  }
  PutText(field, capacity, text);
}

// Delivers a tag text into a zeroed tag field as the file stores it (see the
// header); `flag` is the field's UTF-16 flag.
void PutTag(char* field, int32_t* flag, const TagText& text) {
  if (text.encoding == TagText::Encoding::kUTF16) {
    PutUTF16(field, flag, text.bytes);
  } else if (text.encoding == TagText::Encoding::kBytes) {
    PutLegacy(field, kMediaTagSize, text.bytes);
  } else {
    PutText(field, kMediaTagSize, text.bytes);
  }
}

// The text as clean UTF-8 by MediaInfoValid's rules, for a field that it
// does not re-encode itself: a scratch record carries it as a title without
// a path, so that text that cannot be converted comes back empty.
std::string CleanUTF8(const TagText& text) {
  __tag_QUVA_MEDIA_INFO scratch;
  memset(&scratch, 0, sizeof(scratch));
  PutTag(scratch.szTitle, &scratch.blTitleUTF16, text);
  if (scratch.szTitle[0] == '\0') return "";
  MediaInfoValid(&scratch);
  return scratch.szTitle;
}

std::string_view TrimRight(std::string_view text) {
  while (!text.empty() && (text.back() == ' ' || text.back() == '\0')) {
    text.remove_suffix(1);
  }
  return text;
}

// The leading whole number of a tag text ("3/12" gives 3); 0 without one.
int64_t LeadingNumber(std::string_view text, size_t max_digits) {
  size_t i = 0;
  while (i < text.size() && text[i] == ' ') ++i;
  int64_t value = 0;
  for (size_t digits = 0; i < text.size() && text[i] >= '0' && text[i] <= '9' &&
                          digits < max_digits;
       ++i, ++digits) {
    value = value * 10 + (text[i] - '0');
  }
  return value;
}

const std::string* FindTag(const ContainerFacts& container,
                           std::string_view key) {
  for (const auto& [name, value] : container.tags) {
    if (name.size() == key.size() &&
        strncasecmp(name.data(), key.data(), key.size()) == 0) {
      return &value;
    }
  }
  return nullptr;
}

// The music tags of a container's own tags (meant to be UTF-8).
MusicTags TagsOfContainer(const ContainerFacts& container) {
  MusicTags tags;
  struct Text {
    const char* key;
    TagText* text;
  };
  const Text texts[] = {
      {"title", &tags.title},     {"artist", &tags.artist},
      {"album", &tags.album},     {"album_artist", &tags.album_artist},
      {"genre", &tags.genre},     {"composer", &tags.composer},
      {"comment", &tags.comment},
  };
  for (const Text& entry : texts) {
    if (const std::string* value = FindTag(container, entry.key)) {
      entry.text->bytes = *value;
    }
  }
  if (const std::string* value = FindTag(container, "track")) {
    tags.track = LeadingNumber(*value, 9);
  }
  if (const std::string* value = FindTag(container, "disc")) {
    tags.disc = LeadingNumber(*value, 9);
  }
  const std::string* date = FindTag(container, "date");
  if (date == nullptr) date = FindTag(container, "year");
  if (date != nullptr) tags.year = LeadingNumber(*date, 4);
  return tags;
}

void FillTags(const MusicTags& tags, __tag_QUVA_MEDIA_INFO* r) {
  PutTag(r->szTitle, &r->blTitleUTF16, tags.title);
  PutTag(r->szArtist, &r->blArtistUTF16, tags.artist);
  PutTag(r->szAlbum, &r->blAlbumUTF16, tags.album);
  PutTag(r->szGenre, &r->blGenreUTF16, tags.genre);
  PutTag(r->szComposer, &r->blComposerUTF16, tags.composer);
  PutTag(r->szComment, &r->blCommentUTF16, tags.comment);
  PutText(r->szAlbumArtist, kMediaTagSize, CleanUTF8(tags.album_artist));
  r->track = Count(tags.track);
  r->disc = Count(tags.disc);
  r->year = Count(tags.year);
}

void FormatTime(int64_t seconds, char* field, size_t capacity) {
  time_t when = static_cast<time_t>(seconds);
  struct tm parts;
  if (localtime_r(&when, &parts) == nullptr ||
      strftime(field, capacity, "%Y-%m-%d %H:%M:%S", &parts) == 0) {
    field[0] = '\0';
  }
}

const StreamFacts* FirstStream(const ContainerFacts& container,
                               StreamFacts::Type type) {
  for (const StreamFacts& stream : container.streams) {
    if (stream.type == type) return &stream;
  }
  return nullptr;
}

// Frames per second as a fraction of positive 32-bit terms, or nothing.
void PutFrameRate(const StreamFacts& video, __tag_QUVA_MEDIA_INFO* r) {
  if (video.frame_rate_num > 0 && video.frame_rate_den > 0 &&
      video.frame_rate_num <= INT32_MAX && video.frame_rate_den <= INT32_MAX) {
    r->frame_rate_num = static_cast<int32_t>(video.frame_rate_num);
    r->frame_rate_den = static_cast<int32_t>(video.frame_rate_den);
  }
}

void FillStreams(MediaKind kind, const ContainerFacts& container,
                 __tag_QUVA_MEDIA_INFO* r) {
  if (isfinite(container.duration) && container.duration > 0) {
    r->duration = container.duration >= FLT_MAX
                      ? FLT_MAX
                      : static_cast<float>(container.duration);
  }
  r->frame_bitrate = Rate(container.bit_rate);
  for (const StreamFacts& stream : container.streams) {
    if (stream.type == StreamFacts::Type::kCover) ++r->coverCount;
  }
  if (const StreamFacts* audio =
          FirstStream(container, StreamFacts::Type::kAudio)) {
    r->audio_bitrate = Rate(audio->bit_rate);
    // A song's only stream is what the container's rate measures.
    if (r->audio_bitrate == 0 && kind == MediaKind::kMusic) {
      r->audio_bitrate = r->frame_bitrate;
    }
    r->frequency = Count(audio->sample_rate);
    r->channel = Count(audio->channels);
    if (audio->codec == "aac") {
      int type = static_cast<int>(audio->aac_object_type < 0 ||
                                          audio->aac_object_type > INT32_MAX
                                      ? 0
                                      : audio->aac_object_type);
      PutText(r->szAudioCodec, kMediaTagSize, QUVAAacCodecNameGet(type));
    } else {
      PutName(r->szAudioCodec, kMediaTagSize, audio->codec);
    }
  }
  if (const StreamFacts* video =
          FirstStream(container, StreamFacts::Type::kVideo)) {
    r->resolutionX = Count(video->width);
    r->resolutionY = Count(video->height);
    r->video_bitrate = Rate(video->bit_rate);
    PutFrameRate(*video, r);
    PutName(r->szVideoCodec, kMediaTagSize, video->codec);
    r->videoProfile = Signed(video->profile);
    r->videoLevel = Signed(video->level);
  }
}

// "1/125" below a quarter second, else seconds with one decimal ("2.5",
// "30"), as photographers read them.
void PutExposure(const PhotoFacts& photo, __tag_QUVA_MEDIA_INFO* r) {
  if (photo.exposure_num <= 0 || photo.exposure_den <= 0) return;
  double seconds = static_cast<double>(photo.exposure_num) /
                   static_cast<double>(photo.exposure_den);
  char text[64];
  if (seconds < 0.25001) {
    double inverse = floor(1 / seconds + 0.5);
    if (inverse > 1e15) return;
    snprintf(text, sizeof(text), "1/%.0f", inverse);
  } else {
    if (seconds > 1e15) return;
    snprintf(text, sizeof(text), "%.1f", seconds);
    size_t length = strlen(text);
    if (length > 2 && strcmp(text + length - 2, ".0") == 0) {
      text[length - 2] = '\0';
    }
  }
  if (strlen(text) < sizeof(r->szExposure)) {
    PutText(r->szExposure, sizeof(r->szExposure), text);
  }
}

// The f-number with one decimal ("2.8"), two below 1.
void PutAperture(const PhotoFacts& photo, __tag_QUVA_MEDIA_INFO* r) {
  if (photo.fnumber_num <= 0 || photo.fnumber_den <= 0) return;
  double f = static_cast<double>(photo.fnumber_num) /
             static_cast<double>(photo.fnumber_den);
  if (f > 1e15) return;
  char text[64];
  snprintf(text, sizeof(text), f < 1 ? "%.2f" : "%.1f", f);
  if (strlen(text) < sizeof(r->szAperture)) {
    PutText(r->szAperture, sizeof(r->szAperture), text);
  }
}

// EXIF's "YYYY:MM:DD HH:MM:SS" in the record's date form; anything else
// (blank dates included) is left out.
void PutTakenTime(std::string_view taken, __tag_QUVA_MEDIA_INFO* r) {
  constexpr std::string_view kForm = "dddd:dd:dd dd:dd:dd";
  if (taken.size() < kForm.size()) return;
  char text[kMediaDateSize] = {};
  for (size_t i = 0; i < kForm.size(); ++i) {
    bool digit = taken[i] >= '0' && taken[i] <= '9';
    if (kForm[i] == 'd' ? !digit : taken[i] != kForm[i]) return;
    text[i] = (i == 4 || i == 7) ? '-' : taken[i];
  }
  if (LeadingNumber(taken, 4) == 0) return;  // "0000:00:00 ..."
  PutText(r->szTakenTime, sizeof(r->szTakenTime), text);
}

void FillPhoto(const ContainerFacts& container, const PhotoFacts* photo,
               __tag_QUVA_MEDIA_INFO* r) {
  if (photo != nullptr) {
    r->resolutionX = Count(photo->width);
    r->resolutionY = Count(photo->height);
    TagText make{TagText::Encoding::kBytes,
                 std::string(TrimRight(photo->make))};
    TagText model{TagText::Encoding::kBytes,
                  std::string(TrimRight(photo->model))};
    PutText(r->szMake, sizeof(r->szMake), CleanUTF8(make));
    PutText(r->szModel, sizeof(r->szModel), CleanUTF8(model));
    PutExposure(*photo, r);
    PutAperture(*photo, r);
    r->iso = Count(photo->iso);
    PutTakenTime(photo->taken, r);
  }
  if (r->resolutionX == 0 || r->resolutionY == 0) {
    if (const StreamFacts* picture =
            FirstStream(container, StreamFacts::Type::kVideo)) {
      r->resolutionX = Count(picture->width);
      r->resolutionY = Count(picture->height);
    }
  }
}

bool EndsWith(std::string_view text, std::string_view end) {
  return text.size() >= end.size() &&
         text.compare(text.size() - end.size(), end.size(), end) == 0;
}

bool IsImageFormat(std::string_view format) {
  return EndsWith(format, "_pipe") || format == "image2" ||
         format == "image2pipe" || format == "gif" || format == "apng" ||
         format == "ico";
}

}  // namespace

bool ClassifyContainer(const ContainerFacts& container, MediaKind* kind) {
  bool audio = false, video = false;
  for (const StreamFacts& stream : container.streams) {
    audio = audio || stream.type == StreamFacts::Type::kAudio;
    video = video || stream.type == StreamFacts::Type::kVideo;
  }
  if (IsImageFormat(container.format) && video) {
    *kind = MediaKind::kPhoto;
  } else if (video) {
    *kind = MediaKind::kVideo;
  } else if (audio) {
    *kind = MediaKind::kMusic;
  } else {
    return false;
  }
  return true;
}

std::string ContainerTypeName(const std::string& format) {
  if (IsImageFormat(format) && format != "gif" && format != "apng" &&
      format != "ico") {
    return QUVADlnaContainerNameGet(1);  // "image2"
  }
  return format;
}

void FillRecord(MediaKind kind, const FileFacts& file,
                const ContainerFacts& container, const MusicTags* tags,
                const PhotoFacts* photo, __tag_QUVA_MEDIA_INFO* record) {
  __tag_QUVA_MEDIA_INFO* r = record;
  memset(r, 0, sizeof(*r));
  PutText(r->szPath, sizeof(r->szPath), file.path);
  PutText(r->szName, sizeof(r->szName),
          std::string_view(file.path).substr(file.path.rfind('/') + 1));
  r->fileSize = file.size;
  FormatTime(file.mtime, r->szDate, sizeof(r->szDate));
  FormatTime(file.mtime, r->szMDate, sizeof(r->szMDate));
  PutName(r->szFsUUID, sizeof(r->szFsUUID), file.fs_uuid);
  PutName(r->szContainerType, sizeof(r->szContainerType),
          ContainerTypeName(container.format));
  if (kind == MediaKind::kPhoto) {
    FillPhoto(container, photo, r);
  } else {
    FillStreams(kind, container, r);
    FillTags(tags != nullptr ? *tags : TagsOfContainer(container), r);
  }
  MediaInfoValid(r);
}

_VIDEO_METADATA_ VideoMetadataOf(const ContainerFacts& container) {
  _VIDEO_METADATA_ metadata = {0, 1, 1};
  const StreamFacts* video = FirstStream(container, StreamFacts::Type::kVideo);
  if (video == nullptr) return metadata;
  if (video->has_rotation && isfinite(video->rotation)) {
    // Counterclockwise degrees to the clockwise quarter turn nearest them.
    double turn = fmod(-video->rotation, 360.0);
    if (turn < 0) turn += 360.0;
    metadata.rotation = static_cast<int32_t>(lround(turn / 90.0) % 4) * 90;
  }
  if (video->sar_num > 0 && video->sar_den > 0) {
    int64_t divisor = std::gcd(video->sar_num, video->sar_den);
    int64_t num = video->sar_num / divisor, den = video->sar_den / divisor;
    if (num <= INT32_MAX && den <= INT32_MAX) {
      metadata.parWidth = static_cast<int32_t>(num);
      metadata.parHeight = static_cast<int32_t>(den);
    }
  }
  return metadata;
}

}  // namespace mediaparserd

// The media parser's glue (daemons/mediaparserd/record_fill.h) on library
// results no library needs to give: odd tag encodings and bytes, huge and
// negative numbers, absent and surplus streams, any code page of the host.
//
// The input makes, through FuzzedDataProvider, the host's code page (one of
// a few settings folders made at start-up), a container with its streams
// and tags, music tags, photo facts and file facts; every kind of record is
// filled from them. Checked: every text field ends within its capacity,
// every text but the path and the name is valid UTF-8 (that is what the
// daemon's replies carry; the title and album only with a UTF-8 path, whose
// names they fall back to), the UTF-16 flags are 0 or 1, the record's JSON
// form has its 47 members, the rotation is a quarter turn and the pixel
// aspect ratio positive.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <fuzzer/FuzzedDataProvider.h>
#include <json/json.h>

#include "media_facts.h"
#include "quvaidx/mediainfo.h"
#include "record_fill.h"

namespace {

using mediaparserd::ContainerFacts;
using mediaparserd::FileFacts;
using mediaparserd::MediaKind;
using mediaparserd::MusicTags;
using mediaparserd::PhotoFacts;
using mediaparserd::StreamFacts;
using mediaparserd::TagText;

[[noreturn]] void Fail(const char* what, const char* field) {
  fprintf(stderr, "fuzz_mediaparser_glue: %s: %s\n", what, field);
  abort();
}

// Strict UTF-8, as ICU reads it.
bool IsValidUTF8(const char* text) {
  const auto* p = reinterpret_cast<const unsigned char*>(text);
  while (*p != 0) {
    unsigned c = *p;
    int extra = c < 0x80                 ? 0
                : c >= 0xC2 && c <= 0xDF ? 1
                : c >= 0xE0 && c <= 0xEF ? 2
                : c >= 0xF0 && c <= 0xF4 ? 3
                                         : -1;
    if (extra < 0) return false;
    unsigned cp = extra == 0 ? c : c & (0x3F >> extra);
    for (int k = 1; k <= extra; ++k) {
      if ((p[k] & 0xC0) != 0x80) return false;
      cp = cp << 6 | (p[k] & 0x3F);
    }
    if ((extra == 2 && (cp < 0x800 || (cp >= 0xD800 && cp <= 0xDFFF))) ||
        (extra == 3 && (cp < 0x10000 || cp > 0x10FFFF))) {
      return false;
    }
    p += extra + 1;
  }
  return true;
}

// Settings folders for the host, one per code page (and one without).
std::vector<std::string> g_hosts;

void MakeHosts() {
  const char* pages[] = {"",
                         "UTF-8",
                         "windows-1251",
                         "windows-936",
                         "windows-31j",
                         "windows-1252"};
  for (const char* page : pages) {
    char dir[] = "/tmp/fuzz-mpglue-XXXXXX";
    if (mkdtemp(dir) == nullptr) abort();
    if (*page != '\0') {
      std::string conf = std::string(dir) + "/host.conf";
      FILE* file = fopen(conf.c_str(), "w");
      if (file == nullptr) abort();
      fprintf(file, "[system]\ncode_page = %s\n", page);
      fclose(file);
    }
    g_hosts.push_back(dir);
  }
}

void RemoveHosts() {
  for (const std::string& dir : g_hosts) {
    unlink((dir + "/host.conf").c_str());
    rmdir(dir.c_str());
  }
}

int64_t Number(FuzzedDataProvider& in) {
  switch (in.ConsumeIntegralInRange(0, 3)) {
    case 0:
      return in.ConsumeIntegral<int64_t>();
    case 1:
      return in.ConsumeIntegralInRange<int64_t>(-2, 100000);
    case 2:
      return in.PickValueInArray<int64_t>(
          {INT32_MAX, int64_t{INT32_MAX} + 1, UINT32_MAX, INT32_MIN, -99});
    default:
      return 0;
  }
}

std::string Bytes(FuzzedDataProvider& in) {
  return in.ConsumeRandomLengthString(600);
}

TagText Tag(FuzzedDataProvider& in) {
  TagText text;
  text.encoding =
      in.PickValueInArray({TagText::Encoding::kBytes, TagText::Encoding::kUTF16,
                           TagText::Encoding::kUTF8});
  text.bytes = Bytes(in);
  return text;
}

StreamFacts Stream(FuzzedDataProvider& in) {
  StreamFacts stream;
  stream.type = in.PickValueInArray(
      {StreamFacts::Type::kAudio, StreamFacts::Type::kVideo,
       StreamFacts::Type::kCover, StreamFacts::Type::kOther});
  stream.codec = in.PickValueInArray<std::string>(
      {"aac", "mp3", "h264", "flac", "", "\xff\xfe"});
  if (in.ConsumeBool()) stream.codec = Bytes(in);
  stream.profile = Number(in);
  stream.level = Number(in);
  stream.aac_object_type = Number(in);
  stream.bit_rate = Number(in);
  stream.sample_rate = Number(in);
  stream.channels = Number(in);
  stream.width = Number(in);
  stream.height = Number(in);
  stream.sar_num = Number(in);
  stream.sar_den = Number(in);
  stream.frame_rate_num = Number(in);
  stream.frame_rate_den = Number(in);
  stream.has_rotation = in.ConsumeBool();
  stream.rotation = in.ConsumeFloatingPoint<double>();
  return stream;
}

void CheckText(const char* field, size_t capacity, const char* name,
               bool utf8) {
  if (memchr(field, '\0', capacity) == nullptr) Fail("not terminated", name);
  if (utf8 && !IsValidUTF8(field)) Fail("not UTF-8", name);
}

void Check(__tag_QUVA_MEDIA_INFO& r, bool utf8_path) {
#define TEXT(f, utf8) CheckText(r.f, sizeof(r.f), #f, utf8)
  TEXT(szPath, false);
  TEXT(szName, false);
  TEXT(szDesc, true);
  TEXT(szTitle, utf8_path);
  TEXT(szAlbum, utf8_path);
  TEXT(szArtist, true);
  TEXT(szAlbumArtist, true);
  TEXT(szGenre, true);
  TEXT(szComposer, true);
  TEXT(szComment, true);
  TEXT(szMake, true);
  TEXT(szModel, true);
  TEXT(szExposure, true);
  TEXT(szAperture, true);
  TEXT(szTakenTime, true);
  TEXT(szDate, true);
  TEXT(szMDate, true);
  TEXT(szVideoCodec, true);
  TEXT(szContainerType, true);
  TEXT(szAudioCodec, true);
  TEXT(szFsUUID, true);
#undef TEXT
  for (int32_t flag : {r.blTitleUTF16, r.blArtistUTF16, r.blAlbumUTF16,
                       r.blGenreUTF16, r.blComposerUTF16, r.blCommentUTF16}) {
    if (flag != 0 && flag != 1) Fail("flag", "UTF16");
  }
  Json::Value json;
  MediaInfoObject2Json(r, json);
  if (json.size() != 47) Fail("JSON members", "media");
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  MakeHosts();
  atexit(RemoveHosts);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FuzzedDataProvider in(data, size);
  setenv(
      "QUVA_HOST_ETC",
      g_hosts[in.ConsumeIntegralInRange<size_t>(0, g_hosts.size() - 1)].c_str(),
      1);
  ContainerFacts container;
  container.format = in.PickValueInArray<std::string>(
      {"mp3", "mov,mp4,m4a,3gp,3g2,mj2", "jpeg_pipe", "gif", "image2", ""});
  if (in.ConsumeBool()) container.format = Bytes(in);
  container.duration = in.ConsumeFloatingPoint<double>();
  container.bit_rate = Number(in);
  for (int i = in.ConsumeIntegralInRange(0, 5); i > 0; --i) {
    container.streams.push_back(Stream(in));
  }
  for (int i = in.ConsumeIntegralInRange(0, 6); i > 0; --i) {
    std::string key = in.PickValueInArray<std::string>(
        {"title", "artist", "album", "album_artist", "genre", "composer",
         "comment", "track", "disc", "date", "year"});
    container.tags.emplace_back(key, Bytes(in));
  }
  MusicTags tags;
  for (TagText* text :
       {&tags.title, &tags.artist, &tags.album, &tags.album_artist, &tags.genre,
        &tags.composer, &tags.comment}) {
    *text = Tag(in);
  }
  tags.track = Number(in);
  tags.disc = Number(in);
  tags.year = Number(in);
  PhotoFacts photo;
  photo.make = Bytes(in);
  photo.model = Bytes(in);
  photo.exposure_num = Number(in);
  photo.exposure_den = Number(in);
  photo.fnumber_num = Number(in);
  photo.fnumber_den = Number(in);
  photo.iso = Number(in);
  photo.taken = in.ConsumeBool() ? "2021:05:01 12:34:56" : Bytes(in);
  photo.width = Number(in);
  photo.height = Number(in);
  FileFacts file;
  file.path = "/share/Music/" + in.ConsumeRandomLengthString(300);
  file.size = in.ConsumeIntegral<uint64_t>();
  file.mtime = Number(in);
  file.fs_uuid = in.ConsumeRandomLengthString(40);

  static __tag_QUVA_MEDIA_INFO record;
  for (MediaKind kind :
       {MediaKind::kMusic, MediaKind::kVideo, MediaKind::kPhoto}) {
    mediaparserd::FillRecord(kind, file, container,
                             in.ConsumeBool() ? &tags : nullptr,
                             in.ConsumeBool() ? &photo : nullptr, &record);
    Check(record, IsValidUTF8(file.path.c_str()));
  }
  MediaKind kind;
  mediaparserd::ClassifyContainer(container, &kind);
  _VIDEO_METADATA_ video = mediaparserd::VideoMetadataOf(container);
  if (video.rotation % 90 != 0 || video.rotation < 0 || video.rotation > 270) {
    Fail("rotation", "metadata");
  }
  if (video.parWidth <= 0 || video.parHeight <= 0) Fail("par", "metadata");
  return 0;
}

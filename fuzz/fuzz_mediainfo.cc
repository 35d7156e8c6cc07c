// Media records from outside data.
//
// Input layout: byte 0 chooses the target, the rest is its input.
//   even: the rest is JSON text, parsed with Json::Reader (exceptions of the
//         parser itself are caught here); MediaInfoJson2Object and
//         VideoMetadataJson2Object must not throw, every text field must end
//         within its capacity, a text that was UTF-8 must stay UTF-8, and
//         writing the record and reading it back must give the same record.
//   odd:  the rest fills a media record byte for byte (fields need not be
//         terminated: MediaInfoValid tolerates that), bit 1 of byte 0 sets
//         all six UTF-16 flags. After MediaInfoValid every tag must be
//         terminated and free of control characters, the four tags without a
//         fallback must be valid UTF-8, and so must the title and album when
//         the path is.
// The host is the stand-in, with no settings directory: the code page is
// the fallback Latin-1, in which every byte converts.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include <json/json.h>

#include "quvaidx/mediainfo.h"
#include "quvaidx/text.h"
#include "util/hooks.h"

namespace {

[[noreturn]] void Fail(const char* what) {
  fprintf(stderr, "fuzz_mediainfo: %s\n", what);
  abort();
}

void DiscardLogLine(int, const char*) {}

bool Terminated(const char* field, size_t capacity) {
  return memchr(field, '\0', capacity) != nullptr;
}

void CheckTextMember(const Json::Value& in, const char* key, const char* field,
                     size_t capacity) {
  if (!Terminated(field, capacity)) Fail("text field not terminated");
  const Json::Value* member =
      in.isObject() ? in.find(key, key + strlen(key)) : nullptr;
  if (member == nullptr || !member->isString()) {
    if (field[0] != '\0') Fail("non-string member gave a text");
    return;
  }
  std::string text = member->asString();
  text.resize(strlen(text.c_str()));
  if (text.compare(0, strlen(field), field) != 0) Fail("text not a prefix");
  if (IsUnicodeString(text.c_str()) && !IsUnicodeString(field)) {
    Fail("UTF-8 text cut inside a character");
  }
}

void FuzzJson(const uint8_t* data, size_t size) {
  std::string text(reinterpret_cast<const char*>(data), size);
  Json::Value in;
  try {
    Json::Reader reader;
    reader.parse(text, in, true);
  } catch (...) {
    return;  // the parser's own nesting limit
  }
  Json::Value in_copy = in;
  __tag_QUVA_MEDIA_INFO record;
  MediaInfoJson2Object(in, record);
  CheckTextMember(in_copy, "szPath", record.szPath, sizeof(record.szPath));
  CheckTextMember(in_copy, "szTitle", record.szTitle, sizeof(record.szTitle));
  CheckTextMember(in_copy, "szExposure", record.szExposure,
                  sizeof(record.szExposure));
  CheckTextMember(in_copy, "szFsUUID", record.szFsUUID,
                  sizeof(record.szFsUUID));

  Json::Value out;
  MediaInfoObject2Json(record, out);
  if (out.size() != 47) Fail("JSON form without 47 members");
  __tag_QUVA_MEDIA_INFO again;
  MediaInfoJson2Object(out, again);
  // duration may be NaN only if it came from bytes; from JSON it is finite.
  if (memcmp(&record, &again, sizeof(record)) != 0) Fail("round trip differs");

  _VIDEO_METADATA_ metadata;
  VideoMetadataJson2Object(in_copy, metadata);
  Json::Value metadata_json;
  VideoMetadataObject2Json(metadata, metadata_json);
  _VIDEO_METADATA_ metadata_again;
  VideoMetadataJson2Object(metadata_json, metadata_again);
  if (memcmp(&metadata, &metadata_again, sizeof(metadata)) != 0) {
    Fail("metadata round trip differs");
  }
}

bool StrictUTF8(const char* field, size_t capacity) {
  std::string text(field, strnlen(field, capacity));
  return TryUTF8ToUTF16(text.c_str()) == 1;
}

void FuzzValid(uint8_t flags, const uint8_t* data, size_t size) {
  __tag_QUVA_MEDIA_INFO record;
  memset(&record, 0, sizeof(record));
  memcpy(&record, data, size < sizeof(record) ? size : sizeof(record));
  int utf16 = (flags & 2) != 0 ? 1 : 0;
  record.blTitleUTF16 = record.blArtistUTF16 = record.blAlbumUTF16 = utf16;
  record.blGenreUTF16 = record.blComposerUTF16 = record.blCommentUTF16 = utf16;
  bool path_utf8 = StrictUTF8(record.szPath, sizeof(record.szPath));

  MediaInfoValid(&record);

  const char* tags[] = {record.szTitle,      record.szArtist, record.szComposer,
                        record.szComment,    record.szAlbum,  record.szGenre,
                        record.szAlbumArtist};
  for (const char* tag : tags) {
    if (!Terminated(tag, kMediaTagSize)) Fail("tag not terminated");
    for (const char* p = tag; *p != '\0'; ++p) {
      if (static_cast<unsigned char>(*p) < 32) Fail("control character left");
    }
  }
  for (const char* tag :
       {record.szArtist, record.szComposer, record.szComment, record.szGenre}) {
    if (!StrictUTF8(tag, kMediaTagSize)) Fail("tag not UTF-8");
  }
  if (path_utf8 && (!StrictUTF8(record.szTitle, kMediaTagSize) ||
                    !StrictUTF8(record.szAlbum, kMediaTagSize))) {
    Fail("fallback from a UTF-8 path not UTF-8");
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  quvaidx::SetLogSink(DiscardLogLine);
  setenv("QUVA_HOST_ETC", "/nonexistent-quvaidx-fuzz", 1);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1 || size > 64 * 1024) return 0;
  if ((data[0] & 1) == 0) {
    FuzzJson(data + 1, size - 1);
  } else {
    FuzzValid(data[0], data + 1, size - 1);
  }
  return 0;
}

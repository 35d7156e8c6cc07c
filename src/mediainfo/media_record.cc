// The media record's layout, its field table, and the conversions between
// records and their JSON form.
#include <stddef.h>
#include <string.h>

#include <type_traits>

#include "mediainfo/media_fields.h"
#include "quvaidx/mediainfo.h"
#include "util/json_read.h"

// The record crosses process and library boundaries by pointer: its layout
// must never move.
static_assert(std::is_standard_layout_v<__tag_QUVA_MEDIA_INFO>);
static_assert(std::is_trivially_copyable_v<__tag_QUVA_MEDIA_INFO>);
static_assert(sizeof(float) == 4 && sizeof(double) == 8);
static_assert(sizeof(__tag_QUVA_MEDIA_INFO) == 11712);
static_assert(alignof(__tag_QUVA_MEDIA_INFO) == 8);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, ID) == 0);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szPath) == 4);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szName) == 4100);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szDesc) == 4355);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, track) == 8452);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, disc) == 8456);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, year) == 8460);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szTitle) == 8464);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szAlbum) == 8719);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szArtist) == 8974);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szAlbumArtist) == 9229);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szGenre) == 9484);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szComposer) == 9739);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szComment) == 9994);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szMake) == 10249);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szModel) == 10349);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szExposure) == 10449);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szAperture) == 10469);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szTakenTime) == 10489);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szDate) == 10521);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szMDate) == 10553);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, duration) == 10588);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, audio_bitrate) == 10592);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, frame_bitrate) == 10596);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, video_bitrate) == 10600);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, frame_rate_num) == 10604);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, frame_rate_den) == 10608);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, frequency) == 10612);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, channel) == 10616);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, resolutionX) == 10620);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, resolutionY) == 10624);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, fileSize) == 10632);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, song_count) == 10640);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blTitleUTF16) == 10644);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blArtistUTF16) == 10648);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blAlbumUTF16) == 10652);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blGenreUTF16) == 10656);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blComposerUTF16) == 10660);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, blCommentUTF16) == 10664);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, coverCount) == 10668);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, iso) == 10672);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szVideoCodec) == 10676);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szContainerType) == 10931);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, videoProfile) == 11188);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, videoLevel) == 11192);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szAudioCodec) == 11196);
static_assert(offsetof(__tag_QUVA_MEDIA_INFO, szFsUUID) == 11451);
static_assert(sizeof(_VIDEO_METADATA_) == 12);
static_assert(offsetof(_VIDEO_METADATA_, parWidth) == 4);
static_assert(offsetof(_VIDEO_METADATA_, parHeight) == 8);
static_assert(sizeof(Resolution) == 8);
static_assert(offsetof(Resolution, height) == 4);

namespace quvaidx {
namespace {

using Rec = __tag_QUVA_MEDIA_INFO;

// A table entry; a text field's capacity is its array's extent.
template <typename Member>
constexpr MediaField Entry(const char* name, FieldKind kind, size_t offset) {
  if constexpr (std::is_array_v<Member>) {
    return {name, kind, offset, std::extent_v<Member>};
  } else {
    return {name, kind, offset, 0};
  }
}

#define FIELD(member, kind) \
  Entry<decltype(Rec::member)>(#member, FieldKind::kind, offsetof(Rec, member))

}  // namespace

const MediaField kMediaFields[kMediaFieldCount] = {
    FIELD(ID, kId),
    FIELD(szPath, kText),
    FIELD(szName, kText),
    FIELD(szDesc, kText),
    FIELD(track, kInt32),
    FIELD(disc, kInt32),
    FIELD(year, kInt32),
    FIELD(szTitle, kText),
    FIELD(szAlbum, kText),
    FIELD(szArtist, kText),
    FIELD(szAlbumArtist, kText),
    FIELD(szGenre, kText),
    FIELD(szComposer, kText),
    FIELD(szComment, kText),
    FIELD(szMake, kText),
    FIELD(szModel, kText),
    FIELD(szExposure, kText),
    FIELD(szAperture, kText),
    FIELD(szTakenTime, kText),
    FIELD(szDate, kText),
    FIELD(szMDate, kText),
    FIELD(duration, kFloat),
    FIELD(audio_bitrate, kUInt32),
    FIELD(frame_bitrate, kUInt32),
    FIELD(video_bitrate, kUInt32),
    FIELD(frame_rate_num, kInt32),
    FIELD(frame_rate_den, kInt32),
    FIELD(frequency, kInt32),
    FIELD(channel, kInt32),
    FIELD(resolutionX, kInt32),
    FIELD(resolutionY, kInt32),
    FIELD(fileSize, kUInt64),
    FIELD(song_count, kInt32),
    FIELD(blTitleUTF16, kInt32),
    FIELD(blArtistUTF16, kInt32),
    FIELD(blAlbumUTF16, kInt32),
    FIELD(blGenreUTF16, kInt32),
    FIELD(blComposerUTF16, kInt32),
    FIELD(blCommentUTF16, kInt32),
    FIELD(coverCount, kInt32),
    FIELD(iso, kInt32),
    FIELD(szVideoCodec, kText),
    FIELD(szContainerType, kText),
    FIELD(videoProfile, kInt32),
    FIELD(videoLevel, kInt32),
    FIELD(szAudioCodec, kText),
    FIELD(szFsUUID, kText),
};

#undef FIELD

}  // namespace quvaidx

using quvaidx::FieldAddress;
using quvaidx::FieldKind;
using quvaidx::MediaField;

namespace {

void WriteRecord(__tag_QUVA_MEDIA_INFO& record, Json::Value& object) {
  for (const MediaField& field : quvaidx::kMediaFields) {
    const char* at = FieldAddress(record, field);
    Json::Value& member = object[field.name];
    switch (field.kind) {
      case FieldKind::kText:
        member = Json::Value(at, at + strnlen(at, field.capacity));
        break;
      case FieldKind::kInt32: {
        int32_t v;
        memcpy(&v, at, sizeof(v));
        member = Json::Value(static_cast<Json::Int>(v));
        break;
      }
      case FieldKind::kUInt32:
      case FieldKind::kId: {
        uint32_t v;
        memcpy(&v, at, sizeof(v));
        member = Json::Value(static_cast<Json::UInt>(v));
        break;
      }
      case FieldKind::kUInt64: {
        uint64_t v;
        memcpy(&v, at, sizeof(v));
        member = Json::Value(static_cast<Json::UInt64>(v));
        break;
      }
      case FieldKind::kFloat: {
        float v;
        memcpy(&v, at, sizeof(v));
        member = Json::Value(static_cast<double>(v));
        break;
      }
    }
  }
}

void ReadRecord(Json::Value& in, __tag_QUVA_MEDIA_INFO& record) {
  for (const MediaField& field : quvaidx::kMediaFields) {
    const Json::Value& member = quvaidx::MemberAdding(in, field.name);
    char* at = FieldAddress(record, field);
    switch (field.kind) {
      case FieldKind::kText:
        quvaidx::ReadText(member, at, field.capacity);
        break;
      case FieldKind::kInt32: {
        int32_t v = quvaidx::ReadInt32(member);
        memcpy(at, &v, sizeof(v));
        break;
      }
      case FieldKind::kUInt32:
      case FieldKind::kId: {
        uint32_t v = quvaidx::ReadUInt32(member);
        memcpy(at, &v, sizeof(v));
        break;
      }
      case FieldKind::kUInt64: {
        uint64_t v = quvaidx::ReadUInt64(member);
        memcpy(at, &v, sizeof(v));
        break;
      }
      case FieldKind::kFloat: {
        float v = quvaidx::ReadFloat(member);
        memcpy(at, &v, sizeof(v));
        break;
      }
    }
  }
}

}  // namespace

// The only exception left below is running out of memory inside jsoncpp;
// it must not leave the library either.

void MediaInfoObject2Json(__tag_QUVA_MEDIA_INFO& record, Json::Value& out) {
  try {
    Json::Value object(Json::objectValue);
    WriteRecord(record, object);
    out.swap(object);
  } catch (...) {
    // Out of memory: `out` keeps what it held.
  }
}

void MediaInfoJson2Object(Json::Value& in, __tag_QUVA_MEDIA_INFO& record) {
  memset(&record, 0, sizeof(record));
  try {
    ReadRecord(in, record);
  } catch (...) {
    // Out of memory: the fields not yet read stay zero.
  }
}

void VideoMetadataObject2Json(_VIDEO_METADATA_& metadata, Json::Value& out) {
  try {
    Json::Value object(Json::objectValue);
    object["rotation"] = Json::Value(static_cast<Json::Int>(metadata.rotation));
    Json::Value& par = object["par"];
    par = Json::Value(Json::objectValue);
    par["width"] = Json::Value(static_cast<Json::Int>(metadata.parWidth));
    par["height"] = Json::Value(static_cast<Json::Int>(metadata.parHeight));
    out.swap(object);
  } catch (...) {
    // Out of memory: `out` keeps what it held.
  }
}

void VideoMetadataJson2Object(Json::Value& in, _VIDEO_METADATA_& metadata) {
  metadata.rotation = 0;
  metadata.parWidth = 0;
  metadata.parHeight = 0;
  try {
    // The same non-const lookups as MediaInfoJson2Object; values that are
    // neither null nor objects are not indexed, since jsoncpp throws there.
    if (!in.isNull() && !in.isObject()) return;
    metadata.rotation = quvaidx::ReadInt32(in["rotation"]);
    Json::Value& par = in["par"];
    if (!par.isNull() && !par.isObject()) return;
    metadata.parWidth = quvaidx::ReadInt32(par["width"]);
    metadata.parHeight = quvaidx::ReadInt32(par["height"]);
  } catch (...) {
    // Out of memory: the fields not yet read stay zero.
  }
}

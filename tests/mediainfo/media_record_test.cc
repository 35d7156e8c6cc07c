// The media record's JSON form: round trips, 64-bit sizes, absent and
// mistyped members, texts too long for their fields, video metadata.
#include <string.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/mediainfo.h"

namespace {

Json::Value Parse(const char* text) {
  Json::Value value;
  EXPECT_TRUE(Json::Reader().parse(text, value)) << text;
  return value;
}

std::string Text(const Json::Value& value) {
  return Json::FastWriter().write(value);
}

__tag_QUVA_MEDIA_INFO FromJson(Json::Value in) {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0x5A, sizeof(r));  // every byte must be overwritten
  MediaInfoJson2Object(in, r);
  return r;
}

__tag_QUVA_MEDIA_INFO Zero() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  return r;
}

// Every member set to something other than zero, unsigned values above
// INT32_MAX, a size above 4 GiB, non-ASCII texts.
const char kFull[] = R"({"ID": 4000000000, "szPath": "/share/A/01 song.mp3",
  "szName": "01 song.mp3", "szDesc": "d", "track": 1, "disc": -2, "year": 1999,
  "szTitle": "Песня", "szAlbum": "专辑", "szArtist": "a 🎵", "szAlbumArtist": "aa",
  "szGenre": "g", "szComposer": "c", "szComment": "100% fine", "szMake": "m",
  "szModel": "mo", "szExposure": "1/250", "szAperture": "f/2.8",
  "szTakenTime": "2020:01:02 03:04:05", "szDate": "2020-01-02",
  "szMDate": "2021-01-02", "duration": 1.5, "audio_bitrate": 320000,
  "frame_bitrate": 4000000000, "video_bitrate": 5000000, "frame_rate_num": 30000,
  "frame_rate_den": 1001, "frequency": 44100, "channel": 2, "resolutionX": 1920,
  "resolutionY": 1080, "fileSize": 1099511627783, "song_count": 12,
  "blTitleUTF16": 1, "blArtistUTF16": 2, "blAlbumUTF16": 3, "blGenreUTF16": 4,
  "blComposerUTF16": 5, "blCommentUTF16": -1, "coverCount": 3, "iso": 400,
  "szVideoCodec": "h264", "szContainerType": "mp4", "videoProfile": 100,
  "videoLevel": 41, "szAudioCodec": "aac", "szFsUUID": "1234-abcd"})";

TEST(MediaRecordTest, LayoutIsTheBinaryInterface) {
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO), 11712u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szPath), 4096u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szExposure), 20u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::fileSize), 8u);
  EXPECT_EQ(sizeof(_VIDEO_METADATA_), 12u);
  EXPECT_EQ(sizeof(Resolution), 8u);
}

// Compared as text, so a flag written as a boolean or a real written as an
// integer shows; the stale member must go.
TEST(MediaRecordTest, RoundTripKeepsEveryMemberAndItsType) {
  const Json::Value in = Parse(kFull);
  ASSERT_EQ(in.size(), 47u);
  __tag_QUVA_MEDIA_INFO r = FromJson(in);
  Json::Value out(Json::objectValue);
  out["stale"] = 1;
  MediaInfoObject2Json(r, out);
  EXPECT_EQ(out.size(), 47u);
  for (const std::string& name : in.getMemberNames()) {
    EXPECT_EQ(Text(out[name]), Text(in[name])) << name;
  }
  __tag_QUVA_MEDIA_INFO back = FromJson(out);
  EXPECT_EQ(memcmp(&r, &back, sizeof(r)), 0);
  Json::Value scalar = "text";
  MediaInfoObject2Json(r, scalar);
  EXPECT_EQ(scalar.size(), 47u);
}

TEST(MediaRecordTest, SizesOf4GiBAndMoreSurvive) {
  for (uint64_t size : {uint64_t{1} << 32, UINT64_MAX}) {
    __tag_QUVA_MEDIA_INFO r = Zero();
    r.fileSize = size;
    Json::Value json;
    MediaInfoObject2Json(r, json);
    EXPECT_TRUE(json["fileSize"].isUInt64());
    EXPECT_EQ(FromJson(json).fileSize, size);
  }
}

// Absent members read as zero (and are added to the input as null); values
// of another numeric type that fit are read.
TEST(MediaRecordTest, AbsentMembersAreZeroAndFittingValuesAreRead) {
  Json::Value in = Parse(R"({"track": 3.9, "ID": 4294967295, "duration": 2,
      "year": -2147483648, "blTitleUTF16": true, "extra": "ignored"})");
  __tag_QUVA_MEDIA_INFO expected = Zero();
  expected.track = 3;  // cut toward zero
  expected.ID = 4294967295u;
  expected.duration = 2.0f;
  expected.year = INT32_MIN;
  expected.blTitleUTF16 = 1;
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0x5A, sizeof(r));
  MediaInfoJson2Object(in, r);
  EXPECT_EQ(memcmp(&r, &expected, sizeof(r)), 0);
  EXPECT_EQ(in.size(), 48u);
  EXPECT_TRUE(in["szPath"].isNull());
}

// Every mistyped or out-of-range member converts to 0 (or an empty text)
// instead of throwing out of the library.
TEST(MediaRecordTest, MistypedMembersConvertToZeroWithoutThrowing) {
  const Json::Value object = Parse(R"({"a": 1})");
  const std::pair<const char*, Json::Value> cases[] = {
      {"track", "12"},
      {"year", object},
      {"disc", Parse("[1]")},
      {"ID", -1},
      {"audio_bitrate", -0.5},
      {"video_bitrate", Json::UInt64{1} << 32},
      {"resolutionX", Json::Int64{1} << 31},
      {"resolutionY", -(Json::Int64{1} << 31) - 1},
      {"channel", 3e10},
      {"fileSize", -5},
      {"fileSize", 1e20},
      {"fileSize", "4294967301"},
      {"duration", "1.5"},
      {"duration", 1e300},
      {"blTitleUTF16", "yes"},
      {"szTitle", 5},
      {"szAlbum", object},
      {"szPath", true}};
  const __tag_QUVA_MEDIA_INFO zero = Zero();
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.first) + " = " + Text(c.second));
    Json::Value in(Json::objectValue);
    in[c.first] = c.second;
    __tag_QUVA_MEDIA_INFO r;
    ASSERT_NO_THROW(MediaInfoJson2Object(in, r));
    EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0);
  }
  for (Json::Value in : {Json::Value("text"), Json::Value(Json::arrayValue)}) {
    const Json::Value copy = in;
    __tag_QUVA_MEDIA_INFO r;
    ASSERT_NO_THROW(MediaInfoJson2Object(in, r));
    EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0);
    EXPECT_EQ(in, copy);  // not turned into an object
  }
}

// A text too long for its field is cut to capacity - 1 bytes, moved back to
// a character boundary when the text is UTF-8.
TEST(MediaRecordTest, LongTextsAreCutAtCharacterBoundaries) {
  const std::pair<std::string, size_t> cases[] = {
      {"a", 254},
      {"\xD0\x96", 254},          // Ж
      {"\xE4\xB8\xAD", 252},      // 中
      {"\xF0\x9F\x8E\xB5", 252},  // 🎵
      {"x\xD0\x96", 253},         // odd offset
      {"\xFF\xD0", 254}};         // not UTF-8: plain byte cut
  for (const auto& c : cases) {
    std::string text;
    while (text.size() < 400) text += c.first;
    SCOPED_TRACE(text.substr(0, 8));
    Json::Value in(Json::objectValue);
    in["szTitle"] = text;
    in["szExposure"] = text;
    __tag_QUVA_MEDIA_INFO r = FromJson(in);
    EXPECT_EQ(std::string(r.szTitle), text.substr(0, c.second));
    EXPECT_LE(strlen(r.szExposure), 19u);
    EXPECT_EQ(text.compare(0, strlen(r.szExposure), r.szExposure), 0);
  }
}

TEST(VideoMetadataTest, RoundTripAndMistypedMembers) {
  _VIDEO_METADATA_ m = {90, 16, -9};
  Json::Value json;
  VideoMetadataObject2Json(m, json);
  EXPECT_EQ(Text(json),
            "{\"par\":{\"height\":-9,\"width\":16},\"rotation\":90}\n");
  _VIDEO_METADATA_ back = {1, 1, 1};
  VideoMetadataJson2Object(json, back);
  EXPECT_EQ(memcmp(&back, &m, sizeof(m)), 0);
  for (const char* text :
       {R"({"rotation": 90})", R"({"rotation": 90, "par": "16:9"})",
        R"({"rotation": 90, "par": [16, 9]})",
        R"({"rotation": 90, "par": {"width": "16", "height": -1e12}})", "[]"}) {
    SCOPED_TRACE(text);
    Json::Value in = Parse(text);
    _VIDEO_METADATA_ got = {1, 1, 1};
    ASSERT_NO_THROW(VideoMetadataJson2Object(in, got));
    EXPECT_EQ(got.rotation, text[0] == '[' ? 0 : 90);
    EXPECT_EQ(got.parWidth, 0);
    EXPECT_EQ(got.parHeight, 0);
  }
}

}  // namespace

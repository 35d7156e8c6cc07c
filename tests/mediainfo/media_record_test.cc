// The media record's JSON form: round trips, 64-bit sizes, absent and
// mistyped members, texts too long for their fields, video metadata.
#include <string.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/mediainfo.h"

namespace {

// A record with every field set to something other than zero.
__tag_QUVA_MEDIA_INFO FullRecord() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  r.ID = 4000000000u;
  strcpy(r.szPath, "/share/music/Album X/01 song.mp3");
  strcpy(r.szName, "01 song.mp3");
  strcpy(r.szDesc, "a description");
  r.track = 1;
  r.disc = -2;
  r.year = 1999;
  strcpy(r.szTitle, "Песня");
  strcpy(r.szAlbum, "专辑");
  strcpy(r.szArtist, "artist \xF0\x9F\x8E\xB5");
  strcpy(r.szAlbumArtist, "album artist");
  strcpy(r.szGenre, "genre");
  strcpy(r.szComposer, "composer");
  strcpy(r.szComment, "100% fine");
  strcpy(r.szMake, "make");
  strcpy(r.szModel, "model");
  strcpy(r.szExposure, "1/250");
  strcpy(r.szAperture, "f/2.8");
  strcpy(r.szTakenTime, "2020:01:02 03:04:05");
  strcpy(r.szDate, "2020-01-02");
  strcpy(r.szMDate, "2021-01-02");
  r.duration = 123.456f;
  r.audio_bitrate = 320000;
  r.frame_bitrate = 4000000000u;
  r.video_bitrate = 5000000;
  r.frame_rate_num = 30000;
  r.frame_rate_den = 1001;
  r.frequency = 44100;
  r.channel = 2;
  r.resolutionX = 1920;
  r.resolutionY = 1080;
  r.fileSize = (uint64_t{1} << 40) + 7;
  r.song_count = 12;
  r.blTitleUTF16 = 1;
  r.blArtistUTF16 = 2;
  r.blAlbumUTF16 = 3;
  r.blGenreUTF16 = 4;
  r.blComposerUTF16 = 5;
  r.blCommentUTF16 = -1;
  r.coverCount = 3;
  r.iso = 400;
  strcpy(r.szVideoCodec, "h264");
  strcpy(r.szContainerType, "mp4");
  r.videoProfile = 100;
  r.videoLevel = 41;
  strcpy(r.szAudioCodec, "aac");
  strcpy(r.szFsUUID, "1234-abcd");
  return r;
}

__tag_QUVA_MEDIA_INFO FromJson(Json::Value in) {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0x5A, sizeof(r));  // every byte must be overwritten
  MediaInfoJson2Object(in, r);
  return r;
}

TEST(MediaRecordTest, LayoutIsTheBinaryInterface) {
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO), 11712u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szPath), 4096u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szMake), 100u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szExposure), 20u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::szMDate), 32u);
  EXPECT_EQ(sizeof(__tag_QUVA_MEDIA_INFO::fileSize), 8u);
  EXPECT_EQ(sizeof(_VIDEO_METADATA_), 12u);
  EXPECT_EQ(sizeof(Resolution), 8u);
}

TEST(MediaRecordTest, RoundTripKeepsEveryField) {
  __tag_QUVA_MEDIA_INFO original = FullRecord();
  Json::Value json;
  MediaInfoObject2Json(original, json);
  EXPECT_EQ(json.size(), 47u);
  __tag_QUVA_MEDIA_INFO back = FromJson(json);
  EXPECT_EQ(memcmp(&original, &back, sizeof(back)), 0);
}

TEST(MediaRecordTest, BytesAfterTheTerminatorAreNotCarried) {
  __tag_QUVA_MEDIA_INFO original = FullRecord();
  memcpy(original.szTitle, "A\0B\0", 4);  // UTF-16LE "AB"
  Json::Value json;
  MediaInfoObject2Json(original, json);
  EXPECT_EQ(json["szTitle"].asString(), "A");
  EXPECT_EQ(json["blTitleUTF16"], 1);
  EXPECT_STREQ(FromJson(json).szTitle, "A");
  EXPECT_EQ(FromJson(json).szTitle[2], '\0');
}

TEST(MediaRecordTest, SizesOf4GiBAndMoreSurvive) {
  for (uint64_t size :
       {uint64_t{1} << 32, (uint64_t{1} << 32) + 5, UINT64_MAX}) {
    __tag_QUVA_MEDIA_INFO r = FullRecord();
    r.fileSize = size;
    Json::Value json;
    MediaInfoObject2Json(r, json);
    EXPECT_TRUE(json["fileSize"].isUInt64());
    EXPECT_EQ(FromJson(json).fileSize, size);
  }
}

TEST(MediaRecordTest, FlagsAreIntegersNotBooleans) {
  __tag_QUVA_MEDIA_INFO r = FullRecord();
  Json::Value json;
  MediaInfoObject2Json(r, json);
  EXPECT_TRUE(json["blTitleUTF16"].isInt());
  EXPECT_FALSE(json["blTitleUTF16"].isBool());
  EXPECT_TRUE(json["duration"].isDouble());
}

TEST(MediaRecordTest, WritingReplacesWhatTheValueHeld) {
  __tag_QUVA_MEDIA_INFO r = FullRecord();
  Json::Value json(Json::objectValue);
  json["stale"] = 1;
  MediaInfoObject2Json(r, json);
  EXPECT_FALSE(json.isMember("stale"));
  EXPECT_EQ(json.size(), 47u);
  Json::Value scalar = "text";
  MediaInfoObject2Json(r, scalar);
  EXPECT_EQ(scalar.size(), 47u);
}

TEST(MediaRecordTest, AbsentMembersReadAsZeroAndAreAddedAsNull) {
  Json::Value in(Json::objectValue);
  in["track"] = 7;
  in["extra"] = "ignored";
  __tag_QUVA_MEDIA_INFO r = FromJson(in);
  __tag_QUVA_MEDIA_INFO expected;
  memset(&expected, 0, sizeof(expected));
  expected.track = 7;
  EXPECT_EQ(memcmp(&r, &expected, sizeof(r)), 0);
  MediaInfoJson2Object(in, r);
  EXPECT_EQ(in.size(), 48u);
  EXPECT_TRUE(in["year"].isNull());
}

// Every mistyped or out-of-range member converts to 0 (or an empty text)
// instead of throwing out of the library.
struct MistypedCase {
  const char* fault;
  const char* key;
  Json::Value value;
};

TEST(MediaRecordTest, MistypedMembersConvertToZeroWithoutThrowing) {
  Json::Value object(Json::objectValue);
  object["a"] = 1;
  Json::Value array(Json::arrayValue);
  array.append(1);
  const MistypedCase cases[] = {
      {"StringForSigned", "track", "12"},
      {"ObjectForSigned", "year", object},
      {"ArrayForSigned", "disc", array},
      {"NegativeForUnsigned", "ID", -1},
      {"NegativeRealForUnsigned", "audio_bitrate", -0.5},
      {"TooLargeForUnsigned32", "video_bitrate", Json::UInt64{1} << 32},
      {"TooLargeForSigned", "resolutionX", Json::Int64{1} << 31},
      {"TooSmallForSigned", "resolutionY", -(Json::Int64{1} << 31) - 1},
      {"RealTooLargeForSigned", "channel", 3e10},
      {"NegativeForFileSize", "fileSize", -5},
      {"RealTooLargeForFileSize", "fileSize", 1e20},
      {"StringForFileSize", "fileSize", "4294967301"},
      {"StringForFloat", "duration", "1.5"},
      {"RealTooLargeForFloat", "duration", 1e300},
      {"StringForFlag", "blTitleUTF16", "yes"},
  };
  for (const MistypedCase& c : cases) {
    SCOPED_TRACE(c.fault);
    Json::Value in(Json::objectValue);
    in[c.key] = c.value;
    __tag_QUVA_MEDIA_INFO r;
    ASSERT_NO_THROW(MediaInfoJson2Object(in, r));
    __tag_QUVA_MEDIA_INFO zero;
    memset(&zero, 0, sizeof(zero));
    EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0);
  }
}

TEST(MediaRecordTest, NonStringTextsBecomeEmpty) {
  Json::Value in(Json::objectValue);
  in["szTitle"] = 5;
  in["szAlbum"] = Json::Value(Json::objectValue);
  in["szPath"] = true;
  __tag_QUVA_MEDIA_INFO r = FromJson(in);
  EXPECT_STREQ(r.szTitle, "");
  EXPECT_STREQ(r.szAlbum, "");
  EXPECT_STREQ(r.szPath, "");
}

TEST(MediaRecordTest, InRangeValuesOfOtherNumericTypesAreRead) {
  Json::Value in(Json::objectValue);
  in["track"] = 3.9;                        // cut toward zero
  in["ID"] = Json::UInt{4294967295u};       // largest unsigned 32-bit
  in["year"] = Json::Int{-2147483647 - 1};  // smallest signed 32-bit
  in["blTitleUTF16"] = true;
  in["duration"] = 2;
  __tag_QUVA_MEDIA_INFO r = FromJson(in);
  EXPECT_EQ(r.track, 3);
  EXPECT_EQ(r.ID, 4294967295u);
  EXPECT_EQ(r.year, INT32_MIN);
  EXPECT_EQ(r.blTitleUTF16, 1);
  EXPECT_EQ(r.duration, 2.0f);
}

TEST(MediaRecordTest, InputThatIsNotAnObjectGivesAZeroRecordUntouched) {
  for (Json::Value in :
       {Json::Value("text"), Json::Value(3), Json::Value(Json::arrayValue)}) {
    Json::Value copy = in;
    __tag_QUVA_MEDIA_INFO r;
    ASSERT_NO_THROW(MediaInfoJson2Object(in, r));
    EXPECT_EQ(r.ID, 0u);
    EXPECT_STREQ(r.szPath, "");
    EXPECT_EQ(in, copy);
  }
}

// A text too long for its field is cut to capacity - 1 bytes, moved back to
// a character boundary when the text is UTF-8.
struct CutCase {
  const char* fault;
  std::string unit;  // repeated to overflow the field
  size_t expected_length;
};

TEST(MediaRecordTest, LongTextsAreCutAtCharacterBoundaries) {
  const CutCase cases[] = {
      {"AsciiCutAtCapacityLessOne", "a", 254},
      {"CyrillicTwoByteNotSplit", "\xD0\x96", 254},   // Ж
      {"CjkThreeByteNotSplit", "\xE4\xB8\xAD", 252},  // 中
      {"FourByteNotSplit", "\xF0\x9F\x8E\xB5", 252},  // 🎵
      {"OddOffsetCyrillic", "x\xD0\x96", 253},
      {"NotUtf8PlainByteCut", "\xFF\xD0", 254},
  };
  for (const CutCase& c : cases) {
    SCOPED_TRACE(c.fault);
    std::string text;
    while (text.size() < 400) text += c.unit;
    Json::Value in(Json::objectValue);
    in["szTitle"] = text;
    in["szExposure"] = text;
    __tag_QUVA_MEDIA_INFO r = FromJson(in);
    EXPECT_EQ(strlen(r.szTitle), c.expected_length);
    EXPECT_EQ(std::string(r.szTitle), text.substr(0, c.expected_length));
    EXPECT_LE(strlen(r.szExposure), 19u);
    EXPECT_EQ(text.compare(0, strlen(r.szExposure), r.szExposure), 0);
  }
}

TEST(MediaRecordTest, TextWithEmbeddedZeroEndsThere) {
  Json::Value in(Json::objectValue);
  in["szName"] = std::string("ab\0cd", 5);
  EXPECT_STREQ(FromJson(in).szName, "ab");
}

TEST(VideoMetadataTest, RoundTrip) {
  _VIDEO_METADATA_ m = {90, 16, -9};
  Json::Value json;
  VideoMetadataObject2Json(m, json);
  EXPECT_EQ(json["rotation"], 90);
  EXPECT_EQ(json["par"]["width"], 16);
  EXPECT_EQ(json["par"]["height"], -9);
  _VIDEO_METADATA_ back = {1, 1, 1};
  VideoMetadataJson2Object(json, back);
  EXPECT_EQ(back.rotation, 90);
  EXPECT_EQ(back.parWidth, 16);
  EXPECT_EQ(back.parHeight, -9);
}

TEST(VideoMetadataTest, MissingOrMistypedMembersGiveZero) {
  const char* texts[] = {
      R"({"rotation": 90})",                  // no "par"
      R"({"rotation": 90, "par": "16:9"})",   // "par" not an object
      R"({"rotation": 90, "par": [16, 9]})",  // "par" an array
      R"({"rotation": 90, "par": {"width": "16", "height": -1e12}})",
  };
  for (const char* text : texts) {
    SCOPED_TRACE(text);
    Json::Value in;
    ASSERT_TRUE(Json::Reader().parse(text, in));
    _VIDEO_METADATA_ m = {1, 1, 1};
    ASSERT_NO_THROW(VideoMetadataJson2Object(in, m));
    EXPECT_EQ(m.rotation, 90);
    EXPECT_EQ(m.parWidth, 0);
    EXPECT_EQ(m.parHeight, 0);
  }
  Json::Value array(Json::arrayValue);
  _VIDEO_METADATA_ m = {1, 1, 1};
  ASSERT_NO_THROW(VideoMetadataJson2Object(array, m));
  EXPECT_EQ(m.rotation, 0);
}

}  // namespace

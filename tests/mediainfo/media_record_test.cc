// The media record's JSON form (round trips, 64-bit sizes, absent and
// mistyped members, texts too long for their fields, video metadata) and its
// two dumps, on standard output and in the system log.
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include <iterator>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/mediainfo.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;

// The members in record (and dump) order.
std::vector<std::string> Fields() {
  std::istringstream list(
      "ID szPath szName szDesc track disc year szTitle szAlbum szArtist "
      "szAlbumArtist szGenre szComposer szComment szMake szModel szExposure "
      "szAperture szTakenTime szDate szMDate duration audio_bitrate "
      "frame_bitrate video_bitrate frame_rate_num frame_rate_den frequency "
      "channel resolutionX resolutionY fileSize song_count blTitleUTF16 "
      "blArtistUTF16 blAlbumUTF16 blGenreUTF16 blComposerUTF16 blCommentUTF16 "
      "coverCount iso szVideoCodec szContainerType videoProfile videoLevel "
      "szAudioCodec szFsUUID");
  return {std::istream_iterator<std::string>(list), {}};
}

bool IsText(const std::string& name) { return name.compare(0, 2, "sz") == 0; }

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

static_assert(sizeof(__tag_QUVA_MEDIA_INFO) == 11712 &&
                  sizeof(_VIDEO_METADATA_) == 12 && sizeof(Resolution) == 8,
              "the record layout is the binary interface");

// Every member distinct and non-zero: non-ASCII texts, unsigned values above
// INT32_MAX, negative ints, a size above 4 GiB. Compared as text, so a flag
// written as a boolean or a real written as an integer shows; the stale
// member must go.
TEST(MediaRecordTest, RoundTripKeepsEveryMemberAndItsType) {
  Json::Value in(Json::objectValue);
  int n = 0;
  for (const std::string& name : Fields()) {
    ++n;
    in[name] = IsText(name) ? Json::Value(std::to_string(n) + " é中🎵")
                            : Json::Value(n);
  }
  in["ID"] = in["frame_bitrate"] = 4000000000u;
  in["disc"] = -2;
  in["blCommentUTF16"] = -1;
  in["duration"] = 1.5;
  in["fileSize"] = Json::UInt64{1099511627783};
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
  for (uint64_t size : {uint64_t{1} << 32, UINT64_MAX}) {
    r.fileSize = size;
    MediaInfoObject2Json(r, out);
    EXPECT_TRUE(out["fileSize"].isUInt64());
    EXPECT_EQ(FromJson(out).fileSize, size);
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

// Every mistyped or out-of-range member, set alone, converts to 0 (or an
// empty text) instead of throwing out of the library.
TEST(MediaRecordTest, MistypedMembersConvertToZeroWithoutThrowing) {
  const __tag_QUVA_MEDIA_INFO zero = Zero();
  for (const char* cases :
       {R"({"track": "12", "year": {"a": 1}, "disc": [1], "ID": -1,
            "audio_bitrate": -0.5, "video_bitrate": 4294967296,
            "resolutionX": 2147483648, "resolutionY": -2147483649,
            "channel": 3e10, "fileSize": -5, "duration": "1.5",
            "blTitleUTF16": "yes", "szTitle": 5, "szAlbum": {"a": 1},
            "szPath": true})",
        R"({"fileSize": 1e20, "duration": 1e300})",
        R"({"fileSize": "4294967301"})"}) {
    const Json::Value all = Parse(cases);
    for (const std::string& name : all.getMemberNames()) {
      SCOPED_TRACE(name + " = " + Text(all[name]));
      Json::Value in(Json::objectValue);
      in[name] = all[name];
      __tag_QUVA_MEDIA_INFO r;
      ASSERT_NO_THROW(MediaInfoJson2Object(in, r));
      EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0);
    }
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
    in["szTitle"] = in["szExposure"] = text;
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

// The dump of a record with edge values and zeros elsewhere: one item per
// member, printed without a line feed, logged as one error line each
// whatever the level. Texts are values, never formats, and end at their
// field's capacity; fileSize prints in full.
TEST(MediaDumpTest, PrintAndSyslogWriteExactlyTheItems) {
  __tag_QUVA_MEDIA_INFO r = Zero();
  r.ID = r.video_bitrate = 4294967295u;
  r.track = -1;
  strcpy(r.szTitle, "Song");
  strcpy(r.szComment, "100%s %d %n");
  memset(r.szExposure, 'e', sizeof(r.szExposure));  // unterminated
  r.duration = 1.5f;
  r.fileSize = UINT64_MAX;
  const std::map<std::string, std::string> set = {
      {"ID", "4294967295"},
      {"video_bitrate", "4294967295"},
      {"track", "-1"},
      {"szTitle", "Song"},
      {"szComment", "100%s %d %n"},
      {"szExposure", std::string(20, 'e')},
      {"duration", "1.500000"},
      {"fileSize", "18446744073709551615"}};
  std::vector<std::string> items;
  for (const std::string& name : Fields()) {
    auto it = set.find(name);
    std::string value = it != set.end() ? it->second : IsText(name) ? "" : "0";
    char item[64];
    snprintf(item, sizeof(item), "%-16s= %s,", name.c_str(), value.c_str());
    items.push_back(item);
  }
  testing::internal::CaptureStdout();
  PrintMediaInfoObject(r);
  PrintMediaInfoObject(r);
  fflush(stdout);
  std::string all;
  for (const std::string& item : items) all += item;
  EXPECT_EQ(testing::internal::GetCapturedStdout(), all + all);
  LogCapture log(0);  // level 0: leveled lines would be dropped
  SyslogMediaInfoObject(r);
  ASSERT_EQ(log.lines().size(), items.size());
  std::vector<std::string> lines = log.Normalized();
  for (size_t i = 0; i < items.size(); ++i) {
    EXPECT_EQ(log.lines()[i].priority, LOG_ERR);
    EXPECT_EQ(lines[i], "quvaidx_mediainfo:N " + items[i]);
  }
  EXPECT_EQ(lines[0], "quvaidx_mediainfo:N ID              = 4294967295,");
  EXPECT_EQ(lines[42], "quvaidx_mediainfo:N szContainerType = ,");
}

}  // namespace

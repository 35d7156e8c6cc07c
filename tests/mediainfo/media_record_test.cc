// The media record's JSON form and its dumps to standard output and syslog.
#include <float.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include <map>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "mediainfo/media_fields.h"
#include "quvaidx/mediainfo.h"
#include "support/log_capture.h"

namespace {

using quvaidx::FieldKind;
using quvaidx::kMediaFields;

Json::Value Parse(const char* text) {
  Json::Value value;
  EXPECT_TRUE(Json::Reader().parse(text, value)) << text;
  return value;
}

std::string Text(const Json::Value& value) {
  return Json::FastWriter().write(value);
}

// The record a JSON value gives, every byte of it overwritten first.
__tag_QUVA_MEDIA_INFO FromJson(Json::Value& in, char fill = 0x5A) {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, fill, sizeof(r));
  MediaInfoJson2Object(in, r);
  return r;
}

__tag_QUVA_MEDIA_INFO Zero() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  return r;
}

// Every member distinct, non-ASCII, above INT32_MAX or 4 GiB, compared as
// text so a type change shows; stale members go, a non-object becomes one.
TEST(MediaRecordTest, RoundTripKeepsEveryMemberAndItsType) {
  Json::Value in(Json::objectValue);
  int n = 0;
  for (const auto& field : kMediaFields) {
    ++n;
    in[field.name] = field.kind == FieldKind::kText
                         ? Json::Value(std::to_string(n) + " é中🎵")
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
  EXPECT_EQ(Text(out), Text(in));
  __tag_QUVA_MEDIA_INFO back = FromJson(out, 0x33);
  EXPECT_EQ(memcmp(&r, &back, sizeof(r)), 0);
  Json::Value scalar = "text";
  MediaInfoObject2Json(r, scalar);
  EXPECT_EQ(Text(scalar), Text(in));
  for (uint64_t size : {uint64_t{1} << 32, UINT64_MAX}) {
    r.fileSize = size;
    MediaInfoObject2Json(r, out);
    EXPECT_TRUE(out["fileSize"].isUInt64());
    EXPECT_EQ(FromJson(out).fileSize, size);
  }
}

// Absent members read as zero (added to the input as null), fitting numbers
// of another type are read, mistyped or out-of-range ones read as zero.
TEST(MediaRecordTest, AbsentAndMistypedMembersAreZeroAndFittingOnesRead) {
  Json::Value in = Parse(R"({"track": 3.9, "ID": 4294967295,
      "duration": 3.4028234663852886e38, "year": -2147483648,
      "disc": -2147483648.0, "audio_bitrate": 4294967295.0,
      "fileSize": 1e19, "blTitleUTF16": true, "extra": "ignored"})");
  __tag_QUVA_MEDIA_INFO expected = Zero();
  expected.track = 3;  // cut toward zero
  expected.ID = expected.audio_bitrate = 4294967295u;
  expected.duration = FLT_MAX;
  expected.year = expected.disc = INT32_MIN;
  expected.fileSize = 10000000000000000000u;
  expected.blTitleUTF16 = 1;
  __tag_QUVA_MEDIA_INFO r = FromJson(in);
  EXPECT_EQ(memcmp(&r, &expected, sizeof(r)), 0);
  EXPECT_EQ(in.size(), 48u);
  EXPECT_TRUE(in["szPath"].isNull());
  const __tag_QUVA_MEDIA_INFO zero = Zero();
  const Json::Value all = Parse(
      R"({"track": "12", "year": {"a": 1}, "disc": [1], "ID": -1,
          "audio_bitrate": -0.5, "video_bitrate": 4294967296,
          "resolutionX": 2147483648, "resolutionY": -2147483649,
          "channel": 3e10, "fileSize": -5, "duration": "1.5",
          "blTitleUTF16": "yes", "szTitle": 5, "szAlbum": {"a": 1},
          "szPath": true, "song_count": 1e20, "frequency": -1e300,
          "szFsUUID": null})");
  for (const std::string& name : all.getMemberNames()) {
    Json::Value one(Json::objectValue);
    one[name] = all[name];
    ASSERT_NO_THROW(r = FromJson(one)) << name;
    EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0) << name << " = " << all[name];
  }
  for (const char* text :
       {R"({"fileSize": 1e20, "duration": 1e300})",
        R"({"fileSize": "4294967301"})", R"("text")", "[1]"}) {
    const Json::Value value = Parse(text);
    in = value;
    ASSERT_NO_THROW(r = FromJson(in)) << text;
    EXPECT_EQ(memcmp(&r, &zero, sizeof(r)), 0) << text;
    EXPECT_TRUE(value.isObject() || in == value) << text;
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
  for (const auto& [unit, length] : cases) {
    std::string text;
    while (text.size() < 400) text += unit;
    Json::Value in(Json::objectValue);
    in["szTitle"] = in["szExposure"] = text;
    __tag_QUVA_MEDIA_INFO r = FromJson(in);
    EXPECT_EQ(std::string(r.szTitle), text.substr(0, length)) << length;
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
    Json::Value in = Parse(text);
    _VIDEO_METADATA_ got = {1, 1, 1};
    ASSERT_NO_THROW(VideoMetadataJson2Object(in, got));
    EXPECT_EQ(got.rotation, text[0] == '[' ? 0 : 90) << text;
    EXPECT_EQ(got.parWidth, 0) << text;
    EXPECT_EQ(got.parHeight, 0) << text;
  }
}

// One item per member, printed without line feeds, logged as error lines at
// any level; texts are never formats and end at their capacity.
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
  std::string all;
  for (const auto& field : kMediaFields) {
    auto it = set.find(field.name);
    char item[64];
    snprintf(item, sizeof(item), "%-16s= %s,", field.name,
             it != set.end()                  ? it->second.c_str()
             : field.kind == FieldKind::kText ? ""
                                              : "0");
    all += items.emplace_back(item);
  }
  testing::internal::CaptureStdout();
  PrintMediaInfoObject(r);
  PrintMediaInfoObject(r);
  fflush(stdout);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), all + all);
  quvaidx::test::LogCapture log(0);  // level 0: leveled lines would be dropped
  SyslogMediaInfoObject(r);
  ASSERT_EQ(log.lines().size(), items.size());
  for (size_t i = 0; i < items.size(); ++i) {
    EXPECT_EQ(log.lines()[i].priority, LOG_ERR);
    EXPECT_EQ(log.Normalized()[i], "quvaidx_mediainfo:N " + items[i]);
  }
  EXPECT_EQ(items[0], "ID              = 4294967295,");
  EXPECT_EQ(items[42], "szContainerType = ,");
}

}  // namespace

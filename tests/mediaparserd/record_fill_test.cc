// The glue from the libraries' results to the record, with values no file
// on disk needs to produce.
#include "record_fill.h"

#include <float.h>
#include <math.h>
#include <string.h>

#include <limits>
#include <string>

#include <gtest/gtest.h>

#include "media_test_util.h"

namespace mediaparserd::test {
namespace {

using Type = StreamFacts::Type;
using Encoding = TagText::Encoding;
constexpr MediaKind kMusic = MediaKind::kMusic;
constexpr MediaKind kVideo = MediaKind::kVideo;
constexpr MediaKind kPhoto = MediaKind::kPhoto;
constexpr int64_t kMax64 = std::numeric_limits<int64_t>::max();

// A container of `format` whose streams are named by letter: a audio (aac),
// v video (h264), c cover, o other.
ContainerFacts Container(const std::string& format, const std::string& kinds) {
  ContainerFacts container;
  container.format = format;
  for (char k : kinds) {
    StreamFacts stream;
    stream.type = k == 'a'   ? Type::kAudio
                  : k == 'v' ? Type::kVideo
                  : k == 'c' ? Type::kCover
                             : Type::kOther;
    stream.codec = k == 'a' ? "aac" : k == 'v' ? "h264" : "png";
    container.streams.push_back(stream);
  }
  return container;
}

// UTF-16LE code units of a UTF-8 literal's code points.
TagText UTF16(const std::u16string& text) {
  return {
      Encoding::kUTF16,
      std::string(reinterpret_cast<const char*>(text.data()), 2 * text.size())};
}

// Checks the record's members named in the JSON object `expected`.
void ExpectFields(__tag_QUVA_MEDIA_INFO r, const char* expected) {
  Json::Value all, want;
  MediaInfoObject2Json(r, all);
  ASSERT_TRUE(Json::Reader().parse(expected, want)) << expected;
  for (const std::string& name : want.getMemberNames()) {
    EXPECT_EQ(Json::FastWriter().write(all[name]),
              Json::FastWriter().write(want[name]))
        << name;
  }
}

// The record of "/music/Album X/01 song.mp3" (5 GiB), under UTF-8.
class RecordFillTest : public ::testing::Test {
 protected:
  RecordFillTest() {
    file_.path = "/music/Album X/01 song.mp3";
    file_.size = 5ull << 32;
  }

  __tag_QUVA_MEDIA_INFO Fill(MediaKind kind, const ContainerFacts& container,
                             const MusicTags* tags = nullptr,
                             const PhotoFacts* photo = nullptr) {
    __tag_QUVA_MEDIA_INFO record;
    memset(&record, 0x5A, sizeof(record));  // every field must be written
    FillRecord(kind, file_, container, tags, photo, &record);
    return record;
  }
  __tag_QUVA_MEDIA_INFO Fill(const MusicTags& tags) {
    return Fill(kMusic, ContainerFacts(), &tags);
  }
  __tag_QUVA_MEDIA_INFO Fill(const PhotoFacts& photo,
                             const ContainerFacts& container = {}) {
    return Fill(kPhoto, container, nullptr, &photo);
  }

  HostCodePage host_{"UTF-8"};
  FileFacts file_;
};

// A container is media when it has an audio or video stream, not a cover;
// the image formats but GIF, APNG and ICO go by one container name.
TEST_F(RecordFillTest, KindAndContainerNameComeFromTheStreams) {
  const struct {
    const char *format, *streams;
    bool media;
    MediaKind kind;
    const char* name;  // szContainerType
  } cases[] = {
      {"mp3", "acc", true, kMusic, "mp3"},
      {"mov,mp4,m4a,3gp,3g2,mj2", "av", true, kVideo,
       "mov,mp4,m4a,3gp,3g2,mj2"},
      {"matroska,webm", "va", true, kVideo, "matroska,webm"},
      {"jpeg_pipe", "v", true, kPhoto, "image2"},
      {"image2pipe", "v", true, kPhoto, "image2"},
      {"gif", "v", true, kPhoto, "gif"},
      {"apng", "v", true, kPhoto, "apng"},
      {"ico", "v", true, kPhoto, "ico"},
      {"matroska,webm", "o", false, kMusic, "matroska,webm"},
      {"png_pipe", "", false, kMusic, "image2"},
      {"mp3", "c", false, kMusic, "mp3"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.format) + " " + c.streams);
    MediaKind kind = kMusic;
    EXPECT_EQ(ClassifyContainer(Container(c.format, c.streams), &kind),
              c.media);
    if (c.media) {
      EXPECT_EQ(kind, c.kind);
    }
    EXPECT_STREQ(Fill(c.media ? c.kind : kMusic, Container(c.format, ""))
                     .szContainerType,
                 c.name);
  }
}

// Numbers beyond their field are bounded to it, names that are not UTF-8
// left out: a record never holds a wrapped number or bad text.
TEST_F(RecordFillTest, ValuesTheFieldsCannotHoldAreBoundedOrLeftOut) {
  ContainerFacts container = Container("mp\xFF", "av");
  container.streams[1].codec = "";
  file_.fs_uuid = "1234-\xC0\x80";
  container.duration = 1e300;
  container.bit_rate = int64_t{1} << 40;
  StreamFacts& audio = container.streams[0];
  audio.bit_rate = -5;
  audio.sample_rate = -44100;
  audio.channels = int64_t{1} << 33;
  audio.aac_object_type = int64_t{1} << 40;
  StreamFacts& video = container.streams[1];
  video.width = kMax64;
  video.height = -1;
  video.bit_rate = int64_t{1} << 32;
  video.profile = -99;
  video.level = std::numeric_limits<int64_t>::min();
  video.frame_rate_num = int64_t{1} << 35;
  video.frame_rate_den = 1;
  ExpectFields(Fill(kVideo, container), R"({"duration": 3.4028234663852886e38,
      "frame_bitrate": 4294967295, "audio_bitrate": 0, "frequency": 0,
      "video_bitrate": 4294967295, "channel": 2147483647, "resolutionY": 0,
      "szAudioCodec": "aac_invalid", "resolutionX": 2147483647,
      "videoProfile": -99, "videoLevel": -2147483648, "frame_rate_num": 0,
      "frame_rate_den": 0, "fileSize": 21474836480, "szContainerType": "",
      "szVideoCodec": "", "szFsUUID": ""})");
  container.streams[0].codec = "fl\xE9";
  video.frame_rate_num = 30000;
  video.frame_rate_den = int64_t{1} << 31;
  video.level = int64_t{1} << 31;
  ExpectFields(Fill(kVideo, container), R"({"szAudioCodec": "",
      "frame_rate_num": 0, "videoLevel": 2147483647})");
  video.frame_rate_num = video.frame_rate_den = INT32_MAX;  // as large as fits
  ExpectFields(
      Fill(kVideo, container),
      R"({"frame_rate_num": 2147483647, "frame_rate_den": 2147483647})");
  // Names are strict UTF-8 at every bound of its lead bytes, or left out.
  const std::pair<const char*, bool> names[] = {
      {"\xC2\x80", true},          {"\xDF\xBF", true},
      {"\xE0\xA0\x80", true},      {"\xEF\xBF\xBF", true},
      {"\xF0\x90\x80\x80", true},  {"\xF4\x8F\xBF\xBF", true},
      {"\xC1\xBF", false},         {"\xE0\x9F\xBF", false},
      {"\xED\xA0\x80", false},     {"\xF0\x8F\xBF\xBF", false},
      {"\xF4\x90\x80\x80", false}, {"\xF5\x80\x80\x80", false},
      {"a\xE2\x82", false},        {"\xC2\x41", false}};
  for (const auto& [name, valid] : names) {
    file_.fs_uuid = name;
    EXPECT_STREQ(Fill(kVideo, container).szFsUUID, valid ? name : "") << name;
  }
  for (double duration : {static_cast<double>(NAN), -3.0}) {
    container.duration = duration;
    EXPECT_EQ(Fill(kVideo, container).duration, 0.0f) << duration;
  }
  // AAC is named by its object type; any other type is "aac_invalid".
  const std::pair<int64_t, const char*> aac[] = {
      {2, "aac_lc"},          {5, "aac_he"},       {1, "aac_main"},
      {0, "aac_invalid"},     {-1, "aac_invalid"}, {10, "aac_invalid"},
      {kMax64, "aac_invalid"}};
  for (const auto& [type, name] : aac) {
    container = Container("", "a");
    container.streams[0].aac_object_type = type;
    EXPECT_STREQ(Fill(kMusic, container).szAudioCodec, name) << type;
  }
}

// A song's only stream is what the container's rate measures; covers are
// counted, no picture; without streams there are no technical fields.
TEST_F(RecordFillTest, SongTakesTheContainerRateAndCountsItsCovers) {
  ContainerFacts container = Container("flac", "acc");
  container.bit_rate = 171960;
  ExpectFields(Fill(kMusic, container), R"({"audio_bitrate": 171960,
      "frame_bitrate": 171960, "coverCount": 2, "resolutionX": 0,
      "szVideoCodec": "", "szName": "01 song.mp3"})");
  container.streams.push_back(Container("", "v").streams[0]);
  EXPECT_EQ(Fill(kVideo, container).audio_bitrate, 0u);
  ExpectFields(Fill(kMusic, Container("mp3", "")), R"({"duration": 0.0,
      "audio_bitrate": 0, "szAudioCodec": "", "szTitle": ""})");
}

// UTF-16 is converted, not read as bytes; long texts are cut before the
// character that does not fit, UTF-16 at 125 units without splitting a pair.
TEST_F(RecordFillTest, TagTextsArriveAsUTF8CutAtCharacterBoundaries) {
  std::string cyrillic;
  for (int i = 0; i < 200; ++i) cyrillic += "ж";  // two bytes each
  std::u16string faces;
  for (int i = 0; i < 100; ++i) faces += u"\U0001F600";
  MusicTags tags;
  tags.title = UTF16(u"Hello");
  tags.artist = UTF16(u"Привет");
  tags.album = UTF16(u"\U0001F600 emoji");
  tags.album_artist = UTF16(u"Zoë");
  tags.composer = UTF16(faces);
  tags.comment = UTF16(std::u16string(300, u'x'));
  tags.genre = {Encoding::kUTF8, cyrillic};
  __tag_QUVA_MEDIA_INFO r = Fill(tags);
  ExpectFields(r, R"({"szTitle": "Hello", "szArtist": "Привет",
      "szAlbum": "\ud83d\ude00 emoji", "szAlbumArtist": "Zoë", "blTitleUTF16": 1,
      "blArtistUTF16": 1, "blAlbumUTF16": 1, "blGenreUTF16": 0})");
  EXPECT_TRUE(IsValidUTF8(r.szComposer));
  EXPECT_EQ(strlen(r.szComposer), 62u * 4);  // 125 units: 62 pairs, no lead
  EXPECT_EQ(std::string(r.szComment), std::string(125, 'x'));
  EXPECT_EQ(strlen(r.szGenre), 254u);
  tags = MusicTags();
  tags.album_artist = {Encoding::kUTF8, "x" + cyrillic};
  tags.title = UTF16(std::u16string(u"ab\0cd", 5));
  r = Fill(tags);
  EXPECT_EQ(strlen(r.szAlbumArtist), 253u);
  EXPECT_TRUE(IsValidUTF8(r.szAlbumArtist));
  // Empty texts stay unflagged.
  ExpectFields(r,
               R"({"szTitle": "ab", "blTitleUTF16": 1, "blArtistUTF16": 0})");
  PhotoFacts photo;
  photo.model = cyrillic;
  EXPECT_EQ(strlen(Fill(photo).szModel), 98u);
}

// Undeclared tag bytes are decoded in the host's code page, a long text cut
// where a character ends (cut inside one, none of it would convert).
TEST_F(RecordFillTest, LegacyTagBytesAreReadInTheHostCodePage) {
  const std::string cp1251_hello = "\xCF\xF0\xE8\xE2\xE5\xF2";  // Привет
  const std::string gbk_hello = "\xC4\xE3\xBA\xC3";             // 你好
  // code page, bytes, title (after MediaInfoValid), album artist: what is
  // not valid in the code page makes the title the file's name.
  const std::tuple<const char*, std::string, const char*, const char*> cases[] =
      {{"windows-1251", cp1251_hello, "Привет", "Привет"},
       {"windows-936", gbk_hello, "你好", "你好"},
       {"UTF-8", cp1251_hello, "01 song", ""},
       {"UTF-8", "plain ASCII", "plain ASCII", "plain ASCII"}};
  for (const auto& [code_page, bytes, title, album_artist] : cases) {
    HostCodePage host(code_page);
    MusicTags tags;
    tags.title = tags.album_artist = {Encoding::kBytes, bytes};
    __tag_QUVA_MEDIA_INFO r = Fill(tags);
    EXPECT_STREQ(r.szTitle, title) << code_page;
    EXPECT_STREQ(r.szAlbumArtist, album_artist) << code_page;
    EXPECT_EQ(r.blTitleUTF16, 0);
  }
  // Lead bytes of each code page; one byte too long for a last character.
  const std::tuple<const char*, std::string, const char*> long_texts[] = {
      {"windows-936", "\xC4\xE3", "你"},
      {"windows-31j", "\x93\xFA", "日"},
      {"windows-31j", "\xE3\x81", "縺"},
      {"windows-950", "\xA7\x41", "你"},
      {"windows-949", "\xB0\xA1", "가"}};
  for (const auto& [code_page, character, utf8] : long_texts) {
    HostCodePage host(code_page);
    std::string text = "x";
    for (int i = 0; i < 150; ++i) text += character;
    MusicTags tags;
    tags.comment = {Encoding::kBytes, text};
    std::string comment = Fill(tags).szComment;
    ASSERT_GE(comment.size(), 1u + 3 * 80) << code_page;  // the host cuts
    EXPECT_EQ(comment.substr(0, 7), "x" + std::string(utf8) + utf8);
    EXPECT_TRUE(IsValidUTF8(comment)) << code_page;
  }
}

// The first tag of a key counts, whatever its letter case; numbers are
// their leading digits, bounded; "year" stands in for a missing "date".
TEST_F(RecordFillTest, ContainerTagsGiveTextsAndLeadingNumbers) {
  ContainerFacts container;
  container.tags = {{"title", "Clip"},      {"ARTIST", "Maker"},
                    {"album", "Album"},     {"genre", "Genre"},
                    {"composer", "Writer"}, {"comment", "Note"},
                    {"track", "3/12"},      {"disc", " 2"},
                    {"date", "20210501"},   {"album_artist", "Various"},
                    {"year", "1999"},       {"title", "ignored"}};
  ExpectFields(Fill(kVideo, container), R"({"szTitle": "Clip",
      "szArtist": "Maker", "szAlbum": "Album", "szGenre": "Genre",
      "szComposer": "Writer", "szComment": "Note", "szAlbumArtist": "Various",
      "track": 3, "disc": 2, "year": 2021})");
  container.tags = {
      {"track", "99999999999999999999"}, {"year", "1987-02"}, {"disc", "two"}};
  ExpectFields(Fill(kVideo, container),
               R"({"track": 999999999, "year": 1987, "disc": 0})");
  container.tags = {{"date", "-5"}};
  EXPECT_EQ(Fill(kVideo, container).year, 0);
}

// Exposure, aperture and dates as photographers write them; nonsense gives
// none.
TEST_F(RecordFillTest, PhotoFieldsAreReadAsPhotographersWriteThem) {
  const std::tuple<int64_t, int64_t, const char*, int64_t, int64_t, const char*>
      cases[] = {
          {1, 125, "1/125", 28, 10, "2.8"}, {10, 2500, "1/250", 4, 1, "4.0"},
          {1, 4, "1/4", 95, 100, "0.95"},   {3, 10, "0.3", 0, 1, ""},
          {25, 10, "2.5", 1, 0, ""},        {30, 1, "30", -28, 10, ""},
          {0, 1, "", kMax64, 1, ""},        {-1, 100, "", 28, -10, ""},
          {kMax64, 1, "", 1, 1, "1.0"},     {1, kMax64, "", 10, 1, "10.0"},
          {1, 0, "", 1, 2, "0.50"}};
  for (const auto& [exposure_num, exposure_den, exposure, f_num, f_den,
                    aperture] : cases) {
    PhotoFacts photo;
    photo.exposure_num = exposure_num;
    photo.exposure_den = exposure_den;
    photo.fnumber_num = f_num;
    photo.fnumber_den = f_den;
    EXPECT_STREQ(Fill(photo).szExposure, exposure)
        << exposure_num << "/" << exposure_den;
    EXPECT_STREQ(Fill(photo).szAperture, aperture) << f_num << "/" << f_den;
  }
  // Only a whole EXIF date and time is a taken time; blank dates are none.
  const std::pair<const char*, const char*> dates[] = {
      {"2021:05:01 12:34:56", "2021-05-01 12:34:56"},
      {"2021:05:01 12:34:56\n", "2021-05-01 12:34:56"},
      {"    :  :     :  :  ", ""},
      {"0000:00:00 00:00:00", ""},
      {"2021:05:01", ""},
      {"2021-05-01 12:34:56", ""},
      {"2021:05:01 12:34:5x", ""}};
  for (const auto& [exif, taken] : dates) {
    PhotoFacts photo;
    photo.taken = exif;
    EXPECT_STREQ(Fill(photo).szTakenTime, taken) << exif;
  }
  // Camera names unpadded, in the host's code page; negative sizes and ISO
  // none; a photo without a size takes its stream's, no duration or codec.
  HostCodePage host("windows-1251");
  PhotoFacts photo;
  photo.make = std::string("Canon\0\0", 7) + "   ";
  photo.model = "\xCA\xE8\xE5\xE2";  // Киев in windows-1251
  photo.width = 640;
  photo.height = -480;
  photo.iso = -100;
  ContainerFacts container = Container("qoi_pipe", "v");
  container.streams[0].width = 3;
  container.streams[0].height = 2;
  container.duration = 0.04;
  ExpectFields(Fill(photo, container), R"({"szMake": "Canon",
      "szModel": "Киев", "resolutionX": 3, "resolutionY": 2, "iso": 0,
      "duration": 0.0, "szVideoCodec": "", "szContainerType": "image2"})");
  photo.height = 480;
  photo.iso = 200;
  ExpectFields(Fill(photo, container),
               R"({"resolutionX": 640, "resolutionY": 480, "iso": 200})");
  ExpectFields(Fill(kPhoto, container),  // no EXIF at all
               R"({"resolutionX": 3, "szMake": ""})");
}

// A name the libraries give reaches the record only as strict UTF-8: the
// edges of each sequence length pass; overlong forms, surrogates, code
// points past U+10FFFF, stray or missing continuation bytes leave it out.
TEST_F(RecordFillTest, LibraryNamesPassOnlyAsStrictUTF8) {
  const std::pair<const char*, bool> names[] = {{"\xC2\x80", true},
                                                {"\xDF\xBF", true},
                                                {"\xE0\xA0\x80", true},
                                                {"\xED\x9F\xBF", true},
                                                {"\xEE\x80\x80", true},
                                                {"\xEF\xBF\xBF", true},
                                                {"\xF0\x90\x80\x80", true},
                                                {"\xF4\x8F\xBF\xBF", true},
                                                {"\xC1\xBF", false},
                                                {"\xE0\x9F\xBF", false},
                                                {"\xED\xA0\x80", false},
                                                {"\xF0\x8F\xBF\xBF", false},
                                                {"\xF4\x90\x80\x80", false},
                                                {"\xF5\x80\x80\x80", false},
                                                {"\x80", false},
                                                {"\xC2", false},
                                                {"\xE0\xA0", false},
                                                {"\xC2\xC0", false}};
  for (const auto& [name, valid] : names) {
    ContainerFacts container = Container("matroska,webm", "v");
    container.streams[0].codec = std::string("x") + name + "y";
    EXPECT_STREQ(Fill(kVideo, container).szVideoCodec,
                 valid ? container.streams[0].codec.c_str() : "")
        << container.streams[0].codec;
  }
  ContainerFacts cut = Container("matroska,webm", "v");
  cut.streams[0].codec = "x\xE0\xA0";  // ends inside a character
  EXPECT_STREQ(Fill(kVideo, cut).szVideoCodec, "");
}

// The rotation is the clockwise quarter turn nearest the display matrix's
// turn, the pixel aspect reduced; both are neutral when unknown.
TEST_F(RecordFillTest, VideoMetadataIsAQuarterTurnAndAReducedAspect) {
  const std::tuple<bool, double, int32_t> turns[] = {
      {true, -90, 90}, {true, 90, 270},     {true, 180, 180}, {true, -180, 180},
      {true, 0, 0},    {true, -89.6, 90},   {true, 359, 0},   {true, -450, 90},
      {true, NAN, 0},  {true, INFINITY, 0}, {false, -90, 0}};
  for (const auto& [has, counterclockwise, rotation] : turns) {
    ContainerFacts container = Container("", "av");
    container.streams[1].has_rotation = has;
    container.streams[1].rotation = counterclockwise;
    EXPECT_EQ(VideoMetadataOf(container).rotation, rotation)
        << counterclockwise;
  }
  const int64_t kTera = int64_t{1} << 40;
  const std::tuple<int64_t, int64_t, int32_t, int32_t> aspects[] = {
      {8, 6, 4, 3},     {1, 1, 1, 1},     {0, 0, 1, 1},
      {0, 1, 1, 1},     {-4, 3, 1, 1},    {4, -3, 1, 1},
      {kTera, 1, 1, 1}, {1, kTera, 1, 1}, {3 * kTera, kTera, 3, 1}};
  for (const auto& [num, den, width, height] : aspects) {
    ContainerFacts container = Container("", "cv");  // the first picture
    container.streams[1].sar_num = num;
    container.streams[1].sar_den = den;
    _VIDEO_METADATA_ metadata = VideoMetadataOf(container);
    EXPECT_EQ(metadata.parWidth, width) << num << "/" << den;
    EXPECT_EQ(metadata.parHeight, height) << num << "/" << den;
  }
  _VIDEO_METADATA_ none = VideoMetadataOf(Container("", "a"));
  EXPECT_EQ(none.rotation, 0);
  EXPECT_EQ(none.parWidth, 1);
  EXPECT_EQ(none.parHeight, 1);
}

}  // namespace
}  // namespace mediaparserd::test

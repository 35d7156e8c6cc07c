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

namespace mediaparserd {
namespace {

using test::HostCodePage;
using test::IsValidUTF8;
using Type = StreamFacts::Type;

StreamFacts Stream(Type type, const std::string& codec) {
  StreamFacts stream;
  stream.type = type;
  stream.codec = codec;
  return stream;
}

FileFacts File(const std::string& path = "/music/Album X/01 song.mp3") {
  FileFacts file;
  file.path = path;
  file.size = 5ull << 32;
  file.mtime = 1600000000;
  return file;
}

__tag_QUVA_MEDIA_INFO Fill(MediaKind kind, const ContainerFacts& container,
                           const MusicTags* tags = nullptr,
                           const PhotoFacts* photo = nullptr,
                           const FileFacts& file = File()) {
  __tag_QUVA_MEDIA_INFO record;
  memset(&record, 0x5A, sizeof(record));  // every field must be written
  FillRecord(kind, file, container, tags, photo, &record);
  return record;
}

TagText Bytes(const std::string& bytes) {
  return {TagText::Encoding::kBytes, bytes};
}

// UTF-16LE code units of a UTF-8 literal's code points.
TagText UTF16(const std::u16string& text) {
  return {
      TagText::Encoding::kUTF16,
      std::string(reinterpret_cast<const char*>(text.data()), 2 * text.size())};
}

TEST(RecordFillTest, ClassifiesByStreamsNotByName) {
  struct Case {
    const char* format;
    std::vector<Type> streams;
    bool media;
    MediaKind kind;
  } cases[] = {
      {"mp3", {Type::kAudio}, true, MediaKind::kMusic},
      {"mp3",
       {Type::kAudio, Type::kCover, Type::kCover},
       true,
       MediaKind::kMusic},
      {"mov,mp4,m4a,3gp,3g2,mj2",
       {Type::kAudio, Type::kVideo},
       true,
       MediaKind::kVideo},
      {"jpeg_pipe", {Type::kVideo}, true, MediaKind::kPhoto},
      {"gif", {Type::kVideo}, true, MediaKind::kPhoto},
      {"matroska,webm", {Type::kOther}, false, MediaKind::kMusic},
      {"png_pipe", {}, false, MediaKind::kMusic},
      {"mp3", {Type::kCover}, false, MediaKind::kMusic},
  };
  for (const Case& c : cases) {
    ContainerFacts container;
    container.format = c.format;
    for (Type type : c.streams) container.streams.push_back(Stream(type, "x"));
    MediaKind kind = MediaKind::kMusic;
    EXPECT_EQ(ClassifyContainer(container, &kind), c.media) << c.format;
    if (c.media) {
      EXPECT_EQ(kind, c.kind) << c.format;
    }
  }
}

TEST(RecordFillTest, StillImageContainersAreNamedAsTheLibraryTableSpellsThem) {
  EXPECT_EQ(ContainerTypeName("jpeg_pipe"), "image2");
  EXPECT_EQ(ContainerTypeName("png_pipe"), "image2");
  EXPECT_EQ(ContainerTypeName("image2"), "image2");
  EXPECT_EQ(ContainerTypeName("gif"), "gif");
  EXPECT_EQ(ContainerTypeName("mp3"), "mp3");
  EXPECT_EQ(ContainerTypeName("matroska,webm"), "matroska,webm");
}

TEST(RecordFillTest, OutOfRangeNumbersAreBoundedToTheirFields) {
  HostCodePage host("windows-1252");
  ContainerFacts container;
  container.format = "mov,mp4,m4a,3gp,3g2,mj2";
  container.duration = 1e300;
  container.bit_rate = int64_t{1} << 40;
  StreamFacts audio = Stream(Type::kAudio, "aac");
  audio.bit_rate = -5;
  audio.sample_rate = -44100;
  audio.channels = int64_t{1} << 33;
  audio.aac_object_type = int64_t{1} << 40;
  StreamFacts video = Stream(Type::kVideo, "h264");
  video.width = std::numeric_limits<int64_t>::max();
  video.height = -1;
  video.profile = -99;
  video.level = std::numeric_limits<int64_t>::min();
  video.frame_rate_num = int64_t{1} << 35;
  video.frame_rate_den = 1;
  container.streams = {audio, video};
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kVideo, container);
  EXPECT_EQ(r.duration, FLT_MAX);
  EXPECT_EQ(r.frame_bitrate, UINT32_MAX);
  EXPECT_EQ(r.audio_bitrate, 0u);
  EXPECT_EQ(r.frequency, 0);
  EXPECT_EQ(r.channel, INT32_MAX);
  EXPECT_STREQ(r.szAudioCodec, "aac_invalid");
  EXPECT_EQ(r.resolutionX, INT32_MAX);
  EXPECT_EQ(r.resolutionY, 0);
  EXPECT_EQ(r.videoProfile, -99);  // FFmpeg's "unknown" is kept
  EXPECT_EQ(r.videoLevel, INT32_MIN);
  EXPECT_EQ(r.frame_rate_num, 0);
  EXPECT_EQ(r.frame_rate_den, 0);
  EXPECT_EQ(r.fileSize, 5ull << 32);

  container.duration = NAN;
  EXPECT_EQ(Fill(MediaKind::kVideo, container).duration, 0.0f);
  container.duration = -3;
  EXPECT_EQ(Fill(MediaKind::kVideo, container).duration, 0.0f);
}

TEST(RecordFillTest, NamesThatAreNotUTF8AreLeftOut) {
  HostCodePage host("UTF-8");
  ContainerFacts container;
  container.format = "mp\xFF";
  container.streams = {Stream(Type::kAudio,
                              "fl\xE9"
                              "c"),
                       Stream(Type::kVideo, "")};
  FileFacts file = File();
  file.fs_uuid = "1234-\xC0\x80";
  __tag_QUVA_MEDIA_INFO r =
      Fill(MediaKind::kVideo, container, nullptr, nullptr, file);
  EXPECT_STREQ(r.szContainerType, "");
  EXPECT_STREQ(r.szAudioCodec, "");
  EXPECT_STREQ(r.szVideoCodec, "");
  EXPECT_STREQ(r.szFsUUID, "");
}

TEST(RecordFillTest, MusicWithoutStreamsHasNoTechnicalFields) {
  HostCodePage host("windows-1252");
  ContainerFacts container;
  container.format = "mp3";
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, container);
  EXPECT_EQ(r.duration, 0.0f);
  EXPECT_EQ(r.audio_bitrate, 0u);
  EXPECT_STREQ(r.szAudioCodec, "");
  EXPECT_STREQ(r.szVideoCodec, "");
  EXPECT_STREQ(r.szTitle, "");
  EXPECT_STREQ(r.szPath, "/music/Album X/01 song.mp3");
  EXPECT_STREQ(r.szName, "01 song.mp3");
  EXPECT_STREQ(r.szContainerType, "mp3");
}

TEST(RecordFillTest, SongWithoutAStreamRateTakesTheContainerRate) {
  HostCodePage host("windows-1252");
  ContainerFacts container;
  container.format = "flac";
  container.bit_rate = 171960;
  container.streams = {Stream(Type::kAudio, "flac"),
                       Stream(Type::kCover, "png"),
                       Stream(Type::kCover, "mjpeg")};
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, container);
  EXPECT_EQ(r.audio_bitrate, 171960u);
  EXPECT_EQ(r.coverCount, 2);
  EXPECT_EQ(r.resolutionX, 0);  // covers are no picture of the song
  container.streams.push_back(Stream(Type::kVideo, "h264"));
  EXPECT_EQ(Fill(MediaKind::kVideo, container).audio_bitrate, 0u);
}

TEST(RecordFillTest, AacIsNamedByItsObjectType) {
  HostCodePage host("windows-1252");
  struct Case {
    int64_t type;
    const char* name;
  } cases[] = {{2, "aac_lc"},      {5, "aac_he"},       {1, "aac_main"},
               {0, "aac_invalid"}, {-1, "aac_invalid"}, {10, "aac_invalid"}};
  for (const Case& c : cases) {
    ContainerFacts container;
    container.streams = {Stream(Type::kAudio, "aac")};
    container.streams[0].aac_object_type = c.type;
    EXPECT_STREQ(Fill(MediaKind::kMusic, container).szAudioCodec, c.name)
        << c.type;
  }
}

// UTF-16 of Latin letters has a zero in every code unit, and Cyrillic
// UTF-16 holds only bytes below 0x80: without the byte-order mark the
// first would arrive as one letter and the second be taken for UTF-8 full
// of control characters, and emptied.
TEST(RecordFillTest, UTF16TagsArriveWholeAsUTF8) {
  HostCodePage host("UTF-8");
  ContainerFacts container;
  MusicTags tags;
  tags.title = UTF16(u"Hello");
  tags.artist = UTF16(u"Привет");
  tags.album = UTF16(u"\U0001F600 emoji");
  tags.album_artist = UTF16(u"Zoë");
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, container, &tags);
  EXPECT_STREQ(r.szTitle, "Hello");
  EXPECT_STREQ(r.szArtist, "Привет");
  EXPECT_STREQ(r.szAlbum, "\xF0\x9F\x98\x80 emoji");
  EXPECT_STREQ(r.szAlbumArtist, "Zoë");
  EXPECT_EQ(r.blTitleUTF16, 1);
  EXPECT_EQ(r.blArtistUTF16, 1);
  EXPECT_EQ(r.blGenreUTF16, 0);  // empty texts stay unflagged
}

TEST(RecordFillTest, LongUTF16TagIsCutWithoutSplittingAPair) {
  HostCodePage host("UTF-8");
  std::u16string faces;
  for (int i = 0; i < 100; ++i) faces += u"\U0001F600";
  MusicTags tags;
  tags.title = UTF16(faces);
  tags.comment = UTF16(std::u16string(300, u'x'));
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, ContainerFacts(), &tags);
  std::string title = r.szTitle;
  EXPECT_TRUE(IsValidUTF8(title));
  EXPECT_EQ(title.size(), 62u * 4);  // 125 units: 62 pairs, the lead dropped
  EXPECT_EQ(std::string(r.szComment), std::string(125, 'x'));
}

TEST(RecordFillTest, RawTagBytesAreReadInTheHostCodePage) {
  const std::string cp1251_hello = "\xCF\xF0\xE8\xE2\xE5\xF2";  // Привет
  const std::string gbk_hello = "\xC4\xE3\xBA\xC3";             // 你好
  struct Case {
    const char* code_page;
    std::string bytes;
    const char* title;         // szTitle after MediaInfoValid
    const char* album_artist;  // cleaned apart from MediaInfoValid
  } cases[] = {
      {"windows-1251", cp1251_hello, "Привет", "Привет"},
      {"windows-936", gbk_hello, "你好", "你好"},
      // Not valid in the code page: the title falls back to the file's
      // name, the album artist is emptied; no invalid UTF-8 either way.
      {"UTF-8", cp1251_hello, "01 song", ""},
      {"UTF-8", "plain ASCII", "plain ASCII", "plain ASCII"},
  };
  for (const Case& c : cases) {
    HostCodePage host(c.code_page);
    MusicTags tags;
    tags.title = Bytes(c.bytes);
    tags.album_artist = Bytes(c.bytes);
    __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, ContainerFacts(), &tags);
    EXPECT_STREQ(r.szTitle, c.title) << c.code_page;
    EXPECT_STREQ(r.szAlbumArtist, c.album_artist) << c.code_page;
    EXPECT_EQ(r.blTitleUTF16, 0);
  }
}

// A legacy text too long for its field is cut where a character of the
// host's code page ends; cut inside one, the whole text would not convert.
TEST(RecordFillTest, LongLegacyTextIsCutBetweenDoubleByteCharacters) {
  HostCodePage host("windows-936");
  std::string gbk = "x";
  for (int i = 0; i < 150; ++i) gbk += "\xC4\xE3";  // 你
  MusicTags tags;
  tags.comment = Bytes(gbk);
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, ContainerFacts(), &tags);
  std::string comment = r.szComment;
  ASSERT_GE(comment.size(), 1u + 3 * 80);  // the host's output limit cuts
  EXPECT_EQ(comment.substr(0, 7), "x你你");
  EXPECT_TRUE(IsValidUTF8(comment));
}

TEST(RecordFillTest, LongTextsAreCutAtACharacterBoundary) {
  HostCodePage host("UTF-8");
  std::string cyrillic;
  for (int i = 0; i < 200; ++i) cyrillic += "ж";  // two bytes each
  MusicTags tags;
  tags.title = {TagText::Encoding::kUTF8, cyrillic};
  tags.album_artist = {TagText::Encoding::kUTF8, "x" + cyrillic};
  PhotoFacts photo;
  photo.model = cyrillic;
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kMusic, ContainerFacts(), &tags);
  EXPECT_EQ(strlen(r.szTitle), 254u);
  EXPECT_EQ(strlen(r.szAlbumArtist), 253u);
  EXPECT_TRUE(IsValidUTF8(r.szAlbumArtist));
  r = Fill(MediaKind::kPhoto, ContainerFacts(), nullptr, &photo);
  EXPECT_EQ(strlen(r.szModel), 98u);
}

TEST(RecordFillTest, ContainerTagsGiveTextsAndLeadingNumbers) {
  HostCodePage host("UTF-8");
  ContainerFacts container;
  container.tags = {{"title", "Clip"},
                    {"artist", "Maker"},
                    {"track", "3/12"},
                    {"disc", " 2"},
                    {"date", "20210501"},
                    {"album_artist", "Various"},
                    {"title", "ignored: the first one counts"}};
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kVideo, container);
  EXPECT_STREQ(r.szTitle, "Clip");
  EXPECT_STREQ(r.szArtist, "Maker");
  EXPECT_STREQ(r.szAlbumArtist, "Various");
  EXPECT_EQ(r.track, 3);
  EXPECT_EQ(r.disc, 2);
  EXPECT_EQ(r.year, 2021);
  container.tags = {
      {"track", "99999999999999999999"}, {"date", "-5"}, {"disc", "two"}};
  r = Fill(MediaKind::kVideo, container);
  EXPECT_EQ(r.track, 999999999);
  EXPECT_EQ(r.year, 0);
  EXPECT_EQ(r.disc, 0);
}

TEST(RecordFillTest, ExposureAndApertureReadAsPhotographersWriteThem) {
  HostCodePage host("UTF-8");
  struct Case {
    int64_t exposure_num, exposure_den;
    const char* exposure;
    int64_t f_num, f_den;
    const char* aperture;
  } cases[] = {
      {1, 125, "1/125", 28, 10, "2.8"},
      {10, 2500, "1/250", 4, 1, "4.0"},
      {1, 4, "1/4", 95, 100, "0.95"},
      {3, 10, "0.3", 0, 1, ""},
      {25, 10, "2.5", 1, 0, ""},
      {30, 1, "30", -28, 10, ""},
      {0, 1, "", std::numeric_limits<int64_t>::max(), 1, ""},
      {-1, 100, "", 28, -10, ""},
      {std::numeric_limits<int64_t>::max(), 1, "", 1, 1, "1.0"},
      {1, std::numeric_limits<int64_t>::max(), "", 10, 1, "10.0"},
  };
  for (const Case& c : cases) {
    PhotoFacts photo;
    photo.exposure_num = c.exposure_num;
    photo.exposure_den = c.exposure_den;
    photo.fnumber_num = c.f_num;
    photo.fnumber_den = c.f_den;
    __tag_QUVA_MEDIA_INFO r =
        Fill(MediaKind::kPhoto, ContainerFacts(), nullptr, &photo);
    EXPECT_STREQ(r.szExposure, c.exposure)
        << c.exposure_num << "/" << c.exposure_den;
    EXPECT_STREQ(r.szAperture, c.aperture) << c.f_num << "/" << c.f_den;
  }
}

TEST(RecordFillTest, TakenTimeKeepsOnlyRealDates) {
  HostCodePage host("UTF-8");
  struct Case {
    const char* exif;
    const char* taken;
  } cases[] = {
      {"2021:05:01 12:34:56", "2021-05-01 12:34:56"},
      {"2021:05:01 12:34:56\n", "2021-05-01 12:34:56"},
      {"    :  :     :  :  ", ""},
      {"0000:00:00 00:00:00", ""},
      {"2021:05:01", ""},
      {"2021-05-01 12:34:56", ""},
  };
  for (const Case& c : cases) {
    PhotoFacts photo;
    photo.taken = c.exif;
    EXPECT_STREQ(
        Fill(MediaKind::kPhoto, ContainerFacts(), nullptr, &photo).szTakenTime,
        c.taken)
        << c.exif;
  }
}

TEST(RecordFillTest, CameraNamesAreCleanUTF8WithoutPadding) {
  HostCodePage host("windows-1251");
  PhotoFacts photo;
  photo.make = std::string("Canon\0\0", 7) + "   ";
  photo.model = "\xCA\xE8\xE5\xE2";  // Киев in windows-1251
  photo.width = 640;
  photo.height = -480;
  photo.iso = -100;
  __tag_QUVA_MEDIA_INFO r =
      Fill(MediaKind::kPhoto, ContainerFacts(), nullptr, &photo);
  EXPECT_STREQ(r.szMake, "Canon");
  EXPECT_STREQ(r.szModel, "Киев");
  EXPECT_EQ(r.resolutionX, 640);
  EXPECT_EQ(r.resolutionY, 0);
  EXPECT_EQ(r.iso, 0);
}

TEST(RecordFillTest, PhotoWithoutSizeTakesItsPictureStream) {
  HostCodePage host("UTF-8");
  ContainerFacts container;
  container.format = "qoi_pipe";
  container.streams = {Stream(Type::kVideo, "qoi")};
  container.streams[0].width = 3;
  container.streams[0].height = 2;
  container.duration = 0.04;
  __tag_QUVA_MEDIA_INFO r = Fill(MediaKind::kPhoto, container);
  EXPECT_EQ(r.resolutionX, 3);
  EXPECT_EQ(r.resolutionY, 2);
  EXPECT_EQ(r.duration, 0.0f);  // a photo plays for no time
  EXPECT_STREQ(r.szVideoCodec, "");
  EXPECT_STREQ(r.szContainerType, "image2");
}

TEST(RecordFillTest, RotationIsTheClockwiseQuarterTurnOfTheMatrix) {
  struct Case {
    bool has;
    double counterclockwise;
    int32_t rotation;
  } cases[] = {
      {true, -90, 90}, {true, 90, 270},     {true, 180, 180}, {true, -180, 180},
      {true, 0, 0},    {true, -89.6, 90},   {true, 359, 0},   {true, -450, 90},
      {true, NAN, 0},  {true, INFINITY, 0}, {false, -90, 0},
  };
  for (const Case& c : cases) {
    ContainerFacts container;
    container.streams = {Stream(Type::kAudio, "aac"),
                         Stream(Type::kVideo, "h264")};
    container.streams[1].has_rotation = c.has;
    container.streams[1].rotation = c.counterclockwise;
    EXPECT_EQ(VideoMetadataOf(container).rotation, c.rotation)
        << c.counterclockwise;
  }
}

TEST(RecordFillTest, PixelAspectRatioIsReducedAndOneToOneWhenUnknown) {
  struct Case {
    int64_t num, den;
    int32_t width, height;
  } cases[] = {
      {8, 6, 4, 3},
      {1, 1, 1, 1},
      {0, 0, 1, 1},
      {0, 1, 1, 1},
      {-4, 3, 1, 1},
      {4, -3, 1, 1},
      {int64_t{1} << 40, 1, 1, 1},
      {int64_t{3} << 40, int64_t{1} << 40, 3, 1},
  };
  for (const Case& c : cases) {
    ContainerFacts container;
    container.streams = {Stream(Type::kVideo, "h264")};
    container.streams[0].sar_num = c.num;
    container.streams[0].sar_den = c.den;
    _VIDEO_METADATA_ metadata = VideoMetadataOf(container);
    EXPECT_EQ(metadata.parWidth, c.width) << c.num << "/" << c.den;
    EXPECT_EQ(metadata.parHeight, c.height) << c.num << "/" << c.den;
  }
  _VIDEO_METADATA_ none = VideoMetadataOf(ContainerFacts());
  EXPECT_EQ(none.rotation, 0);
  EXPECT_EQ(none.parWidth, 1);
  EXPECT_EQ(none.parHeight, 1);
}

}  // namespace
}  // namespace mediaparserd

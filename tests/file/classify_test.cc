// Extension classification and the converted-video and codec name tables.
#include <string.h>
#include <syslog.h>

#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "file/ext_lists.h"
#include "quvaidx/codec_names.h"
#include "quvaidx/media_type.h"
#include "support/log_capture.h"

namespace {

using quvaidx::ext::List;
using quvaidx::test::LogCapture;

// The eight extension predicates, in the order of the answers below.
const decltype(&BlQUVAIndexIsVideo) kIs[] = {
    BlQUVAIndexIsVideoOnWeb, BlQUVAIndexIsPhotoOnWeb, BlQUVAIndexIsRawImage,
    BlQUVAIndexIsJpeg,       BlQUVAIndexIsVideo,      BlQUVAIndexIsPhoto,
    BlQUVAIndexIsPlaylist,   BlQUVAIndexIsMusic};

TEST(ExtensionPredicates, AnswerEveryListForEveryCase) {
  // The extension, the answers (video-web photo-web raw jpeg video photo
  // pls music) and the table.
  const std::tuple<const char*, const char*, int> cases[] = {
      {"Jpeg", "01010100", MEDIA_TABLE_PHOTO},
      {"gif", "01000100", MEDIA_TABLE_PHOTO},
      {"ico", "00000100", MEDIA_TABLE_PHOTO},
      {"CR2", "01100100", MEDIA_TABLE_PHOTO},
      {"MP3", "00000001", MEDIA_TABLE_MUSIC},
      {"mp4", "10001000", MEDIA_TABLE_VIDEO},
      {"ts", "00001000", MEDIA_TABLE_VIDEO},
      {"DVR-MS", "00001000", MEDIA_TABLE_VIDEO},
      {"PLS", "00000010", MEDIA_TABLE_PLAYLIST}};
  for (const auto& [ext, answers, table] : cases) {
    for (int i = 0; i < 8; ++i)
      EXPECT_EQ(answers[i] - '0', kIs[i](ext)) << ext << " " << i;
    EXPECT_EQ(table, GetMediaTableTypeFromExt(ext)) << ext;
  }
  // No trimming, no prefix match, no folding beyond ASCII ("mp3" | 0x80).
  for (const char* miss : {"", "jpgx", "mp3 ", ".mp3", "\xed\xf0\xb3"}) {
    EXPECT_EQ(MEDIA_TABLE_NONE, GetMediaTableTypeFromExt(miss)) << miss;
    for (auto* is : kIs) EXPECT_EQ(0, is(miss)) << miss;
  }
  EXPECT_EQ(0, BlQUVAIndexIsVideo(nullptr));
  EXPECT_EQ(MEDIA_TABLE_NONE, GetMediaTableTypeFromExt(nullptr));
  // Every list entry in upper case: a fold that misses letters or digits.
  for (int l = 0; l < static_cast<int>(List::kCount); ++l) {
    for (const char* const* e = ListEntries(static_cast<List>(l)); *e; ++e) {
      std::string upper = *e;
      for (char& ch : upper) ch = (ch >= 'a' && ch <= 'z') ? ch - 32 : ch;
      EXPECT_EQ(1, InList(upper.c_str(), static_cast<List>(l))) << upper;
    }
  }
}

TEST(PathPredicates, UseTheTextAfterTheLastDotOfTheWholePath) {
  const decltype(&BlQUVAIndexIsVideoFile) is[] = {
      BlQUVAIndexIsSubtitleFile,   BlQUVAIndexIsVideoFile,
      BlQUVAIndexIsVideoOnWebFile, BlQUVAIndexIsPhotoOnWebConvertFile,
      BlQUVAIndexIsPhotoOnWebFile, BlQUVAIndexIsMusicFile};
  // The path, its QUVAIndexExtGet (null for none) and the answers
  // (subtitle video video-web convert photo-web music).
  const std::tuple<const char*, const char*, const char*> cases[] = {
      {"/m/movie.srt", "srt", "110000"},
      {"/m/clip.m2ts", "m2ts", "011000"},
      {"/m/Pic.JPG", "JPG", "000110"},
      {"/m/._song.mp3", "mp3", "000001"},
      {"/media/album.old/track", "old/track", "000000"},
      {"/media/song", nullptr, "000000"},
      {"name.", "", "000000"}};
  for (const auto& [path, ext, answers] : cases) {
    const char* end = path + strlen(path);  // the result points into it
    EXPECT_EQ(ext ? end - strlen(ext) : nullptr, QUVAIndexExtGet(path)) << path;
    for (int i = 0; i < 6; ++i)
      EXPECT_EQ(answers[i] - '0', is[i](path)) << path << " " << i;
  }
  EXPECT_EQ(nullptr, QUVAIndexExtGet(nullptr));
}

TEST(ConvertVideoType, FindsBareNamesAndCutsTheType) {
  // The name, the out size, the result and what out holds.
  const std::tuple<const char*, int, int, const char*> cases[] = {
      {"QUVAPHOTO:FILM_H.mp4", 32, 1, "CONVERTA_HIGH"},
      {"QUVAPHOTO_FILM_H264.mp4", 32, 1, ""},
      {"QUVAPHOTO:FILM.flv", 32, 1, "GALVENTA_FLV"},
      {"QUVAPHOTO_FILM_MOBILE_ANDROID", 8, 1, "ANDROID"},
      {"QUVAPHOTO:FILM_M.mp4", 1, 1, ""},
      {"quvaphoto_film_h.mp4", 32, 0, ""},     // letter case counts
      {"/v/QUVAPHOTO_FILM_H.mp4", 32, 0, ""},  // a path never matches
      {"QUVAPHOTO_FILM_H.mp", 32, 0, ""}};
  for (const auto& [name, out_size, result, written] : cases) {
    SCOPED_TRACE(name);
    char out[40];
    memset(out, 'x', sizeof(out));
    EXPECT_EQ(result, ConvertVideoTypeGet(name, out, out_size));
    EXPECT_STREQ(written, out);
    EXPECT_EQ('x', out[out_size]) << "wrote beyond out_size";
  }
  char out[8] = "keep";  // never written
  EXPECT_EQ(1, ConvertVideoTypeGet("QUVAPHOTO_FILM_H.mp4", out, -5));
  EXPECT_EQ(1, ConvertVideoTypeGet("QUVAPHOTO_FILM_H.mp4", nullptr, 16));
  LogCapture log;
  EXPECT_EQ(-1, ConvertVideoTypeGet("", out, sizeof(out)));
  EXPECT_EQ(-1, ConvertVideoTypeGet(nullptr, out, sizeof(out)));
  EXPECT_STREQ("keep", out);
  EXPECT_EQ(2, log.Count("quvaidx_file:N Bad parameter: szName."));
  EXPECT_EQ(LOG_ERR, log.lines().at(0).priority);
}

TEST(CodecNames, GapsGiveTheDefaultAndNamesRoundTrip) {
  const std::pair<int, const char*> cases[] = {
      {1, "aac_main"}, {12, "aac_ttsi"}, {31, "aac_he_l3"}};
  for (const auto& [number, name] : cases)
    EXPECT_STREQ(name, QUVAAacCodecNameGet(number)) << number;
  for (int gap : {0, 10, 11, 18, 29, 30, -1})
    EXPECT_STREQ("aac_invalid", QUVAAacCodecNameGet(gap)) << gap;
  for (int n = 1; n < 40; ++n) {
    const char* aac = QUVAAacCodecNameGet(n);
    if (strcmp(aac, "aac_invalid") != 0) {
      EXPECT_EQ(n, QUVAAacObjectTypeGet(aac));
    }
    if (n <= 17) {
      EXPECT_EQ(n, QUVADlnaContainerTypeGet(QUVADlnaContainerNameGet(n)));
    }
  }
  for (const char* name : {"AAC_LC", "aac_invalid"})
    EXPECT_EQ(0, QUVAAacObjectTypeGet(name)) << name;
  EXPECT_EQ(10, QUVADlnaContainerTypeGet("mp4"));
  EXPECT_EQ(8, QUVADlnaContainerTypeGet("mov,mp4,m4a,3gp,3g2,mj2"));
  EXPECT_EQ(0, QUVADlnaContainerTypeGet("mov"));
  for (int gap : {0, 18})
    EXPECT_STREQ("unknown", QUVADlnaContainerNameGet(gap)) << gap;
  EXPECT_STREQ("mpeg_transport_stream_dlna_no_ts",
               QUVADlnaContainerNameGet(17));
}

}  // namespace

// Extension classification and the converted-video and codec name tables.
#include <string.h>
#include <syslog.h>

#include <string>

#include <gtest/gtest.h>

#include "file/ext_lists.h"
#include "quvaidx/codec_names.h"
#include "quvaidx/media_type.h"
#include "support/log_capture.h"

namespace {

using quvaidx::ext::List;
using quvaidx::test::LogCapture;

// Expected answers of the eight extension predicates and the media table.
struct ExtCase {
  const char* ext;
  int video_web, photo_web, raw, jpeg, video, photo, playlist, music;
  int table;
};

const ExtCase kExtCases[] = {
    // ext       vw pw raw jpg vid pho pls mus table
    {"Jpeg", 0, 1, 0, 1, 0, 1, 0, 0, MEDIA_TABLE_PHOTO},
    {"gif", 0, 1, 0, 0, 0, 1, 0, 0, MEDIA_TABLE_PHOTO},
    {"ico", 0, 0, 0, 0, 0, 1, 0, 0, MEDIA_TABLE_PHOTO},
    {"CR2", 0, 1, 1, 0, 0, 1, 0, 0, MEDIA_TABLE_PHOTO},
    {"raw", 0, 1, 1, 0, 0, 1, 0, 0, MEDIA_TABLE_PHOTO},  // last of its lists
    {"MP3", 0, 0, 0, 0, 0, 0, 0, 1, MEDIA_TABLE_MUSIC},
    {"dff", 0, 0, 0, 0, 0, 0, 0, 1, MEDIA_TABLE_MUSIC},
    {"mp4", 1, 0, 0, 0, 1, 0, 0, 0, MEDIA_TABLE_VIDEO},
    {"ts", 0, 0, 0, 0, 1, 0, 0, 0, MEDIA_TABLE_VIDEO},
    {"DVR-MS", 0, 0, 0, 0, 1, 0, 0, 0, MEDIA_TABLE_VIDEO},
    {"tp", 0, 0, 0, 0, 1, 0, 0, 0, MEDIA_TABLE_VIDEO},
    {"mts", 1, 0, 0, 0, 1, 0, 0, 0, MEDIA_TABLE_VIDEO},
    {"PLS", 0, 0, 0, 0, 0, 0, 1, 0, MEDIA_TABLE_PLAYLIST}};

TEST(ExtensionPredicates, AnswerEveryListForEveryCase) {
  for (const ExtCase& c : kExtCases) {
    SCOPED_TRACE(c.ext);
    EXPECT_EQ(c.video_web, BlQUVAIndexIsVideoOnWeb(c.ext));
    EXPECT_EQ(c.photo_web, BlQUVAIndexIsPhotoOnWeb(c.ext));
    EXPECT_EQ(c.raw, BlQUVAIndexIsRawImage(c.ext));
    EXPECT_EQ(c.jpeg, BlQUVAIndexIsJpeg(c.ext));
    EXPECT_EQ(c.video, BlQUVAIndexIsVideo(c.ext));
    EXPECT_EQ(c.photo, BlQUVAIndexIsPhoto(c.ext));
    EXPECT_EQ(c.playlist, BlQUVAIndexIsPlaylist(c.ext));
    EXPECT_EQ(c.music, BlQUVAIndexIsMusic(c.ext));
    EXPECT_EQ(c.table, GetMediaTableTypeFromExt(c.ext));
  }
  // No trimming, no prefix match, no folding beyond ASCII ("mp3" | 0x80).
  for (const char* miss : {"", "jp", "jpgx", "mp3 ", ".mp3", "dvr-ms-x",
                           "mp3mp3mp3", "\xed\xf0\xb3"}) {
    EXPECT_EQ(MEDIA_TABLE_NONE, GetMediaTableTypeFromExt(miss)) << miss;
    for (auto* is :
         {BlQUVAIndexIsVideoOnWeb, BlQUVAIndexIsPhotoOnWeb,
          BlQUVAIndexIsRawImage, BlQUVAIndexIsJpeg, BlQUVAIndexIsVideo,
          BlQUVAIndexIsPhoto, BlQUVAIndexIsPlaylist, BlQUVAIndexIsMusic})
      EXPECT_EQ(0, is(miss)) << miss;
  }
  EXPECT_EQ(0, BlQUVAIndexIsVideo(nullptr));
  EXPECT_EQ(0, BlQUVAIndexIsMusicFile(nullptr));
  EXPECT_EQ(MEDIA_TABLE_NONE, GetMediaTableTypeFromExt(nullptr));
}

// Catches a fold that misses letters or digit-and-hyphen entries.
TEST(ExtensionLists, EveryEntryMatchesInUpperCase) {
  for (int l = 0; l < static_cast<int>(List::kCount); ++l) {
    for (const char* const* e = ListEntries(static_cast<List>(l)); *e; ++e) {
      std::string upper = *e;
      for (char& ch : upper) ch = (ch >= 'a' && ch <= 'z') ? ch - 32 : ch;
      EXPECT_EQ(1, InList(upper.c_str(), static_cast<List>(l))) << upper;
    }
  }
}

struct PathCase {
  const char* path;
  const char* ext;  // expected QUVAIndexExtGet, null for none
  int subtitle, video, video_web, photo_convert, photo_web, music;
};

const PathCase kPathCases[] = {
    {"/m/movie.srt", "srt", 1, 1, 0, 0, 0, 0},
    {"/m/clip.m2ts", "m2ts", 0, 1, 1, 0, 0, 0},
    {"/m/pic.gif", "gif", 0, 0, 0, 0, 1, 0},
    {"/m/Pic.JPG", "JPG", 0, 0, 0, 1, 1, 0},
    {"/m/._song.mp3", "mp3", 0, 0, 0, 0, 0, 1},
    {"archive.tar.gz", "gz", 0, 0, 0, 0, 0, 0},
    {"/media/album.old/track", "old/track", 0, 0, 0, 0, 0, 0},
    {"/media/v.mp4/song", "mp4/song", 0, 0, 0, 0, 0, 0},
    {"/media/song", nullptr, 0, 0, 0, 0, 0, 0},
    {"name.", "", 0, 0, 0, 0, 0, 0}};

TEST(PathPredicates, UseTheTextAfterTheLastDotOfTheWholePath) {
  for (const PathCase& c : kPathCases) {
    SCOPED_TRACE(c.path);
    const char* ext = QUVAIndexExtGet(c.path);
    if (c.ext == nullptr) {
      EXPECT_EQ(nullptr, ext);
    } else {
      ASSERT_NE(nullptr, ext);
      EXPECT_STREQ(c.ext, ext);
      EXPECT_EQ(c.path + strlen(c.path) - strlen(c.ext), ext);  // not a copy
    }
    EXPECT_EQ(c.subtitle, BlQUVAIndexIsSubtitleFile(c.path));
    EXPECT_EQ(c.video, BlQUVAIndexIsVideoFile(c.path));
    EXPECT_EQ(c.video_web, BlQUVAIndexIsVideoOnWebFile(c.path));
    EXPECT_EQ(c.photo_convert, BlQUVAIndexIsPhotoOnWebConvertFile(c.path));
    EXPECT_EQ(c.photo_web, BlQUVAIndexIsPhotoOnWebFile(c.path));
    EXPECT_EQ(c.music, BlQUVAIndexIsMusicFile(c.path));
  }
  EXPECT_EQ(nullptr, QUVAIndexExtGet(nullptr));
}

struct ConvertCase {
  const char* name;
  int out_size;
  int result;
  const char* out;
};

const ConvertCase kConvertCases[] = {
    {"QUVAPHOTO:FILM_H.mp4", 32, 1, "CONVERTA_HIGH"},
    {"QUVAPHOTO_FILM_H264.mp4", 32, 1, ""},
    {"QUVAPHOTO:FILM.flv", 32, 1, "GALVENTA_FLV"},
    {"QUVAPHOTO_FILM_L.mp4", 32, 1, "CONVERTA_LOW"},
    {"QUVAPHOTO_FILM_MOBILE_ANDROID", 8, 1, "ANDROID"},
    {"QUVAPHOTO:FILM_M.mp4", 1, 1, ""},
    {"quvaphoto_film_h.mp4", 32, 0, ""},     // letter case counts
    {"/v/QUVAPHOTO_FILM_H.mp4", 32, 0, ""},  // a path never matches
    {"QUVAPHOTO_FILM_H.mp", 32, 0, ""}};

TEST(ConvertVideoType, FindsBareNamesAndCutsTheType) {
  for (const ConvertCase& c : kConvertCases) {
    SCOPED_TRACE(c.name);
    char out[40];
    memset(out, 'x', sizeof(out));
    EXPECT_EQ(c.result, ConvertVideoTypeGet(c.name, out, c.out_size));
    EXPECT_STREQ(c.out, out);
    EXPECT_EQ('x', out[c.out_size]) << "wrote beyond out_size";
  }
  char out[8] = "keep";  // never written
  EXPECT_EQ(1, ConvertVideoTypeGet("QUVAPHOTO_FILM_H.mp4", out, 0));
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
  const struct {
    int number;
    const char* name;
  } cases[] = {{0, "aac_invalid"},  {1, "aac_main"},     {9, "aac_hvxc"},
               {10, "aac_invalid"}, {11, "aac_invalid"}, {12, "aac_ttsi"},
               {18, "aac_invalid"}, {25, "aac_hxvc_er"}, {29, "aac_invalid"},
               {30, "aac_invalid"}, {31, "aac_he_l3"},   {-1, "aac_invalid"}};
  for (const auto& c : cases) {
    EXPECT_STREQ(c.name, QUVAAacCodecNameGet(c.number)) << c.number;
  }
  for (int n = 1; n < 40; ++n) {
    const char* aac = QUVAAacCodecNameGet(n);
    if (strcmp(aac, "aac_invalid") != 0) {
      EXPECT_EQ(n, QUVAAacObjectTypeGet(aac));
    }
    if (n <= 17) {
      EXPECT_EQ(n, QUVADlnaContainerTypeGet(QUVADlnaContainerNameGet(n)));
    }
  }
  EXPECT_EQ(0, QUVAAacObjectTypeGet("AAC_LC"));
  EXPECT_EQ(0, QUVAAacObjectTypeGet("aac_invalid"));
  EXPECT_EQ(0, QUVAAacObjectTypeGet(nullptr));
  EXPECT_EQ(10, QUVADlnaContainerTypeGet("mp4"));
  EXPECT_EQ(8, QUVADlnaContainerTypeGet("mov,mp4,m4a,3gp,3g2,mj2"));
  EXPECT_EQ(0, QUVADlnaContainerTypeGet("mov"));
  EXPECT_EQ(0, QUVADlnaContainerTypeGet(nullptr));
  EXPECT_STREQ("unknown", QUVADlnaContainerNameGet(0));
  EXPECT_STREQ("unknown", QUVADlnaContainerNameGet(18));
  EXPECT_STREQ("mpeg_transport_stream_dlna_no_ts",
               QUVADlnaContainerNameGet(17));
}

}  // namespace

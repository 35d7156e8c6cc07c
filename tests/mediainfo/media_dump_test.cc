// The two dumps of a media record: exact text on standard output and in the
// system log.
#include <string.h>
#include <syslog.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/mediainfo.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;

// The items of a record with ID 7, szTitle "Song", duration 1.5, fileSize
// 2^32 + 5 and everything else zero or empty.
const char* const kItems[] = {
    "ID              = 7,", "szPath          = ,",
    "szName          = ,",  "szDesc          = ,",
    "track           = 0,", "disc            = 0,",
    "year            = 0,", "szTitle         = Song,",
    "szAlbum         = ,",  "szArtist        = ,",
    "szAlbumArtist   = ,",  "szGenre         = ,",
    "szComposer      = ,",  "szComment       = ,",
    "szMake          = ,",  "szModel         = ,",
    "szExposure      = ,",  "szAperture      = ,",
    "szTakenTime     = ,",  "szDate          = ,",
    "szMDate         = ,",  "duration        = 1.500000,",
    "audio_bitrate   = 0,", "frame_bitrate   = 0,",
    "video_bitrate   = 0,", "frame_rate_num  = 0,",
    "frame_rate_den  = 0,", "frequency       = 0,",
    "channel         = 0,", "resolutionX     = 0,",
    "resolutionY     = 0,", "fileSize        = 4294967301,",
    "song_count      = 0,", "blTitleUTF16    = 0,",
    "blArtistUTF16   = 0,", "blAlbumUTF16    = 0,",
    "blGenreUTF16    = 0,", "blComposerUTF16 = 0,",
    "blCommentUTF16  = 0,", "coverCount      = 0,",
    "iso             = 0,", "szVideoCodec    = ,",
    "szContainerType = ,",  "videoProfile    = 0,",
    "videoLevel      = 0,", "szAudioCodec    = ,",
    "szFsUUID        = ,",
};

__tag_QUVA_MEDIA_INFO SampleRecord() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  r.ID = 7;
  strcpy(r.szTitle, "Song");
  r.duration = 1.5f;
  r.fileSize = (uint64_t{1} << 32) + 5;
  return r;
}

std::string CapturePrint(__tag_QUVA_MEDIA_INFO& r, int times = 1) {
  testing::internal::CaptureStdout();
  for (int i = 0; i < times; ++i) PrintMediaInfoObject(r);
  fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

// Two prints make one unbroken line: no line feed is written.
TEST(MediaDumpTest, PrintWritesExactlyTheItems) {
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  std::string all;
  for (const char* item : kItems) all += item;
  EXPECT_EQ(CapturePrint(r, 2), all + all);
}

TEST(MediaDumpTest, PrintShowsEdgeValuesInFull) {
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  r.fileSize = UINT64_MAX;
  r.ID = 4294967295u;
  r.video_bitrate = 4294967295u;
  r.track = -1;
  strcpy(r.szComment, "100%s %d %n");  // an argument, never a format
  memset(r.szExposure, 'e', sizeof(r.szExposure));  // unterminated
  std::string out = CapturePrint(r);
  for (std::string item :
       {"fileSize        = 18446744073709551615,",
        "ID              = 4294967295,", "video_bitrate   = 4294967295,",
        "track           = -1,", "szComment       = 100%s %d %n,",
        "szExposure      = eeeeeeeeeeeeeeeeeeee,szAperture"}) {
    EXPECT_NE(out.find(item), std::string::npos) << item;
  }
}

TEST(MediaDumpTest, SyslogWritesOneErrorLinePerFieldWhateverTheLevel) {
  LogCapture log(0);  // level 0: leveled lines would be dropped
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  SyslogMediaInfoObject(r);
  ASSERT_EQ(log.lines().size(), 47u);
  std::vector<std::string> lines = log.Normalized();
  for (size_t i = 0; i < 47; ++i) {
    EXPECT_EQ(log.lines()[i].priority, LOG_ERR);
    EXPECT_EQ(lines[i], std::string("quvaidx_mediainfo:N ") + kItems[i]);
  }
}

}  // namespace

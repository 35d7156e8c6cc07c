// MediaInfoValid against a host made to convert or fail: UTF-8 kept, UTF-16
// and code-page text converted, failed conversions with the path-based
// fallbacks, control characters.
#include <string.h>
#include <syslog.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/text.h"
#include "support/fake_host.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;

constexpr char kPath[] = "/data/music/Album X/01 song.mp3";

__tag_QUVA_MEDIA_INFO CleanRecord() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  strcpy(r.szPath, kPath);
  strcpy(r.szTitle, "Песня");
  strcpy(r.szArtist, "歌手");
  strcpy(r.szComposer, "composer \xF0\x9F\x8E\xB5");
  strcpy(r.szComment, "comment \x7F");
  strcpy(r.szAlbum, "album");
  strcpy(r.szGenre, "caf\xC3\xA9");
  strcpy(r.szAlbumArtist, "album artist");
  return r;
}

class MediaValidTest : public ::testing::Test {
 protected:
  MediaValidTest() { host_.AnswerCodePage(1); }  // windows-1252
  FakeHost host_;
};

TEST_F(MediaValidTest, CleanUtf8RecordComesOutUnchanged) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  __tag_QUVA_MEDIA_INFO before = r;
  MediaInfoValid(&r);
  EXPECT_EQ(memcmp(&r, &before, sizeof(r)), 0);
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 0);
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 0);
}

TEST_F(MediaValidTest, FlaggedUtf16IsConverted) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  // "Ж" after a little-endian byte-order mark: not UTF-8 as bytes.
  memcpy(r.szArtist, "\xFF\xFE\x16\x04\0\0", 6);
  r.blArtistUTF16 = 1;
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szArtist, "\xD0\x96");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 1);
}

TEST_F(MediaValidTest, FlaggedUtf16ThatReadsAsUtf8IsKept) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  memcpy(r.szTitle, "A\0B\0\0", 5);
  r.blTitleUTF16 = 1;
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szTitle, "A");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 0);
}

TEST_F(MediaValidTest, UnflaggedNonUtf8IsConvertedFromTheCodePage) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  strcpy(r.szGenre, "caf\xE9");
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szGenre, "caf\xC3\xA9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 1);
  EXPECT_GE(host_.Calls(HostOp::kCodePageGet), 1);
}

TEST_F(MediaValidTest, ConvertedTextTooLongIsCutAtCharacterBoundary) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  strcpy(r.szComment, "\xE9");
  std::string cjk;
  while (cjk.size() < 400) cjk += "\xE4\xB8\xAD";
  host_.AnswerConversion(HostOp::kUnicodeStrCPToUTF8, cjk);
  MediaInfoValid(&r);
  EXPECT_EQ(strlen(r.szComment), 252u);
  EXPECT_EQ(TryUTF8ToUTF16(r.szComment), 1);
}

TEST_F(MediaValidTest, FailedConversionFallsBackToFileAndFolderNames) {
  host_.Fail(HostOp::kUnicodeStrCPToUTF8, EILSEQ);
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  for (char* field : {r.szTitle, r.szArtist, r.szComposer, r.szComment,
                      r.szAlbum, r.szGenre}) {
    strcpy(field, "\xE9t\xE9");
  }
  strcpy(r.szAlbumArtist, "\xE9t\xE9");  // never re-encoded
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szTitle, "01 song");
  EXPECT_STREQ(r.szAlbum, "Album X");
  for (const char* field : {r.szArtist, r.szComposer, r.szComment, r.szGenre}) {
    EXPECT_STREQ(field, "");
  }
  EXPECT_STREQ(r.szAlbumArtist, "\xE9t\xE9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 6);
}

TEST_F(MediaValidTest, FailedUtf16ConversionEmptiesTheField) {
  host_.Fail(HostOp::kUnicodeStrUTF16ToUTF8, EILSEQ);
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  memcpy(r.szGenre, "\xFF\xFE\x00\xD8\0\0", 6);  // unpaired surrogate
  memset(r.szGenre + 6, 'x', 100);               // bytes after it are dropped
  r.blGenreUTF16 = 1;
  MediaInfoValid(&r);
  EXPECT_EQ(std::string(r.szGenre, sizeof(r.szGenre)),
            std::string(sizeof(r.szGenre), '\0'));
}

struct FallbackCase {
  const char* fault;
  const char* path;
  const char* title;
  const char* album;
};

TEST_F(MediaValidTest, FallbackNamesFollowThePath) {
  host_.Fail(HostOp::kUnicodeStrCPToUTF8, EILSEQ);
  const FallbackCase cases[] = {
      {"NameWithoutDotIsWhole", "/music/A/track", "track", "A"},
      {"HiddenNameGivesEmptyTitle", "/music/A/.hidden", "", "A"},
      {"LastDotEndsTheTitle", "/m/A/a.b.mp3", "a.b", "A"},
      {"NoSlashLeavesBothEmpty", "song.mp3", "", ""},
      {"OneSlashLeavesAlbumEmpty", "/song.mp3", "song", ""},
      {"OneSlashRelativeLeavesAlbumEmpty", "A/song.mp3", "song", ""},
  };
  for (const FallbackCase& c : cases) {
    SCOPED_TRACE(c.fault);
    __tag_QUVA_MEDIA_INFO r = CleanRecord();
    strcpy(r.szPath, c.path);
    strcpy(r.szTitle, "\xE9");
    strcpy(r.szAlbum, "\xE9");
    MediaInfoValid(&r);
    EXPECT_STREQ(r.szTitle, c.title);
    EXPECT_STREQ(r.szAlbum, c.album);
  }
}

TEST_F(MediaValidTest, LongFallbackNamesAreCutAtCharacterBoundaries) {
  host_.Fail(HostOp::kUnicodeStrCPToUTF8, EILSEQ);
  const std::pair<const char*, size_t> units[] = {
      {"\xD0\x96", 254}, {"\xE4\xB8\xAD", 252}, {"\xF0\x9F\x8E\xB5", 252}};
  for (const auto& unit : units) {
    std::string name;
    while (name.size() < 300) name += unit.first;
    __tag_QUVA_MEDIA_INFO r = CleanRecord();
    std::string path = "/m/" + name + "/" + name + ".mp3";
    strcpy(r.szPath, path.c_str());
    strcpy(r.szTitle, "\xE9");
    strcpy(r.szAlbum, "\xE9");
    MediaInfoValid(&r);
    EXPECT_EQ(strlen(r.szTitle), unit.second);
    EXPECT_EQ(strlen(r.szAlbum), unit.second);
    EXPECT_EQ(TryUTF8ToUTF16(r.szTitle), 1);
    EXPECT_EQ(TryUTF8ToUTF16(r.szAlbum), 1);
  }
}

TEST_F(MediaValidTest, ControlCharactersEmptyTheirFields) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  strcpy(r.szTitle, "a\tb");
  strcpy(r.szAlbumArtist, "line\n");
  strcpy(r.szGenre, "\x1F");
  strcpy(r.szComment, "keeps \x7F and \xC3\xA9");
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szTitle, "");
  EXPECT_STREQ(r.szAlbumArtist, "");
  EXPECT_STREQ(r.szGenre, "");
  EXPECT_STREQ(r.szComment, "keeps \x7F and \xC3\xA9");
}

TEST_F(MediaValidTest, UnterminatedTagEndsAtItsLastByte) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  memset(r.szArtist, 'a', sizeof(r.szArtist));
  MediaInfoValid(&r);
  EXPECT_EQ(std::string(r.szArtist), std::string(254, 'a'));
  EXPECT_STREQ(r.szAlbumArtist, "album artist");
}

TEST_F(MediaValidTest, NullRecordLogsBadParameter) {
  LogCapture log(0);
  MediaInfoValid(nullptr);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].priority, LOG_ERR);
  const std::string& text = log.lines()[0].text;
  EXPECT_EQ(text.rfind("quvaidx_unicode (", 0), 0u) << text;
  EXPECT_NE(text.find(") Bad parameter."), std::string::npos) << text;
}

}  // namespace

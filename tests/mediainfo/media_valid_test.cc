// MediaInfoValid against a host made to convert or fail: UTF-8 kept, UTF-16
// and code-page text converted, failed conversions with the path-based
// fallbacks, control characters.
#include <string.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/text.h"
#include "support/fake_host.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;

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

// Flagged UTF-16 is converted unless its bytes already read as UTF-8.
TEST_F(MediaValidTest, FlaggedUtf16IsConverted) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  memcpy(r.szArtist, "\xFF\xFE\x16\x04\0\0", 6);  // "Ж" after a BOM
  r.blArtistUTF16 = 1;
  memcpy(r.szTitle, "A\0B\0\0", 5);
  r.blTitleUTF16 = 1;
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szArtist, "\xD0\x96");
  EXPECT_STREQ(r.szTitle, "A");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 1);
}

// Unflagged non-UTF-8 is converted from the code page; a result too long
// for the field is cut at a character boundary.
TEST_F(MediaValidTest, UnflaggedNonUtf8IsConvertedFromTheCodePage) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  strcpy(r.szGenre, "caf\xE9");
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szGenre, "caf\xC3\xA9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 1);
  EXPECT_GE(host_.Calls(HostOp::kCodePageGet), 1);
  std::string cjk;
  while (cjk.size() < 400) cjk += "\xE4\xB8\xAD";
  host_.AnswerConversion(HostOp::kUnicodeStrCPToUTF8, cjk);
  strcpy(r.szComment, "\xE9");
  MediaInfoValid(&r);
  EXPECT_EQ(std::string(r.szComment), cjk.substr(0, 252));
}

TEST_F(MediaValidTest, FailedConversionsFallBackOrEmpty) {
  host_.Fail(HostOp::kUnicodeStrCPToUTF8, EILSEQ);
  host_.Fail(HostOp::kUnicodeStrUTF16ToUTF8, EILSEQ);
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  for (char* field :
       {r.szTitle, r.szArtist, r.szComposer, r.szComment, r.szAlbum}) {
    strcpy(field, "\xE9t\xE9");
  }
  strcpy(r.szAlbumArtist, "\xE9t\xE9");          // never re-encoded
  memcpy(r.szGenre, "\xFF\xFE\x00\xD8\0\0", 6);  // unpaired surrogate
  memset(r.szGenre + 6, 'x', 100);               // bytes after it are dropped
  r.blGenreUTF16 = 1;
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szTitle, "01 song");
  EXPECT_STREQ(r.szAlbum, "Album X");
  for (const char* field : {r.szArtist, r.szComposer, r.szComment}) {
    EXPECT_STREQ(field, "");
  }
  EXPECT_EQ(std::string(r.szGenre, sizeof(r.szGenre)),
            std::string(sizeof(r.szGenre), '\0'));
  EXPECT_STREQ(r.szAlbumArtist, "\xE9t\xE9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 5);
}

TEST_F(MediaValidTest, FallbackNamesFollowThePath) {
  host_.Fail(HostOp::kUnicodeStrCPToUTF8, EILSEQ);
  std::string cjk;
  while (cjk.size() < 300) cjk += "\xE4\xB8\xAD";
  const std::string cut = cjk.substr(0, 252);  // whole characters only
  const struct {
    std::string path, title, album;
  } cases[] = {{"/music/A/.hidden", "", "A"},
               {"/m/A/a.b.mp3", "a.b", "A"},
               {"/m/A/track", "track", "A"},
               {"song.mp3", "", ""},
               {"A/song.mp3", "song", ""},
               {"/m/" + cjk + "/" + cjk + ".mp3", cut, cut}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path.substr(0, 20));
    __tag_QUVA_MEDIA_INFO r = CleanRecord();
    strcpy(r.szPath, c.path.c_str());
    strcpy(r.szTitle, "\xE9");
    strcpy(r.szAlbum, "\xE9");
    MediaInfoValid(&r);
    EXPECT_EQ(std::string(r.szTitle), c.title);
    EXPECT_EQ(std::string(r.szAlbum), c.album);
  }
}

// Control characters empty their fields (DEL does not); an unterminated tag
// ends at its last byte.
TEST_F(MediaValidTest, ControlCharactersAndUnterminatedTags) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  strcpy(r.szTitle, "a\tb");
  strcpy(r.szAlbumArtist, "line\n");
  strcpy(r.szGenre, "\x1F");
  strcpy(r.szComment, "keeps \x7F and \xC3\xA9");
  memset(r.szArtist, 'a', sizeof(r.szArtist));
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szTitle, "");
  EXPECT_STREQ(r.szAlbumArtist, "");
  EXPECT_STREQ(r.szGenre, "");
  EXPECT_STREQ(r.szComment, "keeps \x7F and \xC3\xA9");
  EXPECT_EQ(std::string(r.szArtist), std::string(254, 'a'));
}

}  // namespace

// The text utilities (the two UTF-8 tests, ShortenString, StringTrim,
// EscapePercentSign, the code page) and MediaInfoValid against a host made
// to convert or fail.
#include <string.h>
#include <syslog.h>

#include <regex>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/text.h"
#include "support/fake_host.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostEtc;
using quvahost::test::HostOp;
using quvahost::test::WriteFile;

std::string Repeat(const std::string& unit, size_t at_least) {
  std::string text;
  while (text.size() < at_least) text += unit;
  return text;
}

const std::string kCjk = Repeat("\xE4\xB8\xAD", 2100);  // 中 repeated

TEST(TextTest, Utf8TestsAgreeWhereTheyShouldAndDifferWhereLooser) {
  // Text, IsUnicodeString, TryUTF8ToUTF16.
  const std::tuple<std::string, int, int> cases[] = {
      {"", 1, 1},
      {"\xD0\x96", 1, 1},
      {"\xF0\x9F\x8E\xB5", 1, 1},
      {"\xF8\x88\x80\x80\x80", 1, 0},  // five-byte form
      {"\xC0\x80", 1, 0},              // overlong
      {"\xED\xA0\x80", 1, 0},          // surrogate
      {"\xE2\x82", 0, 0},              // cut by the terminator
      {"caf\xE9", 0, 0}};
  for (const auto& [text, structural, strict] : cases) {
    EXPECT_EQ(IsUnicodeString(text.c_str()), structural) << text;
    EXPECT_EQ(TryUTF8ToUTF16(text.c_str()), strict) << text;
  }
  EXPECT_EQ(IsUnicodeString(nullptr), 1);
  EXPECT_EQ(TryUTF8ToUTF16(nullptr), 1);
}

TEST(TextTest, ShortenStringKeepsWholeCharacters) {
  const std::tuple<std::string, int, std::string> cases[] = {
      {"a\xC3\xA9", 4, "a\xC3\xA9"},
      {"a\xC3\xA9", 3, "a"},
      {"abc", 3, "ab"},
      {"\xF0\x9F\x8E\xB5x", 3, ""},        // first character does not fit
      {"caf\xE9 au lait", 5, "caf\xE9"},   // not UTF-8: byte cut
      {kCjk, 1500, kCjk.substr(0, 1497)},  // longer than 1023 bytes
      {std::string(3000, 'a'), 2000, std::string(1999, 'a')},
      {"abc", 1, ""}};
  for (const auto& [src, size, expected] : cases) {
    SCOPED_TRACE(src.substr(0, 12) + " size " + std::to_string(size));
    std::vector<char> dst(static_cast<size_t>(size) + 1, 'Z');
    ShortenString(src.c_str(), dst.data(), size);
    EXPECT_EQ(std::string(dst.data()), expected);
    EXPECT_EQ(dst[static_cast<size_t>(size)], 'Z');  // nothing beyond size
  }
  char dst[8] = "keep";  // bad arguments write nothing
  ShortenString(nullptr, dst, 8);
  ShortenString("", dst, 8);
  ShortenString("abc", dst, 0);
  ShortenString("abc", dst, -3);
  ShortenString("abc", nullptr, 8);
  EXPECT_STREQ(dst, "keep");
}

TEST(TextTest, StringTrimAndEscapePercentSign) {
  const std::pair<const char*, const char*> trims[] = {
      {"  a b  ", "a b"}, {"   ", "   "}, {"\ta ", "\ta"}, {"", ""}};
  for (const auto& c : trims) {
    char text[16];
    strcpy(text, c.first);
    StringTrim(text);
    EXPECT_STREQ(text, c.second) << "input '" << c.first << "'";
  }
  StringTrim(nullptr);
  // EscapePercentSign cuts by output bytes and writes nothing at or beyond
  // size.
  const std::tuple<int, const char*, int> cases[] = {
      {16, "50%%", 4}, {4, "50%", 3}, {3, "50", 2}, {1, "", 0}};
  for (const auto& [size, expected, result] : cases) {
    char dst[17];
    memset(dst, 'Z', sizeof(dst));
    EXPECT_EQ(EscapePercentSign("50%", dst, size), result);
    EXPECT_STREQ(dst, expected);
    EXPECT_EQ(dst[size], 'Z');
  }
  char dst[4] = "xyz";  // bad arguments write nothing
  EXPECT_EQ(EscapePercentSign("50%", dst, 0), -1);
  EXPECT_STREQ(dst, "xyz");
  EXPECT_EQ(EscapePercentSign(nullptr, dst, 4), -1);
  EXPECT_EQ(EscapePercentSign("a", nullptr, 4), -1);
}

TEST(TextTest, CodePageFallsBackTo15WhenTheHostFails) {
  HostEtc etc;
  WriteFile(etc.File("host.conf"), "[system]\ncode_page = 3\n");
  FakeHost host;
  EXPECT_EQ(QUVAIndexCodePageGet(), 3);
  host.Fail(HostOp::kCodePageGet, ENOENT);
  EXPECT_EQ(QUVAIndexCodePageGet(), 15);
  EXPECT_EQ(host.Calls(HostOp::kCodePageGet), 2);  // never cached
}

__tag_QUVA_MEDIA_INFO CleanRecord(const char* path = "/m/Album X/01 s.mp3") {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  strcpy(r.szPath, path);
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
  MediaValidTest() {
    WriteFile(etc_.File("host.conf"), "[system]\ncode_page = 1\n");  // 1252
  }
  HostEtc etc_;
  FakeHost host_;
};

// A clean UTF-8 record comes out unchanged without asking the host; a null
// record is logged.
TEST_F(MediaValidTest, CleanUtf8RecordComesOutUnchanged) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  __tag_QUVA_MEDIA_INFO before = r;
  MediaInfoValid(&r);
  EXPECT_EQ(memcmp(&r, &before, sizeof(r)), 0);
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 0);
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 0);
  quvaidx::test::LogCapture log;
  MediaInfoValid(nullptr);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_TRUE(std::regex_match(
      log.lines()[0].text,
      std::regex(R"(quvaidx_unicode \(\d+\) Bad parameter\.)")));
}

// Flagged UTF-16 is converted unless its bytes already read as UTF-8;
// unflagged non-UTF-8 is converted from the code page, a result too long for
// the field cut at a character boundary.
TEST_F(MediaValidTest, Utf16AndCodePageTextIsConverted) {
  __tag_QUVA_MEDIA_INFO r = CleanRecord();
  memcpy(r.szArtist, "\xFF\xFE\x16\x04\0\0", 6);  // "Ж" after a BOM
  r.blArtistUTF16 = 1;
  memcpy(r.szTitle, "A\0B\0\0", 5);
  r.blTitleUTF16 = 1;
  strcpy(r.szGenre, "caf\xE9");
  MediaInfoValid(&r);
  EXPECT_STREQ(r.szArtist, "\xD0\x96");
  EXPECT_STREQ(r.szTitle, "A");
  EXPECT_STREQ(r.szGenre, "caf\xC3\xA9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrUTF16ToUTF8), 1);
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 1);
  EXPECT_GE(host_.Calls(HostOp::kCodePageGet), 1);
  host_.AnswerConversion(HostOp::kUnicodeStrCPToUTF8, kCjk.substr(0, 402));
  strcpy(r.szComment, "\xE9");
  MediaInfoValid(&r);
  EXPECT_EQ(std::string(r.szComment), kCjk.substr(0, 252));
}

// Failed conversions: title and album fall back to names from the path,
// other fields are emptied.
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
  EXPECT_STREQ(r.szTitle, "01 s");
  EXPECT_STREQ(r.szAlbum, "Album X");
  for (const char* field : {r.szArtist, r.szComposer, r.szComment}) {
    EXPECT_STREQ(field, "");
  }
  EXPECT_EQ(std::string(r.szGenre, sizeof(r.szGenre)),
            std::string(sizeof(r.szGenre), '\0'));
  EXPECT_STREQ(r.szAlbumArtist, "\xE9t\xE9");
  EXPECT_EQ(host_.Calls(HostOp::kUnicodeStrCPToUTF8), 5);
  const std::string cjk = kCjk.substr(0, 300);
  const std::string cut = cjk.substr(0, 252);        // whole characters only
  const std::string a254(254, 'a'), t255(255, 't');  // a field holds 254
  const std::tuple<std::string, std::string, std::string> cases[] = {
      {"/music/A/.hidden", "", "A"},
      {"/m/A/a.b.mp3", "a.b", "A"},
      {"/m/A/track", "track", "A"},
      {"song.mp3", "", ""},
      {"A/song.mp3", "song", ""},
      {"/m/" + cjk + "/" + cjk + ".mp3", cut, cut},
      {"/m/" + a254 + "/" + t255 + ".mp3", t255.substr(1), a254}};
  for (const auto& [path, title, album] : cases) {
    r = CleanRecord(path.c_str());
    strcpy(r.szTitle, "\xE9");
    strcpy(r.szAlbum, "\xE9");
    MediaInfoValid(&r);
    EXPECT_EQ(std::string(r.szTitle), title) << path.substr(0, 20);
    EXPECT_EQ(std::string(r.szAlbum), album) << path.substr(0, 20);
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

// The text utilities: the two UTF-8 tests, ShortenString, StringTrim,
// EscapePercentSign and the code page.
#include <string.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/text.h"
#include "support/fake_host.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;

TEST(TextTest, Utf8TestsAgreeWhereTheyShouldAndDifferWhereLooser) {
  const struct {
    std::string text;
    int structural;  // IsUnicodeString
    int strict;      // TryUTF8ToUTF16
  } cases[] = {{"", 1, 1},
               {"\xD0\x96", 1, 1},
               {"\xF0\x9F\x8E\xB5", 1, 1},
               {"\xF8\x88\x80\x80\x80", 1, 0},  // five-byte form
               {"\xC0\x80", 1, 0},              // overlong
               {"\xED\xA0\x80", 1, 0},          // surrogate
               {"\xE2\x82", 0, 0},              // cut by the terminator
               {"caf\xE9", 0, 0}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    EXPECT_EQ(IsUnicodeString(c.text.c_str()), c.structural);
    EXPECT_EQ(TryUTF8ToUTF16(c.text.c_str()), c.strict);
  }
  EXPECT_EQ(IsUnicodeString(nullptr), 1);
  EXPECT_EQ(TryUTF8ToUTF16(nullptr), 1);
}

TEST(TextTest, ShortenStringKeepsWholeCharacters) {
  std::string cjk;
  while (cjk.size() < 2100) cjk += "\xE4\xB8\xAD";
  const struct {
    std::string src;
    int size;
    std::string expected;
  } cases[] = {{"a\xC3\xA9", 4, "a\xC3\xA9"},
               {"a\xC3\xA9", 3, "a"},
               {"abc", 3, "ab"},
               {"\xF0\x9F\x8E\xB5x", 3, ""},  // first character does not fit
               {"caf\xE9 au lait", 5, "caf\xE9"},  // not UTF-8: byte cut
               {cjk, 1500, cjk.substr(0, 1497)},   // longer than 1023 bytes
               {std::string(3000, 'a'), 2000, std::string(1999, 'a')},
               {"abc", 1, ""}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.src.substr(0, 12) + " size " + std::to_string(c.size));
    std::vector<char> dst(static_cast<size_t>(c.size) + 1, 'Z');
    ShortenString(c.src.c_str(), dst.data(), c.size);
    EXPECT_EQ(std::string(dst.data()), c.expected);
    EXPECT_EQ(dst[static_cast<size_t>(c.size)], 'Z');  // nothing beyond size
  }
  char dst[8] = "keep";  // bad arguments write nothing
  ShortenString(nullptr, dst, 8);
  ShortenString("", dst, 8);
  ShortenString("abc", dst, 0);
  ShortenString("abc", dst, -3);
  ShortenString("abc", nullptr, 8);
  EXPECT_STREQ(dst, "keep");
}

TEST(TextTest, StringTrimRemovesBlanksOnly) {
  const std::pair<const char*, const char*> cases[] = {
      {"  a b  ", "a b"}, {"   ", "   "}, {"\ta ", "\ta"}, {"", ""}};
  for (const auto& c : cases) {
    char text[16];
    strcpy(text, c.first);
    StringTrim(text);
    EXPECT_STREQ(text, c.second) << "input '" << c.first << "'";
  }
  StringTrim(nullptr);
}

TEST(TextTest, EscapePercentSignCutsByOutputBytes) {
  const struct {
    int size;
    const char* expected;
    int result;
  } cases[] = {{16, "50%%", 4}, {4, "50%", 3}, {3, "50", 2}, {1, "", 0}};
  for (const auto& c : cases) {
    char dst[17];
    memset(dst, 'Z', sizeof(dst));
    EXPECT_EQ(EscapePercentSign("50%", dst, c.size), c.result);
    EXPECT_STREQ(dst, c.expected);
    EXPECT_EQ(dst[c.size], 'Z');  // nothing at or beyond size
  }
  char dst[4] = "xyz";  // bad arguments write nothing
  EXPECT_EQ(EscapePercentSign("50%", dst, 0), -1);
  EXPECT_STREQ(dst, "xyz");
  EXPECT_EQ(EscapePercentSign(nullptr, dst, 4), -1);
  EXPECT_EQ(EscapePercentSign("a", nullptr, 4), -1);
}

TEST(TextTest, CodePageFallsBackTo15WhenTheHostFails) {
  FakeHost host;
  host.AnswerCodePage(3);
  EXPECT_EQ(QUVAIndexCodePageGet(), 3);
  host.Fail(HostOp::kCodePageGet, ENOENT);
  EXPECT_EQ(QUVAIndexCodePageGet(), 15);
  EXPECT_EQ(host.Calls(HostOp::kCodePageGet), 2);  // never cached
}

}  // namespace

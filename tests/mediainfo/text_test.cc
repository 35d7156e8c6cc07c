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

struct Utf8Case {
  const char* fault;
  std::string text;
  int structural;  // IsUnicodeString
  int strict;      // TryUTF8ToUTF16
};

TEST(TextTest, Utf8TestsAgreeWhereTheyShouldAndDifferWhereLooser) {
  const Utf8Case cases[] = {
      {"EmptyIsUtf8", "", 1, 1},
      {"Ascii", "abc", 1, 1},
      {"Cyrillic", "\xD0\x96", 1, 1},
      {"FourByte", "\xF0\x9F\x8E\xB5", 1, 1},
      {"FiveByteFormOnlyStructural", "\xF8\x88\x80\x80\x80", 1, 0},
      {"OverlongOnlyStructural", "\xC0\x80", 1, 0},
      {"SurrogateOnlyStructural", "\xED\xA0\x80", 1, 0},
      {"LoneContinuation", "\x80", 0, 0},
      {"CutByTerminator", "\xE2\x82", 0, 0},
      {"ByteFE", "a\xFE", 0, 0},
      {"Latin1", "caf\xE9", 0, 0},
  };
  for (const Utf8Case& c : cases) {
    SCOPED_TRACE(c.fault);
    EXPECT_EQ(IsUnicodeString(c.text.c_str()), c.structural);
    EXPECT_EQ(TryUTF8ToUTF16(c.text.c_str()), c.strict);
  }
  EXPECT_EQ(IsUnicodeString(nullptr), 1);
  EXPECT_EQ(TryUTF8ToUTF16(nullptr), 1);
}

struct ShortenCase {
  const char* fault;
  std::string src;
  int size;
  std::string expected;
};

std::string Repeat(const std::string& unit, size_t times) {
  std::string s;
  for (size_t i = 0; i < times; ++i) s += unit;
  return s;
}

TEST(TextTest, ShortenStringKeepsWholeCharacters) {
  const std::string cjk = Repeat("\xE4\xB8\xAD", 700);  // 2100 bytes
  const ShortenCase cases[] = {
      {"FitsWhole", "a\xC3\xA9", 4, "a\xC3\xA9"},
      {"SplitTwoByteCharDropped", "a\xC3\xA9", 3, "a"},
      {"ExactlySizeBytesIsShortened", "abc", 3, "ab"},
      {"FirstCharTooLongGivesEmpty", "\xF0\x9F\x8E\xB5x", 3, ""},
      {"NotUtf8PlainByteCut", "caf\xE9 au lait", 5, "caf\xE9"},
      {"LongerThan1023Bytes", cjk, 1500, cjk.substr(0, 1497)},
      {"LongerThan1023BytesSmallSize", cjk, 11, cjk.substr(0, 9)},
      {"LongAsciiWholeBuffer", std::string(3000, 'a'), 2000,
       std::string(1999, 'a')},
      {"SizeOneEmpty", "abc", 1, ""},
  };
  for (const ShortenCase& c : cases) {
    SCOPED_TRACE(c.fault);
    std::vector<char> dst(static_cast<size_t>(c.size) + 1, 'Z');
    ShortenString(c.src.c_str(), dst.data(), c.size);
    EXPECT_EQ(std::string(dst.data()), c.expected);
    EXPECT_EQ(dst[static_cast<size_t>(c.size)], 'Z');  // nothing beyond size
  }
}

TEST(TextTest, ShortenStringWritesNothingForBadArguments) {
  char dst[8] = "keep";
  ShortenString(nullptr, dst, 8);
  ShortenString("", dst, 8);
  ShortenString("abc", dst, 0);
  ShortenString("abc", dst, -3);
  ShortenString("abc", nullptr, 8);
  EXPECT_STREQ(dst, "keep");
}

TEST(TextTest, StringTrimRemovesBlanksOnly) {
  const std::pair<const char*, const char*> cases[] = {
      {"  a b  ", "a b"}, {"   ", "   "}, {"\ta ", "\ta"},
      {"", ""},           {"x", "x"},     {" x", "x"},
  };
  for (const auto& c : cases) {
    char text[16];
    strcpy(text, c.first);
    StringTrim(text);
    EXPECT_STREQ(text, c.second) << "input '" << c.first << "'";
  }
  StringTrim(nullptr);
}

TEST(TextTest, EscapePercentSignCutsByOutputBytes) {
  struct {
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
  char dst[4] = "xyz";
  EXPECT_EQ(EscapePercentSign("50%", dst, 0), -1);
  EXPECT_STREQ(dst, "xyz");
  EXPECT_EQ(EscapePercentSign(nullptr, dst, 4), -1);
  EXPECT_EQ(EscapePercentSign("a", nullptr, 4), -1);
  EXPECT_EQ(EscapePercentSign("50%", dst, -1), 0);
  EXPECT_STREQ(dst, "");
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

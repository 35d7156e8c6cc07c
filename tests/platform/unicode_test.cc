#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <tuple>

#include "support/fake_host.h"

namespace quvahost::test {
namespace {

TEST(CodePageTest, SettingForms) {
  HostEtc etc;
  // The setting (null: no settings file), the result, the code page or
  // the error.
  const std::tuple<const char*, int, int> cases[] = {
      {nullptr, -1, ENOENT},
      {"[system]\ncode_page = 15\n", 0, 15},
      {"[system]\ncode_page = windows-1251\n", 0, 3},
      {"[system]\ncode_page = \"WINDOWS-31J\"\n", 0, 11},
      {"[system]\ncode_page = 16\n", -1, EINVAL},
      {"code_page = 1\n", -1, ENOENT}};
  for (const auto& [setting, result, code_page_or_error] : cases) {
    SCOPED_TRACE(setting ? setting : "(none)");
    if (setting != nullptr) WriteFile(etc.File("host.conf"), setting);
    int code_page = 777;
    EXPECT_EQ(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, &code_page), result);
    EXPECT_EQ(result == 0 ? code_page : QLIBCErrGet(), code_page_or_error);
    EXPECT_TRUE(result == 0 || code_page == 777);
  }
  int code_page = 0;
  EXPECT_EQ(QLIBCCodePageGet(0, &code_page), -1);
  EXPECT_EQ(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, nullptr), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  for (code_page = 0; code_page <= 15; ++code_page) {  // every converter opens
    char out[255];
    EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(code_page, "Abc 123", out, sizeof out), 7)
        << code_page;
  }
}

// The text a conversion left in `out`, filled with '#' before: "untouched"
// when it failed without writing.
std::string Written(int result, const char* out) {
  return result >= 0 ? out : out[0] == '#' ? "untouched" : "written";
}

// Output is cut on a character boundary to out_size; input is read no
// further than out_size bytes, and a character cut by that limit is dropped.
TEST(UTF16Test, ByteOrderCharactersAndBounds) {
  std::string long_text;  // 127 'A' within the 254 bytes read, then 'B'
  for (int i = 0; i < 150; ++i)
    long_text += std::string(i < 127 ? "A" : "B") + '\0';
  const struct {
    std::string bytes;
    int out_size, result;
    std::string utf8;
  } cases[] = {
      {std::string("A\0B\0\0\0", 6), 255, 2, "AB"},          // LE, no BOM
      {std::string("\377\376A\0B\0\0\0", 8), 255, 2, "AB"},  // LE BOM
      {std::string("\xFE\xFF\0A\0B\0\0", 8), 255, 2, "AB"},  // BE BOM
      // Only both bytes make a mark: one of them alone is text.
      {std::string("\376\0\0\0", 4), 255, 2, "\xC3\xBE"},     // U+00FE
      {std::string("\377\0\0\0", 4), 255, 2, "\xC3\xBF"},     // U+00FF
      {std::string("A\377\0\0", 4), 255, 3, "\xEF\xBD\x81"},  // U+FF41
      {std::string("A\376\0\0", 4), 255, 3, "\xEF\xB9\x81"},  // U+FE41
      {std::string("\xE5\x65\x2C\x67\0\0", 6), 255, 6, "日本"},
      {std::string("\x3D\xD8\x00\xDE\0\0", 6), 255, 4, "\xF0\x9F\x98\x80"},
      {std::string("\0\336A\0\0\0", 6), 255, -1, "untouched"},  // lone trail
      {std::string("=\330A\0\0\0", 6), 255, -1, "untouched"},   // lone lead
      {std::string("\x3D\xD8\0\0", 4), 255, -1, "untouched"},  // lead, then end
      {std::string("\xE5\x65\x2C\x67\0", 5), 6, 3, "日"},
      {std::string("A\0\x3D\xD8\x00\xDE\0", 7), 4, 1, "A"},
      {long_text, 255, 127, std::string(127, 'A')}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.utf8.substr(0, 8));
    char text[320] = {};
    memcpy(text, c.bytes.data(), c.bytes.size());
    char out[300];
    memset(out, '#', sizeof out);
    EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(text, out, c.out_size), c.result);
    EXPECT_EQ(Written(c.result, out), c.utf8);
    EXPECT_EQ(out[c.out_size], '#');
    EXPECT_TRUE(c.result >= 0 || QLIBCErrGet() == EILSEQ);
  }
  char field[255] = "h\0i\0\0";  // in place
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(field, field, sizeof field), 2);
  EXPECT_STREQ(field, "hi");
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(nullptr, field, 8), -1);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8("a\0", nullptr, 8), -1);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8("a\0", field, 0), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

TEST(CodePageConversionTest, TextsAndBounds) {
  const std::string aaaa(15, 'a');  // no terminator within 8 bytes
  const std::string e254(254, '\xE9');
  std::string e127;
  for (int i = 0; i < 127; ++i) e127 += "é";
  const struct {
    int code_page;
    const char* text;
    int out_size, result;
    const char* utf8;
    int error;
  } cases[] = {{1, "caf\xE9", 255, 5, "café", 0},
               {11, "\x93\xFA\x96\x7B", 255, 6, "日本", 0},
               {0, "\xC3\xA9t\xC3\xA9", 255, 5, "été", 0},
               {0, "ab\xC3", 255, -1, "untouched", EILSEQ},    // cut UTF-8
               {0, "\xC0\x80", 255, -1, "untouched", EILSEQ},  // overlong
               {11, "\x93", 255, -1, "untouched", EILSEQ},     // cut Shift_JIS
               {99, "abc", 255, -1, "untouched", EINVAL},
               {1, "abc", 0, -1, "untouched", EINVAL},  // no room at all
               {1, "", 255, 0, "", 0},
               {1, "\xE9\xE9\xE9", 4, 2, "é", 0},
               {1, aaaa.c_str(), 8, 7, "aaaaaaa", 0},
               // 日日 limited to 3 input bytes: the second 日 is cut.
               {11, "\x93\xFA\x93\xFA", 4, 3, "日", 0},
               // 254 Latin-1 bytes expand to 508 bytes of UTF-8: cut to 254.
               {15, e254.c_str(), 255, 254, e127.c_str(), 0}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    char out[300];
    memset(out, '#', sizeof out);
    EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(c.code_page, c.text, out, c.out_size),
              c.result);
    EXPECT_EQ(Written(c.result, out), c.utf8);
    EXPECT_EQ(out[c.out_size], '#');
    EXPECT_TRUE(c.result >= 0 || QLIBCErrGet() == c.error);
  }
}

TEST(UTF8StepTest, CountAndForward) {
  const std::pair<const char*, int> counts[] = {
      {"a\xC3\xA9日", 3}, {"\x80\x80-", 2}, {"\xC3", 1}};
  for (const auto& [text, count] : counts)
    EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar(text), count) << text;
  EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar(nullptr), -1);
  const char* text = "a\xC3\xA9日";  // 1 + 2 + 3 bytes
  const int offsets[] = {0, 1, 3, 6};
  for (int n = 0; n < 4; ++n)
    EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(text, n), text + offsets[n]);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(text, -1), nullptr);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(nullptr, 0), nullptr);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(text, 4), nullptr);
  EXPECT_EQ(QLIBCErrGet(), ERANGE);
  const char* cut = "\xE6\x97";  // two bytes of a 3-byte character
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(cut, 1), cut + 2);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(cut, 2), nullptr);
}

}  // namespace
}  // namespace quvahost::test

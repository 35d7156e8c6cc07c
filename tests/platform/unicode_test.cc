#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

// --- QLIBCCodePageGet
// ---------------------------------------------------------

TEST(CodePageTest, SettingForms) {
  HostEtc etc;
  struct Case {
    const char* setting;
    int result, code_page, error;
  } cases[] = {
      {"[system]\ncode_page = 1\n", 0, 1, 0},
      {"[system]\ncode_page = 15\n", 0, 15, 0},
      {"[system]\ncode_page = 0\n", 0, 0, 0},
      {"[system]\ncode_page = windows-1251\n", 0, 3, 0},
      {"[system]\ncode_page = \"WINDOWS-31J\"\n", 0, 11, 0},
      {"[system]\ncode_page = 16\n", -1, 0, EINVAL},
      {"[system]\ncode_page = -1\n", -1, 0, EINVAL},
      {"[system]\ncode_page = klingon\n", -1, 0, EINVAL},
      {"[system]\ncode_page =\n", -1, 0, EINVAL},
      {"[other]\ncode_page = 1\n", -1, 0, ENOENT},
      {"code_page = 1\n", -1, 0, ENOENT},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.setting);
    WriteFile(etc.File("host.conf"), c.setting);
    int code_page = 777;
    EXPECT_EQ(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, &code_page), c.result);
    if (c.result == 0) {
      EXPECT_EQ(code_page, c.code_page);
    } else {
      EXPECT_EQ(code_page, 777);
      EXPECT_EQ(QLIBCErrGet(), c.error);
    }
  }
}

TEST(CodePageTest, NoSettingsFileFails) {
  HostEtc etc;
  int code_page = 777;
  EXPECT_EQ(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, &code_page), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(code_page, 777);
}

TEST(CodePageTest, BadSelectorOrOutput) {
  HostEtc etc;
  WriteFile(etc.File("host.conf"), "[system]\ncode_page = 1\n");
  int code_page = 0;
  EXPECT_EQ(QLIBCCodePageGet(0, &code_page), -1);
  EXPECT_EQ(QLIBCCodePageGet(2, &code_page), -1);
  EXPECT_EQ(QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, nullptr), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// Every identifier of the table has a converter that ICU can open.
TEST(CodePageTest, EveryTableEntryConverts) {
  for (int code_page = 0; code_page <= 15; ++code_page) {
    char out[255];
    EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(code_page, "Abc 123", out, sizeof out), 7)
        << code_page;
    EXPECT_STREQ(out, "Abc 123");
  }
}

// --- QLIBCUnicodeStrUTF16ToUTF8
// ------------------------------------------------

TEST(UTF16Test, ByteOrderAndCharacters) {
  struct Case {
    std::string bytes;
    int result;
    const char* utf8;
  } cases[] = {
      {std::string("A\0B\0\0\0", 6), 2, "AB"},  // LE, no BOM
      {std::string("\xFF\xFE"
                   "A\0B\0\0\0",
                   8),
       2, "AB"},                                        // LE BOM
      {std::string("\xFE\xFF\0A\0B\0\0", 8), 2, "AB"},  // BE BOM
      {std::string("\xE9\0\0\0", 4), 2, "\xC3\xA9"},    // é
      {std::string("\xE5\x65\x2C\x67\0\0", 6), 6, "日本"},
      {std::string("\x3D\xD8\x00\xDE\0\0", 6), 4, "\xF0\x9F\x98\x80"},
      {std::string("\0\0", 2), 0, ""},
      {std::string("\xFF\xFE\0\0", 4), 0, ""},
      {std::string("\x00\xDE"
                   "A\0\0\0",
                   6),
       -1, nullptr},  // lone trail
      {std::string("\x3D\xD8"
                   "A\0\0\0",
                   6),
       -1, nullptr},                                  // lone lead
      {std::string("\x3D\xD8\0\0", 4), -1, nullptr},  // lead, then end
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.utf8 != nullptr ? c.utf8 : "(bad)");
    char text[64] = {};
    memcpy(text, c.bytes.data(), c.bytes.size());
    char out[255];
    strcpy(out, "untouched");
    EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(text, out, sizeof out), c.result);
    EXPECT_STREQ(out, c.utf8 != nullptr ? c.utf8 : "untouched");
    if (c.result < 0) {
      EXPECT_EQ(QLIBCErrGet(), EILSEQ);
    }
  }
}

TEST(UTF16Test, OutputIsCutAtCharacterBoundary) {
  char text[] = "\xE5\x65\x2C\x67\x00\x00";  // 日本
  char out[8];
  memset(out, '#', sizeof out);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(text, out, 6), 3);
  EXPECT_STREQ(out, "日");
  EXPECT_EQ(out[6], '#');
}

// A full 255-byte field without a zero code unit: nothing beyond the field
// is read.
TEST(UTF16Test, InputIsNotReadBeyondOutputSize) {
  char memory[300];
  for (int i = 0; i < 300; i += 2) {
    memory[i] = i < 254 ? 'A' : 'B';
    memory[i + 1] = 0;
  }
  char out[255];
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(memory, out, 255), 127);
  EXPECT_EQ(std::string(out), std::string(127, 'A'));
}

TEST(UTF16Test, SurrogatePairCutByInputLimitIsDropped) {
  char text[] = "A\0\x3D\xD8\x00\xDE\0";  // A, then 😀 whose 2nd half is past 4
  char out[16];
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(text, out, 4), 1);
  EXPECT_STREQ(out, "A");
}

TEST(UTF16Test, ConvertsInPlace) {
  char field[255] = {};
  memcpy(field, "h\0i\0\0\0", 6);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(field, field, sizeof field), 2);
  EXPECT_STREQ(field, "hi");
}

TEST(UTF16Test, BadArguments) {
  char out[8];
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8(nullptr, out, 8), -1);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8("a\0", nullptr, 8), -1);
  EXPECT_EQ(QLIBCUnicodeStrUTF16ToUTF8("a\0", out, 0), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// --- QLIBCUnicodeStrCPToUTF8
// ---------------------------------------------------

TEST(CodePageConversionTest, Texts) {
  struct Case {
    int code_page;
    const char* text;
    int result;
    const char* utf8;
    int error;
  } cases[] = {
      {1, "caf\xE9", 5, "café", 0},
      {15, "\xFF\xE9", 4, "ÿé", 0},
      {3, "\xCF\xF0\xE8\xE2\xE5\xF2", 12, "Привет", 0},
      {11, "\x93\xFA\x96\x7B", 6, "日本", 0},
      {12, "\xC4\xE3\xBA\xC3", 6, "你好", 0},
      {0, "\xC3\xA9t\xC3\xA9", 5, "été", 0},
      {0, "ab\xC3", -1, nullptr, EILSEQ},    // truncated UTF-8
      {0, "\xC0\x80", -1, nullptr, EILSEQ},  // overlong
      {11, "\x93", -1, nullptr, EILSEQ},     // truncated Shift_JIS
      {99, "abc", -1, nullptr, EINVAL},
      {-1, "abc", -1, nullptr, EINVAL},
      {1, "", 0, "", 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.code_page);
    char out[255];
    strcpy(out, "untouched");
    EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(c.code_page, c.text, out, sizeof out),
              c.result);
    EXPECT_STREQ(out, c.utf8 != nullptr ? c.utf8 : "untouched");
    if (c.result < 0) {
      EXPECT_EQ(QLIBCErrGet(), c.error);
    }
  }
}

TEST(CodePageConversionTest, OutputIsCutAtCharacterBoundary) {
  char out[8];
  memset(out, '#', sizeof out);
  EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(1, "\xE9\xE9\xE9", out, 4), 2);
  EXPECT_STREQ(out, "é");
  EXPECT_EQ(out[4], '#');
}

// Latin-1 text of 255 bytes becomes up to 510 bytes of UTF-8: cut to 254,
// on a character boundary.
TEST(CodePageConversionTest, FullFieldExpandsAndIsCut) {
  char field[255];
  memset(field, '\xE9', 254);
  field[254] = '\0';
  char out[255];
  EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(15, field, out, sizeof out), 254);
  EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar(out), 127);
}

TEST(CodePageConversionTest, InputIsNotReadBeyondOutputSize) {
  char memory[16];
  memset(memory, 'a', sizeof memory);  // no terminator within 8 bytes
  memory[15] = '\0';
  char out[16];
  EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(1, memory, out, 8), 7);
  EXPECT_STREQ(out, "aaaaaaa");
}

TEST(CodePageConversionTest, MultiByteCharacterCutByInputLimitIsDropped) {
  char out[16];
  // 日日 in Shift_JIS, limited to 3 input bytes: the second 日 is cut.
  EXPECT_EQ(QLIBCUnicodeStrCPToUTF8(11, "\x93\xFA\x93\xFA", out, 4), 3);
  EXPECT_STREQ(out, "日");
}

// --- counting and stepping ---------------------------------------------------

TEST(UTF8StepTest, CountChar) {
  struct Case {
    const char* text;
    int count;
  } cases[] = {{"", 0},
               {"abc", 3},
               {"a\xC3\xA9", 2},
               {"日本", 2},
               {"\xF0\x9F\x98\x80", 1},
               {"\x80", 1},
               {"\x80\x80"
                "a",
                2},
               {"\xC3", 1}};
  for (const Case& c : cases) {
    EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar(c.text), c.count) << c.text;
  }
  EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar(nullptr), -1);
}

TEST(UTF8StepTest, ForwardNChar) {
  const char* text = "a\xC3\xA9日";  // 1 + 2 + 3 bytes
  struct Case {
    int n;
    int offset;  // -1: null
  } cases[] = {{0, 0}, {1, 1}, {2, 3}, {3, 6}, {4, -1}, {-1, -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.n);
    const char* p = QLIBCUnicodeUTF8ForwardNChar(text, c.n);
    if (c.offset < 0) {
      EXPECT_EQ(p, nullptr);
    } else {
      EXPECT_EQ(p, text + c.offset);
    }
  }
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(nullptr, 0), nullptr);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar("ab", 3), nullptr);
  EXPECT_EQ(QLIBCErrGet(), ERANGE);
}

TEST(UTF8StepTest, TruncatedSequenceNeverStepsPastTerminator) {
  const char* text = "\xE6\x97";  // first two bytes of a 3-byte character
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(text, 1), text + 2);
  EXPECT_EQ(QLIBCUnicodeUTF8ForwardNChar(text, 2), nullptr);
}

}  // namespace
}  // namespace quvahost::test

#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "file_line.h"
#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

constexpr int kBuf = 4097;

int GetLine(const std::string& file, const char* key, std::string* line) {
  char buffer[kBuf];
  strcpy(buffer, "untouched");
  int result =
      QLIBCFileGetLine(file.c_str(), key, buffer, kBuf, QLIBC_GETLINE_EXACT);
  if (line != nullptr) *line = buffer;
  return result;
}

TEST(FileGetLineTest, ExactLineMatch) {
  TempDir dir;
  struct Case {
    const char* content;
    const char* key;
    int result;
  } cases[] = {
      {"/a/b\n/a/c\n", "/a/b", 1},
      {"/a/b\n/a/c\n", "/a/c", 1},
      {"/a/b\n/a/c", "/a/c", 1},  // last line without line end
      {"/a/bc\n", "/a/b", 0},     // prefix of a line
      {"x/a/b\n", "/a/b", 0},     // suffix of a line
      {"/a/b/\n", "/a/b", 0},
      {"/a/b\r\n", "/a/b", 0},  // '\r' is part of the line
      {"/a/b \n", "/a/b", 0},
      {"", "/a/b", 0},
      {"\n", "", 1},  // an empty line
      {"a\n\nb\n", "", 1},
      {"a\nb\n", "", 0},  // no empty line
      {"", "", 0},        // an empty file has no lines
      {"a\nb", "", 0},
      {"/a/b/a/b\n", "/a/b", 0},
      {"/a/b\n", "/A/B", 0},  // case-sensitive
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.content) + " / " + c.key);
    WriteFile(dir.File("q"), c.content);
    std::string line;
    EXPECT_EQ(GetLine(dir.File("q"), c.key, &line), c.result);
    EXPECT_EQ(line, c.result == 1 ? c.key : "untouched");
  }
}

TEST(FileGetLineTest, NulBytesInFileDoNotStopTheSearch) {
  TempDir dir;
  WriteFile(dir.File("q"), std::string("x\0y\n/a/b\n", 9));
  EXPECT_EQ(GetLine(dir.File("q"), "/a/b", nullptr), 1);
}

// A matching line placed so that it crosses the first block boundary at
// every offset around it, and so that its line ends fall on either side.
TEST(FileGetLineTest, LineCrossingBlockBoundaryIsFound) {
  TempDir dir;
  const std::string key = "/share/photo/2015/07/summer";
  for (int shift = -40; shift <= 40; ++shift) {
    SCOPED_TRACE(shift);
    size_t start = kLineSearchBlock + shift;  // offset of the key's first byte
    std::string filler(start - 1, 'f');
    std::string content = filler + "\n" + key + "\nlast\n";
    WriteFile(dir.File("q"), content);
    EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 1);
    // The same bytes without the line end before the key: no match.
    WriteFile(dir.File("q"), filler + "x" + key + "\nlast\n");
    EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 0);
    // Key as the last line without line end, near the boundary.
    WriteFile(dir.File("q"), filler + "\n" + key);
    EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 1);
    // Key followed by more text on its line: no match.
    WriteFile(dir.File("q"), filler + "\n" + key + "more");
    EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 0);
  }
}

TEST(FileGetLineTest, EmptyLineAtBlockBoundaryIsFound) {
  TempDir dir;
  for (int shift = -2; shift <= 2; ++shift) {
    std::string content(kLineSearchBlock + shift, 'a');
    content += "\n\nb\n";
    WriteFile(dir.File("q"), content);
    EXPECT_EQ(GetLine(dir.File("q"), "", nullptr), 1) << shift;
  }
}

TEST(FileGetLineTest, LongKeyLongerThanCarryOfSmallFiles) {
  TempDir dir;
  std::string key(4096, 'k');
  WriteFile(dir.File("q"), "a\n" + key + "\n");
  EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 1);
  WriteFile(dir.File("q"), key.substr(1) + "\n");
  EXPECT_EQ(GetLine(dir.File("q"), key.c_str(), nullptr), 0);
}

TEST(FileGetLineTest, HundredThousandLinesAreSearchedQuickly) {
  TempDir dir;
  std::string content;
  for (int i = 0; i < 100000; ++i) {
    content += "/share/Multimedia/photos/album" + std::to_string(i) + "\n";
  }
  WriteFile(dir.File("q"), content);
  auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(GetLine(dir.File("q"), "/share/Multimedia/photos/album", nullptr),
              0);
    EXPECT_EQ(
        GetLine(dir.File("q"), "/share/Multimedia/photos/album99999", nullptr),
        1);
  }
  auto elapsed = std::chrono::steady_clock::now() - start;
  // 40 scans of 4 MB; a per-line reader with allocations takes far longer.
  EXPECT_LT(elapsed, std::chrono::seconds(2));
}

TEST(FileGetLineTest, BadArgumentsAndFiles) {
  TempDir dir;
  WriteFile(dir.File("q"), "a\n");
  char buffer[kBuf];
  std::string q = dir.File("q");
  struct Case {
    const char* file;
    const char* key;
    char* buffer;
    int size, option, error;
  } cases[] = {
      {q.c_str(), "a", buffer, kBuf, 0, EINVAL},
      {q.c_str(), "a", buffer, kBuf, 0x4, EINVAL},
      {nullptr, "a", buffer, kBuf, QLIBC_GETLINE_EXACT, EINVAL},
      {q.c_str(), nullptr, buffer, kBuf, QLIBC_GETLINE_EXACT, EINVAL},
      {q.c_str(), "a", nullptr, kBuf, QLIBC_GETLINE_EXACT, EINVAL},
      {q.c_str(), "a\nb", buffer, kBuf, QLIBC_GETLINE_EXACT, EINVAL},
      {q.c_str(), "a", buffer, 1, QLIBC_GETLINE_EXACT, ERANGE},
      {q.c_str(), "a", buffer, 0, QLIBC_GETLINE_EXACT, ERANGE},
      {"/nonexistent/q", "a", buffer, kBuf, QLIBC_GETLINE_EXACT, ENOENT},
      {dir.path().c_str(), "a", buffer, kBuf, QLIBC_GETLINE_EXACT, EISDIR},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.error);
    EXPECT_EQ(QLIBCFileGetLine(c.file, c.key, c.buffer, c.size, c.option), -1);
    EXPECT_EQ(QLIBCErrGet(), c.error);
  }
  EXPECT_EQ(QLIBCFileGetLine(q.c_str(), "a", buffer, 2, QLIBC_GETLINE_EXACT),
            1);
  EXPECT_STREQ(buffer, "a");
}

TEST(FileGetLineTest, FifoIsRefusedWithoutBlocking) {
  TempDir dir;
  ASSERT_EQ(mkfifo(dir.File("fifo").c_str(), 0600), 0);
  EXPECT_EQ(GetLine(dir.File("fifo"), "a", nullptr), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// --- QLIBCFileGetSectionValue ---------------------------------------------

const char kIni[] =
    "top = before any section\n"
    "# comment = no\n"
    "[video]\n"
    "guid = 1234-abcd\n"
    "  spaced   =   inner value  \n"
    "quoted = \"  kept  \"\n"
    "empty =\n"
    "eq = a=b\n"
    "crlf = yes\r\n"
    "novalue\n"
    "guid = second\n"
    "[ music ]\n"
    "guid = 99\n"
    "[video]\n"
    "late = ignored\n";

TEST(SectionValueTest, ReadsValues) {
  TempDir dir;
  WriteFile(dir.File("map"), kIni);
  struct Case {
    const char* section;
    const char* key;
    int result;
    const char* value;
  } cases[] = {
      {"video", "guid", 9, "1234-abcd"},
      {"video", "spaced", 11, "inner value"},
      {"video", "quoted", 8, "  kept  "},
      {"video", "empty", 0, ""},
      {"video", "eq", 3, "a=b"},
      {"video", "crlf", 3, "yes"},
      {"music", "guid", 2, "99"},
      {"", "top", 18, "before any section"},
      {"video", "late", -1, nullptr},
      {"video", "novalue", -1, nullptr},
      {"video", "# comment", -1, nullptr},
      {"Video", "guid", -1, nullptr},
      {"photo", "guid", -1, nullptr},
      {"", "guid", -1, nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.section) + "/" + c.key);
    char buffer[256] = "untouched";
    EXPECT_EQ(QLIBCFileGetSectionValue(dir.File("map").c_str(), c.section,
                                       c.key, buffer, sizeof buffer),
              c.result);
    EXPECT_STREQ(buffer, c.value != nullptr ? c.value : "untouched");
    if (c.result < 0) {
      EXPECT_EQ(QLIBCErrGet(), ENOENT);
    }
  }
}

TEST(SectionValueTest, ValueThatDoesNotFitFailsWithoutWriting) {
  TempDir dir;
  WriteFile(dir.File("map"), "[s]\nk = 123456789\n");
  char buffer[16];
  memset(buffer, '#', sizeof buffer);
  EXPECT_EQ(
      QLIBCFileGetSectionValue(dir.File("map").c_str(), "s", "k", buffer, 9),
      -1);
  EXPECT_EQ(QLIBCErrGet(), ERANGE);
  for (char c : buffer) EXPECT_EQ(c, '#');
  EXPECT_EQ(
      QLIBCFileGetSectionValue(dir.File("map").c_str(), "s", "k", buffer, 10),
      9);
  EXPECT_STREQ(buffer, "123456789");
}

TEST(SectionValueTest, MissingFileAndBadArguments) {
  char buffer[8];
  EXPECT_EQ(QLIBCFileGetSectionValue("/nonexistent/map", "s", "k", buffer, 8),
            -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(QLIBCFileGetSectionValue(nullptr, "s", "k", buffer, 8), -1);
  EXPECT_EQ(QLIBCFileGetSectionValue("/x", nullptr, "k", buffer, 8), -1);
  EXPECT_EQ(QLIBCFileGetSectionValue("/x", "s", nullptr, buffer, 8), -1);
  EXPECT_EQ(QLIBCFileGetSectionValue("/x", "s", "k", nullptr, 8), -1);
  EXPECT_EQ(QLIBCFileGetSectionValue("/x", "s", "k", buffer, 0), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

}  // namespace
}  // namespace quvahost::test

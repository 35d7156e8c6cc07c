#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <tuple>

#include "file_line.h"
#include "support/fake_host.h"

namespace quvahost::test {
namespace {

constexpr int kBuf = 4097;

// Writes `content` to a file and looks for the line `key` in it.
int FindLine(const TempDir& dir, const std::string& content,
             const std::string& key, std::string* line = nullptr) {
  WriteFile(dir.File("q"), content);
  char buffer[kBuf] = "untouched";
  int result = QLIBCFileGetLine(dir.File("q").c_str(), key.c_str(), buffer,
                                kBuf, QLIBC_GETLINE_EXACT);
  if (line != nullptr) *line = buffer;
  return result;
}

TEST(FileGetLineTest, ExactLineMatch) {
  TempDir dir;
  const std::tuple<const char*, const char*, int> cases[] = {
      {"/a/b\n/a/c", "/a/c", 1},  // last line without line end
      {"/a/bc\n", "/a/b", 0},     // prefix of a line
      {"x/a/b\n", "/a/b", 0},     // suffix of a line
      {"/a/b\r\n", "/a/b", 0},    // '\r' is part of the line
      {"a\n\nb\n", "", 1},        // an empty line
      {"a\nb", "", 0}};
  for (const auto& [content, key, result] : cases) {
    std::string line;
    EXPECT_EQ(FindLine(dir, content, key, &line), result) << content;
    EXPECT_EQ(line, result == 1 ? key : "untouched");
  }
  EXPECT_EQ(FindLine(dir, std::string("x\0y\n/a/b\n", 9), "/a/b"), 1);
  std::string long_key(4096, 'k');
  EXPECT_EQ(FindLine(dir, "a\n" + long_key + "\n", long_key), 1);
  EXPECT_EQ(FindLine(dir, long_key.substr(1) + "\n", long_key), 0);
}

// A line that crosses the first block boundary at every offset around it.
TEST(FileGetLineTest, LinesAtTheBlockBoundary) {
  TempDir dir;
  const std::string key = "/share/photo/2015/07/summer";
  for (int shift = -40; shift <= 40; ++shift) {
    SCOPED_TRACE(shift);
    std::string filler(kLineSearchBlock + shift - 1, 'f');
    EXPECT_EQ(FindLine(dir, filler + "\n" + key + "\nlast\n", key), 1);
    EXPECT_EQ(FindLine(dir, filler + "x" + key + "\nlast\n", key), 0);
    EXPECT_EQ(FindLine(dir, filler + "\n" + key, key), 1);
    EXPECT_EQ(FindLine(dir, filler + "\n" + key + "more", key), 0);
    if (shift >= -2 && shift <= 2) {
      EXPECT_EQ(FindLine(dir, filler + "f\n\nb\n", ""), 1);
    }
  }
}

// Refused without blocking on a FIFO, and without a descriptor left open.
TEST(FileGetLineTest, BadArgumentsAndFiles) {
  quvaidx::test::FdLeakCheck leaks;
  TempDir dir;
  WriteFile(dir.File("q"), "a\n");
  ASSERT_EQ(mkfifo(dir.File("fifo").c_str(), 0600), 0);
  char buffer[kBuf];
  std::string q = dir.File("q"), fifo = dir.File("fifo");
  const int kExact = QLIBC_GETLINE_EXACT;
  const struct {
    const char* file;
    const char* key;
    char* buffer;
    int size, option, error;
  } cases[] = {
      {q.c_str(), "a", buffer, kBuf, 0x4, EINVAL},
      {nullptr, "a", buffer, kBuf, kExact, EINVAL},
      {q.c_str(), "a\nb", buffer, kBuf, kExact, EINVAL},
      {q.c_str(), "a", buffer, 1, kExact, ERANGE},
      {"/nonexistent/q", "a", buffer, kBuf, kExact, ENOENT},
      {dir.path().c_str(), "a", buffer, kBuf, kExact, EISDIR},
      {fifo.c_str(), "a", buffer, kBuf, kExact, EINVAL}  // must not block
  };
  for (const auto& c : cases) {
    EXPECT_EQ(QLIBCFileGetLine(c.file, c.key, c.buffer, c.size, c.option), -1);
    EXPECT_EQ(QLIBCErrGet(), c.error) << (c.file ? c.file : "") << c.size;
  }
  EXPECT_EQ(QLIBCFileGetLine(q.c_str(), "a", buffer, 2, kExact), 1);
  EXPECT_STREQ(buffer, "a");
  EXPECT_TRUE(leaks.NoLeak());
}

// A value is copied only whole: one that does not fit leaves the buffer as
// it was.
TEST(SectionValueTest, ValuesAndBounds) {
  TempDir dir;
  WriteFile(dir.File("map"),
            "top = before any section\n[video]\n  spaced   =   inner value  \n"
            "quoted = \"  kept  \"\ncrlf = yes\r\nnovalue\n[ music ]\n"
            "guid = 99\n[no end\nafter = x\n[video]\nlate = ignored\n");
  const struct {
    const char *section, *key;
    int size, result;
    const char* value;
  } cases[] = {{"video", "spaced", 256, 11, "inner value"},
               {"video", "quoted", 256, 8, "  kept  "},
               {"video", "crlf", 256, 3, "yes"},
               {"music", "guid", 256, 2, "99"},
               {"music", "after", 256, 1, "x"},  // "[no end" is no section
               {"video", "late", 256, -1, "untouched"},  // a repeated section
               {"video", "novalue", 256, -1, "untouched"},
               {"video", "spaced", 12, 11, "inner value"},
               {"video", "spaced", 11, -1, "untouched"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.section) + "/" + c.key);
    char buffer[257] = "untouched";
    memset(buffer + 10, '#', sizeof buffer - 10);
    EXPECT_EQ(QLIBCFileGetSectionValue(dir.File("map").c_str(), c.section,
                                       c.key, buffer, c.size),
              c.result);
    EXPECT_STREQ(buffer, c.value);
    EXPECT_EQ(buffer[c.size], '#');
    EXPECT_TRUE(c.result >= 0 ||
                QLIBCErrGet() == (c.size < 12 ? ERANGE : ENOENT));
  }
  char buffer[16];
  const std::string map = dir.File("map");
  EXPECT_EQ(QLIBCFileGetSectionValue("/nonexistent/map", "s", "k", buffer, 8),
            -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(QLIBCFileGetSectionValue(map.c_str(), "s", "k", buffer, 0), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

}  // namespace
}  // namespace quvahost::test

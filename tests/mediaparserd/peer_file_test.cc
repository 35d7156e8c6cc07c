// Opening a peer's file and reading it within limits through the cache.
#include "peer_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "support/fd_check.h"

namespace mediaparserd {
namespace {

using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

std::string Pattern(size_t size) {
  std::string text(size, '\0');
  for (size_t i = 0; i < size; ++i)
    text[i] = static_cast<char>(i * 7 + i / 251);
  return text;
}

class BoundedReaderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = dir_.File("data");
    content_ = Pattern(300 * 1024);
    WriteFile(path_, content_);
    std::string reason;
    ASSERT_TRUE(OpenPeerFile(path_, &file_, &reason)) << reason;
  }

  std::string Read(BoundedReader* reader, int64_t offset, int64_t count) {
    std::string out(static_cast<size_t>(count), '\0');
    int64_t n = reader->ReadAt(offset, out.data(), count);
    out.resize(n < 0 ? 0 : static_cast<size_t>(n));
    return n < 0 ? "<stopped>" : out;
  }

  TempDir dir_;
  std::string path_, content_;
  PeerFile file_;
};

// Pieces of every size around the 64 KiB blocks, in an order that makes the
// cache replace blocks, read what the file holds.
TEST_F(BoundedReaderTest, PiecesAcrossBlocksReadWhatTheFileHolds) {
  BoundedReader reader(file_.fd(), file_.status().st_size, ReadLimits());
  const int64_t kBlock = 64 * 1024;
  const int64_t offsets[] = {0,          kBlock - 3,     5 * kBlock / 2,
                             10,         4 * kBlock - 1, kBlock,
                             3 * kBlock, 299 * 1024,     2};
  const int64_t counts[] = {1, 7, 4096, kBlock - 1, kBlock, kBlock + 9};
  for (int64_t offset : offsets) {
    for (int64_t count : counts) {
      EXPECT_EQ(Read(&reader, offset, count),  // substr stops at the end
                content_.substr(static_cast<size_t>(offset),
                                static_cast<size_t>(count)))
          << offset << "+" << count;
    }
  }
  EXPECT_EQ(Read(&reader, static_cast<int64_t>(content_.size()), 10), "");
  EXPECT_EQ(Read(&reader, -1, 10), "");
}

// A file cut while it is read reads short, and what it grows by after the
// open is not read: the size is the one checked.
TEST_F(BoundedReaderTest, FileThatShrinksReadsShortAndGrowthIsNotSeen) {
  BoundedReader reader(file_.fd(), file_.status().st_size, ReadLimits());
  ASSERT_EQ(truncate(path_.c_str(), 100 * 1024), 0);
  EXPECT_EQ(Read(&reader, 99 * 1024, 4096), content_.substr(99 * 1024, 1024));
  EXPECT_EQ(Read(&reader, 200 * 1024, 4096), "");
  WriteFile(path_, content_ + content_);
  EXPECT_EQ(Read(&reader, 300 * 1024 - 5, 100).size(), 5u);
  EXPECT_EQ(reader.stop(), BoundedReader::Stop::kNone);
}

// The budget counts the bytes read from the file, not those served from
// the cache; once the budget or the time is spent, no read is served.
TEST_F(BoundedReaderTest, BudgetAndDeadlineStopEveryReadForGood) {
  ReadLimits limits;
  limits.bytes = 100 * 1024;
  BoundedReader reader(file_.fd(), file_.status().st_size, limits);
  EXPECT_EQ(Read(&reader, 0, 10).size(), 10u);   // reads one block
  EXPECT_EQ(Read(&reader, 20, 10).size(), 10u);  // from the cache
  EXPECT_EQ(reader.bytes_read(), 64 * 1024);
  EXPECT_EQ(Read(&reader, 70 * 1024, 10), "<stopped>");
  EXPECT_EQ(reader.stop(), BoundedReader::Stop::kBudget);
  EXPECT_EQ(Read(&reader, 0, 10), "<stopped>");  // even cached bytes
  limits.time_ms = 0;
  BoundedReader late(file_.fd(), file_.status().st_size, limits);
  EXPECT_TRUE(late.Expired());
  EXPECT_EQ(Read(&late, 0, 10), "<stopped>");
  EXPECT_EQ(late.stop(), BoundedReader::Stop::kTime);
}

// The opened file is the one checked: a regular file, open for reading
// only, and a second open replaces the first without leaking it.
TEST_F(BoundedReaderTest, OpenedFileIsTheCheckedRegularFile) {
  quvaidx::test::FdLeakCheck fds;
  {
    PeerFile file;
    std::string reason;
    ASSERT_TRUE(OpenPeerFile(path_, &file, &reason));
    ASSERT_TRUE(OpenPeerFile(path_, &file, &reason));
    EXPECT_EQ(fcntl(file.fd(), F_GETFL) & O_ACCMODE, O_RDONLY);
    EXPECT_NE(fcntl(file.fd(), F_GETFD) & FD_CLOEXEC, 0);
    EXPECT_EQ(file.status().st_size, static_cast<off_t>(content_.size()));
    EXPECT_FALSE(OpenPeerFile("/dev/null", &file, &reason));
    EXPECT_EQ(reason, "not a regular file");
    EXPECT_EQ(file.status().st_size, static_cast<off_t>(content_.size()));
  }
  EXPECT_TRUE(fds.NoLeak());
}

}  // namespace
}  // namespace mediaparserd

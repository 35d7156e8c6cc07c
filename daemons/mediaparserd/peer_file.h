// Opening the file a peer named, and reading it within one request's limits.
//
// A peer names any path it likes: a FIFO that never answers, a device, a
// directory, a file that another process grows, shrinks or replaces while it
// is read, a sparse file of terabytes. OpenPeerFile is the one place where
// the daemon opens such a path, and a BoundedReader is the only way the
// media libraries read it: at their own offsets, never past the size the
// file had when it was opened, and never after the request's deadline or
// byte budget ran out.
//
// Single-threaded: one request at a time owns a PeerFile and its reader.
#ifndef MEDIAPARSERD_PEER_FILE_H_
#define MEDIAPARSERD_PEER_FILE_H_

#include <stdint.h>
#include <sys/stat.h>
#include <time.h>

#include <memory>
#include <string>

#include "peer_access.h"

namespace mediaparserd {

// An open regular file; closes its descriptor when destroyed.
class PeerFile {
 public:
  PeerFile() = default;
  ~PeerFile();
  PeerFile(const PeerFile&) = delete;
  PeerFile& operator=(const PeerFile&) = delete;

  int fd() const { return fd_; }
  const struct stat& status() const { return status_; }

 private:
  friend bool OpenFileChecked(const std::string&, PeerFile*, std::string*);
  int fd_ = -1;  // open for reading; -1 before OpenPeerFile succeeded
  struct stat status_ = {};  // of fd_, taken when it was opened
};

// Opens the file a peer named at `path` for reading, without ever opening
// anything else for reading: the path is opened with O_PATH (which reads
// nothing and cannot block), checked with fstat, and only a regular file is
// then opened for reading through that descriptor (/proc/self/fd/N), so
// what is read is the file that was checked even if the name is changed in
// between. Symbolic links in the path are followed.
// Returns true with *file open (a file that was open before is closed);
// false with *reason set to one readable line: "path is not absolute",
// "path too long", "path holds a zero byte", the system's text for the
// error ("No such file or directory", "Permission denied"), or "not a
// regular file".
// With `peer`, the file is opened with that process's rights (see
// peer_access.h): what it could not read itself is refused with "Permission
// denied".
bool OpenPeerFile(const std::string& path, PeerFile* file, std::string* reason,
                  const PeerIdentity* peer = nullptr);

// OpenPeerFile without the peer's rights.
bool OpenFileChecked(const std::string& path, PeerFile* file,
                     std::string* reason);

// The limits of one request.
struct ReadLimits {
  int64_t time_ms = 5000;             // from the reader's creation
  int64_t bytes = 128 * 1024 * 1024;  // read by all libraries together
};

// Memory for the blocks a BoundedReader caches, kept from one request to
// the next so that a request neither allocates nor faults it in anew.
class BlockMemory {
 public:
  static constexpr int64_t kBlockSize = 64 << 10;
  static constexpr int kBlocks = 4;

  // Block `i` (0 <= i < kBlocks), allocated on first use, not zeroed.
  char* block(int i);

 private:
  std::unique_ptr<char[]> blocks_[kBlocks];
};

// Reads one open file for the media libraries, each at its own offset.
// Small reads are served from a few cached 64 KiB blocks: the libraries
// read headers and tags in pieces of a few bytes, and every system call is
// dear (in a virtual machine several microseconds).
class BoundedReader {
 public:
  enum class Stop {
    kNone,    // nothing stopped the reads so far
    kTime,    // the deadline passed
    kBudget,  // the byte budget was used up
    kError,   // the system refused a read (error() tells why)
  };

  // `size` is the file's size at opening: a file that grows is read up to
  // that size, one that shrinks reads short. The deadline starts now.
  // `memory` holds the cached blocks (its own when null); it must outlive
  // the reader and serve one reader at a time.
  BoundedReader(int fd, int64_t size, const ReadLimits& limits,
                BlockMemory* memory = nullptr);

  // Reads up to `count` bytes at `offset` into `buffer`. Returns the bytes
  // read, 0 at or past the end, or -1 once the deadline or the budget has
  // run out or a read failed; after -1, every further read gives -1.
  int64_t ReadAt(int64_t offset, void* buffer, int64_t count);

  // True once the deadline has passed (then stop() is kTime). Cheap enough
  // for the libraries' interrupt callbacks.
  bool Expired();

  int64_t size() const { return size_; }
  Stop stop() const { return stop_; }
  int error() const { return error_; }
  int64_t bytes_read() const { return bytes_read_; }  // from the file

 private:
  static constexpr int64_t kBlockSize = BlockMemory::kBlockSize;
  static constexpr int kBlocks = BlockMemory::kBlocks;
  struct Block {
    int64_t index = -1;    // offset / kBlockSize; -1: empty
    int64_t length = 0;    // bytes held (short at the end of the file)
    uint64_t used = 0;     // when last used, for replacing the oldest
    char* data = nullptr;  // in memory_, once used
  };

  // Reads count bytes at offset from the file into buffer, within the
  // budget; the bytes read or -1 (stop_ set).
  int64_t ReadFile(int64_t offset, void* buffer, int64_t count);
  // The cached block `index`, read in if needed; null after a stop.
  const Block* LoadBlock(int64_t index);

  int fd_;
  int64_t size_;
  struct timespec deadline_;  // CLOCK_MONOTONIC
  int64_t budget_;            // bytes that may still be read
  int64_t bytes_read_ = 0;
  Stop stop_ = Stop::kNone;
  int error_ = 0;                            // errno of the failed read
  std::unique_ptr<BlockMemory> own_memory_;  // when none was given
  BlockMemory* memory_;
  Block blocks_[kBlocks];
  uint64_t clock_ = 0;  // counts block uses
};

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_PEER_FILE_H_

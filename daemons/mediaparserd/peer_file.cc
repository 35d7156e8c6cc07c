#include "peer_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <quvaidx/mediainfo.h>

namespace mediaparserd {
namespace {

void CloseQuietly(int fd) {
  if (fd >= 0) close(fd);  // nothing was written: nothing to lose
}

}  // namespace

PeerFile::~PeerFile() { CloseQuietly(fd_); }

bool OpenPeerFile(const std::string& path, PeerFile* file, std::string* reason,
                  const PeerIdentity* peer) {
  if (peer == nullptr || !PeerNeedsCheck(*peer)) {
    return OpenFileChecked(path, file, reason);
  }
  if (geteuid() != 0) {
    // No other identity can be taken: the permission bits decide.
    return PeerMayRead(path, *peer, reason) &&
           OpenFileChecked(path, file, reason);
  }
  quvaidx_daemons::FsIdentity as_peer(*peer);
  if (!as_peer.taken()) {
    *reason = "cannot take the rights of the asking process";
    return false;
  }
  return OpenFileChecked(path, file, reason);
}

bool OpenFileChecked(const std::string& path, PeerFile* file,
                     std::string* reason) {
  if (path.empty() || path[0] != '/') {
    *reason = "path is not absolute";
    return false;
  }
  if (path.size() >= static_cast<size_t>(kMediaPathSize)) {
    *reason = "path too long";
    return false;
  }
  if (path.find('\0') != std::string::npos) {
    *reason = "path holds a zero byte";
    return false;
  }
  int handle = open(path.c_str(), O_PATH | O_CLOEXEC);
  if (handle < 0) {
    *reason = strerror(errno);
    return false;
  }
  struct stat checked;
  if (fstat(handle, &checked) != 0) {
    *reason = strerror(errno);
    CloseQuietly(handle);
    return false;
  }
  if (!S_ISREG(checked.st_mode)) {
    *reason = "not a regular file";
    CloseQuietly(handle);
    return false;
  }
  // Reopening through the descriptor reaches the very inode checked above,
  // with the access rights checked again as for the path.
  char through[64];
  snprintf(through, sizeof(through), "/proc/self/fd/%d", handle);
  int fd = open(through, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  int saved = errno;
  CloseQuietly(handle);
  if (fd < 0) {
    *reason = saved == ENOENT ? "cannot reopen the file (is /proc mounted?)"
                              : strerror(saved);
    return false;
  }
  struct stat status;
  if (fstat(fd, &status) != 0 || status.st_dev != checked.st_dev ||
      status.st_ino != checked.st_ino) {
    *reason = "the file changed while it was opened";
    CloseQuietly(fd);
    return false;
  }
  CloseQuietly(file->fd_);
  file->fd_ = fd;
  file->status_ = status;
  return true;
}

char* BlockMemory::block(int i) {
  if (blocks_[i] == nullptr) blocks_[i].reset(new char[kBlockSize]);
  return blocks_[i].get();
}

BoundedReader::BoundedReader(int fd, int64_t size, const ReadLimits& limits,
                             BlockMemory* memory)
    : fd_(fd),
      size_(size < 0 ? 0 : size),
      budget_(limits.bytes),
      own_memory_(memory == nullptr ? std::make_unique<BlockMemory>()
                                    : nullptr),
      memory_(memory == nullptr ? own_memory_.get() : memory) {
  clock_gettime(CLOCK_MONOTONIC, &deadline_);
  int64_t ms = limits.time_ms < 0 ? 0 : limits.time_ms;
  deadline_.tv_sec += static_cast<time_t>(ms / 1000);
  deadline_.tv_nsec += static_cast<long>(ms % 1000) * 1000000L;
  if (deadline_.tv_nsec >= 1000000000L) {
    deadline_.tv_sec += 1;
    deadline_.tv_nsec -= 1000000000L;
  }
}

bool BoundedReader::Expired() {
  if (stop_ == Stop::kTime) return true;
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  if (now.tv_sec > deadline_.tv_sec ||
      (now.tv_sec == deadline_.tv_sec && now.tv_nsec >= deadline_.tv_nsec)) {
    stop_ = Stop::kTime;
    return true;
  }
  return false;
}

int64_t BoundedReader::ReadFile(int64_t offset, void* buffer, int64_t count) {
  if (count > budget_) {
    stop_ = Stop::kBudget;
    return -1;
  }
  int64_t done = 0;
  while (done < count) {
    ssize_t n = pread(fd_, static_cast<char*>(buffer) + done,
                      static_cast<size_t>(count - done), offset + done);
    if (n < 0 && errno == EINTR) continue;  // Retry
    if (n < 0) {
      error_ = errno;
      stop_ = Stop::kError;
      return -1;
    }
    if (n == 0) break;  // the file shrank
    done += n;
  }
  budget_ -= done;
  bytes_read_ += done;
  return done;
}

const BoundedReader::Block* BoundedReader::LoadBlock(int64_t index) {
  Block* oldest = &blocks_[0];
  for (Block& block : blocks_) {
    if (block.index == index) {
      block.used = ++clock_;
      return &block;
    }
    if (block.used < oldest->used) oldest = &block;
  }
  if (oldest->data == nullptr) {
    oldest->data = memory_->block(static_cast<int>(oldest - blocks_));
  }
  int64_t start = index * kBlockSize;
  int64_t want = size_ - start < kBlockSize ? size_ - start : kBlockSize;
  oldest->index = -1;
  int64_t n = ReadFile(start, oldest->data, want);
  if (n < 0) return nullptr;
  oldest->index = index;
  oldest->length = n;
  oldest->used = ++clock_;
  return oldest;
}

int64_t BoundedReader::ReadAt(int64_t offset, void* buffer, int64_t count) {
  if (stop_ != Stop::kNone || Expired()) return -1;
  if (offset < 0 || count <= 0 || offset >= size_) return 0;
  if (count > size_ - offset) count = size_ - offset;
  if (count >= kBlockSize) return ReadFile(offset, buffer, count);
  int64_t done = 0;
  while (done < count) {
    int64_t at = offset + done;
    const Block* block = LoadBlock(at / kBlockSize);
    if (block == nullptr) return -1;
    int64_t within = at - block->index * kBlockSize;
    if (within >= block->length) break;  // the file shrank
    int64_t n = block->length - within < count - done ? block->length - within
                                                      : count - done;
    memcpy(static_cast<char*>(buffer) + done, block->data + within,
           static_cast<size_t>(n));
    done += n;
  }
  return done;
}

}  // namespace mediaparserd

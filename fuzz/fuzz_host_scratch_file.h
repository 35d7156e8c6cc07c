// The one scratch file of a host fuzz target: each input is written over it
// and the host's file readers are pointed at its path.
//
// One file per process under $TMPDIR (or /tmp), created on first use with
// mkstemp, kept open and rewritten in place (written at offset 0, then cut
// to the input's length), so no descriptor or disk space grows with the number
// of inputs. Its name is removed right after creation and the host reads it
// through /proc/self/fd/N, so even a crashed run leaves no file behind; the
// descriptor is closed at exit.
#ifndef QUVAIDX_FUZZ_FUZZ_HOST_SCRATCH_FILE_H_
#define QUVAIDX_FUZZ_FUZZ_HOST_SCRATCH_FILE_H_

#include <errno.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/types.h>
#include <unistd.h>

#include <string>

namespace fuzz_host {

class ScratchFile {
 public:
  // Returns the path; creates the file on the first call, aborts when it
  // cannot.
  static const char* Path() { return Instance().path_.c_str(); }

  // Replaces the file's contents by data[0, size); aborts on failure.
  static void Write(const uint8_t* data, size_t size) {
    ScratchFile& file = Instance();
    size_t done = 0;
    while (done < size) {
      ssize_t n =
          pwrite(file.fd_, data + done, size - done, static_cast<off_t>(done));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) Fail("pwrite");
      done += static_cast<size_t>(n);
    }
    // Cut the rest of a longer earlier input. Writing first and cutting
    // only what is left over is much cheaper on disk filesystems than
    // truncating to zero, which some (ext4) answer by flushing the data.
    if (size < file.size_ &&
        ftruncate(file.fd_, static_cast<off_t>(size)) != 0) {
      Fail("ftruncate");
    }
    file.size_ = size;
  }

 private:
  ScratchFile() {
    const char* dir = getenv("TMPDIR");
    if (dir == nullptr || dir[0] == '\0') dir = "/tmp";
    std::string name = std::string(dir) + "/quvahost-fuzz.XXXXXX";
    fd_ = mkstemp(name.data());
    if (fd_ < 0) Fail("mkstemp");
    // The name goes at once: a run that ends in a crash (no exit handlers)
    // leaves nothing behind. The file stays reachable by its descriptor's
    // entry in /proc, a path that opens the file itself.
    if (unlink(name.c_str()) != 0) Fail("unlink");
    path_ = "/proc/self/fd/" + std::to_string(fd_);
    atexit(Close);
  }

  static ScratchFile& Instance() {
    // Never destroyed: Close runs at exit and still needs the object.
    static ScratchFile* file = new ScratchFile();
    return *file;
  }

  static void Close() {
    ScratchFile& file = Instance();
    if (file.fd_ >= 0) close(file.fd_);
    file.fd_ = -1;
  }

  [[noreturn]] static void Fail(const char* what) {
    perror(what);
    abort();
  }

  std::string path_;
  int fd_ = -1;
  size_t size_ = 0;  // bytes in the file now
};

}  // namespace fuzz_host

#endif  // QUVAIDX_FUZZ_FUZZ_HOST_SCRATCH_FILE_H_

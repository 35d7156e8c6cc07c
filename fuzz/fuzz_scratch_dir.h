// A private directory holding one scratch file, for fuzz targets whose
// function under test renames a temporary file over the file's path (and so
// needs a real name in a directory of its own).
//
// One directory per process under $TMPDIR (or /tmp), made with mkdtemp on
// first use and removed with its file at exit. A crashed run leaves that
// directory (one small file) behind.
#ifndef QUVAIDX_FUZZ_FUZZ_SCRATCH_DIR_H_
#define QUVAIDX_FUZZ_FUZZ_SCRATCH_DIR_H_

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

namespace fuzz_scratch {

[[noreturn]] inline void Die(const char* what) {
  perror(what);
  abort();
}

class ScratchDir {
 public:
  // The directory, made on the first call as "<tmp>/quvaidx-<tag>.XXXXXX"
  // with the file "queue" in it; every later call returns the same one.
  static ScratchDir& Get(const char* tag) {
    // Never destroyed: Remove runs at exit and still needs the object.
    static ScratchDir* scratch = new ScratchDir(tag);
    return *scratch;
  }

  const std::string& dir() const { return dir_; }
  const std::string& file() const { return file_; }

  // Makes the file hold data[0, size) with mode `mode`.
  void Write(const char* data, size_t size, mode_t mode) {
    int fd =
        open(file_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (fd < 0) Die("open");
    if (fchmod(fd, mode) != 0) Die("fchmod");  // the umask may have cut it
    size_t done = 0;
    while (done < size) {
      ssize_t n = write(fd, data + done, size - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) Die("write");
      done += static_cast<size_t>(n);
    }
    if (close(fd) != 0) Die("close");
  }

  std::string Read() const {
    int fd = open(file_.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) Die("open for reading");
    std::string text;
    char block[16384];
    for (;;) {
      ssize_t n = read(fd, block, sizeof(block));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) Die("read");
      if (n == 0) break;
      text.append(block, static_cast<size_t>(n));
    }
    close(fd);
    return text;
  }

  // The names in the directory other than the file's own.
  std::string Strays() const {
    std::string strays;
    DIR* dir = opendir(dir_.c_str());
    if (dir == nullptr) Die("opendir");
    while (struct dirent* entry = readdir(dir)) {
      std::string name = entry->d_name;
      if (name == "." || name == ".." || name == "queue") continue;
      strays += name + " ";
    }
    closedir(dir);
    return strays;
  }

 private:
  explicit ScratchDir(const char* tag) {
    const char* tmp = getenv("TMPDIR");
    if (tmp == nullptr || tmp[0] == '\0') tmp = "/tmp";
    dir_ = std::string(tmp) + "/quvaidx-" + tag + ".XXXXXX";
    if (mkdtemp(&dir_[0]) == nullptr) Die("mkdtemp");
    file_ = dir_ + "/queue";
    atexit(Remove);
  }

  static void Remove() {
    ScratchDir& scratch = Get(nullptr);
    unlink(scratch.file_.c_str());  // may be missing; don't care
    rmdir(scratch.dir_.c_str());
  }

  std::string dir_;
  std::string file_;
};

}  // namespace fuzz_scratch

#endif  // QUVAIDX_FUZZ_FUZZ_SCRATCH_DIR_H_

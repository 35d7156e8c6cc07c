#include "host_io.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "quvahost/quvahost.h"

namespace quvahost {

int OpenRegularFile(const char* path, int* error) {
  // O_NONBLOCK: opening a FIFO must not wait for a writer. It has no effect
  // on reads from regular files.
  int fd = RetryOnEintr(
      [&] { return open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK); });
  if (fd < 0) {
    *error = errno;
    return -1;
  }
  struct stat st;
  if (fstat(fd, &st) != 0) {
    *error = errno;
    close(fd);
    return -1;
  }
  if (!S_ISREG(st.st_mode)) {
    *error = S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
    close(fd);
    return -1;
  }
  return fd;
}

int ReadWholeFile(const char* path, size_t max_bytes, std::string* text) {
  int error = 0;
  int fd = OpenRegularFile(path, &error);
  if (fd < 0) return error;
  std::string data;
  char block[16384];
  for (;;) {
    ssize_t n = RetryOnEintr([&] { return read(fd, block, sizeof block); });
    if (n < 0) {
      error = errno;
      break;
    }
    if (n == 0) break;
    if (data.size() + static_cast<size_t>(n) > max_bytes) {
      error = EFBIG;
      break;
    }
    data.append(block, static_cast<size_t>(n));
  }
  close(fd);
  if (error == 0) text->swap(data);
  return error;
}

int WriteAll(int fd, const char* data, size_t size) {
  while (size > 0) {
    ssize_t n = RetryOnEintr([&] { return write(fd, data, size); });
    if (n < 0) return errno;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return 0;
}

std::string HostEtcDir() {
  const char* dir = getenv(QUVA_HOST_ETC_ENV);
  return dir != nullptr && dir[0] != '\0' ? dir : QUVA_HOST_ETC_DEFAULT;
}

std::string HostEtcFile(const char* name) { return HostEtcDir() + "/" + name; }

bool CopyIfFits(const char* text, size_t length, char* buffer, int size) {
  if (size < 1 || length >= static_cast<size_t>(size)) return false;
  // text may lie inside buffer; an empty view may have no data pointer.
  if (length > 0) memmove(buffer, text, length);
  buffer[length] = '\0';
  return true;
}

bool ParseDecimalText(std::string_view text, int* value) {
  size_t begin = text.find_first_not_of(" \t\r\n");
  if (begin == std::string_view::npos) return false;
  size_t end = text.find_last_not_of(" \t\r\n");
  text = text.substr(begin, end - begin + 1);
  long long number = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return false;
    number = number * 10 + (c - '0');
    if (number > INT_MAX) return false;
  }
  *value = static_cast<int>(number);
  return true;
}

}  // namespace quvahost

// Text-file readers: the exact-line search used as the duplicate test of
// the spool queues, and the INI value reader.
//
// The line search looks for "\n" key "\n" in the file as if it began with
// '\n' and, when its last line lacks one, ended with '\n'. One memmem per
// block finds candidate and line boundaries at once; the last
// key-length + 1 bytes of each block are carried over so that a line
// crossing a block boundary is still found. Memory: one buffer of
// kLineSearchBlock + key length + 2 bytes per call, nothing per line.
#include "file_line.h"

#include <string.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"
#include "ini_file.h"

namespace quvahost {
namespace {

// Returns 1 (found), 0 (not found) or an errno value negated.
int SearchExactLine(int fd, std::string_view key) {
  const size_t needle_size = key.size() + 2;
  std::string needle;
  needle.reserve(needle_size);
  needle.append("\n").append(key).append("\n");

  const size_t carry_max = needle_size - 1;
  std::unique_ptr<char[]> buffer(
      new (std::nothrow) char[kLineSearchBlock + carry_max + 1]);
  if (buffer == nullptr) return -ENOMEM;
  char* data = buffer.get();
  size_t have = 0;
  data[have++] = '\n';  // the line before the first line ends here
  bool file_empty = true;
  char last_byte = '\n';
  for (;;) {
    ssize_t n =
        RetryOnEintr([&] { return read(fd, data + have, kLineSearchBlock); });
    if (n < 0) return -errno;
    if (n == 0) {
      if (file_empty || last_byte == '\n') return 0;
      data[have++] = '\n';  // the last line without its line end
      return memmem(data, have, needle.data(), needle_size) != nullptr ? 1 : 0;
    }
    file_empty = false;
    have += static_cast<size_t>(n);
    last_byte = data[have - 1];
    if (memmem(data, have, needle.data(), needle_size) != nullptr) return 1;
    // A match that continues into the next block starts within the last
    // needle_size - 1 bytes.
    size_t keep = have < carry_max ? have : carry_max;
    memmove(data, data + have - keep, keep);
    have = keep;
  }
}

}  // namespace

int FileGetLineImpl(const char* file, const char* key, char* buffer, int size,
                    int option) {
  if (file == nullptr || key == nullptr || buffer == nullptr ||
      option != QLIBC_GETLINE_EXACT || strchr(key, '\n') != nullptr) {
    return HOST_FAIL(EINVAL);
  }
  size_t key_length = strlen(key);
  if (size < 1 || key_length >= static_cast<size_t>(size)) {
    return HOST_FAIL(ERANGE);
  }
  int error = 0;
  int fd = OpenRegularFile(file, &error);
  if (fd < 0) return HOST_FAIL(error);
  int found = SearchExactLine(fd, std::string_view(key, key_length));
  close(fd);
  if (found < 0) return HOST_FAIL(-found);
  // The line found is the key itself, so copying the key copies the line.
  if (found == 1) CopyIfFits(key, key_length, buffer, size);
  return found;
}

int FileGetSectionValueImpl(const char* file, const char* section,
                            const char* key, char* buffer, int size) {
  if (file == nullptr || section == nullptr || key == nullptr ||
      buffer == nullptr || size < 1) {
    return HOST_FAIL(EINVAL);
  }
  std::string text;
  int error = ReadWholeFile(file, kMaxConfigBytes, &text);
  if (error != 0) return HOST_FAIL(error);
  std::string_view value;
  if (!FindIniValue(ParseIni(text), section, key, &value)) {
    return HOST_FAIL(ENOENT);
  }
  if (!CopyIfFits(value.data(), value.size(), buffer, size)) {
    return HOST_FAIL(ERANGE);
  }
  return static_cast<int>(value.size());
}

}  // namespace quvahost

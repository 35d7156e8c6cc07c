// Process statistics from /proc.
#include <ctype.h>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "quvaidx/system.h"
#include "util/proc_parse.h"

namespace {

constexpr size_t kProcReadLimit = 4096;

// Finds `label` in line[0, length) and reads the number after the line's
// first word into *value, as "%*s %ld" would. Returns whether the label was
// there; *value is set only when a number follows.
bool ReadLabelled(const char* line, size_t length, const char* label,
                  long* value) {
  size_t label_length = strlen(label);
  bool found = false;
  for (size_t i = 0; i + label_length <= length; ++i) {
    if (memcmp(line + i, label, label_length) == 0) {
      found = true;
      break;
    }
  }
  if (!found) return false;
  // Copy the line so that strtol stops inside it.
  char copy[kProcReadLimit + 1];
  memcpy(copy, line, length);
  copy[length] = '\0';
  const char* p = copy;
  while (isspace(static_cast<unsigned char>(*p))) ++p;
  while (*p != '\0' && !isspace(static_cast<unsigned char>(*p))) {
    ++p;  // the first word
  }
  char* end = nullptr;
  errno = 0;
  long number = strtol(p, &end, 10);
  if (end != p) *value = number;
  return true;
}

// Calls visit(line, length) for each line of text[0, length) until it
// returns false.
template <typename Visit>
void ForEachLine(const char* text, size_t length, Visit visit) {
  size_t start = 0;
  while (start < length) {
    const void* newline = memchr(text + start, '\n', length - start);
    size_t end =
        newline != nullptr
            ? static_cast<size_t>(static_cast<const char*>(newline) - text)
            : length;
    if (!visit(text + start, end - start)) return;
    start = end + 1;
  }
}

// Reads at most kProcReadLimit bytes of `path` into buf. Returns the count,
// or -1 when the file cannot be opened.
ssize_t ReadProcFile(const char* path, char* buf) {
  int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -1;
  size_t total = 0;
  while (total < kProcReadLimit) {
    ssize_t got = read(fd, buf + total, kProcReadLimit - total);
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got <= 0) break;
    total += static_cast<size_t>(got);
  }
  close(fd);
  return static_cast<ssize_t>(total);
}

}  // namespace

namespace quvaidx {

bool ParseProcStatus(const char* text, size_t length, long* rss, long* vmsize) {
  *rss = -1;
  *vmsize = -1;
  bool have_rss = false;
  bool have_vmsize = false;
  if (length > kProcReadLimit) length = kProcReadLimit;
  ForEachLine(text, length, [&](const char* line, size_t n) {
    if (ReadLabelled(line, n, "VmRSS:", rss)) have_rss = true;
    if (ReadLabelled(line, n, "VmSize:", vmsize)) have_vmsize = true;
    return !(have_rss && have_vmsize);
  });
  return have_rss && have_vmsize;
}

bool ParseMemInfo(const char* text, size_t length, long* total) {
  *total = -1;
  bool found = false;
  if (length > kProcReadLimit) length = kProcReadLimit;
  ForEachLine(text, length, [&](const char* line, size_t n) {
    found = ReadLabelled(line, n, "MemTotal:", total);
    return !found;
  });
  return found;
}

}  // namespace quvaidx

int GetFileDescriptorNum(int pid) {
  char path[64];
  snprintf(path, sizeof(path), "/proc/%d/fd", pid);
  DIR* dir = opendir(path);
  if (dir == nullptr) return 0;
  int entries = 0;
  while (struct dirent* entry = readdir(dir)) {
    if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) {
      ++entries;
    }
  }
  closedir(dir);
  // A long listing counts one more line, its header.
  return entries + 1;
}

int GetMemoryUsagekb(int pid, long& rss, long& vmsize) {
  rss = -1;
  vmsize = -1;
  char path[64];
  snprintf(path, sizeof(path), "/proc/%d/status", pid);
  char text[kProcReadLimit];
  ssize_t length = ReadProcFile(path, text);
  if (length < 0) return -1;
  return quvaidx::ParseProcStatus(text, static_cast<size_t>(length), &rss,
                                  &vmsize)
             ? 0
             : -1;
}

int GetTotalMemory(long& total) {
  total = -1;
  char text[kProcReadLimit];
  ssize_t length = ReadProcFile("/proc/meminfo", text);
  if (length < 0) return -1;
  return quvaidx::ParseMemInfo(text, static_cast<size_t>(length), &total) ? 0
                                                                          : -1;
}

// ProbeMediaFile: one open, one fstat and one bounded read per request. The
// descriptor is opened without blocking, so a FIFO or device named by a
// client cannot hold up the daemon's only thread, and it is examined with
// fstat so that what is read is the file that was checked.
#include "probe.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <vector>

#include <quvaidx/media_type.h>
#include <quvaidx/text.h>

#include "image_size.h"

namespace mediaparserd {
namespace {

// Container names by extension, as media demuxers name them.
struct Container {
  const char* name;
  const char* extensions[10];  // null-terminated
};
constexpr Container kContainers[] = {
    {"mov,mp4,m4a,3gp,3g2,mj2",
     {"mp4", "m4v", "mov", "qt", "3gp", "3g2", "m4a", "m4b", "m4p", nullptr}},
    {"mp3", {"mp3", "mp2", "mp1", "mpa", nullptr}},
    {"image2", {"jpg", "jpeg", "jpe", "png", "bmp", "tif", "tiff", nullptr}},
    {"gif", {"gif", nullptr}},
    {"matroska,webm", {"mkv", "webm", nullptr}},
    {"avi", {"avi", "divx", "xvid", nullptr}},
    {"asf", {"asf", "wmv", "wma", nullptr}},
    {"mpeg", {"mpg", "mpeg", "dat", nullptr}},
    {"mpegts", {"ts", "m2ts", "m2t", "mts", nullptr}},
    {"flv", {"flv", "f4v", nullptr}},
    {"wav", {"wav", nullptr}},
    {"flac", {"flac", nullptr}},
    {"ogg", {"ogg", nullptr}},
    {"aac", {"aac", nullptr}},
    {"ac3", {"ac3", nullptr}},
    {"aiff", {"aiff", "aif", nullptr}},
};

const char* ContainerOf(const char* ext) {
  if (ext == nullptr) return "";
  for (const Container& container : kContainers) {
    for (const char* const* e = container.extensions; *e != nullptr; ++e) {
      if (strcasecmp(ext, *e) == 0) return container.name;
    }
  }
  return "";
}

// Copies `text` into field[capacity], cut to capacity - 1 bytes without
// splitting a UTF-8 character, always terminated.
void CopyText(char* field, size_t capacity, const std::string& text) {
  size_t length = text.size();
  if (length > capacity - 1) {
    length = capacity - 1;
    while (length > 0 && (text[length] & 0xC0) == 0x80) --length;
  }
  memcpy(field, text.data(), length);
  field[length] = '\0';
}

void FormatTime(time_t when, char* field, size_t capacity) {
  struct tm parts;
  if (localtime_r(&when, &parts) == nullptr ||
      strftime(field, capacity, "%Y-%m-%d %H:%M:%S", &parts) == 0) {
    field[0] = '\0';
  }
}

// Reads up to buffer->size() bytes from the start of fd; shrinks the
// buffer to what was read. False on a read error.
bool ReadHead(int fd, std::vector<uint8_t>* buffer) {
  size_t done = 0;
  while (done < buffer->size()) {
    ssize_t n = read(fd, buffer->data() + done, buffer->size() - done);
    if (n < 0 && errno == EINTR) continue;  // Retry
    if (n < 0) return false;
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  buffer->resize(done);
  return true;
}

}  // namespace

bool ProbeMediaFile(const std::string& path, __tag_QUVA_MEDIA_INFO* record,
                    std::string* reason) {
  memset(record, 0, sizeof(*record));
  if (path.empty() || path[0] != '/') {
    *reason = "path is not absolute";
    return false;
  }
  if (path.size() >= sizeof(record->szPath)) {
    *reason = "path too long";
    return false;
  }
  int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (fd < 0) {
    *reason = strerror(errno);
    return false;
  }
  std::string name = path.substr(path.rfind('/') + 1);
  const char* ext = QUVAIndexExtGet(name.c_str());
  // Only photos have their header read: a video's first bytes state no
  // size this parser knows, and reading them would cost every request.
  bool photo = GetMediaTableTypeFromExt(ext) == MEDIA_TABLE_PHOTO;
  struct stat st;
  std::vector<uint8_t> head(photo ? kHeaderBytes : 0);
  bool ok = fstat(fd, &st) == 0;
  if (!ok) {
    *reason = strerror(errno);
  } else if (!S_ISREG(st.st_mode)) {
    *reason = "not a regular file";
    ok = false;
  } else if (!ReadHead(fd, &head)) {
    *reason = strerror(errno);
    ok = false;
  }
  close(fd);
  if (!ok) return false;

  CopyText(record->szPath, sizeof(record->szPath), path);
  CopyText(record->szName, sizeof(record->szName), name);
  CopyText(record->szContainerType, sizeof(record->szContainerType),
           ContainerOf(ext));
  record->fileSize = static_cast<uint64_t>(st.st_size);
  FormatTime(st.st_mtime, record->szDate, sizeof(record->szDate));
  FormatTime(st.st_mtime, record->szMDate, sizeof(record->szMDate));
  int32_t width = 0, height = 0;
  if (ReadImageSize(head.data(), head.size(), &width, &height)) {
    record->resolutionX = width;
    record->resolutionY = height;
  }
  MediaInfoValid(record);
  return true;
}

}  // namespace mediaparserd

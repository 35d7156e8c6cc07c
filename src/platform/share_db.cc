// The share database: the file shares.conf of the host directory, one INI
// section per share with the keys "path" (absolute path on disk) and
// "status" (status flags, decimal or 0x hexadecimal).
//
// Readers parse the file without a lock: writers replace it by rename, so
// a reader sees either the old or the new file. Writers serialise on an
// exclusive flock of shares.conf.lock and rewrite only the status line of
// the share they update, so updates of different shares never undo each
// other.
#include "share_db.h"

#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"
#include "ini_file.h"

namespace quvahost {
namespace {

struct ShareEntry {
  std::string_view name;    // section name
  std::string path;         // normalized path on disk
  unsigned status = 0;      // status flags
  size_t header_line = 0;   // index of the "[name]" line
  bool has_path = false;    // a "path" key was seen
  size_t path_line = 0;     // index of the first "path" line
  bool has_status = false;  // a "status" key was seen
  size_t status_line = 0;   // index of the first "status" line
  bool valid = false;       // path good and status (if any) a number
};

// Parses "123" or "0x7B" (32 bits). Returns false on anything else.
bool ParseStatus(std::string_view text, unsigned* status) {
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty() || text.size() > 10) return false;
  unsigned long long value = 0;
  for (char c : text) {
    int digit;
    if (c >= '0' && c <= '9') {
      digit = c - '0';
    } else if (base == 16 && c >= 'a' && c <= 'f') {
      digit = c - 'a' + 10;
    } else if (base == 16 && c >= 'A' && c <= 'F') {
      digit = c - 'A' + 10;
    } else {
      return false;
    }
    value = value * base + digit;
  }
  if (value > 0xFFFFFFFFull) return false;
  *status = static_cast<unsigned>(value);
  return true;
}

// Collects the shares of `lines`, the first section of each name and the
// first "path" and "status" of each section only. A share whose path is
// missing, relative, holds ".." or is too long, or whose status is not a
// number, is marked invalid: it matches nothing and cannot be updated.
std::vector<ShareEntry> CollectShares(const std::vector<IniLine>& lines) {
  std::vector<ShareEntry> shares;
  size_t current = SIZE_MAX;
  for (size_t i = 0; i < lines.size(); ++i) {
    const IniLine& line = lines[i];
    if (line.kind == IniLine::kSection) {
      current = SIZE_MAX;
      bool seen = false;
      for (const ShareEntry& share : shares) seen |= share.name == line.section;
      if (seen) continue;
      current = shares.size();
      shares.emplace_back();
      shares[current].name = line.section;
      shares[current].header_line = i;
    } else if (current != SIZE_MAX && line.kind == IniLine::kKeyValue) {
      ShareEntry& share = shares[current];
      if (line.key == "path" && !share.has_path) {
        share.has_path = true;
        share.path_line = i;
      } else if (line.key == "status" && !share.has_status) {
        share.has_status = true;
        share.status_line = i;
      }
    }
  }
  for (ShareEntry& share : shares) {
    share.valid =
        share.has_path &&
        NormalizeAbsolutePath(lines[share.path_line].value, &share.path) &&
        share.path.size() < QUVA_SHARE_PATH_SIZE &&
        share.name.size() < QUVA_SHARE_NAME_SIZE;
    if (share.has_status &&
        !ParseStatus(lines[share.status_line].value, &share.status)) {
      share.valid = false;
    }
  }
  return shares;
}

// Reads and parses the database. Returns 0 or an errno value.
int LoadShares(std::string* text, std::vector<IniLine>* lines,
               std::vector<ShareEntry>* shares) {
  int error =
      ReadWholeFile(HostEtcFile(kShareDbName).c_str(), kMaxConfigBytes, text);
  if (error != 0) return error;
  *lines = ParseIni(*text);
  *shares = CollectShares(*lines);
  return 0;
}

int HandOut(const ShareEntry& share, ShareRecord** record) {
  int error = 0;
  ShareRecord* made =
      NewShareRecord(share.name, share.path, share.status, &error);
  if (made == nullptr) return HOST_FAIL(error);
  *record = made;
  return 0;
}

// Writes `text` to a new file beside `path` and renames it over `path`,
// with the mode (and, where permitted, the owner) of `original`.
// Returns 0 or an errno value; on failure `path` is unchanged.
int ReplaceFile(const std::string& path, const struct stat& original,
                const std::string& text) {
  std::string temp = path + ".XXXXXX";
  int fd = mkostemp(temp.data(), O_CLOEXEC);
  if (fd < 0) return errno;
  int error = 0;
  if (fchmod(fd, original.st_mode & 07777) != 0) error = errno;
  if (error == 0) {
    // Keeps the owner when the caller may; an unprivileged caller that
    // can rename in the directory still gets a correct database.
    if (fchown(fd, original.st_uid, original.st_gid) != 0) {
      // don't care: the database stays readable by its mode
    }
    error = WriteAll(fd, text.data(), text.size());
  }
  if (error == 0 && fsync(fd) != 0) error = errno;
  if (close(fd) != 0 && error == 0) error = errno;
  if (error == 0 && rename(temp.c_str(), path.c_str()) != 0) error = errno;
  if (error != 0) {
    unlink(temp.c_str());  // don't care if this fails
    return error;
  }
  // Makes the rename itself durable; a failure here does not undo it.
  std::string dir = path.substr(0, path.rfind('/') + 1);
  int dir_fd =
      open(dir.empty() ? "." : dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir_fd >= 0) {
    fsync(dir_fd);
    close(dir_fd);
  }
  return 0;
}

}  // namespace

ShareRecord* NewShareRecord(std::string_view name, std::string_view path,
                            unsigned status, int* error) {
  if (name.size() >= QUVA_SHARE_NAME_SIZE ||
      path.size() >= QUVA_SHARE_PATH_SIZE) {
    *error = ENAMETOOLONG;
    return nullptr;
  }
  auto* record = static_cast<ShareRecord*>(calloc(1, sizeof(ShareRecord)));
  if (record == nullptr) {
    *error = ENOMEM;
    return nullptr;
  }
  memcpy(record->szName, name.data(), name.size());
  memcpy(record->szPath, path.data(), path.size());
  record->uStatus = status;
  return record;
}

bool NormalizeAbsolutePath(std::string_view path, std::string* normal) {
  if (path.empty() || path[0] != '/') return false;
  std::string out;
  size_t pos = 0;
  while (pos < path.size()) {
    size_t end = path.find('/', pos);
    if (end == std::string_view::npos) end = path.size();
    std::string_view part = path.substr(pos, end - pos);
    pos = end + 1;
    if (part.empty() || part == ".") continue;
    if (part == "..") return false;
    out += '/';
    out.append(part);
  }
  if (out.empty()) out = "/";
  normal->swap(out);
  return true;
}

bool ShareHoldsPath(std::string_view share, std::string_view path) {
  if (path.size() < share.size() || path.compare(0, share.size(), share) != 0)
    return false;
  return path.size() == share.size() || share == "/" ||
         path[share.size()] == '/';
}

int ShareGetImpl(const char* name, ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  if (name == nullptr || record == nullptr) return HOST_FAIL(EINVAL);
  std::string text;
  std::vector<IniLine> lines;
  std::vector<ShareEntry> shares;
  int error = LoadShares(&text, &lines, &shares);
  if (error != 0) return HOST_FAIL(error);
  for (const ShareEntry& share : shares) {
    if (share.valid && share.name == name) return HandOut(share, record);
  }
  return HOST_FAIL(ENOENT);
}

int ShareGetByAttrStrImpl(const char* value, int attribute,
                          ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  if (value == nullptr || record == nullptr ||
      attribute != QUVA_SHARE_ATTR_PATH) {
    return HOST_FAIL(EINVAL);
  }
  std::string path;
  if (!NormalizeAbsolutePath(value, &path)) return HOST_FAIL(EINVAL);
  std::string text;
  std::vector<IniLine> lines;
  std::vector<ShareEntry> shares;
  int error = LoadShares(&text, &lines, &shares);
  if (error != 0) return HOST_FAIL(error);
  const ShareEntry* best = nullptr;
  for (const ShareEntry& share : shares) {
    if (share.valid && ShareHoldsPath(share.path, path) &&
        (best == nullptr || share.path.size() > best->path.size())) {
      best = &share;
    }
  }
  if (best == nullptr) return HOST_FAIL(ENOENT);
  return HandOut(*best, record);
}

int ShareUpdateImpl(const ShareRecord* record) {
  if (record == nullptr ||
      memchr(record->szName, '\0', sizeof record->szName) == nullptr) {
    return HOST_FAIL(EINVAL);
  }
  std::string lock_path = HostEtcFile(kShareLockName);
  int lock_fd = RetryOnEintr([&] {
    return open(lock_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  });
  if (lock_fd < 0) return HOST_FAIL(errno);
  if (RetryOnEintr([&] { return flock(lock_fd, LOCK_EX); }) != 0) {
    int error = errno;
    close(lock_fd);
    return HOST_FAIL(error);
  }

  // Under the lock: read, change one line, replace. A database reached
  // through a symbolic link is replaced at its target, keeping the link.
  std::string path = HostEtcFile(kShareDbName);
  if (char* resolved = realpath(path.c_str(), nullptr)) {
    path = resolved;
    free(resolved);
  }
  int error = 0;
  struct stat original;
  std::string text;
  std::vector<IniLine> lines;
  std::vector<ShareEntry> shares;
  if (stat(path.c_str(), &original) != 0) {
    error = errno;
  } else {
    error = LoadShares(&text, &lines, &shares);
  }
  const ShareEntry* target = nullptr;
  if (error == 0) {
    for (const ShareEntry& share : shares) {
      if (share.valid && share.name == record->szName) target = &share;
    }
    if (target == nullptr) error = ENOENT;
  }
  if (error == 0) {
    char status_line[32];
    snprintf(status_line, sizeof status_line, "status = 0x%X", record->uStatus);
    std::string updated;
    updated.reserve(text.size() + sizeof status_line);
    for (size_t i = 0; i < lines.size(); ++i) {
      if (i > 0) updated += '\n';
      if (target->has_status && i == target->status_line) {
        updated += status_line;
      } else {
        updated.append(lines[i].raw);
      }
      if (!target->has_status && i == target->header_line) {
        updated += '\n';
        updated += status_line;
      }
    }
    if (!text.empty() && text.back() == '\n') updated += '\n';
    error = ReplaceFile(path, original, updated);
  }
  close(lock_fd);  // releases the lock
  return error == 0 ? 0 : HOST_FAIL(error);
}

void ShareFreeImpl(ShareRecord* record) { free(record); }

}  // namespace quvahost

// Metadata directories: the EA directory of /dir/name is
// /dir/QUVA_EA_HIDDEN_DIR/name.
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <string_view>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"
#include "quvahost/quvahost.h"

namespace quvahost {
namespace {

constexpr std::string_view kHiddenDir = QUVA_EA_HIDDEN_DIR;

std::string_view StripFinalSlashes(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return path;
}

// A name that can be the last component of a media file or EA directory.
bool IsPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name != kHiddenDir &&
         name.find('/') == std::string_view::npos;
}

bool HasHiddenComponent(std::string_view path) {
  size_t pos = 0;
  while (pos <= path.size()) {
    size_t end = path.find('/', pos);
    if (end == std::string_view::npos) end = path.size();
    if (path.substr(pos, end - pos) == kHiddenDir) return true;
    pos = end + 1;
  }
  return false;
}

// Makes `path` a directory unless it is one (or a link to one) already.
// Returns 0 or an errno value. Another process making it at the same
// moment is not a failure.
int EnsureDirectory(const std::string& path) {
  if (mkdir(path.c_str(), 0777) == 0) return 0;
  int error = errno;
  if (error != EEXIST) return error;
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return errno;
  // A file in the way is left alone: it may be someone's data.
  return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}

}  // namespace

int EADirPathImpl(int option, const char* file_path, char* buffer, int size) {
  if (option != 0 || file_path == nullptr || buffer == nullptr || size < 1) {
    return HOST_FAIL(EINVAL);
  }
  std::string_view path = StripFinalSlashes(file_path);
  size_t slash = path.rfind('/');
  std::string_view folder =
      slash == std::string_view::npos ? "" : path.substr(0, slash + 1);
  std::string_view name =
      slash == std::string_view::npos ? path : path.substr(slash + 1);
  if (!IsPlainName(name) || HasHiddenComponent(folder)) {
    return HOST_FAIL(EINVAL);
  }
  std::string result;
  result.reserve(folder.size() + kHiddenDir.size() + 1 + name.size());
  result.append(folder).append(kHiddenDir).append("/").append(name);
  if (!CopyIfFits(result.data(), result.size(), buffer, size)) {
    return HOST_FAIL(ERANGE);
  }
  return 0;
}

int EAMKDirImpl(int option, const char* ea_dir_path) {
  if (option != 1 || ea_dir_path == nullptr) return HOST_FAIL(EINVAL);
  std::string_view path = StripFinalSlashes(ea_dir_path);
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return HOST_FAIL(EINVAL);
  std::string_view name = path.substr(slash + 1);
  std::string_view hidden = path.substr(0, slash);
  size_t hidden_slash = hidden.rfind('/');
  std::string_view hidden_name = hidden_slash == std::string_view::npos
                                     ? hidden
                                     : hidden.substr(hidden_slash + 1);
  std::string_view folder = hidden_slash == std::string_view::npos
                                ? ""
                                : hidden.substr(0, hidden_slash + 1);
  if (!IsPlainName(name) || hidden_name != kHiddenDir ||
      HasHiddenComponent(folder)) {
    return HOST_FAIL(EINVAL);
  }
  int error = EnsureDirectory(std::string(hidden));
  if (error == 0) error = EnsureDirectory(std::string(path));
  return error == 0 ? 0 : HOST_FAIL(error);
}

int EAIsHiddenDirImpl(const char* name) {
  return name != nullptr && kHiddenDir == name ? 1 : 0;
}

}  // namespace quvahost

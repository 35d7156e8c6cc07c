#include "host_error.h"

#include <errno.h>
#include <string.h>

#include "host_ops.h"

namespace quvahost {
namespace {

struct ErrorStack {
  int code = 0;           // errno value of the last failure
  const char* file = "";  // base name of the file that recorded it
  int line = 0;           // line that recorded it
};

thread_local ErrorStack t_error;

}  // namespace

int HostFail(int code, const char* file, int line) {
  const char* slash = file != nullptr ? strrchr(file, '/') : nullptr;
  t_error.code = code;
  t_error.file = file == nullptr ? "" : slash != nullptr ? slash + 1 : file;
  t_error.line = line;
  errno = code;
  return -1;
}

int LastErrorCode() { return t_error.code; }
const char* LastErrorFile() { return t_error.file; }
int LastErrorLine() { return t_error.line; }

int ErrGetImpl() { return LastErrorCode(); }
const char* ErrorGetFileImpl() { return LastErrorFile(); }
int ErrorGetLineImpl() { return LastErrorLine(); }

}  // namespace quvahost

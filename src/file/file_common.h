// Small helpers shared by the media file and folder modules. Not exported.
#ifndef QUVAIDX_FILE_FILE_COMMON_H_
#define QUVAIDX_FILE_FILE_COMMON_H_

#include <stdio.h>

namespace quvaidx::file {

// Size of every path buffer that these modules compose.
inline constexpr int kPathBufferSize = 4096;

// `text`, or "(null)" so that a null argument can be logged with "%s".
inline const char* Printable(const char* text) {
  return text != nullptr ? text : "(null)";
}

// Writes `a` + `separator` + `b` into out[size]. Returns false, with out
// cut, when the whole text does not fit: a cut path names another file, so
// callers must not use it.
inline bool ComposePath(char* out, int size, const char* a,
                        const char* separator, const char* b) {
  int n = snprintf(out, static_cast<size_t>(size), "%s%s%s", a, separator, b);
  return n >= 0 && n < size;
}

}  // namespace quvaidx::file

#endif  // QUVAIDX_FILE_FILE_COMMON_H_

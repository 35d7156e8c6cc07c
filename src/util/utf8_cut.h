// Byte-level UTF-8 helpers shared by the modules that copy texts into fixed
// buffers: a structural UTF-8 test and a cut that never splits a character.
// Not exported.
#ifndef QUVAIDX_UTIL_UTF8_CUT_H_
#define QUVAIDX_UTIL_UTF8_CUT_H_

#include <stddef.h>

namespace quvaidx {

// The length to which `text[0, length)` must be cut to fit in `limit` bytes:
// `length` when it fits; otherwise `limit`, moved back to the start of the
// character it falls in when the text is structurally UTF-8, so that no
// character is split.
size_t CutLength(const char* text, size_t length, size_t limit);

// 1 when text[0, length) is structurally UTF-8 (the rules of
// IsUnicodeString), else 0. Empty text is UTF-8.
bool IsStructurallyUTF8(const char* text, size_t length);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_UTF8_CUT_H_

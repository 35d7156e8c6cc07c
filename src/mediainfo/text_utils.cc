// The text utilities of the quvaidx_unicode module: UTF-8 tests, cutting at
// a character boundary, trimming, escaping '%', the system code page.
#include <stdlib.h>
#include <string.h>

#include <unicode/ustring.h>

#include "quvahost/quvahost.h"
#include "quvaidx/text.h"
#include "util/utf8_cut.h"

extern "C" {

int TryUTF8ToUTF16(const char* text) {
  if (text == nullptr || text[0] == '\0') return 1;
  size_t length = strlen(text);
  // UTF-8 never takes fewer bytes than UTF-16 code units, so length + 1
  // units hold any conversion with its terminator. Tag texts fit the stack
  // buffer, so the common case allocates nothing.
  if (length >= static_cast<size_t>(INT32_MAX)) return 0;
  UChar stack_units[512];
  UChar* units = stack_units;
  if (length + 1 > sizeof(stack_units) / sizeof(stack_units[0])) {
    units = static_cast<UChar*>(malloc((length + 1) * sizeof(UChar)));
    if (units == nullptr) return 0;
  }
  int32_t written = 0;
  UErrorCode status = U_ZERO_ERROR;
  u_strFromUTF8(units, static_cast<int32_t>(length + 1), &written, text, -1,
                &status);
  if (units != stack_units) free(units);
  return U_FAILURE(status) ? 0 : 1;
}

int IsUnicodeString(const char* text) {
  if (text == nullptr) return 1;
  return quvaidx::IsStructurallyUTF8(text, strlen(text)) ? 1 : 0;
}

void ShortenString(const char* src, char* dst, int size) {
  if (src == nullptr || src[0] == '\0' || dst == nullptr || size < 1) return;
  size_t length = strlen(src);
  size_t cut = quvaidx::CutLength(src, length, static_cast<size_t>(size) - 1);
  memmove(dst, src, cut);
  dst[cut] = '\0';
}

void StringTrim(char* text) {
  if (text == nullptr) return;
  size_t length = strlen(text);
  size_t start = 0;
  while (start < length && text[start] == ' ') ++start;
  if (start == length) return;  // empty, or blanks only: left as it is
  size_t end = length;
  while (end > start && text[end - 1] == ' ') --end;
  memmove(text, text + start, end - start);
  text[end - start] = '\0';
}

int EscapePercentSign(const char* src, char* dst, int size) {
  if (src == nullptr || dst == nullptr || size == 0) return -1;
  if (size < 0) {
    dst[0] = '\0';
    return 0;
  }
  const int limit = size - 1;
  int out = 0;
  for (const char* p = src; *p != '\0' && out < limit; ++p) {
    dst[out++] = *p;
    if (*p == '%' && out < limit) dst[out++] = '%';
  }
  dst[out] = '\0';
  return out;
}

int QUVAIndexCodePageGet(void) {
  int code_page = 0;
  if (QLIBCCodePageGet(QLIBC_CODEPAGE_SYSTEM, &code_page) == 0) {
    return code_page;
  }
  return QLIBC_CODEPAGE_FALLBACK;
}

}  // extern "C"

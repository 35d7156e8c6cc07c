#include "util/utf8_cut.h"

namespace quvaidx {

bool IsStructurallyUTF8(const char* text, size_t length) {
  const auto* p = reinterpret_cast<const unsigned char*>(text);
  size_t i = 0;
  while (i < length) {
    unsigned char lead = p[i];
    size_t follow;
    if (lead < 0x80) {
      follow = 0;
    } else if (lead < 0xC0) {
      return false;  // a continuation byte cannot start a character
    } else if (lead < 0xE0) {
      follow = 1;
    } else if (lead < 0xF0) {
      follow = 2;
    } else if (lead < 0xF8) {
      follow = 3;
    } else if (lead < 0xFC) {
      follow = 4;
    } else if (lead < 0xFE) {
      follow = 5;
    } else {
      return false;  // 0xFE and 0xFF never occur
    }
    ++i;
    for (size_t k = 0; k < follow; ++k, ++i) {
      if (i >= length || (p[i] & 0xC0) != 0x80) return false;
    }
  }
  return true;
}

size_t CutLength(const char* text, size_t length, size_t limit) {
  if (length <= limit) return length;
  if (!IsStructurallyUTF8(text, length)) return limit;
  size_t cut = limit;
  while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) {
    --cut;
  }
  return cut;
}

}  // namespace quvaidx

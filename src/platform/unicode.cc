// Character sets: the system code page setting and conversions to UTF-8.
//
// Every conversion decodes its whole input into code points first and only
// then writes the output, cut at a character boundary to fit; so `out` may
// be the input buffer, and nothing is written when decoding fails.
#include <string.h>
#include <strings.h>

#include <string>
#include <string_view>
#include <vector>

#include <unicode/ucnv.h>
#include <unicode/utf16.h>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"
#include "ini_file.h"

namespace quvahost {
namespace {

struct CodePage {
  int id;                 // identifier in the host's numbering
  const char* converter;  // ICU converter name
};

constexpr CodePage kCodePages[] = {
    {0, "UTF-8"},        {1, "windows-1252"}, {2, "windows-1250"},
    {3, "windows-1251"}, {4, "windows-1253"}, {5, "windows-1254"},
    {6, "windows-1255"}, {7, "windows-1256"}, {8, "windows-1257"},
    {9, "windows-1258"}, {10, "windows-874"}, {11, "windows-31j"},
    {12, "windows-936"}, {13, "windows-950"}, {14, "windows-949"},
    {15, "ISO-8859-1"},
};

const char* ConverterName(int id) {
  for (const CodePage& page : kCodePages) {
    if (page.id == id) return page.converter;
  }
  return nullptr;
}

// Appends the UTF-8 form of `cp` to `out`.
void AppendUTF8(char32_t cp, std::string* out) {
  if (cp < 0x80) {
    out->push_back(static_cast<char>(cp));
  } else if (cp < 0x800) {
    out->push_back(static_cast<char>(0xC0 | (cp >> 6)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else if (cp < 0x10000) {
    out->push_back(static_cast<char>(0xE0 | (cp >> 12)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else {
    out->push_back(static_cast<char>(0xF0 | (cp >> 18)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  }
}

// Encodes the well-formed UTF-16 `units` as UTF-8 into out[out_size],
// stopping before the first character that would not fit. Returns the
// bytes written, or -1 (EILSEQ recorded) on an unpaired surrogate.
int WriteUTF16AsUTF8(const std::vector<char16_t>& units, char* out,
                     int out_size) {
  std::string utf8;
  utf8.reserve(units.size() * 3);
  size_t limit = static_cast<size_t>(out_size) - 1;
  size_t i = 0;
  while (i < units.size()) {
    char32_t cp = units[i++];
    if (U16_IS_LEAD(cp) && i < units.size() && U16_IS_TRAIL(units[i])) {
      cp = U16_GET_SUPPLEMENTARY(cp, units[i]);
      ++i;
    } else if (U16_IS_SURROGATE(cp)) {
      return HOST_FAIL(EILSEQ);
    }
    size_t before = utf8.size();
    AppendUTF8(cp, &utf8);
    if (utf8.size() > limit) {
      utf8.resize(before);  // cut before the character that does not fit
      break;
    }
  }
  CopyIfFits(utf8.data(), utf8.size(), out, out_size);
  return static_cast<int>(utf8.size());
}

// The position after the character that starts at `p` (not at the end).
const char* NextChar(const char* p) {
  ++p;
  while ((static_cast<unsigned char>(*p) & 0xC0) == 0x80) ++p;
  return p;
}

}  // namespace

int CodePageGetImpl(int selector, int* code_page) {
  if (selector != QLIBC_CODEPAGE_SYSTEM || code_page == nullptr) {
    return HOST_FAIL(EINVAL);
  }
  std::string text;
  int error =
      ReadWholeFile(HostEtcFile(kSettingsName).c_str(), kMaxConfigBytes, &text);
  if (error != 0) return HOST_FAIL(error);
  std::string_view value;
  if (!FindIniValue(ParseIni(text), "system", "code_page", &value)) {
    return HOST_FAIL(ENOENT);
  }
  int id = -1;
  if (!ParseDecimalText(value, &id)) {
    std::string name(value);
    for (const CodePage& page : kCodePages) {
      if (strcasecmp(page.converter, name.c_str()) == 0) id = page.id;
    }
  }
  if (ConverterName(id) == nullptr) return HOST_FAIL(EINVAL);
  *code_page = id;
  return 0;
}

int UnicodeStrUTF16ToUTF8Impl(const char* text, char* out, int out_size) {
  if (text == nullptr || out == nullptr || out_size < 1) {
    return HOST_FAIL(EINVAL);
  }
  const auto* bytes = reinterpret_cast<const unsigned char*>(text);
  const size_t max_bytes = static_cast<size_t>(out_size) & ~size_t{1};
  bool big_endian = false;
  size_t pos = 0;
  if (max_bytes >= 2 && bytes[0] == 0xFE && bytes[1] == 0xFF) {
    big_endian = true;
    pos = 2;
  } else if (max_bytes >= 2 && bytes[0] == 0xFF && bytes[1] == 0xFE) {
    pos = 2;
  }
  std::vector<char16_t> units;
  units.reserve(max_bytes / 2);
  bool terminated = false;
  for (; pos + 2 <= max_bytes; pos += 2) {
    char16_t unit = big_endian ? (bytes[pos] << 8 | bytes[pos + 1])
                               : (bytes[pos + 1] << 8 | bytes[pos]);
    if (unit == 0) {
      terminated = true;
      break;
    }
    units.push_back(unit);
  }
  // Cut by the input limit: a lead surrogate whose partner lay beyond it is
  // dropped rather than reported as broken text.
  if (!terminated && !units.empty() && U16_IS_LEAD(units.back())) {
    units.pop_back();
  }
  return WriteUTF16AsUTF8(units, out, out_size);
}

int UnicodeStrCPToUTF8Impl(int code_page, const char* text, char* out,
                           int out_size) {
  if (text == nullptr || out == nullptr || out_size < 1) {
    return HOST_FAIL(EINVAL);
  }
  const char* name = ConverterName(code_page);
  if (name == nullptr) return HOST_FAIL(EINVAL);
  size_t length = strnlen(text, static_cast<size_t>(out_size));
  // Text cut by the input limit may end inside a multi-byte character;
  // only text that ends at its terminator must be complete.
  bool cut = length == static_cast<size_t>(out_size);

  UErrorCode status = U_ZERO_ERROR;
  UConverter* converter = ucnv_open(name, &status);
  if (U_FAILURE(status)) return HOST_FAIL(EIO);
  // Stop at the first byte sequence that is not valid in the code page,
  // instead of ICU's default substitution character.
  ucnv_setToUCallBack(converter, UCNV_TO_U_CALLBACK_STOP, nullptr, nullptr,
                      nullptr, &status);
  if (U_FAILURE(status)) {
    ucnv_close(converter);
    return HOST_FAIL(EIO);
  }
  // Two UTF-16 units per input byte cannot run short for any converter.
  std::vector<char16_t> units(2 * length + 2);
  UChar* target = reinterpret_cast<UChar*>(units.data());
  const char* source = text;
  ucnv_toUnicode(converter, &target, target + units.size(), &source,
                 text + length, nullptr, /*flush=*/!cut, &status);
  ucnv_close(converter);
  if (U_FAILURE(status)) return HOST_FAIL(EILSEQ);
  units.resize(
      static_cast<size_t>(target - reinterpret_cast<UChar*>(units.data())));
  return WriteUTF16AsUTF8(units, out, out_size);
}

int UnicodeUTF8StrCountCharImpl(const char* text) {
  if (text == nullptr) return HOST_FAIL(EINVAL);
  int count = 0;
  for (const char* p = text; *p != '\0'; p = NextChar(p)) ++count;
  return count;
}

const char* UnicodeUTF8ForwardNCharImpl(const char* text, int n) {
  if (text == nullptr || n < 0) {
    HOST_FAIL(EINVAL);
    return nullptr;
  }
  const char* p = text;
  for (int i = 0; i < n; ++i) {
    if (*p == '\0') {
      HOST_FAIL(ERANGE);
      return nullptr;
    }
    p = NextChar(p);
  }
  return p;
}

}  // namespace quvahost

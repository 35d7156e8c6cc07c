// Feeds the host's text-file readers arbitrary file contents: the INI value
// reader QLIBCFileGetSectionValue and the exact-line search
// QLIBCFileGetLine.
//
// The input is the file, byte for byte. Section and key names are taken from
// the input itself (its "[name]" lines and the names before '=') plus a few
// fixed ones; keys of the line search are lines of the input, whole or cut.
//
// Checked for every call:
//   - a value read fits the 256-byte buffer, ends with a zero byte at the
//     returned length and occurs in the file; a failure is ENOENT or
//     ERANGE (the file is a readable regular file, the arguments are
//     valid), leaves the buffer untouched and leaves its code in errno;
//   - for files in the plain subset of the format (see PlainIni), the value
//     or failure equals that of a model that reads the documented format;
//   - the line search returns 1 exactly when the key is a whole line of the
//     file (lines end with '\n', the last may lack it), copies the key then,
//     and leaves the buffer untouched when nothing matches; a key that does
//     not fit the buffer fails with ERANGE.
// When the first byte of the input has its high bit set, the line search
// also runs on the input placed behind filler lines so that it straddles
// the search's 64 KiB read blocks, which exercises the carry-over between
// blocks.
//
// A mismatch aborts with a message.
#include <errno.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz_host_scratch_file.h"
#include "quvahost/quvahost.h"

namespace {

constexpr int kValueSize = 256;
constexpr int kLineSize = 4097;
constexpr size_t kMaxInput = 256 * 1024;
// The line search reads this much per block (file_line.h).
constexpr size_t kSearchBlock = 64 * 1024;
constexpr char kSentinel = '\x5a';

[[noreturn]] void Fail(const char* what, std::string_view detail = {}) {
  fprintf(stderr, "fuzz_host_ini: %s", what);
  if (!detail.empty()) {
    fprintf(stderr, " [%.*s]", static_cast<int>(detail.size()), detail.data());
  }
  fputc('\n', stderr);
  abort();
}

std::string_view Trim(std::string_view text) {
  size_t begin = text.find_first_not_of(" \t");
  if (begin == std::string_view::npos) return {};
  size_t end = text.find_last_not_of(" \t");
  return text.substr(begin, end - begin + 1);
}

// The lines of `text`: split at '\n', a final line without '\n' counted, an
// empty text without lines.
std::vector<std::string_view> Lines(std::string_view text) {
  std::vector<std::string_view> lines;
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string_view::npos) end = text.size();
    lines.push_back(text.substr(pos, end - pos));
    pos = end + 1;
  }
  return lines;
}

// A name as the host receives it: a C string, so cut at its first zero.
std::string AsCString(std::string_view text) {
  return std::string(text.substr(0, text.find('\0')));
}

// The model of the INI format for the plain subset, where the documented
// format leaves no doubt: no zero, '\r', '\v' or '\f' bytes; a '#' or ';'
// comment starts in the first column; a line starting with '[' (after
// blanks) is "[name]" with a non-empty name free of '[', ']' and '='; a
// quoted value holds no further quote.
class PlainIni {
 public:
  // The model of `text`, or nothing when it is outside the plain subset.
  static std::optional<PlainIni> Parse(std::string_view text) {
    if (text.find_first_of(std::string_view("\0\r\v\f", 4)) !=
        std::string_view::npos) {
      return std::nullopt;
    }
    PlainIni ini;
    for (std::string_view line : Lines(text)) {
      std::string_view body = Trim(line);
      if (body.empty()) continue;
      if (body[0] == '#' || body[0] == ';') {
        if (line[0] != body[0]) return std::nullopt;
        continue;
      }
      if (body[0] == '[') {
        if (body.size() < 2 || body.back() != ']') return std::nullopt;
        std::string_view inner = body.substr(1, body.size() - 2);
        if (inner.find_first_of("[]=") != std::string_view::npos) {
          return std::nullopt;
        }
        inner = Trim(inner);
        if (inner.empty()) return std::nullopt;
        ini.items_.push_back({true, std::string(inner), {}});
        continue;
      }
      size_t equals = body.find('=');
      if (equals == std::string_view::npos) continue;
      std::string_view value = Trim(body.substr(equals + 1));
      if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
        value = value.substr(1, value.size() - 2);
        if (value.find('"') != std::string_view::npos) return std::nullopt;
      }
      ini.items_.push_back({false, std::string(Trim(body.substr(0, equals))),
                            std::string(value)});
    }
    return ini;
  }

  // The value of `key` in the first section called `section` (the part
  // before the first header for ""). Sets *ambiguous when the key is
  // missing there but present under a later header of the same name, which
  // the format leaves open.
  std::optional<std::string> Find(const std::string& section,
                                  const std::string& key,
                                  bool* ambiguous) const {
    *ambiguous = false;
    bool inside = section.empty();
    int occurrence = section.empty() ? 1 : 0;
    for (const Item& item : items_) {
      if (item.header) {
        if (section.empty()) return std::nullopt;
        inside = item.name == section;
        if (inside) ++occurrence;
      } else if (inside && item.name == key) {
        if (occurrence == 1) return item.value;
        *ambiguous = true;
        return std::nullopt;
      }
    }
    return std::nullopt;
  }

 private:
  struct Item {
    bool header;        // a "[name]" line, else a key line
    std::string name;   // section name or key
    std::string value;  // key lines: the value, quotes removed
  };
  std::vector<Item> items_;  // in file order
};

bool BufferUntouched(const char* buffer, int size) {
  for (int i = 0; i < size; ++i) {
    if (buffer[i] != kSentinel) return false;
  }
  return true;
}

void CheckSectionValue(const char* file, std::string_view text,
                       const std::optional<PlainIni>& model,
                       const std::string& section, const std::string& key) {
  static char* const buffer = new char[kValueSize];
  memset(buffer, kSentinel, kValueSize);
  errno = 0;
  int result = QLIBCFileGetSectionValue(file, section.c_str(), key.c_str(),
                                        buffer, kValueSize);
  int error = errno;
  std::string label = "[" + section + "] " + key;
  if (result >= 0) {
    if (result >= kValueSize) Fail("value longer than the buffer", label);
    if (buffer[result] != '\0')
      Fail("value not terminated at its length", label);
    if (text.find(std::string_view(buffer, static_cast<size_t>(result))) ==
        std::string_view::npos) {
      Fail("value not in the file", label);
    }
  } else {
    if (result != -1) Fail("result below -1", label);
    if (!BufferUntouched(buffer, kValueSize)) {
      Fail("failed read wrote the buffer", label);
    }
    if (error != ENOENT && error != ERANGE) {
      Fail("unexpected error code", label + " errno " + std::to_string(error));
    }
    if (QLIBCErrGet() != error) Fail("error stack and errno disagree", label);
  }
  if (!model) return;
  bool ambiguous = false;
  std::optional<std::string> want = model->Find(section, key, &ambiguous);
  if (ambiguous) return;
  if (!want) {
    if (result != -1 || error != ENOENT) Fail("model: key is missing", label);
  } else if (want->size() >= static_cast<size_t>(kValueSize)) {
    if (result != -1 || error != ERANGE) Fail("model: value too long", label);
  } else {
    if (result != static_cast<int>(want->size()) ||
        memcmp(buffer, want->data(), want->size()) != 0) {
      Fail("model: different value", label + " want " + *want);
    }
  }
}

void CheckLine(const char* file, std::string_view text,
               const std::string& key) {
  static char* const buffer = new char[kLineSize];
  memset(buffer, kSentinel, kLineSize);
  errno = 0;
  int result = QLIBCFileGetLine(file, key.c_str(), buffer, kLineSize,
                                QLIBC_GETLINE_EXACT);
  int error = errno;
  if (key.size() >= static_cast<size_t>(kLineSize)) {
    if (result != -1 || error != ERANGE) Fail("long key not refused");
    if (!BufferUntouched(buffer, kLineSize)) Fail("refusal wrote the buffer");
    return;
  }
  bool present = false;
  for (std::string_view line : Lines(text)) {
    if (line == key) {
      present = true;
      break;
    }
  }
  if (result == 1) {
    if (!present) Fail("line found that the file does not hold", key);
    if (memcmp(buffer, key.c_str(), key.size() + 1) != 0) {
      Fail("found line not copied", key);
    }
    if (!BufferUntouched(buffer + key.size() + 1,
                         kLineSize - static_cast<int>(key.size()) - 1)) {
      Fail("bytes written behind the terminator", key);
    }
  } else if (result == 0) {
    if (present) Fail("whole line not found", key);
    if (!BufferUntouched(buffer, kLineSize)) Fail("no match wrote the buffer");
  } else {
    Fail("line search failed", key + " errno " + std::to_string(error));
  }
}

// Keys for the line search: a line of `text` chosen by `pick`, whole, and
// cut by one byte at its end; and the empty key.
std::vector<std::string> LineKeys(std::string_view text, uint8_t pick) {
  std::vector<std::string> keys = {""};
  std::vector<std::string_view> lines = Lines(text);
  if (lines.empty()) return keys;
  std::string line = AsCString(lines[pick % lines.size()]);
  keys.push_back(line);
  if (!line.empty()) keys.push_back(line.substr(0, line.size() - 1));
  return keys;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return 0;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  fuzz_host::ScratchFile::Write(data, size);
  const char* file = fuzz_host::ScratchFile::Path();

  // Names taken from the input: section names of its header lines and keys
  // of its key lines, the first and the last of each.
  std::vector<std::string> sections = {"", "system"};
  std::vector<std::string> keys = {"code_page"};
  std::string first_section, last_section, first_key, last_key;
  for (std::string_view line : Lines(text)) {
    std::string_view body = Trim(line);
    if (!body.empty() && body.back() == '\r')
      body = Trim(body.substr(0, body.size() - 1));
    if (body.empty()) continue;
    if (body[0] == '[') {
      size_t close = body.rfind(']');
      if (close != std::string_view::npos && close > 0) {
        last_section = AsCString(Trim(body.substr(1, close - 1)));
        if (first_section.empty()) first_section = last_section;
      }
    } else if (size_t equals = body.find('=');
               equals != std::string_view::npos) {
      last_key = AsCString(Trim(body.substr(0, equals)));
      if (first_key.empty()) first_key = last_key;
    }
  }
  for (const std::string& s : {first_section, last_section}) {
    if (!s.empty()) sections.push_back(s);
  }
  for (const std::string& k : {first_key, last_key}) {
    if (!k.empty()) keys.push_back(k);
  }

  const std::optional<PlainIni> model = PlainIni::Parse(text);
  for (const std::string& section : sections) {
    for (const std::string& key : keys) {
      CheckSectionValue(file, text, model, section, key);
    }
  }

  const uint8_t pick = size > 0 ? data[0] : 0;
  const std::vector<std::string> line_keys = LineKeys(text, pick);
  for (const std::string& key : line_keys) CheckLine(file, text, key);

  if ((pick & 0x80) != 0) {
    // Filler lines, then the input, so that the input's first line starts
    // a few bytes before the end of the first read block.
    size_t shift = 1 + (size > 1 ? data[1] % 64 : 0);
    std::string padded(kSearchBlock - shift, 'f');
    for (size_t i = 63; i < padded.size(); i += 64) padded[i] = '\n';
    padded.back() = '\n';
    padded.append(text);
    fuzz_host::ScratchFile::Write(
        reinterpret_cast<const uint8_t*>(padded.data()), padded.size());
    for (const std::string& key : line_keys) CheckLine(file, padded, key);
  }
  return 0;
}

// The one INI reader of the stand-in, used for the share database, the host
// settings and QLIBCFileGetSectionValue.
//
// Format: "[name]" opens a section; "key = value" belongs to the last
// section opened (section "" before the first); blank space (spaces and
// tabs) around names and values is dropped; a value wholly enclosed in
// double quotes loses them; a line starting with '#' or ';', a blank line
// and a line without '=' carry nothing. A '\r' before the '\n' is ignored.
#ifndef QUVAHOST_PLATFORM_INI_FILE_H_
#define QUVAHOST_PLATFORM_INI_FILE_H_

#include <string>
#include <string_view>
#include <vector>

namespace quvahost {

struct IniLine {
  enum Kind { kNothing, kSection, kKeyValue };
  Kind kind = kNothing;      // what the line is
  std::string_view raw;      // the line as written, without its '\n'
  std::string_view section;  // kSection: its name; kKeyValue: its section
  std::string_view key;      // kKeyValue: the key
  std::string_view value;    // kKeyValue: the value, quotes removed
};

// Splits `text` into lines and classifies each. The views point into
// `text`, which must outlive the result. A final line without '\n' counts;
// an empty text has no lines.
std::vector<IniLine> ParseIni(std::string_view text);

// Finds the first `key` of the first section called `section`.
// Returns true and sets *value when found.
bool FindIniValue(const std::vector<IniLine>& lines, std::string_view section,
                  std::string_view key, std::string_view* value);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_INI_FILE_H_

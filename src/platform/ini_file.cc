#include "ini_file.h"

namespace quvahost {
namespace {

std::string_view Trim(std::string_view text) {
  size_t begin = text.find_first_not_of(" \t");
  if (begin == std::string_view::npos) return {};
  size_t end = text.find_last_not_of(" \t");
  return text.substr(begin, end - begin + 1);
}

}  // namespace

std::vector<IniLine> ParseIni(std::string_view text) {
  std::vector<IniLine> lines;
  std::string_view section;
  bool seen_section = false;
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string_view::npos) end = text.size();
    IniLine line;
    line.raw = text.substr(pos, end - pos);
    pos = end + 1;

    std::string_view body = line.raw;
    if (!body.empty() && body.back() == '\r') body.remove_suffix(1);
    body = Trim(body);
    if (body.empty() || body[0] == '#' || body[0] == ';') {
      lines.push_back(line);
      continue;
    }
    if (body[0] == '[') {
      size_t close = body.rfind(']');
      if (close != std::string_view::npos && close > 0) {
        section = Trim(body.substr(1, close - 1));
        seen_section = true;
        line.kind = IniLine::kSection;
        line.section = section;
      }
      lines.push_back(line);
      continue;
    }
    size_t equals = body.find('=');
    if (equals != std::string_view::npos) {
      line.kind = IniLine::kKeyValue;
      line.section = seen_section ? section : std::string_view();
      line.key = Trim(body.substr(0, equals));
      line.value = Trim(body.substr(equals + 1));
      if (line.value.size() >= 2 && line.value.front() == '"' &&
          line.value.back() == '"') {
        line.value = line.value.substr(1, line.value.size() - 2);
      }
    }
    lines.push_back(line);
  }
  return lines;
}

bool FindIniValue(const std::vector<IniLine>& lines, std::string_view section,
                  std::string_view key, std::string_view* value) {
  // Section "" is the part before the first header. Otherwise only the
  // first section of that name counts: keys of a repeated header later in
  // the file are ignored, as they would be ambiguous.
  bool inside = section.empty();
  for (const IniLine& line : lines) {
    if (line.kind == IniLine::kSection) {
      if (inside) return false;
      inside = !section.empty() && line.section == section;
    } else if (inside && line.kind == IniLine::kKeyValue && line.key == key) {
      *value = line.value;
      return true;
    }
  }
  return false;
}

}  // namespace quvahost

#include "json_text.h"

#include <math.h>
#include <stdio.h>
#include <stdlib.h>

namespace quvaidx_cli {
namespace {

// The characters JSON escapes by a letter, and their escapes.
constexpr struct {
  char c;
  const char* escape;
} kShortEscapes[] = {{'"', "\\\""}, {'\\', "\\\\"}, {'\b', "\\b"},
                     {'\f', "\\f"}, {'\n', "\\n"},  {'\r', "\\r"},
                     {'\t', "\\t"}};

void AppendString(const char* begin, const char* end, std::string* out) {
  out->push_back('"');
  for (const char* p = begin; p < end; ++p) {
    unsigned char c = static_cast<unsigned char>(*p);
    const char* escape = nullptr;
    for (const auto& known : kShortEscapes) {
      if (known.c == *p) escape = known.escape;
    }
    if (escape != nullptr) {
      out->append(escape);
    } else if (c < 0x20 || c == 0x7F) {
      char escaped[8];
      snprintf(escaped, sizeof(escaped), "\\u%04x", c);
      out->append(escaped);
    } else {
      out->push_back(static_cast<char>(c));
    }
  }
  out->push_back('"');
}

void Append(const Json::Value& value, bool compact, int depth,
            std::string* out);

void NewLine(bool compact, int depth, std::string* out) {
  if (compact) return;
  out->push_back('\n');
  out->append(static_cast<size_t>(depth) * 2, ' ');
}

void AppendContainer(const Json::Value& value, bool compact, int depth,
                     std::string* out) {
  bool is_object = value.isObject();
  out->push_back(is_object ? '{' : '[');
  if (value.empty()) {
    out->push_back(is_object ? '}' : ']');
    return;
  }
  bool first = true;
  if (is_object) {
    for (Json::ValueConstIterator it = value.begin(); it != value.end(); ++it) {
      if (!first) out->push_back(',');
      first = false;
      NewLine(compact, depth + 1, out);
      const char* end = nullptr;
      const char* begin = it.memberName(&end);
      AppendString(begin, end, out);
      out->append(compact ? ":" : ": ");
      Append(*it, compact, depth + 1, out);
    }
  } else {
    for (Json::ArrayIndex i = 0; i < value.size(); ++i) {
      if (!first) out->push_back(',');
      first = false;
      NewLine(compact, depth + 1, out);
      Append(value[i], compact, depth + 1, out);
    }
  }
  NewLine(compact, depth, out);
  out->push_back(is_object ? '}' : ']');
}

void Append(const Json::Value& value, bool compact, int depth,
            std::string* out) {
  switch (value.type()) {
    case Json::nullValue:
      out->append("null");
      break;
    case Json::booleanValue:
      out->append(value.asBool() ? "true" : "false");
      break;
    case Json::intValue:
      out->append(std::to_string(value.asLargestInt()));
      break;
    case Json::uintValue:
      out->append(std::to_string(value.asLargestUInt()));
      break;
    case Json::realValue:
      out->append(ShortestNumber(value.asDouble()));
      break;
    case Json::stringValue: {
      const char* begin = nullptr;
      const char* end = nullptr;
      if (value.getString(&begin, &end)) {
        AppendString(begin, end, out);
      } else {
        out->append("\"\"");
      }
      break;
    }
    case Json::arrayValue:
    case Json::objectValue:
      AppendContainer(value, compact, depth, out);
      break;
  }
}

}  // namespace

std::string ShortestNumber(double number) {
  if (!isfinite(number)) return "null";
  char text[32];
  for (int precision = 1; precision <= 17; ++precision) {
    snprintf(text, sizeof(text), "%.*g", precision, number);
    if (strtod(text, nullptr) == number) break;
  }
  std::string result = text;
  // A whole number keeps a mark of being a real, as jsoncpp writes it, so
  // that it reads back as one.
  if (result.find_first_of(".eE") == std::string::npos) result += ".0";
  return result;
}

std::string FormatJson(const Json::Value& value, bool compact) {
  std::string out;
  Append(value, compact, 0, &out);
  return out;
}

}  // namespace quvaidx_cli

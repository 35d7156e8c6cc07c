// JSON text for people and pipes, as jq and the protocol tools write it:
// UTF-8 as is (only what JSON requires is escaped), numbers as the shortest
// text that reads back as the same value, members in the order jsoncpp keeps
// them (sorted by key).
#ifndef QUVAIDX_TOOLS_QUVAIDX_JSON_TEXT_H_
#define QUVAIDX_TOOLS_QUVAIDX_JSON_TEXT_H_

#include <string>

#include <json/json.h>

namespace quvaidx_cli {

// `value` as JSON text without a line end: on one line with no blanks when
// `compact`, else indented by two spaces per level ("key": value), with
// empty arrays and objects as [] and {}.
std::string FormatJson(const Json::Value& value, bool compact);

// The shortest decimal text (at most 17 significant digits) that strtod
// reads back as exactly `number`; "1e+300" style exponents where %g uses
// them. Not for NaN or infinities, which JSON cannot carry (they give
// "null").
std::string ShortestNumber(double number);

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_QUVAIDX_JSON_TEXT_H_

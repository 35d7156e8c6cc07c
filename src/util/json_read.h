// Guarded reads of JSON members from outside data. Not exported.
//
// jsoncpp's accessors throw on a mistyped or out-of-range value (asInt on a
// string, asUInt on -1) and its non-const member access throws on a value
// that is neither null nor an object. Nothing may throw out of the library,
// so every member read from a packet goes through these helpers: a value
// that does not fit the target reads as 0 (or an empty text), and a real
// within range is cut toward zero as jsoncpp does. true and false read as 1
// and 0. None of them throws.
#ifndef QUVAIDX_UTIL_JSON_READ_H_
#define QUVAIDX_UTIL_JSON_READ_H_

#include <stddef.h>
#include <stdint.h>

#include <json/json.h>

namespace quvaidx {

// The member `key` of `object`, or null when `object` is not an object or
// has no such member. Never adds a member.
const Json::Value& MemberOf(const Json::Value& object, const char* key);

// The member `key` of `object` through the non-const access, which adds an
// absent key as a null member (and makes a null `object` an object). When
// `object` is neither null nor an object, returns a shared null value and
// leaves `object` alone.
const Json::Value& MemberAdding(Json::Value& object, const char* key);

int32_t ReadInt32(const Json::Value& value);
uint32_t ReadUInt32(const Json::Value& value);
uint64_t ReadUInt64(const Json::Value& value);
// A number within float range, narrowed to the nearest float; else 0.
float ReadFloat(const Json::Value& value);
// True only for a boolean true or a nonzero number; false for everything
// else, so a reply's "success" that is missing or mistyped reads as false.
bool ReadBool(const Json::Value& value);

// Copies a string `value` into field[capacity] as a zero-terminated text:
// its bytes up to its first zero byte, cut to capacity - 1 (see
// CutLength in util/utf8_cut.h). Anything but a string gives an empty text.
// REQUIRES: capacity >= 1.
void ReadText(const Json::Value& value, char* field, size_t capacity);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_JSON_READ_H_

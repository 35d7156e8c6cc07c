#include "util/json_read.h"

#include <float.h>
#include <string.h>

#include <limits>

#include "util/utf8_cut.h"

namespace quvaidx {
namespace {

// Reads `value` as a T. Integers must lie in T's range; reals must too,
// and are cut toward zero. true and false give 1 and 0; anything else is 0.
template <typename T>
T ReadBounded(const Json::Value& value) {
  constexpr int64_t kMin = std::numeric_limits<T>::min();
  constexpr int64_t kMax = std::numeric_limits<T>::max();
  switch (value.type()) {
    case Json::intValue: {
      int64_t v = value.asInt64();
      return v >= kMin && v <= kMax ? static_cast<T>(v) : 0;
    }
    case Json::uintValue: {
      uint64_t v = value.asUInt64();
      return v <= static_cast<uint64_t>(kMax) ? static_cast<T>(v) : 0;
    }
    case Json::realValue: {
      // Both bounds are exact doubles for 32-bit T; written so that NaN
      // fails too.
      double v = value.asDouble();
      return v >= static_cast<double>(kMin) && v <= static_cast<double>(kMax)
                 ? static_cast<T>(v)
                 : 0;
    }
    case Json::booleanValue:
      return value.asBool() ? 1 : 0;
    default:
      return 0;
  }
}

const Json::Value& NullValue() {
  static const Json::Value null_value;
  return null_value;
}

}  // namespace

const Json::Value& MemberOf(const Json::Value& object, const char* key) {
  if (!object.isObject()) return NullValue();
  const Json::Value* found = object.find(key, key + strlen(key));
  return found != nullptr ? *found : NullValue();
}

const Json::Value& MemberAdding(Json::Value& object, const char* key) {
  if (!object.isObject() && !object.isNull()) return NullValue();
  return object[key];
}

int32_t ReadInt32(const Json::Value& value) {
  return ReadBounded<int32_t>(value);
}

uint32_t ReadUInt32(const Json::Value& value) {
  return ReadBounded<uint32_t>(value);
}

uint64_t ReadUInt64(const Json::Value& value) {
  switch (value.type()) {
    case Json::intValue: {
      Json::Value::Int64 v = value.asInt64();
      return v < 0 ? 0 : static_cast<uint64_t>(v);
    }
    case Json::uintValue:
      return value.asUInt64();
    case Json::realValue: {
      double v = value.asDouble();
      // 18446744073709551616.0 is 2^64, the first real that does not fit.
      if (!(v > -1.0 && v < 18446744073709551616.0)) return 0;
      return static_cast<uint64_t>(v);
    }
    case Json::booleanValue:
      return value.asBool() ? 1 : 0;
    default:
      return 0;
  }
}

float ReadFloat(const Json::Value& value) {
  switch (value.type()) {
    case Json::intValue:
    case Json::uintValue:
    case Json::realValue: {
      double v = value.asDouble();
      if (!(v >= -FLT_MAX && v <= FLT_MAX)) return 0;
      return static_cast<float>(v);
    }
    case Json::booleanValue:
      return value.asBool() ? 1 : 0;
    default:
      return 0;
  }
}

bool ReadBool(const Json::Value& value) {
  switch (value.type()) {
    case Json::booleanValue:
      return value.asBool();
    case Json::intValue:
      return value.asInt64() != 0;
    case Json::uintValue:
      return value.asUInt64() != 0;
    case Json::realValue:
      return value.asDouble() != 0.0;
    default:
      return false;
  }
}

void ReadText(const Json::Value& value, char* field, size_t capacity) {
  if (!value.isString()) {
    field[0] = '\0';
    return;
  }
  const char* begin = nullptr;
  const char* end = nullptr;
  if (!value.getString(&begin, &end) || begin == nullptr) {
    field[0] = '\0';
    return;
  }
  size_t length = strnlen(begin, static_cast<size_t>(end - begin));
  length = CutLength(begin, length, capacity - 1);
  memcpy(field, begin, length);
  field[length] = '\0';
}

}  // namespace quvaidx

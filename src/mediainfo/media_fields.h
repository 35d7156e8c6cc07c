// The media record's 47 fields as data, in declared order: the one
// description that the JSON conversions and both dumps walk. Not exported.
#ifndef QUVAIDX_MEDIAINFO_MEDIA_FIELDS_H_
#define QUVAIDX_MEDIAINFO_MEDIA_FIELDS_H_

#include <stddef.h>

#include "quvaidx/mediainfo.h"

namespace quvaidx {

enum class FieldKind {
  kText,    // char[capacity], zero-terminated
  kInt32,   // int32_t: JSON integer, dumped with %d
  kUInt32,  // uint32_t: JSON unsigned integer, dumped with %u
  kId,      // uint32_t ID: as kUInt32, dumped with %lu
  kUInt64,  // uint64_t fileSize: JSON unsigned 64-bit integer
  kFloat,   // float duration: JSON real, dumped with %f
};

struct MediaField {
  const char* name;  // field name, which is also its JSON key
  FieldKind kind;    // type of the field
  size_t offset;     // offsetof in __tag_QUVA_MEDIA_INFO
  size_t capacity;   // bytes of a text field, terminator included; else 0
};

constexpr size_t kMediaFieldCount = 47;
extern const MediaField kMediaFields[kMediaFieldCount];

// The field's storage inside `record`.
inline char* FieldAddress(__tag_QUVA_MEDIA_INFO& record,
                          const MediaField& field) {
  return reinterpret_cast<char*>(&record) + field.offset;
}

}  // namespace quvaidx

#endif  // QUVAIDX_MEDIAINFO_MEDIA_FIELDS_H_

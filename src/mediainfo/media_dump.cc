// The two diagnostic dumps of a media record: standard output and the
// system log. Both print the same 47 items, built by FormatItem.
#include <inttypes.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include "mediainfo/media_fields.h"
#include "quvaidx/mediainfo.h"
#include "util/log_internal.h"

namespace {

constexpr char kModule[] = "quvaidx_mediainfo";
// The longest item: a 16-column name, "= ", a path text and ",".
constexpr size_t kItemSize = kMediaPathSize + 64;

// Formats the item of `field` ("name<pad>= value,") into item[kItemSize].
// Texts are values, never formats, and are read no further than their
// field's capacity; fileSize prints in full.
void FormatItem(__tag_QUVA_MEDIA_INFO& record, const quvaidx::MediaField& field,
                char* item) {
  const char* at = quvaidx::FieldAddress(record, field);
  switch (field.kind) {
    case quvaidx::FieldKind::kText:
      snprintf(item, kItemSize, "%-16s= %.*s,", field.name,
               static_cast<int>(strnlen(at, field.capacity)), at);
      return;
    case quvaidx::FieldKind::kInt32: {
      int32_t v;
      memcpy(&v, at, sizeof(v));
      snprintf(item, kItemSize, "%-16s= %d,", field.name, v);
      return;
    }
    case quvaidx::FieldKind::kUInt32: {
      uint32_t v;
      memcpy(&v, at, sizeof(v));
      snprintf(item, kItemSize, "%-16s= %u,", field.name, v);
      return;
    }
    case quvaidx::FieldKind::kId: {
      uint32_t v;
      memcpy(&v, at, sizeof(v));
      snprintf(item, kItemSize, "%-16s= %lu,", field.name,
               static_cast<unsigned long>(v));
      return;
    }
    case quvaidx::FieldKind::kUInt64: {
      uint64_t v;
      memcpy(&v, at, sizeof(v));
      snprintf(item, kItemSize, "%-16s= %" PRIu64 ",", field.name, v);
      return;
    }
    case quvaidx::FieldKind::kFloat: {
      float v;
      memcpy(&v, at, sizeof(v));
      snprintf(item, kItemSize, "%-16s= %f,", field.name,
               static_cast<double>(v));
      return;
    }
  }
  item[0] = '\0';
}

}  // namespace

void PrintMediaInfoObject(__tag_QUVA_MEDIA_INFO& record) {
  char item[kItemSize];
  for (const quvaidx::MediaField& field : quvaidx::kMediaFields) {
    FormatItem(record, field, item);
    fputs(item, stdout);
  }
}

void SyslogMediaInfoObject(__tag_QUVA_MEDIA_INFO& record) {
  char item[kItemSize];
  for (const quvaidx::MediaField& field : quvaidx::kMediaFields) {
    FormatItem(record, field, item);
    quvaidx::LogDirect(LOG_ERR, "%s:%d %s", kModule, __LINE__, item);
  }
}

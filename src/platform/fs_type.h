// Mapping of statfs(2) magic numbers to the type codes of quvahost.h.
#ifndef QUVAHOST_PLATFORM_FS_TYPE_H_
#define QUVAHOST_PLATFORM_FS_TYPE_H_

#include <stdint.h>

namespace quvahost {

// The type code for the f_type `magic` of statfs; QUVA_FS_OTHER when the
// magic is not in the table.
int FSTypeCodeFromMagic(uint32_t magic);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_FS_TYPE_H_

// Internal helpers of the share database, shared with the test fake so
// that its in-memory shares follow the same rules as the file.
#ifndef QUVAHOST_PLATFORM_SHARE_DB_H_
#define QUVAHOST_PLATFORM_SHARE_DB_H_

#include <string>
#include <string_view>

#include "quvahost/quvahost.h"

namespace quvahost {

// Allocates a record for QUVAShareFree to release. Returns null with
// *error set to ENAMETOOLONG when the name or path does not fit, ENOMEM
// when allocation fails.
ShareRecord* NewShareRecord(std::string_view name, std::string_view path,
                            unsigned status, int* error);

// Lexical normal form of an absolute path: repeated '/', "." components
// and a final '/' removed ("/" stays "/"). Returns false for a relative
// path or one with a ".." component, whose meaning depends on links.
bool NormalizeAbsolutePath(std::string_view path, std::string* normal);

// True when the normalized share path `share` holds the normalized path
// `path`: equal, or a prefix that ends at a component boundary.
bool ShareHoldsPath(std::string_view share, std::string_view path);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_SHARE_DB_H_

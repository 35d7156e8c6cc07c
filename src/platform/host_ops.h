// The dispatch table behind the exported host operations.
//
// Every exported function of quvahost.h does nothing but call its entry in
// the table in force, which starts out as the stand-in's own
// implementations. Tests (tests/support/fake_host.h) install a table of
// their own to make an operation fail or answer something chosen, and
// restore the previous one after.
//
// One list, QUVAHOST_OPS, names every operation once; the table, the
// implementations' declarations, the real table, the exported forwarding
// functions and the test fake's hooks are all generated from it, so they
// cannot disagree, and reordering the list changes nothing. quvahost.h stays
// hand-written as the public reference: a list entry whose type differs
// from the declaration there does not compile.
//
// Not exported from libquvahost.so; reachable only through the static
// library, which is what tests link. Installing a table is not
// synchronised: do it only while no other thread calls the host.
#ifndef QUVAHOST_PLATFORM_HOST_OPS_H_
#define QUVAHOST_PLATFORM_HOST_OPS_H_

#include "quvahost/quvahost.h"

// X(prefix, name, result, (parameters), (arguments)): the operation
// exported as prefix##name, whose implementation is quvahost::name##Impl.
// clang-format off
#define QUVAHOST_OPS(X)                                                       \
  X(QUVA, ShareGet, int,                                                      \
    (const char* name, ShareRecord** record), (name, record))                 \
  X(QUVA, ShareGetByAttrStr, int,                                             \
    (const char* value, int attribute, ShareRecord** record),                 \
    (value, attribute, record))                                               \
  X(QUVA, ShareUpdate, int, (const ShareRecord* record), (record))            \
  X(QUVA, ShareFree, void, (ShareRecord* record), (record))                   \
  X(QUVA, GetFSType, int, (const char* path, int option), (path, option))     \
  X(QUVA, FSIsRemoteFS, int, (int type), (type))                              \
  X(QUVA, FSIsImageFS, int, (int type), (type))                               \
  X(QUVA, EADirPath, int,                                                     \
    (int option, const char* file_path, char* buffer, int size),              \
    (option, file_path, buffer, size))                                        \
  X(QUVA, EAMKDir, int, (int option, const char* ea_dir_path),                \
    (option, ea_dir_path))                                                    \
  X(QUVA, EAIsHiddenDir, int, (const char* name), (name))                     \
  X(QUVA, SystemGetBootStep, int, (), ())                                     \
  X(QLIBC, ErrGet, int, (), ())                                               \
  X(QLIBC, ErrorGetFile, const char*, (), ())                                 \
  X(QLIBC, ErrorGetLine, int, (), ())                                         \
  X(QLIBC, FileGetLine, int,                                                  \
    (const char* file, const char* key, char* buffer, int size, int option),  \
    (file, key, buffer, size, option))                                        \
  X(QLIBC, FileGetSectionValue, int,                                          \
    (const char* file, const char* section, const char* key, char* buffer,    \
     int size),                                                               \
    (file, section, key, buffer, size))                                       \
  X(QLIBC, FileStat, int,                                                     \
    (const char* path, int option, QLIBCFileStatRecord* record),              \
    (path, option, record))                                                   \
  X(QLIBC, ReadPidFile, int, (const char* pid_file), (pid_file))              \
  X(QLIBC, ProcAliveByPidFile, int, (const char* pid_file), (pid_file))       \
  X(QLIBC, CodePageGet, int, (int selector, int* code_page),                  \
    (selector, code_page))                                                    \
  X(QLIBC, UnicodeStrUTF16ToUTF8, int,                                        \
    (const char* text, char* out, int out_size), (text, out, out_size))       \
  X(QLIBC, UnicodeStrCPToUTF8, int,                                           \
    (int code_page, const char* text, char* out, int out_size),               \
    (code_page, text, out, out_size))                                         \
  X(QLIBC, UnicodeUTF8StrCountChar, int, (const char* text), (text))          \
  X(QLIBC, UnicodeUTF8ForwardNChar, const char*, (const char* text, int n),   \
    (text, n))
// clang-format on

namespace quvahost {

// One pointer per operation, named as in QUVAHOST_OPS.
struct HostOps {
#define QUVAHOST_OP_SLOT(prefix, name, result, params, args) \
  result(*name) params;
  QUVAHOST_OPS(QUVAHOST_OP_SLOT)
#undef QUVAHOST_OP_SLOT
};

// The real implementations, one per operation, defined in the module that
// owns the concern.
#define QUVAHOST_OP_IMPL(prefix, name, result, params, args) \
  result name##Impl params;
QUVAHOST_OPS(QUVAHOST_OP_IMPL)
#undef QUVAHOST_OP_IMPL

// Makes the exported functions call `ops` and returns the table they called
// until now. Null restores the stand-in's own table; within a table, a null
// entry stands for the stand-in's own operation.
HostOps SetHostOps(const HostOps* ops);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_HOST_OPS_H_

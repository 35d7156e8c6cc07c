// The dispatch table behind the exported host operations.
//
// Every exported function of quvahost.h does nothing but call its entry in
// g_host_ops, which starts out as kRealHostOps, the stand-in's own
// implementations. Tests (tests/support/fake_host.h) swap entries to make
// an operation fail or answer something chosen, and restore them after.
//
// Not exported from libquvahost.so; reachable only through the static
// library, which is what tests link. Swapping entries is not synchronised:
// do it only while no other thread calls the host.
#ifndef QUVAHOST_PLATFORM_HOST_OPS_H_
#define QUVAHOST_PLATFORM_HOST_OPS_H_

#include "quvahost/quvahost.h"

namespace quvahost {

struct HostOps {
  int (*ShareGet)(const char* name, ShareRecord** record);
  int (*ShareGetByAttrStr)(const char* value, int attribute,
                           ShareRecord** record);
  int (*ShareUpdate)(const ShareRecord* record);
  void (*ShareFree)(ShareRecord* record);
  int (*GetFSType)(const char* path, int option);
  int (*FSIsRemoteFS)(int type);
  int (*FSIsImageFS)(int type);
  int (*EADirPath)(int option, const char* file_path, char* buffer, int size);
  int (*EAMKDir)(int option, const char* ea_dir_path);
  int (*EAIsHiddenDir)(const char* name);
  int (*SystemGetBootStep)();
  int (*ErrGet)();
  const char* (*ErrorGetFile)();
  int (*ErrorGetLine)();
  int (*FileGetLine)(const char* file, const char* key, char* buffer, int size,
                     int option);
  int (*FileGetSectionValue)(const char* file, const char* section,
                             const char* key, char* buffer, int size);
  int (*FileStat)(const char* path, int option, QLIBCFileStatRecord* record);
  int (*ReadPidFile)(const char* pid_file);
  int (*ProcAliveByPidFile)(const char* pid_file);
  int (*CodePageGet)(int selector, int* code_page);
  int (*UnicodeStrUTF16ToUTF8)(const char* text, char* out, int out_size);
  int (*UnicodeStrCPToUTF8)(int code_page, const char* text, char* out,
                            int out_size);
  int (*UnicodeUTF8StrCountChar)(const char* text);
  const char* (*UnicodeUTF8ForwardNChar)(const char* text, int n);
};

// The stand-in's own implementations.
extern const HostOps kRealHostOps;
// What the exported functions call; a copy of kRealHostOps at start-up.
extern HostOps g_host_ops;

// The real implementations, one per operation, defined in the module that
// owns the concern.
int ShareGetImpl(const char* name, ShareRecord** record);
int ShareGetByAttrStrImpl(const char* value, int attribute,
                          ShareRecord** record);
int ShareUpdateImpl(const ShareRecord* record);
void ShareFreeImpl(ShareRecord* record);
int GetFSTypeImpl(const char* path, int option);
int FSIsRemoteFSImpl(int type);
int FSIsImageFSImpl(int type);
int EADirPathImpl(int option, const char* file_path, char* buffer, int size);
int EAMKDirImpl(int option, const char* ea_dir_path);
int EAIsHiddenDirImpl(const char* name);
int SystemGetBootStepImpl();
int ErrGetImpl();
const char* ErrorGetFileImpl();
int ErrorGetLineImpl();
int FileGetLineImpl(const char* file, const char* key, char* buffer, int size,
                    int option);
int FileGetSectionValueImpl(const char* file, const char* section,
                            const char* key, char* buffer, int size);
int FileStatImpl(const char* path, int option, QLIBCFileStatRecord* record);
int ReadPidFileImpl(const char* pid_file);
int ProcAliveByPidFileImpl(const char* pid_file);
int CodePageGetImpl(int selector, int* code_page);
int UnicodeStrUTF16ToUTF8Impl(const char* text, char* out, int out_size);
int UnicodeStrCPToUTF8Impl(int code_page, const char* text, char* out,
                           int out_size);
int UnicodeUTF8StrCountCharImpl(const char* text);
const char* UnicodeUTF8ForwardNCharImpl(const char* text, int n);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_HOST_OPS_H_

// The exported C entry points: each forwards to its entry in g_host_ops.
#include "host_ops.h"

namespace quvahost {

// constexpr so that g_host_ops is constant-initialized: usable from any static
// initializer, whatever the order of initialization.
constexpr HostOps kRealHostOps = {
    ShareGetImpl,
    ShareGetByAttrStrImpl,
    ShareUpdateImpl,
    ShareFreeImpl,
    GetFSTypeImpl,
    FSIsRemoteFSImpl,
    FSIsImageFSImpl,
    EADirPathImpl,
    EAMKDirImpl,
    EAIsHiddenDirImpl,
    SystemGetBootStepImpl,
    ErrGetImpl,
    ErrorGetFileImpl,
    ErrorGetLineImpl,
    FileGetLineImpl,
    FileGetSectionValueImpl,
    FileStatImpl,
    ReadPidFileImpl,
    ProcAliveByPidFileImpl,
    CodePageGetImpl,
    UnicodeStrUTF16ToUTF8Impl,
    UnicodeStrCPToUTF8Impl,
    UnicodeUTF8StrCountCharImpl,
    UnicodeUTF8ForwardNCharImpl,
};

HostOps g_host_ops = kRealHostOps;

}  // namespace quvahost

using quvahost::g_host_ops;

extern "C" {

int QUVAShareGet(const char* name, ShareRecord** record) {
  return g_host_ops.ShareGet(name, record);
}

int QUVAShareGetByAttrStr(const char* value, int attribute,
                          ShareRecord** record) {
  return g_host_ops.ShareGetByAttrStr(value, attribute, record);
}

int QUVAShareUpdate(const ShareRecord* record) {
  return g_host_ops.ShareUpdate(record);
}

void QUVAShareFree(ShareRecord* record) { g_host_ops.ShareFree(record); }

int QUVAGetFSType(const char* path, int option) {
  return g_host_ops.GetFSType(path, option);
}

int QUVAFSIsRemoteFS(int type) { return g_host_ops.FSIsRemoteFS(type); }

int QUVAFSIsImageFS(int type) { return g_host_ops.FSIsImageFS(type); }

int QUVAEADirPath(int option, const char* file_path, char* buffer, int size) {
  return g_host_ops.EADirPath(option, file_path, buffer, size);
}

int QUVAEAMKDir(int option, const char* ea_dir_path) {
  return g_host_ops.EAMKDir(option, ea_dir_path);
}

int QUVAEAIsHiddenDir(const char* name) {
  return g_host_ops.EAIsHiddenDir(name);
}

int QUVASystemGetBootStep(void) { return g_host_ops.SystemGetBootStep(); }

int QLIBCErrGet(void) { return g_host_ops.ErrGet(); }

const char* QLIBCErrorGetFile(void) { return g_host_ops.ErrorGetFile(); }

int QLIBCErrorGetLine(void) { return g_host_ops.ErrorGetLine(); }

int QLIBCFileGetLine(const char* file, const char* key, char* buffer, int size,
                     int option) {
  return g_host_ops.FileGetLine(file, key, buffer, size, option);
}

int QLIBCFileGetSectionValue(const char* file, const char* section,
                             const char* key, char* buffer, int size) {
  return g_host_ops.FileGetSectionValue(file, section, key, buffer, size);
}

int QLIBCFileStat(const char* path, int option, QLIBCFileStatRecord* record) {
  return g_host_ops.FileStat(path, option, record);
}

int QLIBCReadPidFile(const char* pid_file) {
  return g_host_ops.ReadPidFile(pid_file);
}

int QLIBCProcAliveByPidFile(const char* pid_file) {
  return g_host_ops.ProcAliveByPidFile(pid_file);
}

int QLIBCCodePageGet(int selector, int* code_page) {
  return g_host_ops.CodePageGet(selector, code_page);
}

int QLIBCUnicodeStrUTF16ToUTF8(const char* text, char* out, int out_size) {
  return g_host_ops.UnicodeStrUTF16ToUTF8(text, out, out_size);
}

int QLIBCUnicodeStrCPToUTF8(int code_page, const char* text, char* out,
                            int out_size) {
  return g_host_ops.UnicodeStrCPToUTF8(code_page, text, out, out_size);
}

int QLIBCUnicodeUTF8StrCountChar(const char* text) {
  return g_host_ops.UnicodeUTF8StrCountChar(text);
}

const char* QLIBCUnicodeUTF8ForwardNChar(const char* text, int n) {
  return g_host_ops.UnicodeUTF8ForwardNChar(text, n);
}

}  // extern "C"

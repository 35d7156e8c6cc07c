// The per-thread error stack of the host operations.
//
// Every failing operation calls HostFail (through HOST_FAIL), which records
// the code, the source file and the line for QLIBCErrGet and friends and
// leaves the code in errno.
#ifndef QUVAHOST_PLATFORM_HOST_ERROR_H_
#define QUVAHOST_PLATFORM_HOST_ERROR_H_

namespace quvahost {

// Records `code` (an errno value) with `file` (kept as a pointer: it must
// be static text; only its base name is shown) and `line` as the calling
// thread's last failure, sets errno to `code` and returns -1.
int HostFail(int code, const char* file, int line);

// The calling thread's last failure: code (0 when none), base name of the
// file ("" when none), line (0 when none).
int LastErrorCode();
const char* LastErrorFile();
int LastErrorLine();

}  // namespace quvahost

// Records `code` at the caller's file and line; evaluates to -1.
#define HOST_FAIL(code) ::quvahost::HostFail((code), __FILE__, __LINE__)

#endif  // QUVAHOST_PLATFORM_HOST_ERROR_H_

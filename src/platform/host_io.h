// File helpers shared by the host modules: the one EINTR-retry loop, safe
// opening of regular files, whole-file reads and the location of the
// stand-in's own files.
#ifndef QUVAHOST_PLATFORM_HOST_IO_H_
#define QUVAHOST_PLATFORM_HOST_IO_H_

#include <errno.h>
#include <stddef.h>

#include <string>
#include <string_view>

namespace quvahost {

// Calls `call` again while it fails with EINTR; returns its last result.
template <typename Call>
auto RetryOnEintr(Call call) -> decltype(call()) {
  decltype(call()) result;
  do {
    result = call();
  } while (result == -1 && errno == EINTR);
  return result;
}

// Opens `path` read-only and close-on-exec, without blocking on a FIFO.
// Returns the descriptor, or -1 with *error set: the errno of open, EISDIR
// for a directory, EINVAL for anything else that is not a regular file.
int OpenRegularFile(const char* path, int* error);

// Reads the whole regular file `path` into *text. Returns 0, or an errno
// value: EFBIG when the file holds more than `max_bytes`.
int ReadWholeFile(const char* path, size_t max_bytes, std::string* text);

// Writes all `size` bytes of `data` to `fd`. Returns 0 or an errno value.
int WriteAll(int fd, const char* data, size_t size);

// The directory of the stand-in's files: $QUVA_HOST_ETC when set and not
// empty, else QUVA_HOST_ETC_DEFAULT. Read on every call.
std::string HostEtcDir();
// HostEtcDir() + "/" + name.
std::string HostEtcFile(const char* name);

// Names of the stand-in's files inside HostEtcDir().
inline constexpr char kShareDbName[] = "shares.conf";
inline constexpr char kShareLockName[] = "shares.conf.lock";
inline constexpr char kSettingsName[] = "host.conf";
inline constexpr char kBootStepName[] = "boot_step";

// Upper bound for the configuration files read whole.
inline constexpr size_t kMaxConfigBytes = 16 * 1024 * 1024;

// Copies `text` and its terminator into buffer[size] when it fits.
// Returns false (and writes nothing) when it does not.
bool CopyIfFits(const char* text, size_t length, char* buffer, int size);

// Parses a decimal number from 0 to INT_MAX, with blanks, tabs and line
// ends allowed around it and nothing else. Returns false otherwise.
bool ParseDecimalText(std::string_view text, int* value);

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_HOST_IO_H_

// Making way for the event server's socket and creating it.
#include "daemon/server_socket.h"

#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include "quvaidx/log.h"
#include "util/file_io.h"

namespace quvaidx {
namespace {

constexpr char kModule[] = "quvaidx_daemon";

enum class Listener { kAlive, kGone, kUnknown };

// Whether a daemon still takes connections on the socket at `address`.
Listener ProbeListener(const struct sockaddr_un& address) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) return Listener::kUnknown;
  int result = connect(fd, reinterpret_cast<const struct sockaddr*>(&address),
                       sizeof(address));
  int err = errno;
  close(fd);
  // EAGAIN: its backlog is full, so it is alive and busy.
  if (result == 0 || err == EAGAIN) return Listener::kAlive;
  if (err == ECONNREFUSED) return Listener::kGone;
  return Listener::kUnknown;
}

int RefuseToRemove(const char* path) {
  AppLogError(3, "%s:%d [Error] remove %s", kModule, __LINE__, path);
  return -1;
}

// Leaves `path` free for a new socket: 0 when nothing is there or a stale
// socket was removed; -1 (logged) when anything else is there.
int ClearSocketPath(const char* path, const struct sockaddr_un& address) {
  struct stat found;
  if (lstat(path, &found) != 0) {
    return errno == ENOENT ? 0 : RefuseToRemove(path);
  }
  if (!S_ISSOCK(found.st_mode)) return RefuseToRemove(path);
  switch (ProbeListener(address)) {
    case Listener::kAlive:
      AppLogError(3, "%s:%d [Error] %s is in use: a daemon listens there",
                  kModule, __LINE__, path);
      return -1;
    case Listener::kUnknown:
      return RefuseToRemove(path);
    case Listener::kGone:
      break;
  }
  // Only the socket that was probed goes, should the path have changed.
  struct stat again;
  if (lstat(path, &again) != 0) {
    return errno == ENOENT ? 0 : RefuseToRemove(path);
  }
  if (!SameFile(found, again)) return RefuseToRemove(path);
  if (unlink(path) != 0 && errno != ENOENT) return RefuseToRemove(path);
  return 0;
}

// Gives the socket file at `path` its group, then its mode. Returns 0, or
// -1 with errno.
int ApplyAccess(const char* path, const ServerSocketAccess& access) {
  if (access.group != static_cast<gid_t>(-1) &&
      lchown(path, static_cast<uid_t>(-1), access.group) != 0) {
    return -1;
  }
  return chmod(path, access.mode & 0777);
}

}  // namespace

int BindServerSocket(const char* path, const struct sockaddr_un& address,
                     const ServerSocketAccess* access) {
  if (ClearSocketPath(path, address) != 0) return -1;
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    AppLogError(3, "%s:%d [Error] Could not create a listener: %s", kModule,
                __LINE__, path);
    return -1;
  }
  if (access != nullptr) {
    // The file bind creates takes the socket's own mode less the umask:
    // owner only, until the group and mode asked for are in place.
    fchmod(fd, S_IRUSR | S_IWUSR);  // where refused, the mode comes later
  }
  if (bind(fd, reinterpret_cast<const struct sockaddr*>(&address),
           sizeof(address)) != 0) {
    AppLogError(3, "%s:%d [Error] Could not create a listener: %s", kModule,
                __LINE__, path);
    close(fd);
    return -1;
  }
  if (access != nullptr && ApplyAccess(path, *access) != 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] set mode %04o and group %d on %s (%s)",
                kModule, __LINE__, static_cast<unsigned>(access->mode & 0777),
                static_cast<int>(access->group), path, strerror(err));
    close(fd);
    unlink(path);  // ours, made just now
    return -1;
  }
  return fd;
}

}  // namespace quvaidx

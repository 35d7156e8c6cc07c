// Making way for the event server's socket, creating it, and checking one
// handed over by a service manager.
//
// Every refusal leaves the path as it was and says so in its log line; a
// line names a removal only when one was attempted, and every line carries
// the system's reason where there is one. errno tells the caller why.
#include "daemon/server_socket.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "quvaidx/log.h"
#include "util/file_io.h"

namespace quvaidx {
namespace {

constexpr char kModule[] = "quvaidx_daemon";

enum class Listener { kAlive, kGone, kUnknown };

// Whether a daemon still takes connections on the socket at `address`;
// *err holds the connect's error when the answer is kUnknown.
Listener ProbeListener(const struct sockaddr_un& address, int* err) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    *err = errno;
    return Listener::kUnknown;
  }
  int result = connect(fd, reinterpret_cast<const struct sockaddr*>(&address),
                       sizeof(address));
  *err = errno;
  close(fd);
  // EAGAIN: its backlog is full, so it is alive and busy.
  if (result == 0 || *err == EAGAIN) return Listener::kAlive;
  if (*err == ECONNREFUSED) return Listener::kGone;
  return Listener::kUnknown;
}

// Logs "<path> <what>; left alone" from source line `line`, sets errno to
// `err` and returns -1.
int LeaveAlone(int line, const char* path, const std::string& what, int err) {
  AppLogError(3, "%s:%d [Error] %s %s; left alone", kModule, line, path,
              what.c_str());
  errno = err;
  return -1;
}

std::string Because(const char* what, int err) {
  return std::string(what) + " (" + strerror(err) + ")";
}

// Leaves `path` free for a new socket: 0 when nothing is there or a stale
// socket was removed; -1 (logged, errno set) when anything else is there.
int ClearSocketPath(const char* path, const struct sockaddr_un& address) {
  struct stat found;
  if (lstat(path, &found) != 0) {
    if (errno == ENOENT) return 0;
    int err = errno;
    return LeaveAlone(__LINE__, path, Because("cannot be examined", err), err);
  }
  if (!S_ISSOCK(found.st_mode)) {
    return LeaveAlone(__LINE__, path, "is not a socket", EEXIST);
  }
  int err = 0;
  switch (ProbeListener(address, &err)) {
    case Listener::kAlive:
      AppLogError(3, "%s:%d [Error] %s is in use: a daemon listens there",
                  kModule, __LINE__, path);
      errno = EADDRINUSE;
      return -1;
    case Listener::kUnknown:
      return LeaveAlone(__LINE__, path,
                        Because("cannot be probed for a listening daemon", err),
                        err);
    case Listener::kGone:
      break;
  }
  // Only the socket that was probed goes, should the path have changed.
  struct stat again;
  if (lstat(path, &again) != 0) {
    if (errno == ENOENT) return 0;
    err = errno;
    return LeaveAlone(__LINE__, path, Because("cannot be examined", err), err);
  }
  if (!SameFile(found, again)) {
    return LeaveAlone(__LINE__, path, "changed while it was examined", EEXIST);
  }
  if (unlink(path) != 0 && errno != ENOENT) {
    err = errno;
    AppLogError(3, "%s:%d [Error] remove %s (%s)", kModule, __LINE__, path,
                strerror(err));
    errno = err;
    return -1;
  }
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

int NoListener(int line, const char* path, int err) {
  AppLogError(3, "%s:%d [Error] Could not create a listener: %s (%s)", kModule,
              line, path, strerror(err));
  errno = err;
  return -1;
}

// Logs why the handed-over socket `fd` is refused, sets errno, returns -1.
int RefuseHanded(int line, int fd, const std::string& why, int err) {
  AppLogError(3, "%s:%d [Error] the socket handed over (fd %d) %s; not used",
              kModule, line, fd, why.c_str());
  errno = err;
  return -1;
}

int SocketOption(int fd, int option, int* value) {
  socklen_t length = sizeof(*value);
  return getsockopt(fd, SOL_SOCKET, option, value, &length);
}

}  // namespace

int BindServerSocket(const char* path, const struct sockaddr_un& address,
                     const ServerSocketAccess* access) {
  if (ClearSocketPath(path, address) != 0) return -1;
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) return NoListener(__LINE__, path, errno);
  if (access != nullptr) {
    // The file bind creates takes the socket's own mode less the umask:
    // owner only, until the group and mode asked for are in place.
    fchmod(fd, S_IRUSR | S_IWUSR);  // where refused, the mode comes later
  }
  if (bind(fd, reinterpret_cast<const struct sockaddr*>(&address),
           sizeof(address)) != 0) {
    int err = errno;
    close(fd);
    return NoListener(__LINE__, path, err);
  }
  if (access != nullptr && ApplyAccess(path, *access) != 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] set mode %04o and group %d on %s (%s)",
                kModule, __LINE__, static_cast<unsigned>(access->mode & 0777),
                static_cast<int>(access->group), path, strerror(err));
    close(fd);
    unlink(path);  // ours, made just now
    errno = err;
    return -1;
  }
  return fd;
}

int AdoptListeningSocket(int fd, const char* path) {
  int domain = 0, type = 0, listening = 0;
  if (SocketOption(fd, SO_DOMAIN, &domain) != 0) {
    int err = errno;
    return RefuseHanded(__LINE__, fd, Because("is not a socket", err), err);
  }
  if (domain != AF_UNIX || SocketOption(fd, SO_TYPE, &type) != 0 ||
      type != SOCK_STREAM) {
    return RefuseHanded(__LINE__, fd, "is not a Unix-domain stream socket",
                        EINVAL);
  }
  if (SocketOption(fd, SO_ACCEPTCONN, &listening) != 0 || listening == 0) {
    return RefuseHanded(__LINE__, fd, "does not listen", EINVAL);
  }
  struct sockaddr_un bound;
  memset(&bound, 0, sizeof(bound));
  socklen_t length = sizeof(bound);
  if (getsockname(fd, reinterpret_cast<struct sockaddr*>(&bound), &length) !=
      0) {
    int err = errno;
    return RefuseHanded(__LINE__, fd, Because("has no address", err), err);
  }
  // The kernel may leave the name unterminated when it fills sun_path.
  size_t name_length = strnlen(bound.sun_path, sizeof(bound.sun_path));
  std::string name(bound.sun_path, name_length);
  if (path != nullptr && name != path) {
    return RefuseHanded(__LINE__, fd,
                        "is bound to '" + name + "', not to " + path,
                        EADDRNOTAVAIL);
  }
  int status = fcntl(fd, F_GETFL);
  int descriptor = fcntl(fd, F_GETFD);
  if (status < 0 || descriptor < 0 ||
      fcntl(fd, F_SETFL, status | O_NONBLOCK) != 0 ||
      fcntl(fd, F_SETFD, descriptor | FD_CLOEXEC) != 0) {
    int err = errno;
    return RefuseHanded(__LINE__, fd, Because("cannot be set up", err), err);
  }
  return 0;
}

}  // namespace quvaidx

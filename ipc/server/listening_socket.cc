#include "ipc/server/listening_socket.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <utility>

#include "ipc/protocol/wire.h"

namespace tarnel {
namespace {

// Clients that may wait to be accepted.
constexpr int kBacklog = 512;

Error failure(const std::string& what, int code) {
  return {wire::kErrorFailed, code, what + ": " + std::strerror(code)};
}

bool listens(const sockaddr_un& address) {
  const UniqueFd probe(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const auto* generic = reinterpret_cast<const sockaddr*>(&address);
  // EAGAIN: it listens, and its queue is full.
  return connect(probe.get(), generic, sizeof(address)) == 0 || errno == EAGAIN;
}

// Removes the file that a daemon which is gone left at the path.
MaybeError removeStale(const sockaddr_un& address) {
  const std::string path(address.sun_path);
  struct stat file {};
  if (lstat(path.c_str(), &file) != 0) {
    return errno == ENOENT ? std::nullopt : MaybeError(failure("cannot look at " + path, errno));
  }
  if (!S_ISSOCK(file.st_mode)) {
    return Error(wire::kErrorFailed, EEXIST,
                 path + " exists and is not a socket: move it away or choose another runtime directory");
  }
  if (listens(address)) {
    return Error(
        wire::kErrorFailed, EADDRINUSE,
        "another daemon is listening at " + path + ": stop it first or use another runtime directory");
  }
  if (unlink(path.c_str()) != 0 && errno != ENOENT) return failure("cannot remove the stale " + path, errno);
  return std::nullopt;
}

}  // namespace

ListeningSocket::~ListeningSocket() {
  // A socket taken by a successor is not ours to remove.
  struct stat bound {};
  if (madePath_.empty() || !socket_ || lstat(madePath_.c_str(), &bound) != 0) return;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  madePath_.copy(address.sun_path, sizeof(address.sun_path) - 1);
  socket_.reset();
  if (!listens(address)) unlink(madePath_.c_str());
}

ListeningSocket ListeningSocket::fromServiceManager(const std::string& name) {
  char** names = nullptr;
  const int count = sd_listen_fds_with_names(0, &names);
  std::optional<int> first;
  std::optional<int> named;
  for (int i = 0; i < count; ++i) {
    const std::unique_ptr<char, decltype(&free)> held(names[i], &free);
    const int fd = SD_LISTEN_FDS_START + i;
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0) continue;
    if (!first) first = fd;
    if (!named && name == held.get()) named = fd;
  }
  free(names);
  ListeningSocket taken;
  if (const auto chosen = named ? named : first) {
    taken.socket_.reset(*chosen);
    fcntl(*chosen, F_SETFD, FD_CLOEXEC);
    fcntl(*chosen, F_SETFL, fcntl(*chosen, F_GETFL) | O_NONBLOCK);
  }
  return taken;
}

Result<ListeningSocket> ListeningSocket::make(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    return Error(wire::kErrorFailed, ENAMETOOLONG,
                 "the socket's path \"" + path + "\" has " + std::to_string(path.size()) +
                     " bytes, of 1 to " + std::to_string(sizeof(address.sun_path) - 1) +
                     " that a socket may have: choose another runtime directory");
  }
  path.copy(address.sun_path, path.size());

  // Two daemons that start together must not each take the other's new socket for a stale one.
  const auto slash = path.rfind('/');
  const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  const UniqueFd lock(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!lock) return failure("cannot open the runtime directory " + directory, errno);
  if (flock(lock.get(), LOCK_EX) != 0)
    return failure("cannot lock the runtime directory " + directory, errno);
  if (const MaybeError error = removeStale(address)) return *error;

  ListeningSocket made;
  made.socket_.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const auto* generic = reinterpret_cast<const sockaddr*>(&address);
  if (!made || bind(made.get(), generic, sizeof(address)) != 0) return failure("cannot make " + path, errno);
  made.madePath_ = path;
  // Everybody may knock; who is let in is decided by entitlement.
  if (chmod(path.c_str(), 0666) != 0) return failure("cannot open " + path + " to clients", errno);
  if (listen(made.get(), kBacklog) != 0) return failure("cannot listen at " + path, errno);
  return made;
}

}  // namespace tarnel

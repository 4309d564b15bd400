#include "ipc/server/peer_credentials.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <string>
#include <utility>

#include "base/kernel_constants.h"
#include "base/unique_fd.h"
#include "ipc/server/peer_process.h"

namespace tarnel {

namespace {

// A line of /proc/<pid>/cgroup is short; a longer file is no unit of ours.
constexpr size_t kMaxCgroupBytes = 16384;
constexpr size_t kMaxPathBytes = 4096;

std::string procPath(int32_t pid, const char* name) {
  return "/proc/" + std::to_string(pid) + "/" + name;
}

std::optional<std::string> readWhole(const std::string& path) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file) return std::nullopt;
  std::string text;
  std::array<char, 4096> buffer;  // filled by read
  while (text.size() <= kMaxCgroupBytes) {
    const ssize_t count = ::read(file.get(), buffer.data(), buffer.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return std::nullopt;
    if (count == 0) return text;
    text.append(buffer.data(), static_cast<size_t>(count));
  }
  return std::nullopt;
}

class PidfdPeerProcess final : public PeerProcess {
 public:
  PidfdPeerProcess(int32_t pid, UniqueFd pidfd) : pid_(pid), pidfd_(std::move(pidfd)) {}

  std::optional<std::string> executable() const override {
    auto target = executableOfProcess(pid_);
    // Looked at afterwards: while the process lives, nobody else can have had its number.
    return isAlive() ? std::move(target) : std::nullopt;
  }

  std::optional<std::string> unit() const override {
    const auto text = readWhole(procPath(pid_, "cgroup"));
    if (!text || !isAlive()) return std::nullopt;
    return unitOfCgroup(*text);
  }

  // A pidfd becomes readable when its process has ended.
  bool isAlive() const override {
    pollfd entry{.fd = pidfd_.get(), .events = POLLIN, .revents = 0};
    int ready = 0;
    do {
      ready = ::poll(&entry, 1, 0);
    } while (ready < 0 && errno == EINTR);
    return ready == 0;
  }

 private:
  int32_t pid_;
  UniqueFd pidfd_;
};

}  // namespace

std::optional<std::string> executableOfProcess(int32_t pid) {
  std::string target(kMaxPathBytes, '\0');
  const ssize_t length = ::readlink(procPath(pid, "exe").c_str(), target.data(), target.size());
  if (length <= 0 || static_cast<size_t>(length) >= target.size()) return std::nullopt;
  target.resize(static_cast<size_t>(length));
  if (target.front() != '/' || target.ends_with(" (deleted)")) return std::nullopt;
  return target;
}

std::optional<std::string> unitOfCgroup(std::string_view text) {
  // The unified hierarchy's line: "0::/system.slice/app.service".
  constexpr std::string_view kPrefix = "0::/";
  for (size_t start = 0; start < text.size();) {
    const size_t end = std::min(text.find('\n', start), text.size());
    const std::string_view line = text.substr(start, end - start);
    start = end + 1;
    if (!line.starts_with(kPrefix)) continue;
    // The outermost one: whoever is given a group of its own may name what lies below as it likes.
    std::string_view path = line.substr(kPrefix.size());
    while (!path.empty()) {
      const size_t slash = std::min(path.find('/'), path.size());
      const std::string_view name = path.substr(0, slash);
      if (name.ends_with(".service") || name.ends_with(".scope")) return std::string(name);
      path.remove_prefix(std::min(slash + 1, path.size()));
    }
  }
  return std::nullopt;
}

PeerCredentials readPeerCredentials(int socket) {
  PeerCredentials peer;
  ucred credentials{};
  socklen_t size = sizeof(credentials);
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0 ||
      size != sizeof(credentials)) {
    return peer;
  }
  peer.pid = credentials.pid;
  peer.uid = credentials.uid;
  peer.gid = credentials.gid;

  int pidfd = -1;
  size = sizeof(pidfd);
  if (peer.pid > 0 && ::getsockopt(socket, SOL_SOCKET, kernel::kSoPeerPidFd, &pidfd, &size) == 0 &&
      pidfd >= 0) {
    peer.process = std::make_shared<PidfdPeerProcess>(peer.pid, UniqueFd(pidfd));
  }
  return peer;
}

}  // namespace tarnel

#include "platform/linux/sandbox/process_witness.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <utility>

#include "base/file_access.h"
#include "ipc/server/peer_process.h"
#include "platform/linux/sandbox/system_call_filter.h"

namespace tarnel {

namespace {

constexpr int kAnswerMilliseconds = 1000;
constexpr size_t kMaxAnswer = 4096;

// The witness's life: one process id in, one path out (empty: unknown), until the other side is gone.
[[noreturn]] void answer(int channel) {
  for (;;) {
    int32_t pid = 0;
    const ssize_t count = ::recv(channel, &pid, sizeof(pid), 0);
    if (count < 0 && errno == EINTR) continue;
    if (count != static_cast<ssize_t>(sizeof(pid))) ::_exit(0);
    // One byte leads, because an empty message would look like the end.
    const std::string reply = "=" + executableOfProcess(pid).value_or("");
    if (::send(channel, reply.data(), reply.size(), MSG_NOSIGNAL) < 0) ::_exit(0);
  }
}

[[noreturn]] void live(int channel, pid_t parent, const SystemCallFilter& filter) {
  // The parent may have ended before this took effect.
  if (::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || ::getppid() != parent) ::_exit(1);
  ::prctl(PR_SET_NAME, "tarnel-witness");
  const auto fd = static_cast<unsigned>(channel);
  if (fd > 3) ::close_range(3, fd - 1, 0);
  ::close_range(fd + 1, ~0U, 0);
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1UL, 0UL, 0UL, 0UL) != 0 || filter.load()) ::_exit(1);
  answer(channel);
}

}  // namespace

Result<std::unique_ptr<ProcessWitness>> ProcessWitness::start() {
  std::array<int, 2> ends{-1, -1};
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) != 0) {
    return systemError("witness", "a socket pair cannot be made");
  }
  UniqueFd ours(ends[0]);
  const UniqueFd theirs(ends[1]);
  const auto filter = SystemCallFilter::prepare(SandboxProfile());
  if (!filter) return filter.error();
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid < 0) return systemError("witness", "a process cannot be started");
  if (pid == 0) {
    ours.reset();
    live(theirs.get(), parent, *filter);
  }
  return std::unique_ptr<ProcessWitness>(new ProcessWitness(std::move(ours), pid));
}

ProcessWitness::~ProcessWitness() {
  channel_.reset();
  while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
  }
}

std::optional<std::string> ProcessWitness::executable(int32_t pid) {
  const std::lock_guard guard(mutex_);
  if (!channel_) return std::nullopt;
  pollfd entry{.fd = channel_.get(), .events = POLLIN, .revents = 0};
  std::array<char, kMaxAnswer + 1> reply{};
  ssize_t count = ::send(channel_.get(), &pid, sizeof(pid), MSG_NOSIGNAL | MSG_DONTWAIT);
  if (count > 0 && ::poll(&entry, 1, kAnswerMilliseconds) == 1) {
    count = ::recv(channel_.get(), reply.data(), reply.size(), MSG_DONTWAIT);
  } else {
    count = 0;
  }
  if (count <= 0) {
    channel_.reset();  // a late answer must not be taken for the next one
    return std::nullopt;
  }
  if (count == 1) return std::nullopt;
  return std::string(&reply[1], static_cast<size_t>(count) - 1);
}

}  // namespace tarnel

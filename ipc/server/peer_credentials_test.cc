#include "ipc/server/peer_credentials.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <filesystem>

#include "base/unique_fd.h"
#include "ipc/server/peer_process.h"

namespace tarnel {
namespace {

struct SocketPair {
  SocketPair() {
    std::array<int, 2> fds{-1, -1};
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds.data()), 0);
    ours.reset(fds[0]);
    theirs.reset(fds[1]);
  }
  UniqueFd ours;
  UniqueFd theirs;
};

TEST(PeerCredentials, TheKernelSaysWhoConnected) {
  const SocketPair sockets;
  const PeerCredentials peer = readPeerCredentials(sockets.ours.get());
  EXPECT_EQ(peer.pid, ::getpid());
  EXPECT_EQ(peer.uid, ::geteuid());
  EXPECT_EQ(peer.gid, ::getegid());
  if (peer.process == nullptr) GTEST_SKIP() << "the kernel gives no handle on the peer's process";
  EXPECT_EQ(peer.process->executable(), std::filesystem::read_symlink("/proc/self/exe").string());
  EXPECT_TRUE(peer.process->isAlive());
}

TEST(PeerCredentials, AProcessThatEndedHasNoExecutableAndNoUnit) {
  // The pair belongs to the process that made it: a child, which passes one end back and ends.
  const SocketPair channel;
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    std::array<int, 2> fds{-1, -1};
    if (::socketpair(AF_UNIX, SOCK_STREAM, 0, fds.data()) != 0) ::_exit(1);
    char byte = 'x';
    iovec part{.iov_base = &byte, .iov_len = 1};
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int));
    *reinterpret_cast<int*>(CMSG_DATA(header)) = fds[0];
    ::sendmsg(channel.theirs.get(), &message, 0);
    ::read(channel.theirs.get(), &byte, 1) == 1 ? ::_exit(0) : ::_exit(2);
  }
  char byte = 0;
  iovec part{.iov_base = &byte, .iov_len = 1};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  ASSERT_EQ(::recvmsg(channel.ours.get(), &message, MSG_CMSG_CLOEXEC), 1);
  const UniqueFd passed(*reinterpret_cast<int*>(CMSG_DATA(CMSG_FIRSTHDR(&message))));

  const PeerCredentials peer = readPeerCredentials(passed.get());
  EXPECT_EQ(peer.pid, child);
  if (peer.process != nullptr) {
    EXPECT_TRUE(peer.process->executable().has_value());
  }
  ASSERT_EQ(::write(channel.ours.get(), "y", 1), 1);
  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  if (peer.process == nullptr) GTEST_SKIP() << "the kernel gives no handle on the peer's process";
  EXPECT_FALSE(peer.process->isAlive());
  EXPECT_FALSE(peer.process->executable());
  EXPECT_FALSE(peer.process->unit());
}

TEST(PeerCredentials, WhatIsNoUnixSocketHasNoCredentials) {
  std::array<int, 2> ends{-1, -1};
  ASSERT_EQ(::pipe(ends.data()), 0);
  const UniqueFd first(ends[0]);
  const UniqueFd second(ends[1]);
  for (const int fd : {-1, first.get()}) {
    const PeerCredentials peer = readPeerCredentials(fd);
    EXPECT_EQ(peer.pid, 0);
    EXPECT_EQ(peer.uid, PeerCredentials::kNoId);
    EXPECT_EQ(peer.gid, PeerCredentials::kNoId);
    EXPECT_EQ(peer.process, nullptr);
  }
  const UniqueFd unconnected(::socket(AF_UNIX, SOCK_STREAM, 0));
  EXPECT_EQ(readPeerCredentials(unconnected.get()).uid, PeerCredentials::kNoId);
}

TEST(PeerCredentials, TheUnitIsTheSystemsOwn) {
  EXPECT_EQ(unitOfCgroup("0::/system.slice/app.service\n"), "app.service");
  EXPECT_EQ(unitOfCgroup("1:name=systemd:/other.service\n0::/system.slice/app.service/worker\n"),
            "app.service");
  EXPECT_EQ(unitOfCgroup("0::/machine.slice/box.scope"), "box.scope");
  // Whatever a user's own manager starts stays that user's.
  EXPECT_EQ(unitOfCgroup("0::/user.slice/user-7.slice/user@7.service/app.slice/app.service\n"),
            "user@7.service");
  EXPECT_EQ(unitOfCgroup("0::/system.slice/evil.service/app.service\n"), "evil.service");
  for (const char* text :
       {"", "0::/\n", "0::/user.slice\n", "1:name=systemd:/app.service\n", "0::/app.service.d/x\n"}) {
    EXPECT_FALSE(unitOfCgroup(text)) << text;
  }
}

}  // namespace
}  // namespace tarnel

#include "tests/fuzz/socket_peer.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>

#include "tests/fuzz/fuzz_target.h"

namespace tarnel::fuzz {
namespace {

constexpr unsigned kMostDescriptors = 16;
constexpr std::string_view kContents = "contents of a file\n";

UniqueFd smallFile() {
  UniqueFd file(memfd_create("fuzz", MFD_CLOEXEC));
  require(file && ::write(file.get(), kContents.data(), kContents.size()) > 0, "a file can be made");
  return file;
}

}  // namespace

int openDescriptors() {
  constexpr int kHighest = 96;
  int count = 0;
  for (int number = 0; number < kHighest; ++number) count += fcntl(number, F_GETFD) >= 0 ? 1 : 0;
  return count;
}

SocketPeer::SocketPeer() {
  std::array<int, 2> ends{};
  require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) == 0,
          "a socket pair can be made");
  own_.reset(ends[0]);
  other_.reset(ends[1]);
}

void SocketPeer::write(std::string_view bytes, unsigned descriptors) {
  if (bytes.empty()) return;
  iovec part{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  alignas(cmsghdr) std::array<char, CMSG_SPACE(kMostDescriptors * sizeof(int))> control{};
  const UniqueFd file = descriptors > 0 ? smallFile() : UniqueFd();
  if (descriptors > 0) {
    std::array<int, kMostDescriptors> numbers{};
    numbers.fill(file.get());
    const size_t size = std::min(descriptors, kMostDescriptors) * sizeof(int);
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(size);
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(size);
    std::memcpy(CMSG_DATA(header), numbers.data(), size);
  }
  const auto written = sendmsg(own_.get(), &message, MSG_NOSIGNAL);
  require(written < 0 || static_cast<size_t>(written) == bytes.size(), "an input fits into the socket");
}

void SocketPeer::endWriting() {
  shutdown(own_.get(), SHUT_WR);
}

void SocketPeer::drain() {
  std::array<char, 4096> piece{};
  for (;;) {
    const auto got = recv(own_.get(), piece.data(), piece.size(), MSG_DONTWAIT);
    if (got <= 0) return;
    received_.append(piece.data(), static_cast<size_t>(got));
  }
}

}  // namespace tarnel::fuzz

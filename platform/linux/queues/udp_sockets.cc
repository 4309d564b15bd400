#include "platform/linux/queues/udp_sockets.h"

#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "base/unique_fd.h"

namespace tarnel {
namespace {

sockaddr_in socketAddress(const Ipv4Address& address) {
  sockaddr_in result{};
  result.sin_family = AF_INET;
  result.sin_port = htons(address.port);
  result.sin_addr.s_addr = htonl(address.address);
  return result;
}

class UdpSocket final : public DatagramSocket {
 public:
  explicit UdpSocket(UniqueFd fd) noexcept : fd_(std::move(fd)) {}

  int descriptor() const noexcept override { return fd_.get(); }
  // Linux has this per send, not per socket.
  void suppressBrokenPipeSignal() override { sendFlags_ |= MSG_NOSIGNAL; }
  int bindToWildcard() override {
    const sockaddr_in any = socketAddress({INADDR_ANY, 0});
    return ::bind(fd_.get(), reinterpret_cast<const sockaddr*>(&any), sizeof any) == 0 ? 0 : errno;
  }
  int connectTo(const Ipv4Address& address) override {
    const sockaddr_in peer = socketAddress(address);
    return ::connect(fd_.get(), reinterpret_cast<const sockaddr*>(&peer), sizeof peer) == 0 ? 0 : errno;
  }
  std::ptrdiff_t send(std::span<const uint8_t> datagram) override {
    return ::send(fd_.get(), datagram.data(), datagram.size(), sendFlags_);
  }
  std::ptrdiff_t receive(std::span<uint8_t> buffer) override {
    return ::recv(fd_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
  }
  void close() override { fd_.reset(); }

 private:
  UniqueFd fd_;
  int sendFlags_ = MSG_DONTWAIT;
};

}  // namespace

Result<std::unique_ptr<DatagramSocket>> UdpSockets::create() {
  UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) return Error(kDatagramErrorDomain, errno, std::strerror(errno));
  return std::unique_ptr<DatagramSocket>(std::make_unique<UdpSocket>(std::move(fd)));
}

}  // namespace tarnel

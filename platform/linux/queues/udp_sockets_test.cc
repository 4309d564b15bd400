#include "platform/linux/queues/udp_sockets.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <iterator>
#include <string>

#include "base/unique_fd.h"
#include "testing/waiting.h"

namespace tarnel {
namespace {

size_t descriptors() {
  return static_cast<size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                                           std::filesystem::directory_iterator()));
}

// A server's socket on the loopback interface.
class Server {
 public:
  Server() : fd_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::bind(fd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  int fd() const { return fd_.get(); }
  Ipv4Address address() const {
    sockaddr_in address{};
    socklen_t length = sizeof address;
    ::getsockname(fd_.get(), reinterpret_cast<sockaddr*>(&address), &length);
    return {INADDR_LOOPBACK, ntohs(address.sin_port)};
  }
  // Answers to whoever sent the next datagram, which it returns.
  std::string answer(const std::string& with) const {
    std::array<char, 2048> buffer{};
    sockaddr_in from{};
    socklen_t length = sizeof from;
    pollfd wait{fd_.get(), POLLIN, 0};
    EXPECT_EQ(::poll(&wait, 1, test::Deadline().milliseconds()), 1);
    const auto size =
        ::recvfrom(fd_.get(), buffer.data(), buffer.size(), 0, reinterpret_cast<sockaddr*>(&from), &length);
    EXPECT_GE(size, 0);
    EXPECT_GE(::sendto(fd_.get(), with.data(), with.size(), 0, reinterpret_cast<sockaddr*>(&from), length),
              0);
    return {buffer.data(), size < 0 ? 0 : static_cast<size_t>(size)};
  }

 private:
  UniqueFd fd_;
};

std::span<const uint8_t> bytes(const std::string& text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

std::unique_ptr<DatagramSocket> makeSocket() {
  auto made = UdpSockets().create();
  EXPECT_TRUE(static_cast<bool>(made));
  return std::move(*made);
}

TEST(UdpSocketsTest, SendsToAndReceivesFromItsPeer) {
  const Server server;
  const auto socket = makeSocket();
  EXPECT_EQ(socket->bindToWildcard(), 0);
  ASSERT_EQ(socket->connectTo(server.address()), 0);
  EXPECT_EQ(socket->send(bytes("report")), 6);
  EXPECT_EQ(server.answer("acknowledged"), "report");
  pollfd wait{socket->descriptor(), POLLIN, 0};
  ASSERT_EQ(::poll(&wait, 1, test::Deadline().milliseconds()), 1);
  std::array<uint8_t, 5> buffer{};
  EXPECT_EQ(socket->receive(buffer), 5);  // cut to the buffer
  EXPECT_EQ(std::string(buffer.begin(), buffer.end()), "ackno");
  EXPECT_EQ(socket->receive(buffer), -1);  // nothing, without waiting
}

TEST(UdpSocketsTest, EmptyDatagramsPass) {
  const Server server;
  const auto socket = makeSocket();
  ASSERT_EQ(socket->connectTo(server.address()), 0);
  EXPECT_EQ(socket->send({}), 0);
  EXPECT_EQ(server.answer(""), "");
  pollfd wait{socket->descriptor(), POLLIN, 0};
  ASSERT_EQ(::poll(&wait, 1, test::Deadline().milliseconds()), 1);
  std::array<uint8_t, 5> buffer{};
  EXPECT_EQ(socket->receive(buffer), 0);
}

TEST(UdpSocketsTest, NeverWaitsAndIsClosedOnExec) {
  const auto socket = makeSocket();
  EXPECT_NE(::fcntl(socket->descriptor(), F_GETFL) & O_NONBLOCK, 0);
  EXPECT_NE(::fcntl(socket->descriptor(), F_GETFD) & FD_CLOEXEC, 0);
}

TEST(UdpSocketsTest, BindingTakesAPortOfTheWildcardAddress) {
  const auto socket = makeSocket();
  ASSERT_EQ(socket->bindToWildcard(), 0);
  sockaddr_in address{};
  socklen_t length = sizeof address;
  ASSERT_EQ(::getsockname(socket->descriptor(), reinterpret_cast<sockaddr*>(&address), &length), 0);
  EXPECT_EQ(address.sin_addr.s_addr, htonl(INADDR_ANY));
  EXPECT_NE(address.sin_port, 0);
  EXPECT_EQ(socket->bindToWildcard(), EINVAL);  // it is bound
}

TEST(UdpSocketsTest, ConnectingToTheBroadcastAddressIsRefused) {
  EXPECT_EQ(makeSocket()->connectTo({0xFFFFFFFF, 9}), EACCES);
}

TEST(UdpSocketsTest, SendingOnAClosedConnectionGivesAnError) {
  const Server server;
  const auto socket = makeSocket();
  socket->suppressBrokenPipeSignal();
  ASSERT_EQ(socket->connectTo(server.address()), 0);
  ASSERT_EQ(::shutdown(socket->descriptor(), SHUT_WR), 0);
  EXPECT_EQ(socket->send(bytes("report")), -1);
  EXPECT_EQ(errno, EPIPE);
}

TEST(UdpSocketsTest, ClosesOnceAndWithTheObject) {
  const size_t before = descriptors();
  {
    const auto socket = makeSocket();
    EXPECT_EQ(descriptors(), before + 1);
    socket->close();
    EXPECT_EQ(socket->descriptor(), -1);
    EXPECT_EQ(descriptors(), before);
    socket->close();
    EXPECT_EQ(socket->send(bytes("report")), -1);
    std::array<uint8_t, 5> buffer{};
    EXPECT_EQ(socket->receive(buffer), -1);
    const auto other = makeSocket();
  }
  EXPECT_EQ(descriptors(), before);
}

TEST(UdpSocketsTest, WithoutDescriptorsTheErrorNumberIsGiven) {
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit none{3, before.rlim_max};  // only the standard streams
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto socket = UdpSockets().create();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  ASSERT_FALSE(static_cast<bool>(socket));
  EXPECT_EQ(socket.error().code(), EMFILE);
}

}  // namespace
}  // namespace tarnel

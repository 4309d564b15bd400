#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/unique_fd.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"

// Clients for tests: one that writes bytes by hand, one on a bus library.

namespace tarnel {

inline UniqueFd connectTo(const std::string& path) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  if (connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) fd.reset();
  return fd;
}

// True when the peer has closed the socket, whatever it sent before.
inline bool isClosedByPeer(const UniqueFd& fd) {
  std::array<char, 4096> rest{};
  while (true) {
    const auto got = recv(fd.get(), rest.data(), rest.size(), 0);
    if (got == 0 || (got < 0 && errno == ECONNRESET)) return true;
    if (got < 0) return false;
  }
}

// A client without a bus library.
class RawClient {
 public:
  explicit RawClient(const std::string& path) : fd_(connectTo(path)) {
    EXPECT_TRUE(fd_);
    timeval limit{30, 0};
    setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
  }
  // False when the peer takes no more.
  bool write(std::string_view bytes) const {
    while (!bytes.empty()) {
      const auto sent = send(fd_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(sent));
    }
    return true;
  }
  void authenticate() const {
    EXPECT_TRUE(write(std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27)));
    EXPECT_TRUE(readLine().starts_with("OK "));
  }
  // The same, and descriptors may be passed.
  void authenticateForDescriptors() const {
    EXPECT_TRUE(write(std::string("\0AUTH ANONYMOUS 74\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n", 46)));
    EXPECT_TRUE(readLine().starts_with("OK "));
    EXPECT_EQ(readLine(), "AGREE_UNIX_FD\r\n");
  }
  // Sends the bytes in one piece with so many copies of the descriptor.
  bool writeWith(std::string_view bytes, int descriptor, size_t copies = 1) const {
    iovec piece{const_cast<char*>(bytes.data()), bytes.size()};
    std::vector<char> control(CMSG_SPACE(copies * sizeof(int)));
    msghdr message{};
    message.msg_iov = &piece;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    auto* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(copies * sizeof(int));
    const std::vector<int> descriptors(copies, descriptor);
    std::memcpy(CMSG_DATA(header), descriptors.data(), copies * sizeof(int));
    return sendmsg(fd_.get(), &message, MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
  }
  std::string readLine() const {
    std::string answer;
    char c = 0;
    while (!answer.ends_with("\r\n") && recv(fd_.get(), &c, 1, 0) == 1) answer += c;
    return answer;
  }
  const UniqueFd& fd() const { return fd_; }
  void close() { fd_.reset(); }

 private:
  UniqueFd fd_;
};

// A method call's bytes, little endian, written by hand; bodySize may lie.
inline std::string rawCall(std::string_view member, std::string_view body = {},
                           std::string_view signature = {}, uint32_t bodySize = UINT32_MAX,
                           uint32_t serial = 1, uint32_t descriptors = 0) {
  std::string fields;
  const auto field = [&fields](char code, char type, std::string_view text) {
    while (fields.size() % 8 != 0) fields += '\0';
    fields += code;
    fields += {'\1', type, '\0'};
    const auto size = static_cast<uint32_t>(text.size());
    if (type == 'g') {
      fields += static_cast<char>(size);
    } else {
      fields.append(reinterpret_cast<const char*>(&size), 4);
    }
    fields += text;
    fields += '\0';
  };
  field(1, 'o', wire::kSessionPath);
  field(2, 's', wire::kSessionInterface);
  field(3, 's', member);
  if (!signature.empty()) field(8, 'g', signature);
  if (descriptors > 0) {
    while (fields.size() % 8 != 0) fields += '\0';
    fields += std::string("\x09\1u\0", 4).append(reinterpret_cast<const char*>(&descriptors), 4);
  }
  std::string message("l\1\0\1", 4);
  const uint32_t claimed = bodySize == UINT32_MAX ? static_cast<uint32_t>(body.size()) : bodySize;
  const auto fieldBytes = static_cast<uint32_t>(fields.size());
  for (const uint32_t number : {claimed, serial, fieldBytes}) {
    message.append(reinterpret_cast<const char*>(&number), 4);
  }
  message += fields;
  while (message.size() % 8 != 0) message += '\0';
  return message.append(body);
}

// A client as another program's D-Bus library would be.
class BusClient {
 public:
  explicit BusClient(const std::string& path) {
    auto fd = connectTo(path);
    EXPECT_TRUE(fd);
    fd_ = fd.release();
    sd_bus* bus = nullptr;
    sd_bus_new(&bus);
    bus_.reset(bus);
    EXPECT_GE(sd_bus_set_fd(bus, fd_, fd_), 0);
    EXPECT_GE(sd_bus_start(bus), 0);
  }

  BusMessage newCall(const char* member) {
    sd_bus_message* call = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_.get(), &call, nullptr, wire::kSessionPath,
                                             wire::kSessionInterface, member),
              0);
    return BusMessage(call);
  }
  // The answer, or null with the error's name and text kept.
  BusMessage call(const BusMessage& message) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    const int r = sd_bus_call(bus_.get(), message.get(), 30'000'000, &error, &reply);
    errorName = r >= 0 ? "" : error.name == nullptr ? std::strerror(-r) : error.name;
    errorText = error.message == nullptr ? "" : error.message;
    sd_bus_error_free(&error);
    return BusMessage(reply);
  }
  template <class... Arguments>
  BusMessage call(const char* member, const char* signature, Arguments... arguments) {
    auto message = newCall(member);
    EXPECT_GE(sd_bus_message_append(message.get(), signature, arguments...), 0);
    return call(message);
  }
  int post(const BusMessage& message) { return sd_bus_send(bus_.get(), message.get(), nullptr); }
  sd_bus* bus() { return bus_.get(); }
  int fd() const { return fd_; }

  std::string errorName;
  std::string errorText;

 private:
  struct Close {
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
  };
  int fd_ = -1;
  std::unique_ptr<sd_bus, Close> bus_;
};

}  // namespace tarnel

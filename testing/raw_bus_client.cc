#include "testing/raw_bus_client.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <array>
#include <cerrno>

#include "testing/waiting.h"

namespace tarnel::test {
namespace {

void append32(std::string& to, uint32_t number) {
  to.append(reinterpret_cast<const char*>(&number), sizeof number);
}

void align(std::string& text, size_t to) {
  while (text.size() % to != 0) text += '\0';
}

void appendText(std::string& to, std::string_view text) {
  append32(to, static_cast<uint32_t>(text.size()));
  to.append(text) += '\0';
}

void appendField(std::string& fields, char code, char type, std::string_view text) {
  align(fields, 8);
  fields += {code, '\1', type, '\0'};
  if (type == 'g') {
    fields += static_cast<char>(text.size());
    fields.append(text) += '\0';
  } else {
    appendText(fields, text);
  }
}

}  // namespace

RawBusClient::RawBusClient(const std::string& socketPath)
    : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  const timeval limit{kDeadline.count(), 0};
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  socketPath.copy(address.sun_path, sizeof address.sun_path - 1);
  const auto* generic = reinterpret_cast<const sockaddr*>(&address);
  if (::connect(socket_.get(), generic, sizeof address) != 0) socket_.reset();
}

bool RawBusClient::write(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t count = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    bytes.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

ssize_t RawBusClient::writeSome(std::string_view bytes) const {
  const ssize_t count = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  return count < 0 && (errno == EAGAIN || errno == EINTR) ? 0 : count;
}

bool RawBusClient::authenticate() const {
  if (!write(std::string_view("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27))) return false;
  std::string answer;
  char letter = 0;
  while (!answer.ends_with("\r\n") && ::recv(socket_.get(), &letter, 1, 0) == 1) answer += letter;
  return answer.starts_with("OK ");
}

bool RawBusClient::isClosedByDaemon() const {
  std::array<char, 16384> rest{};
  while (true) {
    const ssize_t count = ::recv(socket_.get(), rest.data(), rest.size(), 0);
    if (count == 0 || (count < 0 && (errno == ECONNRESET || errno == EPIPE))) return true;
    if (count < 0 && errno != EINTR) return false;
  }
}

std::string RawBusClient::readSome() const {
  std::array<char, 16384> bytes{};
  const ssize_t count = ::recv(socket_.get(), bytes.data(), bytes.size(), 0);
  return {bytes.data(), count > 0 ? static_cast<size_t>(count) : 0};
}

std::string bytesOf(const RawCall& call) {
  std::string fields;
  appendField(fields, 1, 'o', call.path);
  appendField(fields, 2, 's', call.interface);
  appendField(fields, 3, 's', call.member);
  if (!call.signature.empty()) appendField(fields, 8, 'g', call.signature);
  std::string message("l\1\0\1", 4);
  if (!call.wantsReply) message[2] = '\1';
  append32(message, call.bodySize == UINT32_MAX ? static_cast<uint32_t>(call.body.size()) : call.bodySize);
  append32(message, call.serial);
  append32(message, static_cast<uint32_t>(fields.size()));
  message += fields;
  align(message, 8);
  return message.append(call.body);
}

std::string messageBody(uint16_t category, uint16_t type) {
  std::string body(reinterpret_cast<const char*>(&category), sizeof category);
  body.append(reinterpret_cast<const char*>(&type), sizeof type);
  append32(body, 0);
  return body;
}

std::string messageBody(uint16_t category, uint16_t type, std::string_view text) {
  // At 16: the one entry of the one dictionary.
  std::string entry;
  appendText(entry, "text");
  entry += std::string("\1s\0", 3);
  align(entry, 4);
  appendText(entry, text);
  std::string body(reinterpret_cast<const char*>(&category), sizeof category);
  body.append(reinterpret_cast<const char*>(&type), sizeof type);
  append32(body, static_cast<uint32_t>(8 + entry.size()));
  append32(body, static_cast<uint32_t>(entry.size()));
  align(body, 8);
  return body + entry;
}

}  // namespace tarnel::test

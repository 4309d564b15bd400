#include "tools/lab/receivers/datagram_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>
#include <thread>

#include "base/unique_fd.h"

namespace tarnel::lab {
namespace {

// Read in one go before the end is looked for.
constexpr int kMaxAtOnce = 1000;
// Read at the end: more than a receive buffer holds, and an end to a flood.
constexpr int kMaxAtEnd = 100'000;
// Failures to read in a row until the socket is given up.
constexpr int kMaxFailures = 100;

std::string textOf(const sockaddr_in& address) {
  std::array<char, INET_ADDRSTRLEN> text{};
  ::inet_ntop(AF_INET, &address.sin_addr, text.data(), text.size());
  return std::string(text.data()) + ":" + std::to_string(ntohs(address.sin_port));
}

class ServerOfDatagrams final : public DatagramServer {
 public:
  ServerOfDatagrams(ListeningSocket socket, DatagramReceiver& receiver, Notices& notices)
      : socket_(std::move(socket)),
        receiver_(receiver),
        notices_(notices),
        stopEvent_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
        thread_([this] { run(); }) {}
  ~ServerOfDatagrams() override { stop(); }

  void stop() override {
    const uint64_t one = 1;
    // A full counter is as readable as one that took this.
    [[maybe_unused]] const ssize_t written = ::write(stopEvent_.get(), &one, sizeof one);
    if (thread_.joinable()) thread_.join();
  }

 private:
  void run() {
    while (failures_ < kMaxFailures) {
      pollfd entries[2] = {{.fd = socket_.socket.get(), .events = POLLIN, .revents = 0},
                           {.fd = stopEvent_.get(), .events = POLLIN, .revents = 0}};
      if (::poll(entries, 2, -1) < 0 && errno != EINTR) break;
      const bool isEnd = entries[1].revents != 0;
      const int most = isEnd ? kMaxAtEnd : kMaxAtOnce;
      for (int i = 0; i < most && readOne(); ++i) {
      }
      if (isEnd) return;
    }
    notices_.warning("cannot receive datagrams any more: " + std::generic_category().message(errno) +
                     "; start the lab again");
  }

  bool readOne() {
    sockaddr_in sender{};
    socklen_t senderSize = sizeof sender;
    const ssize_t size = ::recvfrom(socket_.socket.get(), buffer_.data(), buffer_.size(), MSG_TRUNC,
                                    reinterpret_cast<sockaddr*>(&sender), &senderSize);
    if (size < 0) {
      if (errno != EAGAIN) ++failures_;
      return false;
    }
    failures_ = 0;
    const auto whole = static_cast<size_t>(size);
    receiver_.receive({buffer_.data(), std::min(whole, buffer_.size())}, whole, textOf(sender),
                      [this, &sender](const std::vector<uint8_t>& bytes) { send(bytes, sender); });
    return true;
  }

  void send(const std::vector<uint8_t>& bytes, const sockaddr_in& to) {
    const ssize_t sent = ::sendto(socket_.socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL,
                                  reinterpret_cast<const sockaddr*>(&to), sizeof to);
    const bool failed = sent < 0;
    // Told once, until sending succeeds again.
    if (failed && !failing_) {
      notices_.warning("cannot send an acknowledgement to " + textOf(to) + ": " +
                       std::generic_category().message(errno));
    }
    failing_ = failed;
  }

  const ListeningSocket socket_;
  DatagramReceiver& receiver_;
  Notices& notices_;
  const UniqueFd stopEvent_;
  std::array<uint8_t, kMaxDatagramBytes + 1> buffer_{};
  bool failing_ = false;  // to send
  int failures_ = 0;      // to read, in a row
  std::thread thread_;
};

}  // namespace

std::unique_ptr<DatagramServer> DatagramServer::start(ListeningSocket socket, DatagramReceiver& receiver,
                                                      Notices& notices) {
  return std::make_unique<ServerOfDatagrams>(std::move(socket), receiver, notices);
}

}  // namespace tarnel::lab

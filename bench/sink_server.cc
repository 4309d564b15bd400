// Takes every HTTP post on a loopback port, throws it away and answers 200 with nothing: a reporting server
// that never holds the daemon up. Prints its port, then serves until it is killed.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <string>
#include <string_view>
#include <unordered_map>

namespace {

constexpr std::string_view kAnswer = "HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n";
constexpr size_t kMaxHead = 64U << 10U;
constexpr std::string_view kHeadEnd = "\r\n\r\n";
constexpr std::string_view kLength = "\r\ncontent-length:";

// One connection: counts through heads and bodies.
class Exchange {
 public:
  // Returns how many requests these bytes completed; -1 when they are no request.
  int take(std::string_view bytes) {
    int completed = 0;
    while (!bytes.empty()) {
      if (bodyLeft_ > 0) {
        const size_t skipped = std::min(bodyLeft_, bytes.size());
        bodyLeft_ -= skipped;
        bytes.remove_prefix(skipped);
        if (bodyLeft_ == 0) ++completed;
        continue;
      }
      head_ += bytes;
      const size_t end = head_.find(kHeadEnd);
      if (end == std::string::npos) return head_.size() > kMaxHead ? -1 : completed;
      const size_t headSize = end + kHeadEnd.size();
      bytes.remove_prefix(bytes.size() - (head_.size() - headSize));
      if (!readLength(std::string_view(head_).substr(0, end))) return -1;
      head_.clear();
      if (bodyLeft_ == 0) ++completed;
    }
    return completed;
  }

 private:
  bool readLength(std::string_view head) {
    const auto sameLetter = [](char a, char b) { return std::tolower(static_cast<unsigned char>(a)) == b; };
    const auto found = std::search(head.begin(), head.end(), kLength.begin(), kLength.end(), sameLetter);
    bodyLeft_ = 0;
    if (found == head.end()) return true;
    const char* at = &*found + kLength.size();
    const char* end = head.data() + head.size();
    while (at != end && *at == ' ') ++at;
    return std::from_chars(at, end, bodyLeft_).ec == std::errc{};
  }

  std::string head_;
  size_t bodyLeft_ = 0;
};

int listenOnLoopback(uint16_t& port) {
  const int socket = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  auto* generic = reinterpret_cast<sockaddr*>(&address);
  if (socket < 0 || ::bind(socket, generic, size) != 0 || ::listen(socket, 64) != 0) return -1;
  if (::getsockname(socket, generic, &size) != 0) return -1;
  port = ntohs(address.sin_port);
  return socket;
}

class Sink {
 public:
  explicit Sink(int listener) : listener_(listener), epoll_(::epoll_create1(EPOLL_CLOEXEC)) {
    watch(listener_);
  }

  void serve() {
    std::array<epoll_event, 64> events{};
    for (;;) {
      const int count = ::epoll_wait(epoll_, events.data(), static_cast<int>(events.size()), -1);
      for (int i = 0; i < count; ++i) {
        const int descriptor = events[static_cast<size_t>(i)].data.fd;
        if (descriptor == listener_) {
          accept();
        } else if (!serve(descriptor)) {
          exchanges_.erase(descriptor);
          ::close(descriptor);
        }
      }
    }
  }

 private:
  void watch(int descriptor) const {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = descriptor;
    ::epoll_ctl(epoll_, EPOLL_CTL_ADD, descriptor, &event);
  }
  void accept() {
    const int descriptor = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (descriptor < 0) return;
    const int on = 1;
    ::setsockopt(descriptor, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    exchanges_[descriptor];
    watch(descriptor);
  }
  // False when the connection is over.
  bool serve(int descriptor) {
    const ssize_t got = ::recv(descriptor, buffer_.data(), buffer_.size(), 0);
    if (got <= 0) return false;
    const int completed =
        exchanges_[descriptor].take(std::string_view(buffer_.data(), static_cast<size_t>(got)));
    for (int i = 0; i < completed; ++i) {
      if (::send(descriptor, kAnswer.data(), kAnswer.size(), MSG_NOSIGNAL) < 0) return false;
    }
    return completed >= 0;
  }

  const int listener_;
  const int epoll_;
  std::unordered_map<int, Exchange> exchanges_;
  std::array<char, size_t{64} << 10U> buffer_{};
};

}  // namespace

int main() {
  uint16_t port = 0;
  const int listener = listenOnLoopback(port);
  if (listener < 0) {
    std::perror("tarnel-sink: no loopback port can be opened");
    return 1;
  }
  std::printf("%u\n", unsigned{port});
  std::fflush(stdout);
  Sink(listener).serve();
}

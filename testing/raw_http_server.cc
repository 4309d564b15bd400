#include "testing/raw_http_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstring>
#include <stdexcept>

namespace tarnel::test {
namespace {

// How many body bytes a request's head announces.
size_t announcedLength(std::string_view head) {
  for (size_t at = head.find("\r\n"); at != std::string_view::npos; at = head.find("\r\n", at + 2)) {
    constexpr std::string_view kName = "content-length:";
    const std::string_view line = head.substr(at + 2);
    if (line.size() > kName.size() && strncasecmp(line.data(), kName.data(), kName.size()) == 0) {
      return std::stoul(std::string(line.substr(kName.size(), 24)));
    }
  }
  return 0;
}

// A peer that has closed must end a write, not the test.
void blockBrokenPipes() {
  sigset_t pipes;
  sigemptyset(&pipes);
  sigaddset(&pipes, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipes, nullptr);
}

}  // namespace

std::optional<std::string> RawConnection::readRequest() {
  size_t headEnd = 0;
  while ((headEnd = unread_.find("\r\n\r\n")) == std::string::npos) {
    if (!readSome(unread_)) return std::nullopt;
  }
  const size_t length = headEnd + 4 + announcedLength(std::string_view(unread_).substr(0, headEnd));
  while (unread_.size() < length) {
    if (!readSome(unread_)) return std::nullopt;
  }
  std::string request = unread_.substr(0, length);
  unread_.erase(0, length);
  return request;
}

struct RawHttpServer::Tls {
  explicit Tls(const TlsIdentity& identity) : context(SSL_CTX_new(TLS_server_method()), SSL_CTX_free) {
    const auto open = [](const std::string& pem) {
      return std::unique_ptr<BIO, decltype(&BIO_free)>(
          BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free);
    };
    const std::unique_ptr<X509, FreeOpenSsl> certificate(
        PEM_read_bio_X509(open(identity.certificatePem).get(), nullptr, nullptr, nullptr));
    const std::unique_ptr<EVP_PKEY, FreeOpenSsl> key(
        PEM_read_bio_PrivateKey(open(identity.keyPem).get(), nullptr, nullptr, nullptr));
    if (SSL_CTX_use_certificate(context.get(), certificate.get()) != 1 ||
        SSL_CTX_use_PrivateKey(context.get(), key.get()) != 1) {
      throw std::runtime_error("the test server's certificate cannot be used");
    }
  }
  std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)> context;
};

class RawHttpServer::Socket final : public RawConnection {
 public:
  Socket(int descriptor, Tls* tls) : descriptor_(descriptor), ssl_(nullptr, SSL_free) {
    if (tls == nullptr) return;
    ssl_.reset(SSL_new(tls->context.get()));
    SSL_set_fd(ssl_.get(), descriptor);
    accepted_ = SSL_accept(ssl_.get()) == 1;
  }

  bool accepted() const { return accepted_; }

  bool write(std::string_view bytes) override {
    while (!bytes.empty()) {
      const ssize_t count = ssl_ != nullptr
                                ? SSL_write(ssl_.get(), bytes.data(), static_cast<int>(bytes.size()))
                                : send(descriptor_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(count));
    }
    return true;
  }
  void waitForClose() override {
    std::array<char, 4096> ignored{};
    while (recv(descriptor_, ignored.data(), ignored.size(), 0) > 0) {
    }
  }
  void reset() override {
    const linger atOnce{1, 0};
    setsockopt(descriptor_, SOL_SOCKET, SO_LINGER, &atOnce, sizeof atOnce);
    reset_ = true;
  }
  void finish() {
    if (ssl_ != nullptr && !reset_) SSL_shutdown(ssl_.get());
  }

 protected:
  bool readSome(std::string& into) override {
    std::array<char, 16384> bytes{};
    const ssize_t count = ssl_ != nullptr ? SSL_read(ssl_.get(), bytes.data(), static_cast<int>(bytes.size()))
                                          : recv(descriptor_, bytes.data(), bytes.size(), 0);
    if (count > 0) into.append(bytes.data(), static_cast<size_t>(count));
    return count > 0;
  }

 private:
  int descriptor_;
  std::unique_ptr<SSL, decltype(&SSL_free)> ssl_;
  bool accepted_ = true;
  bool reset_ = false;
};

RawHttpServer::RawHttpServer(Handler handler, std::optional<TlsIdentity> identity)
    : handler_(std::move(handler)), tls_(identity ? std::make_unique<Tls>(*identity) : nullptr) {
  listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  if (bind(listener_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      listen(listener_, 128) != 0 ||
      getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    throw std::runtime_error("the test server cannot listen");
  }
  port_ = ntohs(address.sin_port);
  thread_ = std::thread([this] { acceptAll(); });
}

RawHttpServer::~RawHttpServer() {
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;
    for (const auto& connection : connections_) {
      if (!connection.ended) shutdown(connection.descriptor, SHUT_RDWR);
    }
  }
  shutdown(listener_, SHUT_RDWR);
  thread_.join();
  for (auto& connection : connections_) connection.thread.join();
  close(listener_);
}

std::string RawHttpServer::url(std::string_view path) const {
  return (tls_ != nullptr ? "https://127.0.0.1:" : "http://127.0.0.1:") + std::to_string(port_) +
         std::string(path);
}

size_t RawHttpServer::connectionCount() const {
  const std::lock_guard lock(mutex_);
  return connections_.size();
}

size_t RawHttpServer::openConnectionCount() const {
  const std::lock_guard lock(mutex_);
  return static_cast<size_t>(std::count_if(connections_.begin(), connections_.end(),
                                           [](const Connection& connection) { return !connection.ended; }));
}

void RawHttpServer::acceptAll() {
  while (true) {
    const int descriptor = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    if (descriptor < 0) return;
    const std::lock_guard lock(mutex_);
    if (stopping_) {
      close(descriptor);
      return;
    }
    Connection& connection = connections_.emplace_back();
    connection.descriptor = descriptor;
    connection.thread = std::thread([this, &connection] { serve(connection); });
  }
}

void RawHttpServer::serve(Connection& connection) {
  blockBrokenPipes();
  int descriptor = -1;
  {
    const std::lock_guard lock(mutex_);
    descriptor = connection.descriptor;
  }
  {
    Socket socket(descriptor, tls_.get());
    if (socket.accepted()) {
      handler_(socket);
      socket.finish();
    }
  }
  const std::lock_guard lock(mutex_);
  connection.ended = true;
  close(descriptor);
}

RawHttpServer::Handler RawHttpServer::hangingAfterRequest(std::promise<void>& came) {
  return [&came](RawConnection& connection) {
    connection.readRequest();
    came.set_value();
    connection.waitForClose();
  };
}

RawHttpServer::Handler RawHttpServer::answering(
    std::function<std::string(const std::string& request)> answer) {
  return [answer = std::move(answer)](RawConnection& connection) {
    while (const auto request = connection.readRequest()) {
      if (!connection.write(answer(*request))) return;
    }
  };
}

std::string httpAnswer(std::string_view status, std::string_view body, std::string_view headerLines) {
  std::string out = "HTTP/1.1 ";
  out.append(status).append("\r\n").append(headerLines);
  out += "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n";
  return out.append(body);
}

}  // namespace tarnel::test

#include "tools/lab/http/connection.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netdb.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "base/unique_fd.h"

namespace tarnel::lab {
namespace {

using Clock = std::chrono::steady_clock;

constexpr Connection::Milliseconds kWriteLimit{10'000};
constexpr Connection::Milliseconds kHurryLimit{500};
constexpr Connection::Milliseconds kLingerLimit{200};

int pollTimeout(Clock::time_point until) {
  if (until == Clock::time_point::max()) return -1;
  const auto left = std::chrono::ceil<Connection::Milliseconds>(until - Clock::now()).count();
  return static_cast<int>(std::clamp<int64_t>(left, 0, 600'000));
}

std::string handshakeProblem(int sslError) {
  const unsigned long code = ERR_peek_error();
  ERR_clear_error();
  switch (ERR_GET_REASON(code)) {
    case SSL_R_TLSV1_ALERT_UNKNOWN_CA:
    case SSL_R_SSLV3_ALERT_BAD_CERTIFICATE:
    case SSL_R_SSLV3_ALERT_CERTIFICATE_UNKNOWN:
      return "the client does not trust this lab: copy the lab's ca.pem to the client's trust.d folder";
    case SSL_R_SSLV3_ALERT_CERTIFICATE_EXPIRED:
      return "the client takes the lab's certificate for expired: check both clocks, and restart the lab";
    case SSL_R_HTTP_REQUEST:
      return "a plain HTTP request came to the HTTPS address: write https:// in the client's settings";
    case SSL_R_WRONG_VERSION_NUMBER:
      return "what came was not TLS: this address speaks HTTPS only";
    default:
      break;
  }
  if (code == 0 || sslError == SSL_ERROR_SYSCALL)
    return "the client ended the connection during the TLS handshake";
  const char* reason = ERR_reason_error_string(code);
  return std::string("the TLS handshake failed: ") + (reason != nullptr ? reason : "unknown reason");
}

}  // namespace

void Connection::SslFree::operator()(ssl_st* ssl) const {
  SSL_free(ssl);
}

Connection::Connection(UniqueFd socket, int stopFd) : socket_(std::move(socket)), stopFd_(stopFd) {
  const int flags = ::fcntl(socket_.get(), F_GETFL);
  ::fcntl(socket_.get(), F_SETFL, flags | O_NONBLOCK);
  const int on = 1;
  ::setsockopt(socket_.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
  sockaddr_storage address{};
  socklen_t size = sizeof address;
  char host[NI_MAXHOST] = "?";
  char port[NI_MAXSERV] = "0";
  auto* generic = reinterpret_cast<sockaddr*>(&address);
  if (::getpeername(socket_.get(), generic, &size) == 0) {
    ::getnameinfo(generic, size, host, sizeof host, port, sizeof port, NI_NUMERICHOST | NI_NUMERICSERV);
  }
  peerAddress_ = host;
  peerPort_ = static_cast<uint16_t>(std::strtoul(port, nullptr, 10));
}

Connection::~Connection() = default;

std::string Connection::peer() const {
  const bool colons = peerAddress_.find(':') != std::string::npos;
  return (colons ? "[" + peerAddress_ + "]" : peerAddress_) + ":" + std::to_string(peerPort_);
}

bool Connection::stopping() const {
  pollfd entry{.fd = stopFd_, .events = POLLIN, .revents = 0};
  return ::poll(&entry, 1, 0) > 0;
}

bool Connection::waitFor(short events, Clock::time_point until, OnStop onStop) const {
  bool hurrying = false;
  for (;;) {
    pollfd entries[2] = {{.fd = socket_.get(), .events = events, .revents = 0},
                         {.fd = hurrying ? -1 : stopFd_, .events = POLLIN, .revents = 0}};
    const int ready = ::poll(entries, 2, pollTimeout(until));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;
    if (entries[0].revents != 0) return true;
    if (onStop == OnStop::end) return false;
    hurrying = true;
    until = std::min(until, Clock::now() + kHurryLimit);
  }
}

bool Connection::waitReadable(Milliseconds limit) {
  if (broken_) return false;
  if (ssl_ && SSL_pending(ssl_.get()) > 0) return true;
  return waitFor(POLLIN, Clock::now() + limit, OnStop::end);
}

void Connection::pause(Milliseconds time) {
  waitFor(POLLRDHUP, Clock::now() + time, OnStop::end);
}

void Connection::limitReading(Milliseconds time, uint64_t bytes) {
  readDeadline_ = Clock::now() + time;
  readLeft_ = bytes;
}

template <class Operation>
ssize_t Connection::transfer(Operation operation, Clock::time_point until, OnStop onStop) {
  for (;;) {
    if (broken_) return -1;
    short wanted = 0;
    const ssize_t result = operation(wanted);
    if (result >= 0) return result;
    if (wanted == 0 || !waitFor(wanted, until, onStop)) {
      broken_ = true;
      return -1;
    }
  }
}

namespace {

short wantedBySsl(const SSL* ssl, int result) {
  const int error = SSL_get_error(ssl, result);
  if (error == SSL_ERROR_WANT_READ) return POLLIN;
  return error == SSL_ERROR_WANT_WRITE ? POLLOUT : 0;
}

short wantedBySocket(short events) {
  return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR ? events : short{0};
}

}  // namespace

std::optional<std::string> Connection::acceptTls(ssl_ctx_st* context, Milliseconds limit) {
  ssl_.reset(SSL_new(context));
  if (!ssl_ || SSL_set_fd(ssl_.get(), socket_.get()) != 1) return "no memory for a TLS connection";
  ERR_clear_error();
  int error = 0;
  const ssize_t done = transfer(
      [this, &error](short& wanted) -> ssize_t {
        const int result = SSL_accept(ssl_.get());
        if (result == 1) return 1;
        wanted = wantedBySsl(ssl_.get(), result);
        error = SSL_get_error(ssl_.get(), result);
        return -1;
      },
      Clock::now() + limit, OnStop::end);
  if (done == 1) return std::nullopt;
  const bool unfinished = error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE;
  std::string problem =
      unfinished ? (stopping() ? "" : "the TLS handshake took too long") : handshakeProblem(error);
  ssl_.reset();
  broken_ = true;
  return problem;
}

ssize_t Connection::read(char* bytes, size_t size) {
  if (readLeft_ == 0) return -1;
  size = static_cast<size_t>(std::min<uint64_t>({size, readLeft_, INT32_MAX}));
  const ssize_t count = transfer(
      [this, bytes, size](short& wanted) -> ssize_t {
        if (!ssl_) {
          const ssize_t result = ::recv(socket_.get(), bytes, size, 0);
          if (result < 0) wanted = wantedBySocket(POLLIN);
          return result;
        }
        ERR_clear_error();
        const int result = SSL_read(ssl_.get(), bytes, static_cast<int>(size));
        if (result > 0) return result;
        if (SSL_get_error(ssl_.get(), result) == SSL_ERROR_ZERO_RETURN) return 0;
        wanted = wantedBySsl(ssl_.get(), result);
        return -1;
      },
      readDeadline_, OnStop::end);
  if (count > 0) readLeft_ -= static_cast<uint64_t>(count);
  return count;
}

ssize_t Connection::writeWhole(const char* bytes, size_t size) {
  size_t written = 0;
  while (written < size) {
    const char* from = bytes + written;
    const size_t left = std::min<size_t>(size - written, INT32_MAX);
    const ssize_t count = transfer(
        [this, from, left](short& wanted) -> ssize_t {
          if (!ssl_) {
            const ssize_t result = ::send(socket_.get(), from, left, MSG_NOSIGNAL);
            if (result < 0) wanted = wantedBySocket(POLLOUT);
            return result;
          }
          ERR_clear_error();
          const int result = SSL_write(ssl_.get(), from, static_cast<int>(left));
          if (result > 0) return result;
          wanted = wantedBySsl(ssl_.get(), result);
          return -1;
        },
        Clock::now() + kWriteLimit, OnStop::hurry);
    if (count <= 0) return -1;
    written += static_cast<size_t>(count);
  }
  return static_cast<ssize_t>(size);
}

ssize_t Connection::write(const char* bytes, size_t size) {
  if (broken_) return -1;
  if (!bytesToReset_ || size < *bytesToReset_) {
    if (bytesToReset_) *bytesToReset_ -= size;
    return writeWhole(bytes, size);
  }
  writeWhole(bytes, static_cast<size_t>(*bytesToReset_));
  reset();
  return -1;
}

void Connection::reset() {
  broken_ = true;
  // Disconnecting a connected TCP socket sends the reset at once, where closing it would first finish
  // what is queued.
  sockaddr none{};
  none.sa_family = AF_UNSPEC;
  ::connect(socket_.get(), &none, sizeof none);
}

void Connection::close() {
  if (broken_) return;
  if (ssl_) {
    ERR_clear_error();
    SSL_shutdown(ssl_.get());
  }
  ::shutdown(socket_.get(), SHUT_WR);
  // Closing with unread bytes would reset the connection and may cost the peer the answer.
  const auto until = Clock::now() + kLingerLimit;
  char scrap[4096];
  for (int i = 0; i < 64 && waitFor(POLLIN, until, OnStop::end); ++i) {
    if (::recv(socket_.get(), scrap, sizeof scrap, 0) <= 0) break;
  }
  broken_ = true;
}

}  // namespace tarnel::lab

#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <future>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "testing/test_certificates.h"

namespace tarnel::test {

// The server's end of one connection. Threads: its handler's only.
class RawConnection {
 public:
  RawConnection() = default;
  RawConnection(const RawConnection&) = delete;
  RawConnection& operator=(const RawConnection&) = delete;
  virtual ~RawConnection() = default;

  // One whole request as it came: head and the body that its Content-Length announces. Nothing once the
  // peer has closed.
  std::optional<std::string> readRequest();
  // False once the peer has closed.
  virtual bool write(std::string_view bytes) = 0;
  // Returns when the peer or the server's destructor closes the connection.
  virtual void waitForClose() = 0;
  // Ends the connection with a TCP reset.
  virtual void reset() = 0;

 protected:
  // More bytes at the end of `into`; false at the end of the stream.
  virtual bool readSome(std::string& into) = 0;

 private:
  std::string unread_;
};

// A server on a free loopback port that says exactly the bytes its handler writes. The handler runs once for
// each connection, each on a thread of its own; the connection is closed when it returns. Threads: any.
class RawHttpServer {
 public:
  using Handler = std::function<void(RawConnection&)>;

  // With an identity the server speaks TLS.
  explicit RawHttpServer(Handler handler, std::optional<TlsIdentity> identity = std::nullopt);
  RawHttpServer(const RawHttpServer&) = delete;
  RawHttpServer& operator=(const RawHttpServer&) = delete;
  // Closes all connections and waits for their handlers.
  ~RawHttpServer();

  uint16_t port() const { return port_; }
  std::string url(std::string_view path = "/") const;
  size_t connectionCount() const;
  // Those that are not closed by this side.
  size_t openConnectionCount() const;

  // A handler that answers every request of a connection with what `answer` gives for it.
  static Handler answering(std::function<std::string(const std::string& request)> answer);
  // A handler that reads one request, sets the promise, and never answers. For one connection; the promise
  // outlives the server.
  static Handler hangingAfterRequest(std::promise<void>& came);

 private:
  class Socket;
  struct Connection {
    int descriptor;
    bool ended = false;
    std::thread thread;
  };
  struct Tls;

  void acceptAll();
  void serve(Connection& connection);

  Handler handler_;
  std::unique_ptr<Tls> tls_;
  int listener_ = -1;
  uint16_t port_ = 0;
  mutable std::mutex mutex_;
  bool stopping_ = false;
  std::list<Connection> connections_;
  std::thread thread_;
};

// An HTTP/1.1 answer with that status line ("200 OK"), extra header lines (each ending in CRLF) and body.
std::string httpAnswer(std::string_view status, std::string_view body = "",
                       std::string_view headerLines = "");

}  // namespace tarnel::test

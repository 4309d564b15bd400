#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "base/error.h"
#include "tools/lab/http/listener.h"
#include "tools/receiving/http_message.h"

struct ssl_ctx_st;

namespace tarnel::lab {

struct HttpServerOptions {
  std::shared_ptr<ssl_ctx_st> tls;  // null: plain HTTP
  size_t maxBodyBytes = 16U << 20U;
  // Bodies that are held at the same time, all connections together; beyond it a request waits its turn
  // to fail as too large.
  size_t maxHeldBytes = 256U << 20U;
  size_t maxConnections = 128;  // served at the same time; further ones wait
};

// HTTP/1.1 over one listening socket, one thread a connection. Everything a client can make it hold is
// bounded: request line and header fields to 64 KiB, the body as above, the time of a request to two
// minutes, an idle connection to a minute (less while others wait).
class HttpServer {
 public:
  // Serves what comes to the socket from now on. The handler outlives the server.
  static std::unique_ptr<HttpServer> start(const HttpServerOptions& options, ListeningSocket listening,
                                           HttpHandler& handler);

  HttpServer() = default;
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;
  virtual ~HttpServer() = default;

  // Answers what is being answered, ends all connections; returns when no thread is left. Idempotent.
  virtual void stop() = 0;
};

// The context that presents this certificate; null with the reason on failure.
Result<std::shared_ptr<ssl_ctx_st>> makeServerTlsContext(const std::string& certificateFile,
                                                         const std::string& keyFile);

}  // namespace tarnel::lab

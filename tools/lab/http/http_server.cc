#include "tools/lab/http/http_server.h"

#include <httplib.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <csignal>

#include "base/unique_fd.h"
#include "tools/lab/http/connection.h"
#include "tools/lab/http/worker_pool.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kHandshakeLimit{15'000};
constexpr milliseconds kHeadLimit{30'000};
constexpr milliseconds kBodyLimit{120'000};
constexpr milliseconds kIdleLimit{60'000};
constexpr milliseconds kIdleSlice{1'000};
constexpr milliseconds kEndlessLimit{600'000};
constexpr uint64_t kMaxHeadBytes = 64U << 10U;
constexpr size_t kMaxPathBytes = 1024;
constexpr size_t kRequestsTold = 1'000'000;  // for the answer's Keep-Alive field; nothing is counted

// The library would act on these fields itself (unpack, cut, compress); they pass it by under another name.
constexpr std::string_view kHeldPrefix = "X-Lab-Held-";
constexpr char kAddedLength[] = "X-Lab-Added-Length";
constexpr std::array<const char*, 4> kHeldFields = {"Content-Encoding", "Accept-Encoding", "Content-Type",
                                                    "Range"};
// Fields that the library adds to what the client sent.
constexpr std::array<std::string_view, 4> kAddedFields = {"REMOTE_ADDR", "REMOTE_PORT", "LOCAL_ADDR",
                                                          "LOCAL_PORT"};

class LibraryStream final : public httplib::Stream {
 public:
  explicit LibraryStream(Connection& connection) : connection_(connection) {}

  bool is_readable() const override { return true; }
  bool is_writable() const override { return true; }
  ssize_t read(char* bytes, size_t size) override { return connection_.read(bytes, size); }
  ssize_t write(const char* bytes, size_t size) override { return connection_.write(bytes, size); }
  void get_remote_ip_and_port(std::string& ip, int& port) const override {
    ip = connection_.peerAddress();
    port = connection_.peerPort();
  }
  void get_local_ip_and_port(std::string&, int&) const override {}
  socket_t socket() const override { return -1; }

 private:
  Connection& connection_;
};

void holdFields(httplib::Request& request) {
  for (const char* name : kHeldFields) {
    const auto range = request.headers.equal_range(name);
    httplib::Headers held;
    for (auto field = range.first; field != range.second; ++field) {
      held.emplace(std::string(kHeldPrefix) + field->first, field->second);
    }
    request.headers.erase(range.first, range.second);
    request.headers.insert(held.begin(), held.end());
  }
  request.ranges.clear();
  // Without a length there is no body (RFC 9112 section 6.3); the library would wait for the end of the
  // connection.
  if (!request.has_header("Content-Length") && !request.has_header("Transfer-Encoding")) {
    request.headers.emplace("Content-Length", "0");
    request.headers.emplace(kAddedLength, "1");
  }
}

HttpRequest requestFrom(const httplib::Request& from, const Connection& connection) {
  HttpRequest request;
  request.method = from.method;
  request.path = from.path;
  for (const auto& [name, value] : from.params) request.query.emplace_back(name, value);
  const size_t mark = from.target.find('?');
  if (mark != std::string::npos) request.rawQuery = from.target.substr(mark + 1);
  const bool lengthAdded = from.has_header(kAddedLength);
  for (const auto& [name, value] : from.headers) {
    if (lengthAdded && (name == kAddedLength || name == "Content-Length")) continue;
    if (std::find(kAddedFields.begin(), kAddedFields.end(), name) != kAddedFields.end()) continue;
    request.headers.emplace_back(name.starts_with(kHeldPrefix) ? name.substr(kHeldPrefix.size()) : name,
                                 value);
  }
  request.sender = connection.peer();
  return request;
}

// The bytes of bodies that are held at this moment, given back at the end of each request.
class HeldBytes {
 public:
  HeldBytes(std::atomic<size_t>& total, size_t limit) : total_(total), limit_(limit) {}
  ~HeldBytes() { total_ -= mine_; }
  HeldBytes(const HeldBytes&) = delete;
  HeldBytes& operator=(const HeldBytes&) = delete;

  bool add(size_t bytes) {
    mine_ += bytes;
    return (total_ += bytes) <= limit_;
  }

 private:
  std::atomic<size_t>& total_;
  const size_t limit_;
  size_t mine_ = 0;
};

// Reads requests and writes answers with the library's parser, on connections that are ours.
class Protocol final : private httplib::Server {
 public:
  Protocol(const HttpServerOptions& options, HttpHandler& handler) : options_(options), handler_(handler) {
    svr_sock_ = 0;  // any valid number: the library ends long answers when there is no socket
    set_payload_max_length(options.maxBodyBytes);
    set_keep_alive_timeout(kIdleLimit.count() / 1000);
    set_keep_alive_max_count(kRequestsTold);
    set_pre_routing_handler([this](const httplib::Request& from, httplib::Response& to) {
      return answerWithoutBody(from, to) ? HandlerResponse::Handled : HandlerResponse::Unhandled;
    });
    Post(".*", [this](const httplib::Request& from, httplib::Response& to,
                      const httplib::ContentReader& reader) { answerWithBody(from, to, reader); });
  }

  // One request; false when the connection is to end.
  bool serveOne(Connection& connection) {
    LibraryStream stream(connection);
    current_ = &connection;
    mustClose_ = false;
    connection.limitReading(kHeadLimit, kMaxHeadBytes);
    bool closed = false;
    bool headRead = false;
    const bool served =
        process_request(stream, false, closed, [this, &connection, &headRead](httplib::Request& request) {
          headRead = true;
          connection.limitReading(kBodyLimit, options_.maxBodyBytes + kMaxHeadBytes);
          holdFields(request);
        });
    current_ = nullptr;
    // After a head that makes no sense nobody knows where the next request begins.
    return served && headRead && !closed && !mustClose_;
  }

 private:
  // Everything but POST. True when it was answered.
  bool answerWithoutBody(const httplib::Request& from, httplib::Response& to) {
    const bool reads = from.method == "GET" || from.method == "HEAD";
    if (from.path.size() > kMaxPathBytes) {
      refuse(to, 414, "the path is longer than 1024 bytes\n");
      return true;
    }
    if (from.method == "POST") return false;
    if (!reads) {
      refuse(to, 405, "only GET, HEAD and POST are understood here\n");
      to.set_header("Allow", "GET, HEAD, POST");
      return true;
    }
    // A body that nobody reads would be taken for the next request.
    if (!from.has_header(kAddedLength)) closeAfter(to);
    send(handler_.answer(requestFrom(from, *current_)), to);
    return true;
  }

  void answerWithBody(const httplib::Request& from, httplib::Response& to,
                      const httplib::ContentReader& reader) {
    HttpRequest request = requestFrom(from, *current_);
    HeldBytes held(heldBytes_, options_.maxHeldBytes);
    const size_t limit = std::min(options_.maxBodyBytes, handler_.maxBodyBytes(request));
    bool tooLarge = from.get_header_value<uint64_t>("Content-Length") > limit;
    const bool complete =
        !tooLarge && reader([&request, &held, &tooLarge, limit](const char* bytes, size_t size) {
          tooLarge = request.body.size() + size > limit || !held.add(size);
          if (!tooLarge) request.body.append(bytes, size);
          return !tooLarge;
        });
    if (!complete) {
      // The library has set 413 when the announced length alone is too much.
      request.bodyState = tooLarge || to.status == 413 ? BodyState::tooLarge : BodyState::cutOff;
      closeAfter(to);
    }
    send(handler_.answer(request), to);
  }

  void refuse(httplib::Response& to, int status, const std::string& text) {
    to.status = status;
    to.set_content(text, "text/plain");
    closeAfter(to);
  }

  static void closeAfter(httplib::Response& to) {
    mustClose_ = true;
    to.set_header("Connection", "close");
  }

  static void send(HttpAnswer answer, httplib::Response& to) {
    if (answer.delay.count() > 0) current_->pause(answer.delay);
    if (answer.resetAfter) current_->resetAfterWriting(*answer.resetAfter);
    to.status = answer.status;
    for (const auto& [name, value] : answer.headers) to.set_header(name, value);
    if (answer.endless) {
      closeAfter(to);
      sendEndlessly(std::move(answer), to);
    } else if (!answer.body.empty()) {
      to.set_content(answer.body, answer.contentType);
    }
  }

  static void sendEndlessly(HttpAnswer answer, httplib::Response& to) {
    const auto until = std::chrono::steady_clock::now() + kEndlessLimit;
    to.set_chunked_content_provider(
        answer.contentType, [body = std::move(answer.body), until](size_t offset, httplib::DataSink& sink) {
          const std::string more = offset == 0 && !body.empty() ? body : std::string(4096, ' ');
          const bool written = sink.write(more.data(), more.size());
          return written && !current_->stopping() && std::chrono::steady_clock::now() < until;
        });
  }

  const HttpServerOptions options_;
  HttpHandler& handler_;
  std::atomic<size_t> heldBytes_ = 0;
  // The library hands its request to the handlers, but not the connection it came from; each connection
  // has one thread for its whole life.
  static thread_local Connection* current_;
  static thread_local bool mustClose_;
};

thread_local Connection* Protocol::current_ = nullptr;
thread_local bool Protocol::mustClose_ = false;

class ServerOfConnections final : public HttpServer {
 public:
  ServerOfConnections(const HttpServerOptions& options, ListeningSocket listening, HttpHandler& handler)
      : options_(options),
        handler_(handler),
        listening_(std::move(listening)),
        stopEvent_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
        protocol_(options, handler),
        workers_(options.maxConnections),
        acceptor_([this] { acceptConnections(); }) {}
  ~ServerOfConnections() override { stop(); }

  void stop() override {
    const uint64_t one = 1;
    // A full counter is as readable as one that took this.
    [[maybe_unused]] const ssize_t written = ::write(stopEvent_.get(), &one, sizeof one);
    workers_.stop();
    if (acceptor_.joinable()) acceptor_.join();
  }

 private:
  void acceptConnections() {
    for (;;) {
      pollfd entries[2] = {{.fd = listening_.socket.get(), .events = POLLIN, .revents = 0},
                           {.fd = stopEvent_.get(), .events = POLLIN, .revents = 0}};
      if (::poll(entries, 2, -1) < 0 && errno != EINTR) return;
      if (entries[1].revents != 0) return;
      auto socket = std::make_shared<UniqueFd>(
          ::accept4(listening_.socket.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
      if (!*socket) {
        if (errno == EMFILE || errno == ENFILE || errno == ENOMEM) waitForStop(milliseconds(100));
        continue;
      }
      if (!workers_.run([this, socket] { serve(std::move(*socket)); })) return;
    }
  }

  void waitForStop(milliseconds time) const {
    pollfd entry{.fd = stopEvent_.get(), .events = POLLIN, .revents = 0};
    ::poll(&entry, 1, static_cast<int>(time.count()));
  }

  void serve(UniqueFd socket) {
    Connection connection(std::move(socket), stopEvent_.get());
    if (options_.tls) {
      if (const auto problem = connection.acceptTls(options_.tls.get(), kHandshakeLimit)) {
        if (!problem->empty()) handler_.connectionFailed(connection.peer(), *problem);
        return;
      }
    }
    while (awaitRequest(connection) && protocol_.serveOne(connection)) {
    }
    connection.close();
  }

  // In slices, so that an idle connection makes room soon after others begin to wait.
  bool awaitRequest(Connection& connection) const {
    for (milliseconds waited{0}; waited < kIdleLimit; waited += kIdleSlice) {
      if (connection.waitReadable(kIdleSlice)) return true;
      if (connection.stopping() || workers_.crowded()) return false;
    }
    return false;
  }

  const HttpServerOptions options_;
  HttpHandler& handler_;
  const ListeningSocket listening_;
  const UniqueFd stopEvent_;
  Protocol protocol_;
  WorkerPool workers_;
  std::thread acceptor_;
};

}  // namespace

std::unique_ptr<HttpServer> HttpServer::start(const HttpServerOptions& options, ListeningSocket listening,
                                              HttpHandler& handler) {
  return std::make_unique<ServerOfConnections>(options, std::move(listening), handler);
}

Result<std::shared_ptr<ssl_ctx_st>> makeServerTlsContext(const std::string& certificateFile,
                                                         const std::string& keyFile) {
  std::shared_ptr<SSL_CTX> context(SSL_CTX_new(TLS_server_method()), SSL_CTX_free);
  if (context && SSL_CTX_set_min_proto_version(context.get(), TLS1_2_VERSION) == 1 &&
      SSL_CTX_use_certificate_chain_file(context.get(), certificateFile.c_str()) == 1 &&
      SSL_CTX_use_PrivateKey_file(context.get(), keyFile.c_str(), SSL_FILETYPE_PEM) == 1 &&
      SSL_CTX_check_private_key(context.get()) == 1) {
    return context;
  }
  const char* reason = ERR_reason_error_string(ERR_get_error());
  ERR_clear_error();
  return Error(kToolErrorDomain, -1,
               "cannot use " + certificateFile + " with " + keyFile + ": " +
                   (reason != nullptr ? reason : "unknown reason") +
                   "; remove both files, and new ones are made at the next start");
}

}  // namespace tarnel::lab

#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/unique_fd.h"
#include "tools/files/file_io.h"

struct ssl_st;
struct ssl_ctx_st;

namespace tarnel::lab {

// One accepted connection, plain or TLS. Every wait has an end: its own limit, the request's deadline, or
// the server's stop. Threads: used by the one thread that serves it.
class Connection {
 public:
  using Milliseconds = std::chrono::milliseconds;

  // The socket is made non-blocking. stopFd becomes readable when the server stops.
  Connection(UniqueFd socket, int stopFd);
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Nothing when the handshake succeeded, else why it did not.
  std::optional<std::string> acceptTls(ssl_ctx_st* context, Milliseconds limit);

  // True when bytes are there; false after the time, when the peer is gone or the server stops.
  bool waitReadable(Milliseconds limit);
  // Until the time is over, the peer is gone or the server stops.
  void pause(Milliseconds time);

  // From now on reading ends at the deadline, and after so many bytes.
  void limitReading(Milliseconds time, uint64_t bytes);
  // After so many more bytes written, reset() is called.
  void resetAfterWriting(uint64_t bytes) { bytesToReset_ = bytes; }

  // Bytes read or written; 0 at the end, -1 on failure.
  ssize_t read(char* bytes, size_t size);
  ssize_t write(const char* bytes, size_t size);

  // Ends the connection at once with a TCP reset; everything after it fails.
  void reset();
  // Orderly end: TLS close notice, FIN, and what the peer still sends is read for a moment.
  void close();

  bool stopping() const;
  const std::string& peerAddress() const { return peerAddress_; }
  uint16_t peerPort() const { return peerPort_; }
  std::string peer() const;

 private:
  enum class Step { done, again, failed };
  enum class OnStop { end, hurry };

  bool waitFor(short events, std::chrono::steady_clock::time_point until, OnStop onStop) const;
  template <class Operation>
  ssize_t transfer(Operation operation, std::chrono::steady_clock::time_point until, OnStop onStop);
  ssize_t writeWhole(const char* bytes, size_t size);

  struct SslFree {
    void operator()(ssl_st* ssl) const;
  };

  UniqueFd socket_;
  const int stopFd_;
  std::unique_ptr<ssl_st, SslFree> ssl_;
  bool broken_ = false;
  std::chrono::steady_clock::time_point readDeadline_ = std::chrono::steady_clock::time_point::max();
  uint64_t readLeft_ = UINT64_MAX;
  std::optional<uint64_t> bytesToReset_;
  std::string peerAddress_;
  uint16_t peerPort_ = 0;
};

}  // namespace tarnel::lab

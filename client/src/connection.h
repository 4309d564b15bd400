#pragma once

#include <chrono>
#include <cstdint>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "client/src/request.h"
#include "client/src/request_codec.h"

struct sd_bus;
struct sd_bus_message;

namespace tarnel::core {

// A socket on its way to the daemon.
struct Dialled {
  UniqueFd socket;
  bool isBusy = false;     // the daemon's backlog is full: try again
  bool isRefused = false;  // and not just absent
  Outcome outcome;
};
Dialled dial(const std::string& path);

// One connection to the daemon, from authentication to its loss.
//
// Threads: made, used and destroyed on the I/O thread.
class Connection {
 public:
  // Whom the connection reports to, on the same thread.
  class Host {
   public:
    Host() = default;
    Host(const Host&) = delete;
    Host& operator=(const Host&) = delete;
    virtual ~Host() = default;
    virtual void answered(Request& request, const Answer& answer) = 0;
    virtual void aggregated(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                            uint16_t type, const MaybeDictionary& payload) = 0;
  };

  // host: not owned; outlives the connection.
  Connection(Host& host, std::chrono::milliseconds replyTimeout);
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  Outcome start(UniqueFd socket);

  // Handles what has come and what is due. Not ok when the connection is lost.
  Outcome process();
  // True once the daemon has let us in.
  bool isReady() const;
  // False while the socket takes no more, or more came than one round handles.
  bool canSend() const;
  // Sends the requests in one call. Those that cannot be encoded are answered; not ok when the connection is
  // lost, and then the requests are among the unanswered ones.
  Outcome send(std::vector<Request> requests);
  size_t unanswered() const { return unanswered_; }
  // Everything sent has been read by the daemon and answered.
  bool isSettled() const { return calls_.empty() && lastUnconfirmed_ <= lastConfirmed_; }
  bool awaitsAnswers() const { return !calls_.empty(); }
  // What is still unanswered, in order of sending.
  std::vector<Request> takeUnanswered();

  // For poll(): what to wait for, and until when (microseconds of CLOCK_MONOTONIC, UINT64_MAX for ever).
  int descriptor() const;
  short events() const;
  uint64_t dueAt() const;

 private:
  struct Call {
    Connection* connection;
    uint64_t sequence;
    std::vector<Request> requests;
    bool isAnswered = false;  // a barrier whose turn has not come
    std::list<Call>::iterator self;
  };
  struct BusCloser {
    void operator()(sd_bus* bus) const noexcept;
  };

  // noexcept: nothing may be thrown through the bus library, whatever a callback does.
  static int onReply(sd_bus_message* reply, void* call, void* error) noexcept;
  static int onDeleteFile(sd_bus_message* message, void* connection, void* error) noexcept;
  static int onAggregated(sd_bus_message* message, void* connection, void* error) noexcept;
  Outcome transmit(std::vector<Request> requests, BusMessage message);
  void handleReply(Call& call, sd_bus_message* reply);
  void passBarriers();

  Host& host_;
  const uint64_t replyTimeoutMicroseconds_;
  std::unique_ptr<sd_bus, BusCloser> bus_;
  std::list<Call> calls_;
  size_t unanswered_ = 0;
  size_t uploads_ = 0;  // of the calls; while there are any, no other call can be late
  uint64_t lastSequence_ = 0;
  uint64_t lastUnconfirmed_ = 0;  // the last call that asked for no answer
  uint64_t lastConfirmed_ = 0;    // the last call that was answered
  bool hasMoreInput_ = false;
};

}  // namespace tarnel::core

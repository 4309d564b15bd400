#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <mutex>
#include <vector>

#include "base/unique_fd.h"
#include "client/src/options.h"
#include "client/src/request.h"
#include "tarnel/tarnel_c_session.h"

namespace tarnel::core {

using SteadyTime = std::chrono::steady_clock::time_point;

enum class State : tarnel_session_state {
  connecting = TARNEL_STATE_CONNECTING,
  connected = TARNEL_STATE_CONNECTED,
  interrupted = TARNEL_STATE_INTERRUPTED,
  invalidated = TARNEL_STATE_INVALIDATED,
  closed = TARNEL_STATE_CLOSED,
};

// What passes between a session's callers and its I/O thread: the bounded queue of requests, the state of
// the connection, and the callers' wishes. Nobody holds its lock while anything but memory is touched.
//
// Threads: put, reconnect, close, mute and state from any; the rest from the I/O thread.
class Mailbox {
 public:
  // What callers want of the I/O thread.
  struct Orders {
    bool connect = false;
    bool close = false;
    SteadyTime closeBy;  // how long what waits may still take
  };

  // wake: an eventfd, which the I/O thread polls.
  Mailbox(UniqueFd wake, const Options& options);

  // Appends a measured request; when it fails the request and its completion are dropped.
  Outcome put(Request request);
  Outcome reconnect();
  // The first call decides the time.
  void close(SteadyTime closeBy);
  // From now on no callback is begun.
  void mute() { isMuted_ = true; }
  bool isMuted() const { return isMuted_; }
  State state() const;

  int wakeDescriptor() const { return wake_.get(); }
  void clearWake();
  // Takes the wish to connect with it.
  Orders orders();
  void setConnected();
  // Callers now get `why`; returns what was waiting.
  std::deque<Request> setDisconnected(State state, const Outcome& why);
  // The requests to send next in one call: a run of messages, or one other request. At most `room` requests.
  std::vector<Request> take(size_t room);
  bool isEmpty() const;
  // False when there is something to do at once; else a request that comes wakes the thread if it could be
  // sent (wishes always do).
  bool mayWait(bool canSend);

 private:
  void wake() const;

  const UniqueFd wake_;
  const size_t maxCalls_;
  const size_t maxBytes_;
  std::atomic<bool> isMuted_{false};

  mutable std::mutex mutex_;
  // All of these are guarded by mutex_.
  std::deque<Request> waiting_;
  size_t waitingBytes_ = 0;
  State state_ = State::connecting;
  Outcome why_;
  Orders orders_{true, false, {}};
  bool wakesOnPut_ = false;
};

}  // namespace tarnel::core

#include "client/src/session_core.h"

#include <pthread.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <system_error>
#include <utility>

#include "client/src/io_loop.h"

namespace tarnel::core {
namespace {

// Blocks all signals of the calling thread while a thread that shall take none is started.
class SignalsBlocked {
 public:
  SignalsBlocked() {
    sigset_t all;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before_);
  }
  ~SignalsBlocked() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
  SignalsBlocked(const SignalsBlocked&) = delete;
  SignalsBlocked& operator=(const SignalsBlocked&) = delete;

 private:
  sigset_t before_;
};

}  // namespace

Outcome SessionCore::create(const Options& options, Handlers handlers,
                            std::shared_ptr<SessionCore>& session) {
  if (auto outcome = check(options); !outcome.ok()) return outcome;
  UniqueFd wake(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wake) {
    return failure(TARNEL_ERROR_SYSTEM,
                   std::string("no descriptor for a session: ") + strerrordesc_np(errno));
  }
  Options resolved = options;
  resolved.socketPath = resolveSocketPath(options.socketPath);  // the caller's environment, as it is now
  auto made = std::make_shared<SessionCore>(Token(), resolved, std::move(handlers), std::move(wake));
  rememberSession(made);
  if (auto outcome = made->startThread(); !outcome.ok()) {
    forgetSession(made.get());
    return outcome;
  }
  session = std::move(made);
  return {};
}

SessionCore::SessionCore(Token, const Options& options, Handlers handlers, UniqueFd wake)
    : options_(options),
      handlers_(std::move(handlers)),
      generation_(forkGeneration()),
      mailbox_(std::move(wake), options_) {}

SessionCore::~SessionCore() = default;

Outcome SessionCore::startThread() {
  const SignalsBlocked blocked;
  const std::lock_guard lock(endMutex_);  // the thread must not end, or detach itself, before it is stored
  try {
    thread_ = std::thread([self = shared_from_this()] { self->run(); });
  } catch (const std::system_error& error) {
    return failure(TARNEL_ERROR_SYSTEM, std::string("no thread for a session: ") + error.what());
  }
  pthread_setname_np(thread_.native_handle(), "tarnel-io");
  return {};
}

void SessionCore::run() {
  { const std::lock_guard lock(endMutex_); }
  ownThread_ = std::this_thread::get_id();
  IoLoop loop(options_, handlers_, mailbox_, socket_);
  loop.run();
  parked_ = loop.takeParked();
  if (!mailbox_.isMuted()) {
    if (handlers_.released) handlers_.released();
    forgetSession(this);
  }
  const std::lock_guard lock(endMutex_);
  hasEnded_ = true;
  ended_.notify_all();
}

Outcome SessionCore::submit(Request request) {
  if (auto outcome = measure(request); !outcome.ok()) return outcome;
  return mailbox_.put(std::move(request));
}

Outcome SessionCore::reconnect() {
  return mailbox_.reconnect();
}

State SessionCore::state() const {
  return mailbox_.state();
}

Outcome SessionCore::checkProcess() const {
  if (!isForeign()) return {};
  return failure(TARNEL_ERROR_FORKED,
                 "the session belongs to the process that forked this one: make a new session here");
}

void SessionCore::close() {
  mailbox_.close(std::chrono::steady_clock::now() + options_.linger);
  if (isOnOwnThread()) {
    const std::lock_guard lock(joinMutex_);
    thread_.detach();
    return;
  }
  if (mailbox_.isMuted()) {
    // The process is ending, and whoever ends it has waited as long as may be waited.
    const std::lock_guard lock(endMutex_);
    if (!hasEnded_) return;
  }
  join();
}

void SessionCore::join() {
  const std::lock_guard lock(joinMutex_);
  if (thread_.joinable()) thread_.join();
}

void SessionCore::beginExit() {
  closesBy_ = std::chrono::steady_clock::now() + options_.linger;
  mailbox_.mute();
  mailbox_.close(closesBy_);
}

void SessionCore::awaitEnd(SteadyTime latest) {
  if (isOnOwnThread()) return;
  {
    std::unique_lock lock(endMutex_);
    if (!ended_.wait_until(lock, latest, [this] { return hasEnded_; })) return;
  }
  join();
}

void SessionCore::closeDescriptorsInChild() {
  socket_.closeInChild();
  ::close(mailbox_.wakeDescriptor());
}

}  // namespace tarnel::core

#ifndef TARNEL_SESSION_H_
#define TARNEL_SESSION_H_

// A reporting session with the daemon, in C++; inline over tarnel_c_session.h, whose general rules (threads,
// fork, exit, signals) hold here too. Needs C++17.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "tarnel/tarnel_c_session.h"
#include "tarnel/value.h"

namespace tarnel::client {

// Whether a call was accepted, and if not, why.
struct Status {
  tarnel_status code = TARNEL_OK;
  std::string message;  // one sentence with the remedy; empty when ok

  bool ok() const noexcept { return code == TARNEL_OK; }
  explicit operator bool() const noexcept { return ok(); }
};

// What a backend reported to the client.
struct BackendError {
  std::string domain;
  std::int64_t code = 0;
  std::string description;
};

// The answer to a call. status is ok when the daemon answered, whatever it answered.
struct Reply {
  Status status;
  std::optional<std::vector<std::string>> names;  // live backends, of startConfig and fetchStates
  std::optional<std::string> text;
  bool success = false;  // of uploadFile and uploadLogData
  std::optional<BackendError> error;

  bool ok() const noexcept { return status.ok(); }
};

// Runs exactly once, on the session's I/O thread, for each call that was accepted. It must not throw. An
// empty one asks for no answer.
using Completion = std::function<void(const Reply& reply)>;

struct Disconnection {
  Status why;
  std::uint64_t lostCalls = 0;  // accepted without a completion and never sent
};

enum class Flag : tarnel_flag {
  normal = TARNEL_FLAG_NORMAL,
  realtime = TARNEL_FLAG_REALTIME,
  important = TARNEL_FLAG_IMPORTANT,
  realtimeAndImportant = TARNEL_FLAG_REALTIME | TARNEL_FLAG_IMPORTANT,
};

enum class State : tarnel_session_state {
  connecting = TARNEL_STATE_CONNECTING,
  connected = TARNEL_STATE_CONNECTED,
  interrupted = TARNEL_STATE_INTERRUPTED,
  invalidated = TARNEL_STATE_INVALIDATED,
  closed = TARNEL_STATE_CLOSED,
};

// Ranges as in tarnel_options.
struct Options {
  std::string socketPath;  // empty: TARNEL_SOCKET, else the installed default
  std::uint32_t maxQueuedCalls = 4096;
  std::uint32_t maxQueuedBytes = 8U << 20U;
  std::uint32_t maxUnanswered = 256;
  std::chrono::milliseconds connectTimeout{10'000};
  std::chrono::milliseconds replyTimeout{120'000};
  std::chrono::milliseconds linger{200};

  // Run on the session's I/O thread; must not throw; may be empty.
  std::function<void(const Disconnection&)> onInterruption;
  std::function<void(const Disconnection&)> onInvalidation;
  // With it, the session aggregates. The views are valid during the call.
  std::function<void(DictionaryView messageInfo, double timestamp, std::uint16_t category, std::uint16_t type,
                     DictionaryView payload)>
      onAggregatedMessage;
  std::function<void()> onAggregationEnd;
};

namespace detail {

inline Status statusOf(tarnel_status status) {
  return status == TARNEL_OK ? Status() : Status{status, tarnel_last_error()};
}

inline Reply replyOf(const tarnel_reply& from) {
  Reply reply;
  reply.status = {from.status, from.message};
  if (from.names != nullptr) reply.names.emplace(from.names, from.names + from.name_count);
  if (from.text != nullptr) reply.text = from.text;
  reply.success = from.success;
  if (from.error_domain != nullptr) {
    reply.error = BackendError{from.error_domain, from.error_code, from.error_description};
  }
  return reply;
}

inline std::uint32_t milliseconds(std::chrono::milliseconds time) {
  if (time.count() < 0) return 0;
  return time.count() > 0xFFFFFFFF ? 0xFFFFFFFFU : static_cast<std::uint32_t>(time.count());
}

// The callbacks of a session, held until the library will run none of them any more.
struct HeldHandlers {
  std::function<void(const Disconnection&)> onInterruption;
  std::function<void(const Disconnection&)> onInvalidation;
  std::function<void(DictionaryView, double, std::uint16_t, std::uint16_t, DictionaryView)>
      onAggregatedMessage;
  std::function<void()> onAggregationEnd;

  static HeldHandlers& of(void* context) { return *static_cast<HeldHandlers*>(context); }
  static Disconnection describe(const tarnel_disconnection& from) {
    return {{from.status, from.message}, from.lost_calls};
  }
};

}  // namespace detail

// One session and its connection. Movable, not copyable.
//
// Every call returns its Status at once: ok means accepted, and that a completion, if one was given, will
// run. The ...AndWait forms block for at most `timeout` (1 ms to 24 h) and return the answer. Dictionary and
// array arguments: {} means none.
class Session {
 public:
  // Begins to connect. Whether that could be begun is told by status(); without it every call fails alike.
  explicit Session(Options options = {}) {
    auto handlers = std::make_unique<detail::HeldHandlers>();
    tarnel_options native;
    tarnel_options_init(&native, sizeof native);
    if (!options.socketPath.empty()) native.socket_path = options.socketPath.c_str();
    native.max_queued_calls = options.maxQueuedCalls;
    native.max_queued_bytes = options.maxQueuedBytes;
    native.max_unanswered = options.maxUnanswered;
    native.connect_timeout_ms = detail::milliseconds(options.connectTimeout);
    native.reply_timeout_ms = detail::milliseconds(options.replyTimeout);
    native.linger_ms = detail::milliseconds(options.linger);
    fillHandlers(native, options);
    handlers->onInterruption = std::move(options.onInterruption);
    handlers->onInvalidation = std::move(options.onInvalidation);
    handlers->onAggregatedMessage = std::move(options.onAggregatedMessage);
    handlers->onAggregationEnd = std::move(options.onAggregationEnd);
    native.context = handlers.get();
    status_ = detail::statusOf(tarnel_session_create(&native, &handle_));
    if (status_.ok()) handlers.release();  // release_context takes it back
  }
  Session(Session&& other) noexcept
      : handle_(std::exchange(other.handle_, nullptr)), status_(std::move(other.status_)) {}
  Session& operator=(Session&& other) noexcept {
    std::swap(handle_, other.handle_);
    std::swap(status_, other.status_);
    return *this;
  }
  // Blocks for at most the linger time, and for a callback that runs; see tarnel_session_destroy.
  ~Session() { tarnel_session_destroy(handle_); }

  const Status& status() const noexcept { return status_; }
  State state() const noexcept { return static_cast<State>(tarnel_session_get_state(handle_)); }
  // After an interruption or invalidation; then the session is configured again.
  Status reconnect() { return made(tarnel_session_reconnect(handle_)); }
  // Blocks until everything accepted before has been read by the daemon and answered.
  Status drain(std::chrono::milliseconds timeout) {
    return made(tarnel_session_drain(handle_, detail::milliseconds(timeout)));
  }

  // Before startConfig. No answer comes.
  Status setSessionInfo(DictionaryView sessionInfo, DictionaryView userInfo = {}, ArrayView frameworks = {}) {
    return made(tarnel_session_set_session_info(handle_, sessionInfo.handle(), userInfo.handle(),
                                                frameworks.handle()));
  }

  // Reply: names of the live backends, or none when there was no configuration.
  Status startConfig(Completion completion) {
    return async(std::move(completion), tarnel_session_start_config, handle_);
  }
  Reply startConfigAndWait(std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_start_config_and_wait, handle_);
  }

  // Reply: names of the live backends under the new user info.
  Status fetchStates(DictionaryView userInfo, Completion completion) {
    return async(std::move(completion), tarnel_session_fetch_states, handle_, userInfo.handle());
  }
  Reply fetchStatesAndWait(DictionaryView userInfo, std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_fetch_states_and_wait, handle_, userInfo.handle());
  }

  // Reply: text.
  Status fetchDisplayURL(Completion completion) {
    return async(std::move(completion), tarnel_session_fetch_display_url, handle_);
  }
  Reply fetchDisplayURLAndWait(std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_fetch_display_url_and_wait, handle_);
  }

  // Reply: text of what was posted, or error, or neither.
  Status sendMessage(std::uint16_t category, std::uint16_t type, DictionaryView payload = {},
                     Flag flag = Flag::normal, Completion completion = {}) {
    return async(std::move(completion), tarnel_session_send_message, handle_, category, type,
                 static_cast<tarnel_flag>(flag), payload.handle());
  }
  Reply sendMessageAndWait(std::uint16_t category, std::uint16_t type, DictionaryView payload, Flag flag,
                           std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_send_message_and_wait, handle_, category, type,
                static_cast<tarnel_flag>(flag), payload.handle());
  }

  // The message as one dictionary, keys kTarnelMessageParameters... of keys.h; reply as above.
  Status sendMessageDictionary(DictionaryView message, Completion completion = {}) {
    return async(std::move(completion), tarnel_session_send_message_dictionary, handle_, message.handle());
  }
  Reply sendMessageDictionaryAndWait(DictionaryView message, std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_send_message_dictionary_and_wait, handle_, message.handle());
  }

  // Reply: text, or error, or both.
  Status flush(Completion completion = {}) {
    return async(std::move(completion), tarnel_session_flush, handle_);
  }
  Reply flushAndWait(std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_flush_and_wait, handle_);
  }

  // The client's last message; reply as for a message.
  Status finish(Completion completion = {}) {
    return async(std::move(completion), tarnel_session_finish, handle_);
  }
  Reply finishAndWait(std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_finish_and_wait, handle_);
  }

  // Uploads a file, which is deleted when the server takes it; see tarnel_session_upload_file. Reply:
  // success.
  Status uploadFile(const std::string& path, Completion completion = {}) {
    return async(std::move(completion), tarnel_session_upload_file, handle_, path.c_str());
  }
  Reply uploadFileAndWait(const std::string& path, std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_upload_file_and_wait, handle_, path.c_str());
  }

  // Reply: success, error.
  Status uploadLogData(ArrayView logData, Completion completion) {
    return async(std::move(completion), tarnel_session_upload_log_data, handle_, logData.handle());
  }
  Reply uploadLogDataAndWait(ArrayView logData, std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_upload_log_data_and_wait, handle_, logData.handle());
  }

  // One message with its own session info, on a session that needs no configuring. Reply: text; without
  // client type or session identifier TARNEL_ERROR_NO_REPLY.
  Status sendSingleMessage(DictionaryView sessionInfo, DictionaryView userInfo, std::uint16_t category,
                           std::uint16_t type, DictionaryView payload, Completion completion) {
    return async(std::move(completion), tarnel_session_send_single_message, handle_, sessionInfo.handle(),
                 userInfo.handle(), category, type, payload.handle());
  }
  Reply sendSingleMessageAndWait(DictionaryView sessionInfo, DictionaryView userInfo, std::uint16_t category,
                                 std::uint16_t type, DictionaryView payload,
                                 std::chrono::milliseconds timeout) {
    return wait(timeout, tarnel_session_send_single_message_and_wait, handle_, sessionInfo.handle(),
                userInfo.handle(), category, type, payload.handle());
  }

  tarnel_session* handle() const noexcept { return handle_; }

 private:
  static void fillHandlers(tarnel_options& native, const Options& options) {
    using detail::HeldHandlers;
    if (options.onInterruption) {
      native.on_interruption = [](void* context, const tarnel_disconnection* disconnection) {
        HeldHandlers::of(context).onInterruption(HeldHandlers::describe(*disconnection));
      };
    }
    if (options.onInvalidation) {
      native.on_invalidation = [](void* context, const tarnel_disconnection* disconnection) {
        HeldHandlers::of(context).onInvalidation(HeldHandlers::describe(*disconnection));
      };
    }
    if (options.onAggregatedMessage) {
      native.on_aggregated_message = [](void* context, const tarnel_dictionary* messageInfo, double timestamp,
                                        std::uint16_t category, std::uint16_t type,
                                        const tarnel_dictionary* payload) {
        HeldHandlers::of(context).onAggregatedMessage(DictionaryView(messageInfo), timestamp, category, type,
                                                      DictionaryView(payload));
      };
    }
    if (options.onAggregationEnd) {
      native.on_aggregation_end = [](void* context) { HeldHandlers::of(context).onAggregationEnd(); };
    }
    native.release_context = [](void* context) {
      const std::unique_ptr<HeldHandlers> owned(static_cast<HeldHandlers*>(context));
    };
  }

  Status made(tarnel_status status) const {
    return handle_ == nullptr && !status_.ok() ? status_ : detail::statusOf(status);
  }

  template <class Call, class... Args>
  Status async(Completion completion, Call call, Args... args) {
    if (!completion) return made(call(args..., nullptr, nullptr));
    auto held = std::make_unique<Completion>(std::move(completion));
    const tarnel_status status = call(
        args...,
        [](void* context, const tarnel_reply* reply) {
          const std::unique_ptr<Completion> owned(static_cast<Completion*>(context));
          (*owned)(detail::replyOf(*reply));
        },
        held.get());
    if (status == TARNEL_OK) held.release();  // the callback takes it back
    return made(status);
  }

  template <class Call, class... Args>
  Reply wait(std::chrono::milliseconds timeout, Call call, Args... args) {
    tarnel_reply* native = nullptr;
    const tarnel_status status = call(args..., detail::milliseconds(timeout), &native);
    const std::unique_ptr<tarnel_reply, void (*)(tarnel_reply*)> owned(native, tarnel_reply_destroy);
    if (owned) return detail::replyOf(*owned);
    Reply reply;
    reply.status = made(status);
    return reply;
  }

  tarnel_session* handle_ = nullptr;
  Status status_;
};

}  // namespace tarnel::client

#endif

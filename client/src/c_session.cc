#include "tarnel/tarnel_c_session.h"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <utility>

#include "client/src/c_support.h"

namespace tarnel::core {
namespace {

constexpr char kNoSession[] = "the session is NULL";

tarnel_options defaultOptions() {
  const Options defaults;
  tarnel_options options{};
  options.size = sizeof options;
  options.max_queued_calls = defaults.maxQueuedCalls;
  options.max_queued_bytes = defaults.maxQueuedBytes;
  options.max_unanswered = defaults.maxUnanswered;
  options.connect_timeout_ms = static_cast<uint32_t>(defaults.connectTimeout.count());
  options.reply_timeout_ms = static_cast<uint32_t>(defaults.replyTimeout.count());
  options.linger_ms = static_cast<uint32_t>(defaults.linger.count());
  return options;
}

Options fromC(const tarnel_options& given) {
  Options options;
  if (given.socket_path != nullptr) options.socketPath = given.socket_path;
  options.maxQueuedCalls = given.max_queued_calls;
  options.maxQueuedBytes = given.max_queued_bytes;
  options.maxUnanswered = given.max_unanswered;
  options.connectTimeout = std::chrono::milliseconds(given.connect_timeout_ms);
  options.replyTimeout = std::chrono::milliseconds(given.reply_timeout_ms);
  options.linger = std::chrono::milliseconds(given.linger_ms);
  return options;
}

std::function<void(const Outcome&, uint64_t)> fromC(tarnel_disconnection_handler handler, void* context) {
  if (handler == nullptr) return nullptr;
  return [handler, context](const Outcome& why, uint64_t lostCalls) {
    const tarnel_disconnection disconnection{sizeof disconnection, why.status, why.message.c_str(),
                                             lostCalls};
    handler(context, &disconnection);
  };
}

Handlers handlersOf(const tarnel_options& given) {
  Handlers handlers;
  handlers.interruption = fromC(given.on_interruption, given.context);
  handlers.invalidation = fromC(given.on_invalidation, given.context);
  if (auto* handler = given.on_aggregated_message) {
    handlers.aggregatedMessage = [handler, context = given.context](
                                     const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                                     uint16_t type, const MaybeDictionary& payload) {
      handler(context, messageInfo ? wrap(&*messageInfo) : nullptr, timestamp, category, type,
              payload ? wrap(&*payload) : nullptr);
    };
  }
  if (auto* handler = given.on_aggregation_end) {
    handlers.aggregationEnd = [handler, context = given.context] { handler(context); };
  }
  if (auto* handler = given.release_context) {
    handlers.released = [handler, context = given.context] { handler(context); };
  }
  return handlers;
}

Completion fromC(tarnel_completion completion, void* context) {
  if (completion == nullptr) return nullptr;
  return [completion, context](const Answer& answer) { completion(context, &ReplyView(answer).reply()); };
}

MaybeDictionary maybe(const tarnel_dictionary* handle) {
  return handle == nullptr ? MaybeDictionary() : MaybeDictionary(*unwrap(handle));
}
std::optional<Array> maybe(const tarnel_array* handle) {
  return handle == nullptr ? std::optional<Array>() : std::optional<Array>(*unwrap(handle));
}

// The wait for one answer; shared, since the wait may end before the answer comes.
struct Waiter {
  std::mutex mutex;
  std::condition_variable arrived;
  std::optional<Answer> answer;  // guarded by mutex
};

// How a call is answered: to a completion, or to a caller who waits.
struct Async {
  tarnel_completion completion;
  void* context;
};
struct Waiting {
  uint32_t timeoutMilliseconds;
  tarnel_reply** reply;
};

Outcome checkSession(const tarnel_session* session) {
  if (session == nullptr) return failure(TARNEL_ERROR_INVALID_ARGUMENT, kNoSession);
  return session->core->checkProcess();
}

Outcome perform(const tarnel_session& session, Request request, const Async& how) {
  request.completion = fromC(how.completion, how.context);
  return session.core->submit(std::move(request));
}

Outcome perform(const tarnel_session& session, Request request, const Waiting& how) {
  if (how.timeoutMilliseconds < 1 || how.timeoutMilliseconds > 86'400'000) {
    return failure(TARNEL_ERROR_INVALID_ARGUMENT, "timeout_ms is " + std::to_string(how.timeoutMilliseconds) +
                                                      "; it must be from 1 to 86400000");
  }
  if (session.core->isOnOwnThread()) {
    return failure(
        TARNEL_ERROR_WRONG_THREAD,
        "a callback of the session cannot wait for an answer of it: use the form with a completion");
  }
  const auto waiter = std::make_shared<Waiter>();
  request.completion = [waiter](const Answer& answer) {
    const std::lock_guard lock(waiter->mutex);
    waiter->answer = answer;
    waiter->arrived.notify_all();
  };
  const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(how.timeoutMilliseconds);
  if (auto accepted = session.core->submit(std::move(request)); !accepted.ok()) return accepted;
  std::unique_lock lock(waiter->mutex);
  if (!waiter->arrived.wait_until(lock, until, [&waiter] { return waiter->answer.has_value(); })) {
    return failure(TARNEL_ERROR_TIMED_OUT, "no answer within " + std::to_string(how.timeoutMilliseconds) +
                                               " ms; the call is still under way");
  }
  Outcome outcome = waiter->answer->outcome;
  if (how.reply != nullptr) *how.reply = std::make_unique<OwnedReply>(std::move(*waiter->answer)).release();
  return outcome;
}

// Checks the session, lets `fill` fill in the request, and performs it.
template <class How, class Fill>
tarnel_status call(tarnel_session* session, Request::Kind kind, const How& how, Fill fill) noexcept {
  if constexpr (std::is_same_v<How, Waiting>) {
    if (how.reply != nullptr) *how.reply = nullptr;
  }
  return guarded([session, kind, &how, &fill]() -> Outcome {
    if (auto outcome = checkSession(session); !outcome.ok()) return outcome;
    Request request;
    request.kind = kind;
    if (auto outcome = fill(request); !outcome.ok()) return outcome;
    return perform(*session, std::move(request), how);
  });
}

template <class How>
tarnel_status call(tarnel_session* session, Request::Kind kind, const How& how) noexcept {
  return call(session, kind, how, [](Request&) { return Outcome(); });
}

auto withUserInfo(const tarnel_dictionary* userInfo) {
  return [userInfo](Request& request) {
    request.userInfo = maybe(userInfo);
    return Outcome();
  };
}

auto withMessage(uint16_t category, uint16_t type, tarnel_flag flags, const tarnel_dictionary* payload) {
  return [category, type, flags, payload](Request& request) {
    if (flags > 3) {
      return failure(TARNEL_ERROR_INVALID_ARGUMENT,
                     "flags is " + std::to_string(flags) + "; it must be from 0 to 3");
    }
    request.category = category;
    request.type = type;
    request.flag = flags;
    request.dictionary = maybe(payload);
    return Outcome();
  };
}

auto withDictionary(const tarnel_dictionary* message) {
  return [message](Request& request) {
    if (message == nullptr) return failure(TARNEL_ERROR_INVALID_ARGUMENT, "the message is NULL");
    request.dictionary = *unwrap(message);
    return Outcome();
  };
}

auto withFile(const char* path) {
  return [path](Request& request) { return UploadFile::open(path, request.file); };
}

auto withLogData(const tarnel_array* logData) {
  return [logData](Request& request) {
    if (logData == nullptr) return failure(TARNEL_ERROR_INVALID_ARGUMENT, "log_data is NULL");
    request.array = *unwrap(logData);
    return Outcome();
  };
}

auto withInfos(const tarnel_dictionary* sessionInfo, const tarnel_dictionary* userInfo, uint16_t category,
               uint16_t type, const tarnel_dictionary* payload) {
  return [sessionInfo, userInfo, category, type, payload](Request& request) {
    request.sessionInfo = maybe(sessionInfo);
    request.userInfo = maybe(userInfo);
    request.category = category;
    request.type = type;
    request.dictionary = maybe(payload);
    return Outcome();
  };
}

}  // namespace
}  // namespace tarnel::core

using namespace tarnel::core;
using Kind = Request::Kind;

extern "C" {

void tarnel_options_init(tarnel_options* options, size_t size) {
  if (options == nullptr || size < sizeof options->size) return;
  const tarnel_options defaults = defaultOptions();
  std::memset(static_cast<void*>(options), 0, size);
  std::memcpy(options, &defaults, std::min(size, sizeof defaults));
  options->size = size;
}

tarnel_status tarnel_session_create(const tarnel_options* options, tarnel_session** session) {
  if (session == nullptr) return report(TARNEL_ERROR_INVALID_ARGUMENT, "where to put the session is NULL");
  *session = nullptr;
  return guarded([options, session]() -> Outcome {
    tarnel_options full = defaultOptions();
    if (options != nullptr) {
      if (options->size < offsetof(tarnel_options, socket_path) || options->size > 65'536) {
        return failure(TARNEL_ERROR_INVALID_ARGUMENT,
                       "the options' size is not set: begin with tarnel_options_init");
      }
      std::memcpy(&full, options, std::min(options->size, sizeof full));
    }
    auto made = std::make_unique<tarnel_session>();
    if (auto outcome = SessionCore::create(fromC(full), handlersOf(full), made->core); !outcome.ok()) {
      return outcome;
    }
    *session = made.release();
    return {};
  });
}

void tarnel_session_destroy(tarnel_session* session) {
  if (session == nullptr) return;
  const std::unique_ptr<tarnel_session> owned(session);
  guarded([session]() -> Outcome {
    if (session->core->checkProcess().ok()) session->core->close();
    return {};
  });
}

tarnel_status tarnel_session_reconnect(tarnel_session* session) {
  return guarded([session]() -> Outcome {
    if (auto outcome = checkSession(session); !outcome.ok()) return outcome;
    return session->core->reconnect();
  });
}

tarnel_session_state tarnel_session_get_state(const tarnel_session* session) {
  if (session == nullptr || session->core->isForeign()) return TARNEL_STATE_CLOSED;
  return static_cast<tarnel_session_state>(session->core->state());
}

tarnel_status tarnel_session_drain(tarnel_session* session, uint32_t timeout_ms) {
  return call(session, Kind::barrier, Waiting{timeout_ms, nullptr});
}

tarnel_status tarnel_session_set_session_info(tarnel_session* session, const tarnel_dictionary* session_info,
                                              const tarnel_dictionary* user_info,
                                              const tarnel_array* frameworks) {
  return call(session, Kind::setSessionInfo, Async{nullptr, nullptr},
              [session, session_info, user_info, frameworks](Request& request) {
                request.sessionInfo = maybe(session_info);
                request.userInfo = maybe(user_info);
                request.array = maybe(frameworks);
                request.hasAggregation = session->core->isAggregator();
                return Outcome();
              });
}

tarnel_status tarnel_session_start_config(tarnel_session* session, tarnel_completion completion,
                                          void* context) {
  return call(session, Kind::startConfig, Async{completion, context});
}
tarnel_status tarnel_session_start_config_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                                   tarnel_reply** reply) {
  return call(session, Kind::startConfig, Waiting{timeout_ms, reply});
}

tarnel_status tarnel_session_fetch_states(tarnel_session* session, const tarnel_dictionary* user_info,
                                          tarnel_completion completion, void* context) {
  return call(session, Kind::fetchStates, Async{completion, context}, withUserInfo(user_info));
}
tarnel_status tarnel_session_fetch_states_and_wait(tarnel_session* session,
                                                   const tarnel_dictionary* user_info, uint32_t timeout_ms,
                                                   tarnel_reply** reply) {
  return call(session, Kind::fetchStates, Waiting{timeout_ms, reply}, withUserInfo(user_info));
}

tarnel_status tarnel_session_fetch_display_url(tarnel_session* session, tarnel_completion completion,
                                               void* context) {
  return call(session, Kind::fetchDisplayURL, Async{completion, context});
}
tarnel_status tarnel_session_fetch_display_url_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                                        tarnel_reply** reply) {
  return call(session, Kind::fetchDisplayURL, Waiting{timeout_ms, reply});
}

tarnel_status tarnel_session_send_message(tarnel_session* session, uint16_t category, uint16_t type,
                                          tarnel_flag flags, const tarnel_dictionary* payload,
                                          tarnel_completion completion, void* context) {
  return call(session, Kind::sendMessage, Async{completion, context},
              withMessage(category, type, flags, payload));
}
tarnel_status tarnel_session_send_message_and_wait(tarnel_session* session, uint16_t category, uint16_t type,
                                                   tarnel_flag flags, const tarnel_dictionary* payload,
                                                   uint32_t timeout_ms, tarnel_reply** reply) {
  return call(session, Kind::sendMessage, Waiting{timeout_ms, reply},
              withMessage(category, type, flags, payload));
}

tarnel_status tarnel_session_send_message_dictionary(tarnel_session* session,
                                                     const tarnel_dictionary* message,
                                                     tarnel_completion completion, void* context) {
  return call(session, Kind::sendDictionary, Async{completion, context}, withDictionary(message));
}
tarnel_status tarnel_session_send_message_dictionary_and_wait(tarnel_session* session,
                                                              const tarnel_dictionary* message,
                                                              uint32_t timeout_ms, tarnel_reply** reply) {
  return call(session, Kind::sendDictionary, Waiting{timeout_ms, reply}, withDictionary(message));
}

tarnel_status tarnel_session_flush(tarnel_session* session, tarnel_completion completion, void* context) {
  return call(session, Kind::flush, Async{completion, context});
}
tarnel_status tarnel_session_flush_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                            tarnel_reply** reply) {
  return call(session, Kind::flush, Waiting{timeout_ms, reply});
}

tarnel_status tarnel_session_finish(tarnel_session* session, tarnel_completion completion, void* context) {
  return call(session, Kind::finish, Async{completion, context});
}
tarnel_status tarnel_session_finish_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                             tarnel_reply** reply) {
  return call(session, Kind::finish, Waiting{timeout_ms, reply});
}

tarnel_status tarnel_session_upload_file(tarnel_session* session, const char* path,
                                         tarnel_completion completion, void* context) {
  return call(session, Kind::uploadFile, Async{completion, context}, withFile(path));
}
tarnel_status tarnel_session_upload_file_and_wait(tarnel_session* session, const char* path,
                                                  uint32_t timeout_ms, tarnel_reply** reply) {
  return call(session, Kind::uploadFile, Waiting{timeout_ms, reply}, withFile(path));
}

tarnel_status tarnel_session_upload_log_data(tarnel_session* session, const tarnel_array* log_data,
                                             tarnel_completion completion, void* context) {
  return call(session, Kind::uploadLogData, Async{completion, context}, withLogData(log_data));
}
tarnel_status tarnel_session_upload_log_data_and_wait(tarnel_session* session, const tarnel_array* log_data,
                                                      uint32_t timeout_ms, tarnel_reply** reply) {
  return call(session, Kind::uploadLogData, Waiting{timeout_ms, reply}, withLogData(log_data));
}

tarnel_status tarnel_session_send_single_message(tarnel_session* session,
                                                 const tarnel_dictionary* session_info,
                                                 const tarnel_dictionary* user_info, uint16_t category,
                                                 uint16_t type, const tarnel_dictionary* payload,
                                                 tarnel_completion completion, void* context) {
  return call(session, Kind::sendSingleMessage, Async{completion, context},
              withInfos(session_info, user_info, category, type, payload));
}
tarnel_status tarnel_session_send_single_message_and_wait(tarnel_session* session,
                                                          const tarnel_dictionary* session_info,
                                                          const tarnel_dictionary* user_info,
                                                          uint16_t category, uint16_t type,
                                                          const tarnel_dictionary* payload,
                                                          uint32_t timeout_ms, tarnel_reply** reply) {
  return call(session, Kind::sendSingleMessage, Waiting{timeout_ms, reply},
              withInfos(session_info, user_info, category, type, payload));
}

}  // extern "C"

#include "ipc/server/message_batch.h"

#include <systemd/sd-bus.h>

#include <atomic>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

// Room for the results of a batch and the call that waits for them. Each result is written by whoever
// answers that message; the last one sends them all.
class BatchAnswer {
 public:
  // One more is missing than there are messages, until release(): the batch itself.
  BatchAnswer(CallToken token, size_t count)
      : token_(std::move(token)), results_(count), missing_(count + 1) {}

  void set(size_t index, MaybeSentObject sent) {
    results_[index] = std::move(sent);
    release();
  }
  // The message's send failed. Counts only where no answer was given; before release() of the batch.
  void fail(size_t index, const char* what) {
    failures_.emplace_back(index, Error(wire::kErrorFailed, -1, what));
  }
  void release() {
    if (missing_.fetch_sub(1, std::memory_order_acq_rel) == 1) send();
  }

  static SentObject noAnswer() { return Error(wire::kErrorNoReply, -1, "no answer will come"); }

 private:
  void send() {
    for (const auto& [index, error] : failures_) {
      if (results_[index] == noAnswer()) results_[index] = error;
    }
    size_t bytes = kSmallAnswer;
    for (const auto& result : results_) bytes += answerBytes(result);
    token_.answer(bytes, [results = std::move(results_)](sd_bus_message* m) { return append(m, results); });
  }
  static MaybeError append(sd_bus_message* m, const std::vector<MaybeSentObject>& results) {
    if (sd_bus_message_open_container(m, 'a', "av") < 0) return noMemory();
    for (const auto& result : results) {
      if (MaybeError error = wire::appendMaybeSentObject(m, result)) return error;
    }
    if (sd_bus_message_close_container(m) < 0) return noMemory();
    return std::nullopt;
  }
  static Error noMemory() { return {wire::kErrorTooLarge, -1, "the message cannot hold the results"}; }

  CallToken token_;
  std::vector<MaybeSentObject> results_;
  std::vector<std::pair<size_t, Error>> failures_;
  std::atomic<size_t> missing_;
};

// The reply of one message of a batch; let go of unused, its place holds an error.
class BatchPlace {
 public:
  BatchPlace(std::shared_ptr<BatchAnswer> answer, size_t index) noexcept
      : answer_(std::move(answer)), index_(index) {}
  BatchPlace(BatchPlace&&) noexcept = default;
  BatchPlace& operator=(BatchPlace&&) = delete;
  ~BatchPlace() {
    if (answer_ != nullptr) answer_->set(index_, BatchAnswer::noAnswer());
  }
  void operator()(MaybeSentObject sent) {
    if (const auto answer = std::move(answer_)) answer->set(index_, std::move(sent));
  }

 private:
  std::shared_ptr<BatchAnswer> answer_;
  size_t index_;
};

void sendOne(ClientSessionInterface& session, BatchedMessage message, SentReply reply) {
  if (message.flag == 0) {
    session.sendMessageWithCategory(message.category, message.type, std::move(message.payload),
                                    std::move(reply));
    return;
  }
  Dictionary dictionary;
  dictionary.reserve(4);
  dictionary.set(kTarnelMessageParametersCategory, Value(message.category));
  dictionary.set(kTarnelMessageParametersType, Value(message.type));
  dictionary.set(kTarnelMessageParametersFlag, Value(message.flag));
  if (message.payload) dictionary.set(kTarnelMessageParametersPayload, Value(*std::move(message.payload)));
  session.sendMessageWithDictionary(std::move(dictionary), std::move(reply));
}

Error cutOff() {
  return {wire::kErrorInvalidArguments, -1, "the batch is cut off or not what its signature says"};
}

Error inMessage(size_t index, const Error& error) {
  return {error.domain(), error.code(),
          "in message " + std::to_string(index) + ": " + error.localizedDescription()};
}

}  // namespace

Result<std::vector<BatchedMessage>> readBatch(sd_bus_message* message) {
  std::vector<BatchedMessage> batch;
  if (sd_bus_message_enter_container(message, 'a', "(qquaa{sv})") < 0) return cutOff();
  while (true) {
    const int entered = sd_bus_message_enter_container(message, 'r', "qquaa{sv}");
    if (entered < 0) return cutOff();
    if (entered == 0) break;
    auto& next = batch.emplace_back();
    if (sd_bus_message_read_basic(message, 'q', &next.category) <= 0 ||
        sd_bus_message_read_basic(message, 'q', &next.type) <= 0 ||
        sd_bus_message_read_basic(message, 'u', &next.flag) <= 0) {
      return cutOff();
    }
    auto payload = wire::readMaybeDictionary(message);
    if (!payload) return inMessage(batch.size() - 1, payload.error());
    next.payload = *std::move(payload);
    if (sd_bus_message_exit_container(message) < 0) return cutOff();
  }
  if (sd_bus_message_exit_container(message) < 0) return cutOff();
  return batch;
}

void runBatch(const SessionCall& call, std::vector<BatchedMessage> messages) {
  std::shared_ptr<BatchAnswer> answer;
  if (sd_bus_message_get_expect_reply(call.message) > 0) {
    answer = std::make_shared<BatchAnswer>(CallToken(call.link, call.serial), messages.size());
  }
  for (size_t i = 0; i < messages.size(); ++i) {
    SentReply reply;
    if (answer != nullptr) reply = SentReply(BatchPlace(answer, i));
    try {
      sendOne(call.session, std::move(messages[i]), std::move(reply));
    } catch (const std::exception& error) {
      call.log.log(LogLevel::error, "IpcConnection: Message %zu of a batch of %s failed: %s", i,
                   call.peer.c_str(), error.what());
      if (answer != nullptr) answer->fail(i, error.what());
    }
  }
  if (answer != nullptr) answer->release();
}

size_t answerBytes(const MaybeSentObject& sent) {
  const auto* text = sent ? std::get_if<std::string>(&*sent) : nullptr;
  return kSmallAnswer + (text == nullptr ? 0 : text->size());
}

}  // namespace tarnel

#include "bench/load_clients.h"

#include <utility>

#include "bench/sample_payload.h"

namespace tarnel::bench {
namespace {

// As many as in the benchmarks inside a process.
constexpr size_t kRing = 1000;
constexpr uint16_t kCategory = 13;
constexpr uint16_t kType = 10;

client::Options sessionOptions(const LoadOptions& options) {
  client::Options native;
  native.socketPath = options.socketPath;
  native.maxUnanswered = static_cast<uint32_t>(options.window);
  return native;
}

client::Dictionary toClient(const Dictionary& dictionary) {
  client::Dictionary result;
  for (const auto& [key, value] : dictionary) {
    if (const auto* text = value.string()) result.set(key, *text);
    if (const auto* number = value.integer()) result.set(key, *number);
    if (const auto* real = value.real()) result.set(key, *real);
    if (const auto* boolean = value.boolean()) result.set(key, *boolean);
  }
  return result;
}

std::optional<std::string> failureOf(const client::Status& status, const char* what) {
  if (status) return std::nullopt;
  return std::string(what) + ": " + status.message;
}

}  // namespace

LoadClient::LoadClient(const LoadOptions& options, size_t number)
    : options_(options), number_(number), session_(sessionOptions(options)) {}

std::optional<std::string> LoadClient::connect() {
  return failureOf(session_.fetchDisplayURLAndWait(options_.timeout).status, "connecting");
}

std::optional<std::string> LoadClient::configure() {
  const auto info = client::Dictionary()
                        .set(kTarnelSessionInfoSessionID, number_ + 1)
                        .set(kTarnelSessionInfoClientType, options_.clientType)
                        .set(kTarnelSessionInfoClientVersion, 3)
                        .set(kTarnelSessionInfoRequireUserInfo, true)
                        .set(kTarnelSessionInfoBatchEvent, !options_.realtime);
  const auto user = toClient(userInfo(options_.service.c_str()));
  if (const auto status = session_.setSessionInfo(info, user); !status)
    return failureOf(status, "configuring");
  const auto reply = session_.startConfigAndWait(options_.timeout);
  if (!reply.ok()) return failureOf(reply.status, "configuring");
  if (!reply.names || reply.names->empty()) return "no backend reports: is the storebag right and served?";
  return std::nullopt;
}

client::Status LoadClient::sendOne(const client::Dictionary& payload, const client::Completion& completion) {
  const auto flag = options_.realtime ? client::Flag::realtime : client::Flag::normal;
  if (options_.calls == Calls::many) return session_.sendMessage(kCategory, kType, payload, flag, completion);
  // The library puts only messages of the short form into common calls.
  const auto message = client::Dictionary()
                           .set(kTarnelMessageParametersCategory, kCategory)
                           .set(kTarnelMessageParametersType, kType)
                           .set(kTarnelMessageParametersFlag, static_cast<int64_t>(flag))
                           .set(kTarnelMessageParametersPayload, payload);
  return session_.sendMessageDictionary(message, completion);
}

std::optional<std::string> LoadClient::send(const std::vector<client::Dictionary>& payloads, size_t count,
                                            std::atomic<size_t>& answered) {
  const client::Completion completion = [this, &answered](const client::Reply& reply) {
    answered.fetch_add(1, std::memory_order_relaxed);
    const std::lock_guard lock(mutex_);
    if (!reply.ok() && !failure_) failure_ = reply.status.message;
    --outstanding_;
    // A half-empty window is filled in one go.
    if (outstanding_ == 0 || outstanding_ == options_.window / 2) changed_.notify_one();
  };
  for (size_t i = 0; i < count; ++i) {
    {
      std::unique_lock lock(mutex_);
      if (failure_) return failure_;
      if (outstanding_ >= options_.window) {
        lock.unlock();
        if (!waitUntilOutstanding(options_.window / 2)) return "answers do not come";
        lock.lock();
      }
      ++outstanding_;
    }
    const auto status = sendOne(payloads[i % payloads.size()], completion);
    if (!status) return failureOf(status, "sending");
  }
  if (!waitUntilOutstanding(0)) return "the last answers do not come";
  const std::lock_guard lock(mutex_);
  return failure_;
}

bool LoadClient::waitUntilOutstanding(size_t atMost) {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, options_.timeout, [&] { return outstanding_ <= atMost; });
}

std::optional<std::string> LoadClient::flush() {
  return failureOf(session_.flushAndWait(options_.timeout).status, "flushing");
}

std::vector<client::Dictionary> loadPayloads(Payload payload) {
  std::vector<client::Dictionary> ring;
  for (size_t i = 0; i < kRing; ++i) {
    ring.push_back(toClient(payload == Payload::small ? smallPayload(i) : callPayload(i)));
  }
  return ring;
}

}  // namespace tarnel::bench

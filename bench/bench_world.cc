#include "bench/bench_world.h"

#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <stdexcept>

#include "bench/sample_payload.h"
#include "ipc/protocol/wire.h"
#include "tarnel/keys.h"

namespace tarnel::bench {
namespace {

constexpr char kService[] = "video-call";

// What the storebag says: one client entry, with filters that hash one field and remove another.
Dictionary httpProfile(MessageLog messageLog) {
  Dictionary entry{{"client", "Meetwell"},
                   {"service", kService},
                   {"locale_whitelist", Array{"AT", "CH", "DE"}},
                   {"filters", Array{Dictionary{{"key", "userName"}, {"action", "sha256"}},
                                     Dictionary{{"key", "remoteUserName"}, {"action", "sha256"}},
                                     Dictionary{{"key", "callTitle"}, {"action", "remove"}},
                                     Dictionary{{"key", "candidateAddress"}, {"action", "remove"}}}},
                   {"sampling_threshold", 1},
                   {"event_threshold", static_cast<int64_t>(kBatch) - 1},
                   {"post_url", "https://events.example/post"}};
  // A type of reporting that passes over consent keeps no copy.
  if (messageLog == MessageLog::off) entry.set("override_dnu", 1);
  return {{"clients", Array{Value(entry)}}};
}

class OneStorebag final : public TarneldSessionDelegate {
 public:
  explicit OneStorebag(Dictionary storebag) : storebag_(std::move(storebag)) {}

  std::optional<Dictionary> storebagForSession(TarneldSession& /*session*/) override { return storebag_; }
  MaybeString storebagVersionForSession(TarneldSession& /*session*/) override { return "1.0"; }
  MaybeString parentSessionIDStringForSession(TarneldSession& /*session*/) override { return std::nullopt; }
  void userInfoUpdatedForSession(TarneldSession& /*session*/) override {}
  std::shared_ptr<TarneldSession> getAncestorWithAggregatorForSession(TarneldSession& /*session*/) override {
    return nullptr;
  }
  void updateDownstreamSessions(TarneldSession& /*session*/) override {}
  std::shared_ptr<TarneldSession> parentSessionForChild(TarneldSession& /*child*/) override {
    return nullptr;
  }
  AgentLock& agentLock() override { return lock_; }
  std::string description() const override { return "<delegate>"; }

 private:
  const Dictionary storebag_;
  AgentLock lock_;
};

void check(int result, const char* what) {
  if (result < 0) throw std::runtime_error(what);
}

}  // namespace

void BenchWorld::forget() {
  fakes.log.clear();
  fakes.files.files.clear();
  fakes.http.clear();
}

std::shared_ptr<HTTPSPostBackend> makeBackend(BenchWorld& world, MessageLog messageLog) {
  auto backend = HTTPSPostBackend::initWithName(world.dependencies, kTarnelBackendHTTPPost,
                                                httpProfile(messageLog), "Slate");
  backend->setSessionID(4102);
  backend->setCompType(9);
  backend->setClientVersion(3);
  backend->setProductVersion("12.5");
  backend->setBuildVersion("24A100");
  backend->setHardwareType("Slate7,1");
  backend->setCombinedSessionIDString("Zm91bmRlcnMgb2YgdGFybmVs");
  backend->setRequireUserInfo(true);
  backend->setBatchEvents(true);
  backend->setUserInfoDict(userInfo(kService));
  backend->setSelfVersion("3.2");
  backend->setStartTimestamp({1700000045, 250000});
  backend->updateState();
  if (backend->state() != ReportingState::enabled) throw std::runtime_error("the backend does not report");
  return backend;
}

std::shared_ptr<TarneldSession> makeSession(BenchWorld& world, MessageLog messageLog) {
  const auto delegate =
      std::make_shared<OneStorebag>(Dictionary{{kTarnelBackendHTTPPost, httpProfile(messageLog)}});
  auto session = TarneldSession::initWithSessionDelegate(world.dependencies, delegate,
                                                         std::make_shared<fake::FakeIpcConnection>());
  session->setSessionInfo(Dictionary{{kTarnelSessionInfoSessionID, 4102},
                                     {kTarnelSessionInfoClientType, 9},
                                     {kTarnelSessionInfoRequireUserInfo, true},
                                     {kTarnelSessionInfoBatchEvent, true}},
                          userInfo(kService), std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  const auto live = session->fetchReportingStates();
  if (!live || live->empty()) throw std::runtime_error("the session does not report");
  return session;
}

SealedMessages::SealedMessages() {
  std::array<int, 2> ends{};
  check(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()), "socketpair");
  sd_bus* bus = nullptr;
  check(sd_bus_new(&bus), "sd_bus_new");
  bus_.reset(bus);
  check(sd_bus_set_fd(bus, ends[0], ends[0]), "sd_bus_set_fd");
  peer_.reset(ends[1]);
  check(sd_bus_start(bus), "sd_bus_start");
}

SealedMessages::Message SealedMessages::newCall(const char* member) {
  sd_bus_message* made = nullptr;
  check(sd_bus_message_new_method_call(bus_.get(), &made, nullptr, wire::kSessionPath,
                                       wire::kSessionInterface, member),
        "new call");
  return Message(made);
}

SealedMessages::Message SealedMessages::single(size_t index) {
  auto message = newCall(wire::kSendMessage.name);
  check(sd_bus_message_append(message.get(), "qq", 13, 10), "append");
  if (wire::appendMaybeDictionary(message.get(), callPayload(index)))
    throw std::runtime_error("append payload");
  check(sd_bus_message_seal(message.get(), index + 1, 0), "seal");
  return message;
}

SealedMessages::Message SealedMessages::unsealedBatch(size_t first) {
  auto message = newCall(wire::kSendMessages.name);
  check(sd_bus_message_open_container(message.get(), 'a', "(qquaa{sv})"), "open batch");
  for (size_t i = 0; i < kBatch; ++i) {
    check(sd_bus_message_open_container(message.get(), 'r', "qquaa{sv}"), "open message");
    check(sd_bus_message_append(message.get(), "qqu", 13, 10, 0), "append");
    if (wire::appendMaybeDictionary(message.get(), callPayload(first + i)))
      throw std::runtime_error("append payload");
    check(sd_bus_message_close_container(message.get()), "close message");
  }
  check(sd_bus_message_close_container(message.get()), "close batch");
  return message;
}

SealedMessages::Message SealedMessages::batch(size_t first) {
  auto message = unsealedBatch(first);
  check(sd_bus_message_seal(message.get(), 1, 0), "seal");
  return message;
}

// The library shows a message's bytes to nobody but a peer.
std::string SealedMessages::batchBytes(size_t first) {
  SealedMessages bus;
  constexpr std::string_view kHandshake = "DATA\r\nOK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";
  check(static_cast<int>(::write(bus.peer_.get(), kHandshake.data(), kHandshake.size())), "handshake");
  while (sd_bus_is_ready(bus.bus_.get()) <= 0) check(sd_bus_process(bus.bus_.get(), nullptr), "handshake");
  std::string bytes;
  const auto readSome = [&] {
    std::array<char, 65536> some{};
    const auto got = ::read(bus.peer_.get(), some.data(), some.size());
    if (got > 0) bytes.append(some.data(), static_cast<size_t>(got));
    return got > 0;
  };
  while (readSome()) {
  }
  bytes.clear();
  const auto message = bus.unsealedBatch(first);
  check(sd_bus_send(bus.bus_.get(), message.get(), nullptr), "send");
  while (readSome() || sd_bus_process(bus.bus_.get(), nullptr) > 0) {
  }
  return bytes;
}

}  // namespace tarnel::bench

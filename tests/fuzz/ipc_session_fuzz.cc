// A session and everything behind it, called by clients who mean no good: in the bytes of their messages, and
// in the order and arguments of their calls.

#include <array>
#include <stdexcept>

#include "tarnel/keys.h"
#include "tests/fuzz/session_bytes.h"
#include "tests/fuzz/session_world.h"
#include "tests/fuzz/socket_peer.h"
#include "tests/fuzz/value_input.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"bytes: session info",
                                                "bytes: start",
                                                "bytes: states",
                                                "bytes: display address",
                                                "bytes: message",
                                                "bytes: dictionary",
                                                "bytes: flush",
                                                "bytes: finish",
                                                "bytes: upload",
                                                "bytes: log data",
                                                "bytes: single message",
                                                "bytes: answered",
                                                "bytes: answered with an error",
                                                "bytes: closed",
                                                "a client type without a storebag",
                                                "a session reports",
                                                "a flush waits",
                                                "a late answer",
                                                "a file is uploaded",
                                                "log data is uploaded",
                                                "a single message is sent",
                                                "a parent hears of its child's message",
                                                "many events are held",
                                                "a session ends while others go on"};

namespace {

constexpr size_t kMostClients = 3;
constexpr int kMostCalls = 100;
constexpr int kMostFloods = 2;

// Calls of up to three clients, in any order.
class Callers {
 public:
  Callers(SessionWorld& world, InputReader& input) : world_(world), input_(input) {}
  ~Callers() {
    for (auto& client : clients_) client.reset();
  }
  Callers(const Callers&) = delete;
  Callers& operator=(const Callers&) = delete;

  void run() {
    for (int calls = 0; calls < kMostCalls && !input_.atEnd(); ++calls) step();
    for (size_t i = 0; i < clients_.size(); ++i) disconnect(i);
  }

 private:
  ClientSessionInterface& session(size_t i) {
    if (clients_[i] == nullptr) clients_[i] = world_.connect();
    return *clients_[i]->exportedObject;
  }
  void disconnect(size_t i) {
    if (clients_[i] == nullptr) return;
    clients_[i]->invalidate();
    clients_[i].reset();
    const bool goOn = !world_.agent->sessionList().empty();
    if (goOn) reached("a session ends while others go on");
  }

  // How many replies are still owed that were not before.
  template <class Call>
  void mustAnswer(Call call) {
    const auto pending = world_.replies.pending();
    const auto dropped = world_.replies.dropped();
    bool hasThrown = false;
    try {
      call();
    } catch (const InvalidArgument&) {
      hasThrown = true;
      reached("a client type without a storebag");
    }
    require(world_.replies.pending() == pending, "only a flush is answered later");
    if (!hasThrown) require(world_.replies.dropped() == dropped, "what is not refused is answered");
  }

  MaybeDictionary readSessionInfo() {
    const auto words = SessionWorld::words();
    const uint8_t setting = input_.byte();
    if (setting == 255) return readMaybeDictionary(input_, words);
    Dictionary info{{kTarnelSessionInfoSessionID, int64_t{input_.byte()}},
                    {kTarnelSessionInfoRequireUserInfo, (setting & 1U) != 0},
                    {kTarnelSessionInfoBatchEvent, (setting & 2U) != 0}};
    // 7 has an adaptor, 18 no storebag.
    constexpr int64_t kTypes[] = {8, 7, 2, 0, 17, 18, -1, 65536};
    info.set(kTarnelSessionInfoClientType, kTypes[(setting >> 2U) % std::size(kTypes)]);
    return info;
  }
  MaybeDictionary readUserInfo() {
    const auto words = SessionWorld::words();
    const uint8_t setting = input_.byte();
    if (setting == 255) return readMaybeDictionary(input_, words);
    if ((setting & 1U) != 0) return std::nullopt;
    constexpr const char* kClients[] = {"Phone", "Mail", "secret", "nobody"};
    return Dictionary{{kTarnelUserInfoClientName, kClients[(setting >> 1U) % std::size(kClients)]},
                      {kTarnelUserInfoServiceName, "Call"}};
  }
  MaybeDictionary readPayload() { return readMaybeDictionary(input_, SessionWorld::words()); }

  void step();
  void happen();
  void setInfo(size_t i);
  void start(size_t i);
  void fetchStates(size_t i);
  void fetchURL(size_t i);
  void sendMessage(size_t i);
  void sendDictionary(size_t i);
  void flush(size_t i);
  void finish(size_t i);
  void upload(size_t i);
  void uploadLogData(size_t i);
  void sendSingle(size_t i);
  void sendMany(size_t i);
  void sendAsChild(size_t i);
  void noteAggregation();

  SessionWorld& world_;
  InputReader& input_;
  int floods_ = 0;
  std::array<std::shared_ptr<fake::FakeIpcConnection>, kMostClients> clients_;
};

void Callers::start(size_t i) {
  mustAnswer([this, i] {
    session(i).startConfigWithCompletionHandler(
        [reply = world_.replies.owe<std::optional<std::vector<std::string>>>()](
            std::optional<std::vector<std::string>> names) mutable {
          if (names && !names->empty()) reached("a session reports");
          reply(std::move(names));
        });
  });
}

void Callers::upload(size_t i) {
  world_.answerAtOnce();
  const auto token = std::to_string(input_.below(4));
  const bool isRegular = input_.below(8) != 1;
  if (input_.below(4) != 1) world_.offerFile(token, input_.shortText(), isRegular);
  mustAnswer([this, i, &token] {
    session(i).uploadFileAtPath(readText(input_, SessionWorld::words()), token,
                                [reply = world_.replies.owe<bool>()](bool success) mutable {
                                  if (success) reached("a file is uploaded");
                                  reply(success);
                                });
  });
}

void Callers::uploadLogData(size_t i) {
  world_.answerAtOnce();
  mustAnswer([this, i] {
    session(i).uploadLogData(
        readArray(input_, SessionWorld::words()),
        [reply = world_.replies.owe<bool, MaybeError>()](bool success, MaybeError error) mutable {
          if (success) reached("log data is uploaded");
          reply(success, std::move(error));
        });
  });
}

void Callers::sendSingle(size_t i) {
  auto info = readSessionInfo();
  // Without them the reply is let go of.
  const bool isComplete =
      info && info->contains(kTarnelSessionInfoClientType) && info->contains(kTarnelSessionInfoSessionID);
  const auto call = [this, i, &info] {
    auto user = readUserInfo();
    const auto type = static_cast<uint16_t>(input_.below(4));
    auto payload = readPayload();
    session(i).sendMessageWithSessionInfo(
        std::move(info), std::move(user), 1, type, std::move(payload),
        [reply = world_.replies.owe<MaybeString>()](MaybeString text) mutable {
          if (text == "finished") reached("a single message is sent");
          reply(std::move(text));
        });
  };
  if (isComplete) return mustAnswer(call);
  const auto dropped = world_.replies.dropped();
  call();
  require(world_.replies.dropped() == dropped + 1, "without a session's numbers no answer comes");
}

void Callers::sendMany(size_t i) {
  if (++floods_ > kMostFloods) return;
  reached("many events are held");
  const Dictionary payload{{"text", std::string(size_t{input_.byte()} * 16, 'x')}};
  for (uint32_t left = input_.below(64); left > 0; --left) {
    session(i).sendMessageWithCategory(3, 3, payload, nullptr);
  }
}

// The client of the upper session is told of what the lower one sends.
void Callers::noteAggregation() {
  for (const auto& client : clients_) {
    if (client == nullptr) continue;
    for (const auto& sent : client->sentToClient()) {
      if (sent.payload && sent.payload->contains("of a child"))
        reached("a parent hears of its child's message");
    }
  }
}

void Callers::happen() {
  const auto pending = world_.replies.pending();
  world_.happen(input_);
  if (world_.replies.pending() < pending) reached("a late answer");
}

void Callers::setInfo(size_t i) {
  auto info = readSessionInfo();
  auto user = readUserInfo();
  auto frameworks =
      input_.below(2) == 1 ? std::optional(readArray(input_, SessionWorld::words())) : std::nullopt;
  session(i).setSessionInfo(std::move(info), std::move(user), std::move(frameworks), input_.below(2) == 1);
}

void Callers::fetchStates(size_t i) {
  mustAnswer([this, i] {
    session(i).fetchStatesWithUserInfo(readUserInfo(),
                                       world_.replies.owe<std::optional<std::vector<std::string>>>());
  });
}

void Callers::fetchURL(size_t i) {
  mustAnswer([this, i] { session(i).fetchDisplayURL(world_.replies.owe<MaybeString>()); });
}

void Callers::sendMessage(size_t i) {
  mustAnswer([this, i] {
    const auto type = static_cast<uint16_t>(input_.below(4));
    session(i).sendMessageWithCategory(input_.byte(), type, readPayload(),
                                       world_.replies.owe<MaybeSentObject>());
  });
}

void Callers::sendDictionary(size_t i) {
  mustAnswer([this, i] {
    session(i).sendMessageWithDictionary(readDictionary(input_, SessionWorld::words()),
                                         world_.replies.owe<MaybeSentObject>());
  });
}

void Callers::flush(size_t i) {
  session(i).flushMessagesWithCompletion(world_.replies.owe<MaybeString, MaybeError>());
  if (world_.replies.pending() > 0) reached("a flush waits");
}

void Callers::finish(size_t i) {
  mustAnswer([this, i] { session(i).finishSessionWithReply(world_.replies.owe<MaybeSentObject>()); });
}

void Callers::sendAsChild(size_t i) {
  session(i).sendMessageWithCategory(2, 2, Dictionary{{"of a child", 1}}, nullptr);
  noteAggregation();
}

void Callers::step() {
  // The corpus knows them by their place; 0 is what happens without a client.
  constexpr void (Callers::*kCalls[])(size_t) = {
      &Callers::setInfo,     &Callers::start,          &Callers::fetchStates, &Callers::fetchURL,
      &Callers::sendMessage, &Callers::sendDictionary, &Callers::flush,       &Callers::finish,
      &Callers::upload,      &Callers::uploadLogData,  &Callers::sendSingle,  &Callers::sendMany,
      &Callers::sendAsChild, &Callers::disconnect};
  const auto call = input_.below(std::size(kCalls) + 1);
  if (call == 0) return happen();
  const size_t i = input_.below(kMostClients);
  (this->*kCalls[call - 1])(i);
}

}  // namespace

void runOne(std::span<const uint8_t> bytes) {
  const int openBefore = openDescriptors();
  InputReader input(bytes);
  SessionWorld world;
  switch (input.below(4)) {
    case 0:
      runBytes(world, input, false);
      break;
    case 1:
      runBytes(world, input, true);
      break;
    default:
      Callers(world, input).run();
  }
  world.settle();
  require(openDescriptors() == openBefore, "no descriptor is left open");
}

}  // namespace tarnel::fuzz

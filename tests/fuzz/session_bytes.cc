#include "tests/fuzz/session_bytes.h"

#include "ipc/protocol/wire.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/connection_loop.h"
#include "tests/fuzz/dbus_frame.h"
#include "tests/fuzz/socket_peer.h"

using std::string_view_literals::operator""sv;

namespace tarnel::fuzz {
namespace {

// Fits, with its answers, into what a socket holds while nobody reads.
constexpr size_t kLongestInput = 8192;
// Small, so that some are large.
constexpr size_t kLargeMessage = 256;
constexpr std::string_view kAuthentication = "\0AUTH ANONYMOUS\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n"sv;

// Stands before the session: things happen between the client's calls, and their replies are watched.
class WatchedSession final : public ClientSessionInterface {
 public:
  WatchedSession(SessionWorld& world, std::shared_ptr<ClientSessionInterface> session,
                 ClientFileRegistry& registry, SocketPeer& client, InputReader events)
      : world_(world), session_(std::move(session)), registry_(registry), client_(client), events_(events) {}

  void setSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo, std::optional<Array> frameworks,
                      bool hasAggregationBlock) override {
    begin("bytes: session info");
    session_->setSessionInfo(std::move(sessionInfo), std::move(userInfo), std::move(frameworks),
                             hasAggregationBlock);
  }
  void startConfigWithCompletionHandler(NamesReply reply) override {
    begin("bytes: start");
    session_->startConfigWithCompletionHandler(world_.replies.watch(std::move(reply)));
  }
  void fetchStatesWithUserInfo(MaybeDictionary userInfo, NamesReply reply) override {
    begin("bytes: states");
    session_->fetchStatesWithUserInfo(std::move(userInfo), world_.replies.watch(std::move(reply)));
  }
  void fetchDisplayURL(TextReply reply) override {
    begin("bytes: display address");
    session_->fetchDisplayURL(world_.replies.watch(std::move(reply)));
  }
  void sendMessageWithCategory(uint16_t category, uint16_t type, MaybeDictionary payload,
                               SentReply reply) override {
    begin("bytes: message");
    session_->sendMessageWithCategory(category, type, std::move(payload),
                                      world_.replies.watch(std::move(reply)));
  }
  void sendMessageWithDictionary(Dictionary message, SentReply reply) override {
    begin("bytes: dictionary");
    session_->sendMessageWithDictionary(std::move(message), world_.replies.watch(std::move(reply)));
  }
  void flushMessagesWithCompletion(FlushReply reply) override {
    begin("bytes: flush");
    session_->flushMessagesWithCompletion(world_.replies.watch(std::move(reply)));
  }
  void finishSessionWithReply(SentReply reply) override {
    begin("bytes: finish");
    session_->finishSessionWithReply(world_.replies.watch(std::move(reply)));
  }
  void uploadFileAtPath(std::string fileURL, std::string token, SuccessReply reply) override {
    begin("bytes: upload");
    world_.answerAtOnce();
    const auto file = registry_.consume(token);
    require(file != nullptr, "the token of an upload is good while the call runs");
    require(registry_.consume(token) == nullptr, "a token is good once");
    if (auto contents = file->contents()) world_.offerFile(token, *std::move(contents), file->isRegular());
    session_->uploadFileAtPath(std::move(fileURL), std::move(token), world_.replies.watch(std::move(reply)));
  }
  void uploadLogData(Array logData, UploadReply reply) override {
    begin("bytes: log data");
    world_.answerAtOnce();
    session_->uploadLogData(std::move(logData), world_.replies.watch(std::move(reply)));
  }
  void sendMessageWithSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo, uint16_t category,
                                  uint16_t type, MaybeDictionary payload, TextReply reply) override {
    begin("bytes: single message");
    session_->sendMessageWithSessionInfo(std::move(sessionInfo), std::move(userInfo), category, type,
                                         std::move(payload), world_.replies.watch(std::move(reply)));
  }

 private:
  void begin(std::string_view milestone) {
    reached(milestone);
    client_.drain();
    if (!events_.atEnd()) world_.happen(events_);
  }

  SessionWorld& world_;
  const std::shared_ptr<ClientSessionInterface> session_;
  ClientFileRegistry& registry_;
  SocketPeer& client_;
  InputReader events_;
};

constexpr const wire::Method* kMethods[] = {
    &wire::kSendMessage,   &wire::kSendMessageDictionary, &wire::kSendMessages,    &wire::kSetSessionInfo,
    &wire::kStartConfig,   &wire::kFetchStates,           &wire::kFetchDisplayURL, &wire::kFlushMessages,
    &wire::kFinishSession, &wire::kUploadLogData,         &wire::kUploadFile,      &wire::kSendSingleMessage};

// A method, the flags of its message, now and then another signature, and its arguments as they are encoded.
std::string readFrames(InputReader& input) {
  std::string stream;
  for (uint32_t serial = 1; !input.atEnd() && stream.size() < kLongestInput; ++serial) {
    const wire::Method& method = *kMethods[input.below(std::size(kMethods))];
    const uint8_t flags = input.byte();
    const auto otherSignature = (flags & 0x80U) != 0 ? input.shortText() : std::string();
    std::string body = input.shortText();
    if ((flags & 0x40U) != 0) body += input.shortText();  // of up to 510 bytes
    DbusFrame frame;
    frame.flags = flags & 7U;
    frame.serial = serial;
    frame.path = wire::kSessionPath;
    frame.interface = wire::kSessionInterface;
    frame.member = method.name;
    frame.signature = (flags & 0x80U) != 0 ? std::string_view(otherSignature) : method.arguments;
    frame.descriptors = (flags & 0x20U) != 0 ? 1 : 0;
    frame.body = body;
    stream += bytesOf(frame);
  }
  return stream;
}

// Whole messages in what a client writes, as those see it who bound them.
uint64_t messagesIn(std::string_view stream) {
  InputFramer framer(wire::kMaxMessageBytes);
  framer.admit(stream);
  return framer.completed();
}

void examineAnswers(const SessionWorld& world, const std::string& answers, uint64_t framed) {
  const auto counts = countMessages(answers);
  require(counts.returns + counts.errors <= framed, "nothing is answered that was not seen as a message");
  if (counts.returns > 0) reached("bytes: answered");
  if (counts.errors > 0) reached("bytes: answered with an error");
  if (world.fakes.log.startingWith("IpcConnection: Closing").size() > 0) reached("bytes: closed");
}

}  // namespace

void runBytes(SessionWorld& world, InputReader& input, bool isFramed) {
  const uint8_t setting = input.byte();
  const std::string events = input.shortText();
  std::string stream = (setting & 1U) != 0 ? std::string() : std::string(kAuthentication);
  stream += isFramed ? readFrames(input) : std::string(input.rest());
  stream.resize(std::min(stream.size(), kLongestInput));

  SocketPeer client;
  // Descriptors come with the messages, and at times with the first byte.
  const unsigned descriptors = (setting >> 1U) & 7U;
  const size_t first = (setting & 0x10U) != 0 ? 0 : std::min(stream.size(), kAuthentication.size());
  client.write(std::string_view(stream).substr(0, first));
  client.write(std::string_view(stream).substr(first), descriptors);
  client.endWriting();

  const auto connection = world.connect();
  ClientFileRegistry registry(world.fakes.log);
  IpcLimits limits;
  limits.interruption = std::chrono::milliseconds(0);
  limits.unansweredCalls = kLongestInput;
  limits.largeMessage = kLargeMessage;
  {
    const auto link = std::make_shared<ConnectionLink>(limits.queuedBytes);
    LargeCalls largeCalls(limits.largeBytesAtWork);
    const std::span eventBytes(reinterpret_cast<const uint8_t*>(events.data()), events.size());
    ConnectionLoop loop({.link = link,
                         .object = std::make_shared<WatchedSession>(
                             world, connection->exportedObject, registry, client, InputReader(eventBytes)),
                         .interruptionHandler = [&connection] { connection->interrupt(); },
                         .peer = "the fuzzer",
                         .limits = limits,
                         .log = world.fakes.log,
                         .clientFiles = &registry,
                         .largeCalls = largeCalls,
                         .uid = 1000},
                        client.takeOther());
    loop.run();
    require(link->closed(), "the end of a connection closes its link");
  }
  client.drain();
  examineAnswers(world, client.received(), messagesIn(stream));
  connection->invalidate();
}

}  // namespace tarnel::fuzz

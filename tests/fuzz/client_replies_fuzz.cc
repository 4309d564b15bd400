// The client library against a daemon that is none: what such a one writes to the socket, raw or as messages
// of which only the contents come from the input.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <vector>

#include "client/src/connection.h"
#include "ipc/protocol/wire.h"
#include "tests/fuzz/dbus_frame.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/socket_peer.h"
#include "tests/fuzz/values.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"let in",
                                                "names",
                                                "text",
                                                "error of a backend",
                                                "success",
                                                "a batch is answered",
                                                "a barrier is passed",
                                                "refused by the daemon",
                                                "no answer will come",
                                                "not understood",
                                                "too few results",
                                                "aggregated",
                                                "a file is deleted",
                                                "the protocol is broken",
                                                "the connection is lost",
                                                "left unanswered"};

namespace {

using core::Answer;
using core::Request;
using Kind = Request::Kind;

constexpr uint32_t kOfBatch = 1;
constexpr size_t kMostRequests = 24;
constexpr size_t kMostFrames = 64;
constexpr std::string_view kWelcome = "DATA\r\nOK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";

// Two files of which only one is handed over.
class Files {
 public:
  Files() {
    std::string pattern = std::filesystem::temp_directory_path() / "fuzzXXXXXX";
    require(mkdtemp(pattern.data()) != nullptr, "a folder can be made");
    folder_ = pattern;
    std::ofstream(handedOver()) << "sent";
    std::ofstream(kept()) << "kept";
  }
  ~Files() {
    require(std::filesystem::exists(kept()), "what was not handed over is never deleted");
    if (!std::filesystem::exists(handedOver())) reached("a file is deleted");
    std::error_code ignored;
    std::filesystem::remove_all(folder_, ignored);
  }
  Files(const Files&) = delete;
  Files& operator=(const Files&) = delete;
  std::string handedOver() const { return folder_ + "/sent"; }
  std::string kept() const { return folder_ + "/kept"; }

 private:
  std::string folder_;
};

// Whom the connection tells. Requests carry their number as their category.
class Host final : public core::Connection::Host {
 public:
  void expect(const Request& request) {
    kinds_.push_back(request.kind);
    isAnswered_.push_back(false);
  }
  size_t answers() const { return answers_; }

  void answered(Request& request, const Answer& answer) override {
    markAnswered(request);
    ++answers_;
    if (request.kind == Kind::barrier) {
      const auto before = isAnswered_.begin() + request.category;
      require(std::find(isAnswered_.begin(), before, false) == before,
              "a barrier is passed when everything before it is answered");
      if (answer.outcome.ok()) reached("a barrier is passed");
    }
    if (!answer.outcome.ok()) {
      require(!answer.outcome.message.empty(), "a failure is explained");
      require(!answer.names && !answer.text && !answer.error, "a failure brings no result");
    }
    note(answer, request.flag == kOfBatch && answer.text);
  }
  // Given back by the connection instead of an answer.
  void markAnswered(const Request& request) {
    require(request.category < isAnswered_.size() && kinds_[request.category] == request.kind,
            "what is answered was asked");
    require(!isAnswered_[request.category], "a request is answered once");
    isAnswered_[request.category] = true;
  }
  bool isEverythingAnswered() const {
    return std::find(isAnswered_.begin(), isAnswered_.end(), false) == isAnswered_.end();
  }

  void aggregated(const MaybeDictionary& messageInfo, double /*timestamp*/, uint16_t /*category*/,
                  uint16_t /*type*/, const MaybeDictionary& payload) override {
    reached("aggregated");
    for (const auto& dictionary : {messageInfo, payload}) {
      if (dictionary) require(depthOf(Value(*dictionary)) <= wire::kMaxDepth + 1, "nesting is bounded");
    }
  }

 private:
  static void note(const Answer& answer, bool isOfBatch) {
    if (isOfBatch) reached("a batch is answered");
    if (answer.names) reached("names");
    if (answer.text) reached("text");
    if (answer.error) reached("error of a backend");
    if (answer.success) reached("success");
    if (answer.outcome.status == TARNEL_ERROR_DAEMON) reached("refused by the daemon");
    if (answer.outcome.status == TARNEL_ERROR_NO_REPLY) reached("no answer will come");
    if (answer.outcome.status == TARNEL_ERROR_PROTOCOL) reached("not understood");
    if (answer.outcome.message.find("too few results") != std::string::npos) reached("too few results");
  }

  std::vector<Kind> kinds_;
  std::vector<bool> isAnswered_;
  size_t answers_ = 0;
};

class Exchange {
 public:
  explicit Exchange(InputReader& input) : input_(input), connection_(host_, std::chrono::hours(1)) {}

  void run();

 private:
  Request newRequest(Kind kind);
  std::vector<Request> readRequests();
  std::string readFrame();
  void sendRequests();
  bool process();
  // Without descriptors: of a message that it finds malformed the bus library leaves them open.
  void write(std::string_view bytes) {
    daemon_.write(bytes);
    isOver_ = !process();
  }

  InputReader& input_;
  Host host_;
  SocketPeer daemon_;
  std::optional<Files> files_;
  core::Connection connection_;
  size_t asked_ = 0;
  size_t silent_ = 0;  // that want no answer
  bool isOver_ = false;
};

Request Exchange::newRequest(Kind kind) {
  Request request;
  request.kind = kind;
  request.category = static_cast<uint16_t>(asked_++);
  host_.expect(request);
  if (kind == Kind::sendDictionary) request.dictionary = Dictionary{{"category", 1}};
  if (kind == Kind::uploadLogData) request.array = Array{1};
  if (kind == Kind::uploadFile) {
    if (!files_) files_.emplace();
    require(core::UploadFile::open(files_->handedOver().c_str(), request.file).ok(),
            "the file can be opened");
  }
  return request;
}

// One call's: several messages, or one other request.
std::vector<Request> Exchange::readRequests() {
  std::vector<Request> requests;
  const auto kind = static_cast<Kind>(input_.below(static_cast<uint32_t>(Kind::barrier) + 1));
  // A file that is gone cannot be handed over again.
  const bool isGone = kind == Kind::uploadFile && files_ && !std::filesystem::exists(files_->handedOver());
  if (isGone) return requests;
  const uint8_t setting = input_.byte();
  const uint32_t count = kind == Kind::sendMessage ? 1 + setting % 4 : 1;
  const bool isSilent =
      setting > 200 && kind != Kind::barrier && kind != Kind::uploadFile && kind != Kind::uploadLogData;
  for (uint32_t i = 0; i < count; ++i) {
    requests.push_back(newRequest(kind));
    if (count > 1) requests.back().flag = kOfBatch;
    if (!isSilent) requests.back().completion = [](const Answer&) {};
    if (isSilent) host_.markAnswered(requests.back());
  }
  if (isSilent) silent_ += requests.size();
  return requests;
}

void Exchange::sendRequests() {
  for (uint32_t calls = input_.below(12); calls > 0 && asked_ < kMostRequests && !isOver_; --calls) {
    auto requests = readRequests();
    if (requests.empty()) continue;
    isOver_ = !connection_.send(std::move(requests)).ok();
  }
}

// False when the connection is lost.
bool Exchange::process() {
  for (size_t turns = 0; turns < kMostFrames; ++turns) {
    const auto outcome = connection_.process();
    daemon_.drain();
    if (!outcome.ok()) {
      require(!outcome.message.empty(), "a loss is explained");
      reached(outcome.status == TARNEL_ERROR_PROTOCOL ? "the protocol is broken" : "the connection is lost");
      return false;
    }
    if (connection_.dueAt() != 0) break;
  }
  require(connection_.unanswered() == asked_ - silent_ - host_.answers(), "the unanswered are counted");
  return true;
}

// The type, the call that is answered, a signature of the protocol or any other, and the body as it is
// encoded.
std::string Exchange::readFrame() {
  constexpr std::string_view kErrors[] = {wire::kErrorNoReply, wire::kErrorFailed,
                                          "org.freedesktop.DBus.Error.NoReply", "a.b"};
  constexpr const wire::Method* kCalls[] = {&wire::kSendMessageToClient, &wire::kDeleteFile};
  constexpr const char* kResults[] = {"", "aas", "as", "av", "aav", "asa(sxs)", "ba(sxs)", "b"};
  const uint8_t setting = input_.byte();
  const uint8_t which = input_.byte();
  DbusFrame frame;
  frame.serial = 1 + which;
  std::string signature;
  if ((setting & 3U) == 1) {
    const auto& method = *kCalls[which % std::size(kCalls)];
    frame.path = wire::kReplyPath;
    frame.interface = wire::kReplyInterface;
    frame.member = method.name;
    signature = method.arguments;
  } else {
    frame.type = (setting & 3U) == 2 ? 3 : 2;
    frame.replySerial = which;
    if (frame.type == 3) frame.errorName = kErrors[(setting >> 2U) % std::size(kErrors)];
    signature = frame.type == 3 ? "s" : kResults[(setting >> 2U) % std::size(kResults)];
  }
  if ((setting & 0x80U) != 0) signature = input_.shortText();
  frame.signature = signature;
  frame.descriptors = (setting & 0x40U) != 0 ? 1 : 0;
  std::string body = input_.shortText();
  // The daemon may name the file that it was given.
  if (files_ && body == "file") {
    const std::string url = "file://" + files_->handedOver();
    body = std::string{static_cast<char>(url.size()), 0, 0, 0} + url + '\0';
  } else if (files_ && body == "kept") {
    const std::string url = "file://" + files_->kept();
    body = std::string{static_cast<char>(url.size()), 0, 0, 0} + url + '\0';
  }
  frame.body = body;
  return bytesOf(frame);
}

void Exchange::run() {
  const uint8_t setting = input_.byte();
  const bool isFramed = (setting & 1U) != 0;
  require(connection_.start(UniqueFd(daemon_.takeOther().release())).ok(), "a connection can be made");
  if ((setting & 0x10U) == 0) write(kWelcome);
  if (!isOver_ && connection_.isReady()) {
    reached("let in");
    sendRequests();
  }
  if (!isOver_ && !isFramed) write(input_.rest());
  for (size_t frames = 0; isFramed && !isOver_ && !input_.atEnd() && frames < kMostFrames; ++frames) {
    write(readFrame());
    if (!isOver_ && connection_.isReady() && (setting & 0x20U) != 0) sendRequests();
  }
  if (!isOver_ && (setting & 0x40U) != 0) {
    daemon_.endWriting();
    process();
  }
  const auto left = connection_.takeUnanswered();
  if (!left.empty()) reached("left unanswered");
  for (const Request& request : left) host_.markAnswered(request);
  require(host_.isEverythingAnswered(), "what is not answered is given back");
}

}  // namespace

void runOne(std::span<const uint8_t> bytes) {
  InputReader input(bytes);
  const int openBefore = openDescriptors();
  Exchange(input).run();
  require(openDescriptors() == openBefore, "no descriptor is left open");
}

}  // namespace tarnel::fuzz

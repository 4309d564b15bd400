// Dashboard datagrams: what is made of a message reads back as docs/dashboard-datagrams.md says, and reliable
// delivery keeps to its rules whatever the server sends, however sending fails, and whenever it is cleaned
// up.

#include <algorithm>
#include <deque>
#include <memory>
#include <vector>

#include "backends/dashboard/dashboard_backend.h"
#include "platform/fake/fake_world.h"
#include "tests/fuzz/value_input.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {
    "no server",          "without a profile", "unreliable",         "reliable",     "several entries",
    "a value is escaped", "an empty value",    "no text or number",  "cut",          "acknowledged",
    "sent again",         "given up",          "an old one goes",    "a send fails", "cleaned up at once",
    "cleaned up later",   "last resort",       "too short an answer"};

namespace {

using std::chrono::milliseconds;

constexpr std::string_view kWords[] = {"key",
                                       "k",
                                       "a=b",
                                       "back\\slash",
                                       "line\nend",
                                       "\n",
                                       "",
                                       "zwei W\xC3\xB6rter",
                                       "\xF0\x9F\x98\x80\xF0\x9F\x98\x80"};
constexpr size_t kHeader = 64;
constexpr size_t kMostText = 1023;
constexpr size_t kMostQueued = 50;
constexpr int kMostSteps = 400;
constexpr milliseconds kPeriod{500};

// What the document says about a value, by means of this file's own.
std::string expectedValue(const Value& value) {
  std::string text = "null";
  if (value.string() != nullptr) text = *value.string();
  if (value.isNumber()) text = value.description();
  std::string sent;
  for (const char c : text) {
    if (c == '\n') continue;
    if (c == '\\' || c == '=') sent += '\\';
    sent += c;
  }
  return sent.empty() ? "empty" : sent;
}

size_t codeUnits(const Value& value) {
  if (value.string() == nullptr) return value.isNumber() ? value.description().size() : 4;
  size_t units = 0;
  for (const char c : *value.string()) {
    const auto byte = static_cast<uint8_t>(c);
    if (byte < 0x80 || byte >= 0xC0) ++units;
    if (byte >= 0xF0) ++units;
  }
  return units;
}

// The whole text, before it is cut.
std::string expectedText(const Dictionary& payload) {
  std::vector<const Dictionary::Entry*> entries;
  for (const auto& entry : payload) {
    // In front of the first that is longer.
    const auto place = std::find_if(entries.begin(), entries.end(), [&entry](const Dictionary::Entry* other) {
      return codeUnits(other->second) > codeUnits(entry.second);
    });
    entries.insert(place, &entry);
  }
  std::string text;
  for (const auto* entry : entries) text += " " + entry->first + "=" + expectedValue(entry->second);
  return text;
}

uint32_t numberAt(const fake::Datagram& datagram, size_t offset, size_t size) {
  uint32_t number = 0;
  for (size_t i = 0; i < size; ++i) number = number << 8U | datagram[offset + i];
  return number;
}

struct Message {
  MaybeDictionary payload;
  TimeValue time;
  uint16_t method = 0;
  uint16_t status = 0;
  uint16_t event = 0;
};

void noteEntries(const Dictionary& payload) {
  if (payload.size() > 1) reached("several entries");
  for (const auto& [key, value] : payload) {
    const auto sent = expectedValue(value);
    if (sent.find('\\') != std::string::npos) reached("a value is escaped");
    if (value.string() != nullptr && sent == "empty" && *value.string() != "empty") reached("an empty value");
    if (sent == "null") reached("no text or number");
  }
}

// How one datagram that waits stands, by the rules of the document alone.
struct Waiting {
  uint16_t event = 0;
  bool isSent = false;
  int checks = 0;
  int repetitions = 0;
};

// One backend, and beside it what its queue must hold.
class Delivery {
 public:
  explicit Delivery(InputReader& input) : input_(input) {}
  void run();

 private:
  bool make();
  void introduce();
  void send();
  void sendMany();
  void examine(const fake::Datagram& datagram, const Message& message) const;
  void tick();
  void receive();
  void examineSends(size_t before, size_t expected);
  void clean();
  fake::SocketRecord& socket() { return world_.datagramSockets.last(); }
  // Whether the next send of the socket puts everything on its way.
  bool nextSendSucceeds();

  InputReader& input_;
  fake::FakeWorld world_;
  std::shared_ptr<DashboardBackend> backend_;
  std::deque<bool> outcomes_;  // of the next sends; beyond them all succeed
  std::vector<Waiting> waiting_;
  bool isReliable_ = false;
  bool isProfile_ = true;
  uint16_t clientVersion_ = 0;
  uint32_t sessionID_ = 0;
  int32_t clientType_ = 0;
  std::string udid_;
  uint16_t nextEvent_ = 0;
};

bool Delivery::make() {
  const uint8_t setting = input_.byte();
  isReliable_ = (setting & 1U) != 0;
  isProfile_ = (setting & 2U) == 0;
  if ((setting & 4U) != 0) {
    const auto profile = readMaybeDictionary(input_, kWords);
    require(DashboardBackend::initWithName(world_.dependencies, "dashboard", profile, "Slate") == nullptr,
            "without an address there is no backend");
    reached("no server");
    return false;
  }
  if (isProfile_) {
    Dictionary profile{{"ip", "192.0.2.7"}, {"port", 8125}};
    if (isReliable_) profile.set("reliable", 500);
    backend_ = DashboardBackend::initWithName(world_.dependencies, "dashboard", profile, "Slate");
  } else {
    reached("without a profile");
    isReliable_ = true;
    backend_ = DashboardBackend::initWithName(world_.dependencies, "dashboard", MaybeString("192.0.2.7"), 9,
                                              "Slate");
  }
  require(backend_ != nullptr, "with an address there is a backend");
  reached(isReliable_ ? "reliable" : "unreliable");
  introduce();
  return true;
}

void Delivery::introduce() {
  sessionID_ = static_cast<uint32_t>(input_.number());
  clientVersion_ = static_cast<uint16_t>(input_.below(65536));
  clientType_ = input_.byte();
  udid_ = input_.shortText();
  nextEvent_ = static_cast<uint16_t>(input_.below(65536));
  backend_->setSessionID(sessionID_);
  backend_->setClientVersion(clientVersion_);
  backend_->setCompType(clientType_);
  backend_->setUdid(udid_);
  backend_->setSelfVersion("3.2");
}

bool Delivery::nextSendSucceeds() {
  if (outcomes_.empty()) return true;
  const bool succeeds = outcomes_.front();
  outcomes_.pop_front();
  if (!succeeds) reached("a send fails");
  return succeeds;
}

void Delivery::examine(const fake::Datagram& datagram, const Message& message) const {
  require(datagram.size() >= kHeader && datagram.size() <= kHeader + kMostText, "a datagram's size");
  require(datagram[0] == 3 && datagram[1] == static_cast<uint8_t>(clientType_) && datagram[2] == 1,
          "its first bytes");
  require(datagram[3] == message.time.microseconds / 4000, "the part of the second");
  require(numberAt(datagram, 4, 4) == static_cast<uint32_t>(message.time.seconds), "the seconds");
  require((numberAt(datagram, 8, 4) ^ 0xFFFFFFFFU) == sessionID_, "the session's number");
  require((numberAt(datagram, 12, 2) ^ 0xFFFFU) == clientVersion_, "the client's version");
  require((numberAt(datagram, 14, 2) ^ 0xFFFFU) == datagram.size(), "its length");
  require(numberAt(datagram, 16, 2) == message.method && numberAt(datagram, 18, 2) == message.status,
          "method and status");
  for (size_t i = 0; i < 40; ++i) {
    require(datagram[20 + i] == (i < udid_.size() ? static_cast<uint8_t>(udid_[i]) : 0), "the identifier");
  }
  require(numberAt(datagram, 60, 2) == message.event, "the event's number");
  require(numberAt(datagram, 62, 2) == (isReliable_ ? 1U : 0U) + (isProfile_ ? 0U : 2U), "the flags");
  const std::string whole = message.payload ? expectedText(*message.payload) : std::string();
  const std::string text(datagram.begin() + kHeader, datagram.end());
  if (whole.size() <= kMostText) return require(text == whole, "the text");
  reached("cut");
  require(whole.starts_with(text) && text.size() + 3 >= kMostText, "a text that is cut");
  const bool isWhole = (static_cast<uint8_t>(whole[text.size()]) & 0xC0U) != 0x80U;
  require(isWhole || !isValidUtf8(whole), "no character is cut through");
}

void Delivery::send() {
  Message message;
  message.payload = readMaybeDictionary(input_, kWords, 2);
  if (message.payload) noteEntries(*message.payload);
  message.time = {static_cast<int64_t>(input_.number() & 0xFFFFFFFFFFU),
                  static_cast<int32_t>(input_.below(50000) * 20)};
  message.method = static_cast<uint16_t>(input_.below(65536));
  message.status = input_.byte();
  message.event = nextEvent_++;
  const size_t before = socket().sent.size();
  const auto line = backend_->sendMessage(message.payload, message.time, Method{message.method},
                                          RespCode{message.status}, EventID{message.event});
  require(line && !line->empty() && line->size() < 1152, "a line tells of the datagram");
  world_.workQueues.runUntilIdle();
  const bool isSent = nextSendSucceeds();
  require(socket().sent.size() == before + (isSent ? 1 : 0), "a datagram is sent once");
  if (isSent) examine(socket().sent.back(), message);
  if (isSent && !isReliable_) return;
  waiting_.push_back({message.event, isSent, 0, 0});
  if (waiting_.size() > kMostQueued) {
    reached("an old one goes");
    waiting_.erase(waiting_.begin());
  }
}

void Delivery::sendMany() {
  for (uint32_t left = input_.below(64); left > 0; --left) {
    backend_->sendMessage(MaybeDictionary(), TimeValue{1, 0}, Method{1}, RespCode{1}, EventID{nextEvent_});
    world_.workQueues.runUntilIdle();
    const bool isSent = nextSendSucceeds();
    if (!isSent || isReliable_) waiting_.push_back({nextEvent_, isSent, 0, 0});
    if (waiting_.size() > kMostQueued) waiting_.erase(waiting_.begin());
    ++nextEvent_;
  }
}

void Delivery::tick() {
  constexpr int kPeriods[] = {2, 3, 5, 9};
  const auto before = static_cast<size_t>(socket().sends);
  world_.workQueues.advance(kPeriod);
  size_t tried = 0;
  std::erase_if(waiting_, [&](Waiting& packet) {
    if (!packet.isSent) {
      ++tried;
      packet.isSent = nextSendSucceeds();
      return packet.isSent && !isReliable_;
    }
    if (packet.repetitions == 4) {
      reached("given up");
      return true;
    }
    if (packet.checks + 1 < kPeriods[packet.repetitions]) {
      ++packet.checks;
      return false;
    }
    ++tried;
    if (!nextSendSucceeds()) return false;
    reached("sent again");
    packet.checks = 0;
    ++packet.repetitions;
    return false;
  });
  require(static_cast<size_t>(socket().sends) == before + tried, "a tick sends what is due");
}

// Any datagram; now and then one that names a packet that waits.
void Delivery::receive() {
  const auto bytes = input_.shortText();
  fake::Datagram datagram(bytes.begin(), bytes.end());
  if (input_.below(4) != 0 && !waiting_.empty()) {
    const auto event = waiting_[input_.below(static_cast<uint32_t>(waiting_.size()))].event;
    datagram.resize(std::max<size_t>(datagram.size(), 62));
    datagram[60] = static_cast<uint8_t>(event >> 8U);
    datagram[61] = static_cast<uint8_t>(event);
  }
  socket().incoming.push_back(datagram);
  world_.workQueues.signalReadable(socket().descriptor);
  if (datagram.size() < 62) return reached("too short an answer");
  if (!isReliable_) return;
  const auto found = std::find_if(waiting_.begin(), waiting_.end(), [&datagram](const Waiting& packet) {
    return packet.event == numberAt(datagram, 60, 2);
  });
  if (found == waiting_.end()) return;
  reached("acknowledged");
  waiting_.erase(found);
}

void Delivery::clean() {
  const bool isEmpty = waiting_.empty();
  backend_->cleanup();
  const std::weak_ptr<DashboardBackend> watched = backend_;
  backend_.reset();
  world_.workQueues.runUntilIdle();
  if (isEmpty) {
    reached("cleaned up at once");
    require(watched.expired(), "nothing waits: the backend goes at once");
  }
  // A tick and 9.5 seconds, the end of which comes before the tick of that moment; what is sent meanwhile
  // follows the same rules.
  for (int ticks = 0; ticks < 19 && !watched.expired(); ++ticks) tick();
  world_.workQueues.advance(kPeriod);
  if (!isEmpty) reached(waiting_.empty() ? "cleaned up later" : "last resort");
  world_.workQueues.runUntilIdle();
  require(watched.expired(), "the backend is gone after a tick and 9.5 seconds");
  require(world_.datagramSockets.open() == 0, "no socket is left");
  require(socket().closes == 1, "the socket is closed once");
  require(world_.workQueues.timers() == 0 && world_.workQueues.readSources() == 0, "no source is left");
  require(world_.workQueues.readyTasks() == 0, "no task is left");
}

void Delivery::run() {
  if (!make()) return;
  for (int steps = 0; steps < kMostSteps && !input_.atEnd(); ++steps) {
    switch (input_.below(6)) {
      case 0:
        sendMany();
        break;
      case 1:
        tick();
        break;
      case 2:
        receive();
        break;
      case 3: {
        // The next sends put all on its way, nothing, or a part.
        constexpr std::ptrdiff_t kResults[] = {-1, 0, 10};
        const auto failures = input_.below(8);
        for (uint32_t i = 0; i < failures; ++i) {
          socket().sendResults.push_back(kResults[input_.below(std::size(kResults))]);
          outcomes_.push_back(false);
        }
        break;
      }
      default:
        send();
    }
    require(waiting_.size() <= kMostQueued, "no more than fifty wait");
  }
  clean();
}

}  // namespace

void runOne(std::span<const uint8_t> bytes) {
  InputReader input(bytes);
  Delivery(input).run();
}

}  // namespace tarnel::fuzz

// Backends made of whatever a storebag's section may hold, and what they then post.

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "platform/fake/fake_world.h"
#include "session/backend_set.h"
#include "tarnel/keys.h"
#include "tests/fuzz/posted_message.h"
#include "tests/fuzz/value_input.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"a section of text",
                                                "a section of values",
                                                "no section",
                                                "undecided",
                                                "disabled",
                                                "enabled",
                                                "sampled out",
                                                "an event is posted",
                                                "a batch is posted",
                                                "a field is removed",
                                                "a field is digested",
                                                "disabled by its server",
                                                "a dashboard",
                                                "an upload server",
                                                "an adaptor",
                                                "a power log",
                                                "large user info for many events"};

namespace {

constexpr std::string_view kWords[] = {kTarnelBackendHTTPPost,
                                       kTarnelBackendHTTPPost2,
                                       kTarnelBackendDashboard,
                                       kTarnelBackendUploadServer,
                                       kTarnelBackendDravik,
                                       kTarnelBackendVesmer,
                                       "clients",
                                       "client",
                                       "service",
                                       "post_url",
                                       "realtime_post_url",
                                       "display_url",
                                       "filters",
                                       "key",
                                       "action",
                                       "remove",
                                       "sha256",
                                       "method",
                                       "status",
                                       "locale_whitelist",
                                       "device_whitelist",
                                       "device_blacklist",
                                       "sampling_threshold",
                                       "override_sampling",
                                       "per_country_sampling_thresholds",
                                       "country",
                                       "threshold",
                                       "event_threshold",
                                       "hierarchy",
                                       "override_dnu",
                                       "custom_clientId",
                                       "expedite",
                                       "extras_on_internal",
                                       "ip",
                                       "port",
                                       "reliable",
                                       "192.0.2.7",
                                       "DE",
                                       "Slate",
                                       "Phone",
                                       "Call",
                                       "Phone,Mail",
                                       "https://x.example/",
                                       "_method",
                                       "_status",
                                       "_sessionID",
                                       "secret",
                                       "Secret",
                                       "number",
                                       "text\nline",
                                       "\xC3\x84\xC3\xA4",
                                       "\xFF",
                                       ""};

// A backend holds 4 MiB; a byte of a text becomes six of JSON at the most.
constexpr size_t kMostBody = (4U << 20U) * 7;
constexpr int kMostSteps = 60;
constexpr int kMostFloods = 2;

struct Filter {
  std::string key;
  std::string action;
  bool isForAll = false;  // for every method and status
};

bool equalIgnoringCase(std::string_view a, std::string_view b) {
  const auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; };
  return a.size() == b.size() &&
         std::equal(a.begin(), a.end(), b.begin(), [lower](char x, char y) { return lower(x) == lower(y); });
}

bool isDigest(const Value& value) {
  const auto* text = value.string();
  return text != nullptr && text->size() == 64 &&
         text->find_first_not_of("0123456789abcdef") == std::string::npos;
}

class Backends {
 public:
  explicit Backends(InputReader& input) : input_(input) {}
  void run();

 private:
  Dictionary readSection();
  Dictionary entryWithFilters();
  Dictionary readSessionInfo();
  void step();
  void send();
  void sendMany();
  void flush();
  void updateStates();
  void changeWorld();
  size_t examinePosts();
  void examineEvent(const Dictionary& event) const;
  void clean();
  static void note(const std::string& name, const TarnelBackend& backend);

  InputReader& input_;
  fake::FakeWorld world_;
  BackendSet backends_;
  std::vector<Filter> filters_;  // in force from the beginning; empty when they are not known
  int owed_ = 0;
  int floods_ = 0;
};

// A client that reports; only its filters come from the input.
Dictionary Backends::entryWithFilters() {
  Array descriptions;
  for (uint32_t left = input_.below(6); left > 0; --left) {
    Filter filter;
    const uint8_t setting = input_.byte();
    filter.key = readText(input_, kWords);
    filter.action = (setting & 3U) == 0   ? readText(input_, kWords)
                    : (setting & 1U) != 0 ? "remove"
                                          : "sha256";
    filter.isForAll = (setting & 12U) != 4;
    Dictionary description{{"key", filter.key}, {"action", filter.action}};
    if (!filter.isForAll)
      description.set((setting & 16U) != 0 ? "method" : "status", int64_t{input_.below(4)});
    descriptions.append(description);
    filters_.push_back(std::move(filter));
  }
  return {{"client", "Phone"},
          {"service", "Call"},
          {"filters", descriptions},
          {"locale_whitelist", Array{"DE"}},
          {"sampling_threshold", 1},
          {"event_threshold", int64_t{input_.below(8)}},
          {"post_url", "https://x.example/"}};
}

Dictionary Backends::readSection() {
  switch (input_.below(3)) {
    case 0: {
      // One line of JSON.
      const auto value = readJson(input_.line());
      if (!value || value->dictionary() == nullptr) return {};
      reached("a section of text");
      return *value->dictionary();
    }
    case 1:
      reached("a section of values");
      return readDictionary(input_, kWords, 6);
    default: {
      Dictionary profile{{"clients", Array{entryWithFilters()}}};
      return {{kTarnelBackendHTTPPost, profile}, {kTarnelBackendHTTPPost2, profile}};
    }
  }
}

Dictionary Backends::readSessionInfo() {
  const uint8_t setting = input_.byte();
  if (setting == 255) return readDictionary(input_, kWords);
  constexpr int64_t kTypes[] = {8, 7, 0, 17};
  return {{kTarnelSessionInfoSessionID, 7},
          {kTarnelSessionInfoRequireUserInfo, (setting & 1U) != 0},
          {kTarnelSessionInfoBatchEvent, (setting & 2U) != 0},
          {kTarnelSessionInfoClientType, kTypes[(setting >> 2U) % std::size(kTypes)]}};
}

void Backends::note(const std::string& name, const TarnelBackend& backend) {
  if (name == kTarnelBackendDashboard) reached("a dashboard");
  if (name == kTarnelBackendUploadServer) reached("an upload server");
  if (name == kTarnelBackendDravik) reached("an adaptor");
  if (name == kTarnelBackendVesmer) reached("a power log");
  if (name != kTarnelBackendHTTPPost) return;
  constexpr std::string_view kStates[] = {"undecided", "disabled", "enabled", "sampled out"};
  const auto state = static_cast<size_t>(backend.state());
  require(state < std::size(kStates), "a reporting state is one of four");
  reached(kStates[state]);
}

void Backends::updateStates() {
  for (const auto& [name, backend] : backends_) {
    backend->updateState();
    note(name, *backend);
  }
}

void Backends::send() {
  const auto payload = readMaybeDictionary(input_, kWords);
  const auto method = static_cast<uint16_t>(input_.below(4));
  const auto status = static_cast<uint16_t>(input_.below(4));
  const auto flag = Flag{static_cast<int32_t>(input_.below(5))};
  for (const auto& [name, backend] : backends_) {
    backend->sendMessage(payload, world_.clock.timeOfDay(), Method{method}, RespCode{status}, flag);
  }
  if (examinePosts() > 0) reached("an event is posted");
}

// Users may be named when many events are held already.
void Backends::sendMany() {
  if (++floods_ > kMostFloods) return;
  const uint32_t count = input_.below(64);
  for (uint32_t left = count; left > 0; --left) {
    for (const auto& [name, backend] : backends_) {
      backend->sendMessage(Dictionary{{"n", 1}}, world_.clock.timeOfDay(), Method{3}, RespCode{3},
                           Flag::normal);
    }
  }
  const Dictionary user{{kTarnelUserInfoClientName, "Phone"},
                        {kTarnelUserInfoServiceName, "Call"},
                        {"text", std::string(size_t{input_.byte()} << 4U, 'x')}};
  if (count > 50) reached("large user info for many events");
  for (const auto& [name, backend] : backends_) backend->setUserInfoDict(user);
  updateStates();
  flush();
}

void Backends::flush() {
  for (const auto& [name, backend] : backends_) {
    ++owed_;
    bool isTold = false;
    backend->flushMessagesWithCompletion([this, &isTold](const MaybeString&, const MaybeError& error) {
      --owed_;
      isTold = true;
      if (error && error->code() >= 500) reached("disabled by its server");
    });
    require(isTold, "a flush is answered as soon as its post is");
  }
  if (examinePosts() > 0) reached("a batch is posted");
}

void Backends::changeWorld() {
  switch (input_.below(6)) {
    case 0:
      world_.consent.allowed = input_.below(2) == 1;
      break;
    case 1:
      world_.locale.country = input_.below(2) == 1 ? std::optional(readText(input_, kWords)) : std::nullopt;
      break;
    case 2:
      world_.clock.advance(static_cast<double>(input_.byte()) * 1000.0);
      break;
    case 3:
      world_.clock.set({static_cast<int64_t>(input_.number() % (uint64_t{1} << 40U)), 0});
      break;
    case 4: {
      constexpr int kCodes[] = {200, 404, 500, 599};
      world_.http.setAnswer(fake::FakeHttpClient::status(kCodes[input_.below(std::size(kCodes))]));
      break;
    }
    default:
      for (const auto& [name, backend] : backends_) backend->setCorrelatedSessionID(readText(input_, kWords));
  }
}

void Backends::step() {
  switch (input_.below(8)) {
    case 0:
      return updateStates();
    case 1: {
      const auto user = readMaybeDictionary(input_, kWords);
      for (const auto& [name, backend] : backends_) backend->setUserInfoDict(user);
      return;
    }
    case 2:
      return flush();
    case 3:
      return changeWorld();
    case 4:
      return sendMany();
    case 5:
      for (const auto& [name, backend] : backends_) {
        backend->setSamplingThreshold(readValue(input_, kWords, 0));
        backend->setState(ReportingState{static_cast<int32_t>(input_.below(4))});
      }
      return;
    default:
      send();
  }
}

// What a filter for every method and status removes or digests is not in an event of a session whose user was
// named from the beginning, whether it came from the message or from the user's information. Not looked at:
// the session's label, which is set behind the filters; filters of one method or status, which a flush does
// not apply to the user's information; sessions that held events before there were filters.
void Backends::examineEvent(const Dictionary& event) const {
  for (const auto& [key, value] : event) {
    if (key == "_sessionID") continue;
    const auto first = std::find_if(filters_.begin(), filters_.end(), [&name = key](const Filter& filter) {
      return equalIgnoringCase(filter.key, name);
    });
    if (first == filters_.end() || !first->isForAll) continue;
    require(first->action != "remove", "what a filter removes is not posted");
    if (first->action != "sha256") continue;
    require(isDigest(value), "what a filter digests is posted as its digest");
    reached("a field is digested");
  }
  const bool isRemoved = std::any_of(filters_.begin(), filters_.end(), [](const Filter& filter) {
    return filter.isForAll && filter.action == "remove";
  });
  if (isRemoved) reached("a field is removed");
}

// How many there were.
size_t Backends::examinePosts() {
  const auto requests = world_.http.requests();
  for (const auto& request : requests) {
    const auto message = readPostedMessage(request);
    if (!message) continue;
    require(bodyOf(request).size() <= kMostBody, "a message is bounded");
    for (const auto& event : eventsOf(*message)) examineEvent(*event.dictionary());
  }
  world_.http.clear();
  return requests.size();
}

void Backends::clean() {
  for (const auto& [name, backend] : backends_) backend->cleanup();
  backends_ = {};
  world_.workQueues.advance(std::chrono::seconds(30));
  require(owed_ == 0, "every flush is answered");
  require(world_.datagramSockets.open() == 0, "no socket is left");
  require(world_.workQueues.timers() == 0 && world_.workQueues.readSources() == 0, "no source is left");
}

void Backends::run() {
  const auto section = readSection();
  if (section.empty()) reached("no section");
  const auto info = readSessionInfo();
  const bool hasUser = input_.below(4) != 0;
  const Dictionary user{
      {kTarnelUserInfoClientName, "Phone"}, {kTarnelUserInfoServiceName, "Call"}, {"secret", 1}};
  auto made = createBackends(world_.dependencies, &TarnelBackend::newBackendWithName, section, info,
                             hasUser ? MaybeDictionary(user) : std::nullopt, "device");
  require(made.has_value(), "with section and session info there is a set of backends");
  backends_ = *std::move(made);
  require(backends_.size() <= 6, "there are six kinds of backends");
  updateStates();
  // Without a user the table is not made, and what is held until one comes has not passed it.
  const Value* isRequired = info.find(kTarnelSessionInfoRequireUserInfo);
  if (!hasUser || isRequired == nullptr || !isRequired->boolValue()) filters_.clear();
  for (int steps = 0; steps < kMostSteps && !input_.atEnd(); ++steps) step();
  examinePosts();
  clean();
  examinePosts();
}

}  // namespace

void runOne(std::span<const uint8_t> bytes) {
  InputReader input(bytes);
  Backends(input).run();
}

}  // namespace tarnel::fuzz

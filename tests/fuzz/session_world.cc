#include "tests/fuzz/session_world.h"

#include <algorithm>

#include "tarnel/keys.h"
#include "tests/fuzz/posted_message.h"
#include "tests/fuzz/value_input.h"

namespace tarnel::fuzz {
namespace {

constexpr std::string_view kWords[] = {kTarnelSessionInfoSessionID,
                                       kTarnelSessionInfoClientType,
                                       kTarnelSessionInfoClientVersion,
                                       kTarnelSessionInfoRequireUserInfo,
                                       kTarnelSessionInfoBatchEvent,
                                       kTarnelUserInfoClientName,
                                       kTarnelUserInfoServiceName,
                                       kTarnelMessageParametersCategory,
                                       kTarnelMessageParametersType,
                                       kTarnelMessageParametersPayload,
                                       kTarnelMessageParametersFlag,
                                       "Phone",
                                       "Call",
                                       "Mail",
                                       "secret",
                                       "number",
                                       "_method",
                                       "_status",
                                       "_sessionID",
                                       "",
                                       "line\nend",
                                       "\xC3\xA4\xF0\x9F\x98\x80",
                                       "\xFF\xFE",
                                       "1"};

// What is held for one backend, with what it becomes as JSON.
constexpr size_t kMostPosted = 64U << 20U;

constexpr char kAdaptorBundle[] =
    "/System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";

// An answer may come from the reply of another, so the number of rounds is bounded and not the requests.
constexpr int kRounds = 64;

Dictionary clientEntry(const char* client, const char* service, int hierarchy) {
  const Array filters{Dictionary{{"key", "secret"}, {"action", "remove"}},
                      Dictionary{{"key", "number"}, {"action", "sha256"}},
                      Dictionary{{"key", "line\nend"}, {"method", 2}, {"action", "remove"}}};
  return {{"client", client},
          {"service", service},
          {"hierarchy", hierarchy},
          {"locale_whitelist", Array{"DE"}},
          {"filters", filters},
          {"sampling_threshold", 1},
          {"event_threshold", 3},
          {"post_url", "https://events.example/post"},
          {"realtime_post_url", "https://events.example/realtime"}};
}

HttpResult resultFor(InputReader& input) {
  constexpr int kStatuses[] = {200, 204, 304, 400, 404, 500, 503, 599, 600};
  const auto which = input.below(std::size(kStatuses) + 1);
  if (which == std::size(kStatuses)) return fake::FakeHttpClient::failure(input.shortText());
  return fake::FakeHttpClient::status(kStatuses[which], input.below(2) == 0 ? "success" : input.shortText());
}

}  // namespace

Dictionary fullStorebag() {
  Dictionary https{{"display_url", "https://show.example"},
                   {"clients", Array{clientEntry("Phone", "Call", 0), clientEntry("Mail", "Call", 1),
                                     clientEntry("secret", "Call", 2)}}};
  return {
      {kTarnelBackendHTTPPost, https},
      {kTarnelBackendHTTPPost2, https},
      {kTarnelBackendDashboard,
       Dictionary{
           {"ip", "192.0.2.7"}, {"port", 8125}, {"reliable", 500}, {"post_url", "https://logs.example/"}}},
      {kTarnelBackendUploadServer, Dictionary{{"post_url", "https://upload.example/"}}},
      {kTarnelBackendDravik, Dictionary()},
      {kTarnelBackendVesmer, Dictionary()},
      {"unknown", Dictionary()}};
}

SessionWorld::SessionWorld() : storebag(fullStorebag()) {
  fakes.codeBundles.scripts[kAdaptorBundle];
  agent = TarneldAgent::init(
      fakes.dependencies, &TarnelBackend::newBackendWithName,
      [this](const Dependencies& /*dependencies*/, int32_t clientType, StorebagFetchSlots slots) {
        if (clientType < 0 || clientType > 17) throw InvalidArgument("no storebag of that client type");
        slots.maxAge = 600;
        if (storebag) slots.version = "5.1";
        return storebag;
      });
}

SessionWorld::~SessionWorld() = default;

std::vector<std::string_view> SessionWorld::words() {
  return {std::begin(kWords), std::end(kWords)};
}

std::shared_ptr<fake::FakeIpcConnection> SessionWorld::connect() {
  auto connection = std::make_shared<fake::FakeIpcConnection>();
  connection->entitlements["com.orvane.private.tarneld"] = true;
  require(agent->shouldAcceptNewConnection(listener_, connection), "a client with the entitlement is let in");
  return connection;
}

void SessionWorld::answer(InputReader& input) {
  if (fakes.http.pendingCount() > 0) fakes.http.answerOldest(resultFor(input));
}

void SessionWorld::changeStorebag(InputReader& input) {
  switch (input.below(4)) {
    case 0:
      storebag.reset();
      break;
    case 1:
      storebag = readDictionary(input, kWords);
      break;
    default:
      storebag = fullStorebag();
  }
}

void SessionWorld::happen(InputReader& input) {
  switch (input.below(10)) {
    case 0:
      return answer(input);
    case 1:
      return fakes.clock.advance(static_cast<double>(input.byte()) * 30.0);
    case 2:
      return fakes.clock.advance(-static_cast<double>(input.byte()));
    case 3:
      return fakes.http.holdAnswers(input.below(2) == 1);
    case 4: {
      const auto result = resultFor(input);
      return fakes.http.setAnswer(result);
    }
    case 5:
      return changeStorebag(input);
    case 6:
      return fakes.workQueues.advance(std::chrono::milliseconds(input.byte() * 20));
    case 7:
      fakes.consent.allowed = input.below(2) == 1;
      return;
    case 8:
      fakes.locale.country = input.below(2) == 1 ? std::optional<std::string>("DE") : std::nullopt;
      return;
    default:
      fakes.settings.broken = input.below(2) == 1;
  }
}

void SessionWorld::offerFile(const std::string& token, std::string contents, bool isRegular) {
  fake::FakeClientFiles::File file;
  file.text = std::move(contents);
  file.isRegular = isRegular;
  fakes.clientFiles.files[token] = std::move(file);
}

void SessionWorld::examinePosts() {
  size_t total = 0;
  for (const auto& request : fakes.http.requests()) {
    readPostedMessage(request);
    total += request.body == nullptr ? 0 : request.body->size();
  }
  require(total <= kMostPosted, "no more is posted than may be held");
  fakes.http.clear();
}

void SessionWorld::settle() {
  fakes.http.holdAnswers(false);
  for (int round = 0; round < kRounds && fakes.http.pendingCount() > 0; ++round) {
    fakes.http.answerOldest(fake::FakeHttpClient::status(200));
  }
  while (fakes.http.pendingCount() > 0) fakes.http.answerOldest(fake::FakeHttpClient::status(503));
  // A dashboard's clean-up is bounded by 9.5 seconds and a tick.
  fakes.workQueues.advance(std::chrono::seconds(30));
  require(replies.pending() == 0, "every reply is answered or let go of");
  require(fakes.datagramSockets.open() == 0, "no socket is left");
  require(fakes.workQueues.timers() == 0 && fakes.workQueues.readSources() == 0, "no source is left");
  require(fakes.workQueues.readyTasks() == 0, "no task is left");
  require(agent->sessionList().empty(), "no session is left in the list");
  for (const auto& [key, list] : agent->correlatedSessions()) {
    require(list.empty(), "no session is left among the correlated");
  }
  require(!fakes.keepAlive.turnedTwice, "the transaction is begun and ended in turn");
  require(fakes.keepAlive.begun == fakes.keepAlive.ended, "the transaction is ended");
  examinePosts();
}

}  // namespace tarnel::fuzz

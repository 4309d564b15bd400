// The agent's storebag cache under any sequence of servers, clients and clocks, against a model of it. The
// input's lines:
//   ENVIRONMENT    one character
//   STEPS          see Run::step()
//   value of the answers' Cache-Control; none when the line is empty
// The rest is the storebag.

#include <cmath>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "daemon/tarneld_agent.h"
#include "formats/document.h"
#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "tarnel/keys.h"
#include "testing/test_storebag.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/storebag_expectation.h"
#include "tests/fuzz/values.h"
#include "util/storebag_internal.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"fetched",
                                                "served from the cache",
                                                "expired",
                                                "waiting after a failure",
                                                "tried again after a failure",
                                                "old data after a failure",
                                                "shared by client types",
                                                "not modified",
                                                "not modified, but unknown",
                                                "asked conditionally",
                                                "built-in storebag",
                                                "no version",
                                                "no name",
                                                "always expired",
                                                "clock set back"};

namespace {

constexpr int kClientTypes = 20;
constexpr size_t kMostSteps = 40;
constexpr char kModified[] = "Tue, 14 Nov 2023 22:13:20 GMT";

// What the agent should know of one storebag.
struct Known {
  std::optional<Dictionary> data;
  MaybeString version;
  bool hasLastModified = false;
  double fetchTime = 0;
  bool isGood = false;
  int32_t maxAge = 0;
  int32_t lastType = 0;
};

class NoListener final : public IpcListener {
 public:
  void setDelegate(IpcListenerDelegate* /*delegate*/) override {}
  MaybeError resume() override { return std::nullopt; }
};

class Run {
 public:
  Run(EnvironmentType environment, MaybeString cacheControl, std::string_view document)
      : environment_(environment), cacheControl_(std::move(cacheControl)), document_(document) {
    world_.clientBundle.resources["publicKey.der"] = fake::StorebagSigner::shared().publicKeyDer();
    world_.settings.setObject(kTarnelSettingsDomain, "environmentType", static_cast<int64_t>(environment));
    if (auto parsed = parseDocument(document); parsed && parsed->dictionary() != nullptr) {
      storebag_ = *parsed->dictionary();
    }
    maxAge_ = kStorebagMaxAgeSeconds;
    if (cacheControl_) {
      const HttpResponse response{200, {{"Cache-Control", *cacheControl_}}};
      maxAge_ = detail::maxAgeOfResponse(&response);
    }
  }
  Run(const Run&) = delete;
  Run& operator=(const Run&) = delete;
  ~Run() {
    for (const auto& [type, client] : clients_) client->invalidate();
  }

  // 'A' to 'T': a client of type 0 to 19 asks; 's', 'l', 'm', 'e', 'x': the server from now on (see
  // answer()); digits: so much time passes; '-': the clock is set back by ten minutes.
  void step(char step) {
    constexpr double kPauses[] = {0, 1, 59.5, 899, 900, 901, 3599, 3600, 86399, 86400};
    if (step >= 'A' && step < 'A' + kClientTypes) return ask(step - 'A');
    if (step >= '0' && step <= '9') return world_.clock.advance(kPauses[step - '0']);
    if (step == '-') {
      world_.clock.advance(-600);
      reached("clock set back");
      return;
    }
    if (std::string_view("slmex").find(step) == std::string_view::npos) return;
    server_ = step;
    world_.http.setAnswer(answer());
  }

 private:
  double now() { return secondsFromTimeValue(world_.clock.timeOfDay()); }

  HttpResult answer() {
    if (server_ == 'e') return fake::FakeHttpClient::failure("no server");
    std::string body;
    if (server_ == 'x') body = "{}";
    if (server_ == 's' || server_ == 'l') {
      if (signed_.empty()) signed_ = fake::StorebagSigner::shared().signedBag(document_);
      body = signed_;
    }
    std::vector<HttpHeader> headers;
    if (cacheControl_) headers.push_back({"Cache-Control", *cacheControl_});
    if (server_ == 'l' || server_ == 'm') headers.push_back({"Last-Modified", kModified});
    return fake::FakeHttpClient::status(200, std::move(body), std::move(headers));
  }

  TarneldSession& sessionOf(int32_t type) {
    auto& client = clients_[type];
    if (client == nullptr) {
      client = std::make_shared<fake::FakeIpcConnection>();
      client->entitlements["com.orvane.private.tarneld"] = true;
      require(agent_->shouldAcceptNewConnection(listener_, client), "a client is let in");
      client->exportedObject->setSessionInfo(
          Dictionary{{kTarnelSessionInfoSessionID, type}, {kTarnelSessionInfoClientType, type}}, std::nullopt,
          std::nullopt, false);
    }
    return *std::static_pointer_cast<TarneldSession>(client->exportedObject);
  }

  void ask(int32_t type) {
    auto& session = sessionOf(type);
    world_.http.clear();
    std::optional<Dictionary> answer;
    bool threw = false;
    try {
      answer = agent_->storebagForSession(session);
    } catch (const InvalidArgument&) {
      threw = true;
    }
    const auto requests = world_.http.requests();
    const auto name = storebagNameForClientType(type);
    if (!name) {
      require(threw && requests.empty(), "a client type without a name asks for nothing");
      reached("no name");
      return;
    }
    const auto before = known_.find(*name);
    const bool isKnown = before != known_.end();
    const bool mustFetch = !isKnown || isDue(before->second);
    require(requests.size() == (mustFetch ? 1U : 0U), "one request when it is due, and only then");
    bool mustThrow = false;
    if (mustFetch) {
      checkRequest(requests.front(), isKnown && before->second.hasLastModified);
      mustThrow = learn(known_[*name], *name == "calvisto");
    } else if (before->second.lastType != type) {
      reached("shared by client types");
    }
    auto& known = known_[*name];
    known.lastType = type;
    require(threw == mustThrow, "only a missing version is an invalid argument");
    if (threw) return;
    require(answer == known.data, "what was last fetched is served");
    require(agent_->storebagVersionForSession(session) == known.version, "with its version");
    if (answer && !known.isGood) reached("old data after a failure");
  }

  bool isDue(const Known& known) {
    const double age = std::fabs(known.fetchTime - now());
    if (known.isGood) {
      const bool isExpired = age >= static_cast<double>(known.maxAge);
      if (known.maxAge <= 0) reached("always expired");
      reached(isExpired ? "expired" : "served from the cache");
      return isExpired;
    }
    reached(age >= 900 ? "tried again after a failure" : "waiting after a failure");
    return age >= 900;
  }

  static void checkRequest(const HttpRequest& request, bool isConditional) {
    require(request.headers.size() == (isConditional ? 1U : 0U), "a condition when a date is known");
    if (!isConditional) return;
    require(request.headers[0].name == "If-Modified-Since" && request.headers[0].value == kModified,
            "with the date as the server gave it");
    reached("asked conditionally");
  }

  // What the present server's answer makes of the entry. True when it must unwind.
  bool learn(Known& known, bool isCalvisto) {
    known.fetchTime = now();
    known.isGood = false;
    if (server_ == 'e') {
      if (isCalvisto && environment_ != EnvironmentType::none) takeBuiltIn(known);
      return false;
    }
    const bool hadLastModified = known.hasLastModified;
    if (server_ == 'l' || server_ == 'm') known.hasLastModified = true;
    known.maxAge = maxAge_;
    if (server_ == 'm') {
      known.isGood = hadLastModified;
      reached(hadLastModified ? "not modified" : "not modified, but unknown");
    }
    if ((server_ != 's' && server_ != 'l') || !storebag_) return false;
    const auto expected = storebagExpectation(*storebag_, environment_);
    if (expected.section == nullptr) return false;
    if (expected.version == nullptr) {
      reached("no version");
      return true;
    }
    known.data = *expected.section;
    known.version = *expected.version;
    known.maxAge = expected.refreshCycle.value_or(maxAge_);
    known.isGood = true;
    reached("fetched");
    return false;
  }

  static void takeBuiltIn(Known& known) {
    known.data = Dictionary{{"dravik", Dictionary{{"active", true}}}};
    known.version = "1.0.0-Calvisto-Fallback";
    known.maxAge = 3600;
    known.isGood = true;
    reached("built-in storebag");
  }

  const EnvironmentType environment_;
  const MaybeString cacheControl_;
  const std::string_view document_;
  std::optional<Dictionary> storebag_;
  int32_t maxAge_ = 0;
  std::string signed_;
  char server_ = 'm';
  std::map<std::string, Known> known_;

  fake::FakeWorld world_;
  NoListener listener_;
  std::shared_ptr<TarneldAgent> agent_ = TarneldAgent::init(world_.dependencies);
  std::map<int32_t, std::shared_ptr<fake::FakeIpcConnection>> clients_;
};

}  // namespace

void runOne(std::span<const uint8_t> input) {
  InputReader reader(input);
  const auto environment = static_cast<EnvironmentType>(static_cast<uint8_t>((reader.line() + "4")[0]) % 5);
  const auto steps = reader.line().substr(0, kMostSteps);
  const auto cacheControl = reader.line();
  Run run(environment, cacheControl.empty() ? MaybeString() : MaybeString(cacheControl), reader.rest());
  run.step('x');
  for (const char step : steps) run.step(step);
}

}  // namespace tarnel::fuzz

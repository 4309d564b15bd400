#include <limits>

#include "backends/https/https_post_backend_fixture.h"
#include "formats/compression.h"
#include "util/identifiers.h"

namespace tarnel {
namespace {

using ::testing::ElementsAre;

constexpr char kUnable[] =
    "HTTPSPostBackend(createMessageForPostAndLogging): JSONWriter unable to handle key: ";

class HTTPSPostBackendMessageTest : public HTTPSPostBackendFixture {
 protected:
  std::string message(HTTPSPostBackend& backend, Array events, MaybeString* pretty = nullptr) {
    return backend.createMessageForPostAndLogging(events, pretty).value_or("none");
  }
  Value clientIdOf(HTTPSPostBackend& backend) {
    const auto body = parsed(message(backend, {}));
    const auto* id = body.find("clientId");
    return id == nullptr ? Value() : *id;
  }
  bool makesPretty(HTTPSPostBackend& backend) {
    MaybeString pretty = "untouched";
    message(backend, {}, &pretty);
    return pretty != "untouched";
  }
  std::string respecting() { return *world.consentIdentifiers.getPersistentIdentifierForDNU(1); }
  std::string overriding() { return *world.consentIdentifiers.getPersistentIdentifierForDNU(0); }
};

TEST_F(HTTPSPostBackendMessageTest, WrapsEventsCompactlyInOrder) {
  const auto backend = makeUpdated();
  EXPECT_EQ(message(*backend, {Dictionary{{"a", 1}}, Dictionary{{"b", "x"}, {"c", 2.5}}}),
            R"({"postTime":1700000100.5,"clientId":")" + respecting() +
                R"(","events":[{"a":1},{"b":"x","c":2.5}]})");
  EXPECT_EQ(message(*backend, {}),
            R"({"postTime":1700000100.5,"clientId":")" + respecting() + R"(","events":[]})");
}

TEST_F(HTTPSPostBackendMessageTest, PostTimeIsAFloatingPointNumber) {
  world.clock.set({1700000100, 0});
  EXPECT_THAT(message(*makeUpdated(), {}), ::testing::StartsWith(R"({"postTime":1700000100.0,)"));
}

class FailingIdentifiers final : public ConsentIdentifierProvider {
 public:
  MaybeString getPersistentIdentifierForDNU(int /*respect*/) override { return std::nullopt; }
};

TEST_F(HTTPSPostBackendMessageTest, WithoutAClientIdentifierTheMessageStopsAtThePostTime) {
  FailingIdentifiers none;
  const Dependencies dependencies = world.withIdentifiers(none);
  const auto backend = HTTPSPostBackend::initWithName(dependencies, "httppost", profile(), "Slate");
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(message(*backend, {Dictionary{{"a", 1}}}), R"({"postTime":1700000100.5})");
}

// Events that are about no user are posted also while consent is withheld, and need an identifier there.
TEST_F(HTTPSPostBackendMessageTest, WhileConsentIsWithheldThereIsAnIdentifierToo) {
  const auto agreed = respecting();
  world.consent.allowed = false;
  requireUserInfo = false;
  const auto withheld = respecting();
  EXPECT_NE(withheld, agreed);
  EXPECT_EQ(message(*makeUpdated(), {Dictionary{{"a", 1}}}),
            R"({"postTime":1700000100.5,"clientId":")" + withheld + R"(","events":[{"a":1}]})");
}

TEST_F(HTTPSPostBackendMessageTest, BooleansAreNumbers) {
  EXPECT_THAT(message(*makeUpdated(), {Dictionary{{"t", true}, {"f", false}}}),
              ::testing::HasSubstr(R"({"t":true,"f":false})"));
  EXPECT_TRUE(world.log.startingWith(kUnable).empty());
}

TEST_F(HTTPSPostBackendMessageTest, DatesBecomeSeconds) {
  const auto backend = makeUpdated();
  Array events{Dictionary{{"d", Date{1700000000.25}},
                          {"w", Date{5}},
                          {"i", Date{std::numeric_limits<double>::infinity()}},
                          {"n", Date{std::numeric_limits<double>::quiet_NaN()}}}};
  const auto body = backend->createMessageForPostAndLogging(events, nullptr);
  EXPECT_THAT(*body, ::testing::HasSubstr(R"({"d":1700000000.25,"w":5.0,"i":-1.0,"n":-1.0})"));
  EXPECT_EQ(events, (Array{Dictionary{{"d", 1700000000.25}, {"w", 5.0}, {"i", -1.0}, {"n", -1.0}}}));
}

TEST_F(HTTPSPostBackendMessageTest, ValuesThatMayNotStandAreRemovedWithAWarning) {
  const auto backend = makeUpdated();
  Array events{Dictionary{{"a", 1},
                          {"nested", Dictionary{{"x", 1}}},
                          {"list", Array{1, "y"}},
                          {"data", Data{1, 255}},
                          {"nothing", Value()},
                          {"z", "text"}}};
  const auto body = backend->createMessageForPostAndLogging(events, nullptr);
  EXPECT_THAT(*body, ::testing::HasSubstr(R"("events":[{"a":1,"z":"text"}])"));
  EXPECT_EQ(events, (Array{Dictionary{{"a", 1}, {"z", "text"}}}));
  expectLog(LogLevel::warning, std::string(kUnable) + "nested, value: {\"x\": 1}");
  expectLog(LogLevel::warning, std::string(kUnable) + "list, value: [1, \"y\"]");
  expectLog(LogLevel::warning, std::string(kUnable) + "data, value: <01ff>");
  expectLog(LogLevel::warning, std::string(kUnable) + "nothing, value: (null)");
  EXPECT_EQ(world.log.startingWith(kUnable).size(), 4U);
}

TEST_F(HTTPSPostBackendMessageTest, ValuesThatCannotBeWrittenAreRemovedAndTheBatchSurvives) {
  const auto backend = makeUpdated();
  const Array events{Dictionary{{"bad", "\xFF"}, {"good", 1}},
                     Dictionary{{"inf", std::numeric_limits<double>::infinity()}, {"good", 2}},
                     Dictionary{{"k\xC3", 1}, {"good", 3}}};
  EXPECT_THAT(message(*backend, events),
              ::testing::HasSubstr(R"("events":[{"good":1},{"good":2},{"good":3}]})"));
  expectLog(LogLevel::warning, std::string(kUnable) + "bad, value: \xFF");
  expectLog(LogLevel::warning, std::string(kUnable) + "inf, value: inf");
  EXPECT_EQ(world.log.startingWith(kUnable).size(), 3U);
}

TEST_F(HTTPSPostBackendMessageTest, MessageThatCannotBeWrittenHasNoBody) {
  entry.set("extras_on_internal", 1);
  internal = true;
  const auto backend = makeUpdated();
  backend->setUdid("\xFF");
  EXPECT_EQ(message(*backend, {}), "none");
  // Nothing is posted then, and a flush says so.
  EXPECT_EQ(send(*backend, 3, Flag::realtime), std::nullopt);
  send(*backend);
  const auto [text, error] = flush(*backend);
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "Can not flush: the events can not be written as JSON"));
  EXPECT_TRUE(world.http.requests().empty());
}

// --- client identifier ---

TEST_F(HTTPSPostBackendMessageTest, ClientIdentifierHonoursConsentByDefault) {
  EXPECT_EQ(clientIdOf(*makeUpdated()), Value(respecting()));
}

TEST_F(HTTPSPostBackendMessageTest, OverriddenConsentUsesTheOverridingIdentifier) {
  entry.set("override_dnu", 1);
  EXPECT_EQ(clientIdOf(*makeUpdated()), Value(overriding()));
  world.consent.allowed = false;
  EXPECT_EQ(clientIdOf(*makeUpdated()), Value(overriding()));
}

TEST_F(HTTPSPostBackendMessageTest, CustomIdentifierComesBeforeBoth) {
  for (const Value& any : {Value(0), Value("x"), Value(Dictionary())}) {
    entry.set("custom_clientId", any);
    const auto custom =
        getPersistentIdentifierForCustomClientIDSuffix(world.dependencies, "Meetwell", "video-call");
    EXPECT_EQ(clientIdOf(*makeUpdated()), Value(custom));
  }
  entry.set("override_dnu", 1);
  EXPECT_NE(clientIdOf(*makeUpdated()), Value(overriding()));
}

TEST_F(HTTPSPostBackendMessageTest, DeviceIdentifierReplacesAllOnInternalBuildsWithExtras) {
  entry.set("custom_clientId", 1);
  entry.set("extras_on_internal", 2);
  internal = true;
  EXPECT_EQ(clientIdOf(*makeUpdated()), Value("device-id"));
  internal = false;
  EXPECT_NE(clientIdOf(*makeUpdated()), Value("device-id"));
  internal = true;
  entry.set("extras_on_internal", 0);
  EXPECT_NE(clientIdOf(*makeUpdated()), Value("device-id"));
}

// --- pretty copy ---

TEST_F(HTTPSPostBackendMessageTest, PrettyCopyIsTheSameMessageIndented) {
  const auto backend = makeUpdated();
  MaybeString pretty;
  const auto compact = message(*backend, {Dictionary{{"a", 1}}}, &pretty);
  ASSERT_TRUE(pretty);
  EXPECT_NE(*pretty, compact);
  EXPECT_THAT(*pretty, ::testing::HasSubstr("\n"));
  EXPECT_EQ(parsed(*pretty), parsed(compact));
}

TEST_F(HTTPSPostBackendMessageTest, PrettyCopyNeedsRespectedConsentOrForcedLogging) {
  EXPECT_TRUE(makesPretty(*makeUpdated()));
  entry.set("override_dnu", 1);  // type 2: agreed, but overridden
  EXPECT_FALSE(makesPretty(*makeUpdated()));
  world.consent.allowed = false;  // type 1
  EXPECT_FALSE(makesPretty(*makeUpdated()));
  entry.remove("override_dnu");  // type 0, not agreed
  EXPECT_FALSE(makesPretty(*makeUpdated()));
}

class HTTPSPostBackendForcedLoggingTest : public HTTPSPostBackendMessageTest,
                                          public ::testing::WithParamInterface<int> {};

TEST_P(HTTPSPostBackendForcedLoggingTest, ForcedLoggingWorksInEnvironmentsOneAndTwo) {
  world.settings.setObject("com.orvane.tarnel", "environmentType", GetParam());
  world.consent.allowed = false;
  EXPECT_FALSE(makesPretty(*makeUpdated()));
  for (const auto& [setting, forced] :
       {std::pair{Value(true), true}, {Value("YES"), true}, {Value(false), false}, {Value("0"), false}}) {
    world.settings.setObject("com.orvane.tarnel", "forceEventLogging", setting);
    EXPECT_EQ(makesPretty(*makeUpdated()), forced && (GetParam() == 1 || GetParam() == 2))
        << setting.description();
  }
}

INSTANTIATE_TEST_SUITE_P(Environments, HTTPSPostBackendForcedLoggingTest, ::testing::Values(0, 1, 2, 3, 4));

// --- request ---

class HTTPSPostBackendPostTest : public HTTPSPostBackendMessageTest {
 protected:
  HttpRequest posted(HTTPSPostBackend& backend, const std::string& body, Flag flag = Flag::normal,
                     std::optional<Method> method = std::nullopt,
                     std::optional<RespCode> responseCode = std::nullopt) {
    backend.postJSONMessage(body, flag, method, responseCode, {});
    return world.http.requests().back();
  }
  static std::vector<std::string> linesOf(const HttpRequest& request) {
    std::vector<std::string> lines;
    for (const auto& header : request.headers) lines.push_back(header.name + ": " + header.value);
    return lines;
  }
};

TEST_F(HTTPSPostBackendPostTest, SetsAllHeadersInOrder) {
  internal = true;
  const auto backend = makeUpdated();
  const auto request = posted(*backend, std::string(1000, 'x'), Flag::normal, Method{3}, RespCode{8});
  EXPECT_EQ(request.method, "POST");
  EXPECT_FALSE(request.wantsBody);
  EXPECT_EQ(request.url, "https://events.example/post");
  EXPECT_EQ(request.timeout, std::nullopt);
  EXPECT_THAT(
      linesOf(request),
      ElementsAre("X-TRN-Client-Name: Meetwell", "X-TRN-Service-Name: video-call", "X-TRN-Internal-Build: 1",
                  "User-Agent: Tarnel/3.2 (Slate7,1; 12.5)", "X-TRN-Client-Version: 5", "X-TRN-Sender: PLMA",
                  "X-TRN-Event-Map: 3 8", "Accept: application/json", "Content-Type: application/json",
                  "Content-Length: " + std::to_string(request.body->size()), "Content-Encoding: gzip"));
}

TEST_F(HTTPSPostBackendPostTest, OptionalHeadersAreLeftOut) {
  userInfo = Dictionary{{kTarnelUserInfoClientName, 5}};
  requireUserInfo = false;
  const auto backend = makeUpdated();
  backend->setHardwareType(std::nullopt);
  backend->setProductVersion(std::nullopt);
  EXPECT_THAT(
      linesOf(posted(*backend, "{}")),
      ElementsAre("User-Agent: Tarnel/3.2 ((null); (null))", "X-TRN-Client-Version: 5", "X-TRN-Sender: PLMA",
                  "Accept: application/json", "Content-Type: application/json", "Content-Length: 2"));
}

TEST_F(HTTPSPostBackendPostTest, EventMapNeedsMethodAndResponseCode) {
  const auto backend = makeUpdated();
  EXPECT_EQ(headerOf(posted(*backend, "{}", Flag::normal, Method{1}, std::nullopt), "X-TRN-Event-Map"),
            nullptr);
  EXPECT_EQ(headerOf(posted(*backend, "{}", Flag::normal, std::nullopt, RespCode{1}), "X-TRN-Event-Map"),
            nullptr);
  EXPECT_EQ(*headerOf(posted(*backend, "{}", Flag::normal, Method{0}, RespCode{65535}), "X-TRN-Event-Map"),
            "0 65535");
}

TEST_F(HTTPSPostBackendPostTest, HeaderValuesCarryNoControlCharactersAndAreBounded) {
  userInfo->set(kTarnelUserInfoClientName, "a\r\nX-Evil: 1\t\x7F" + std::string("ä"));
  userInfo->set(kTarnelUserInfoServiceName, "x" + std::string(5000, 'y') + "ä");
  const auto backend = make();
  backend->setPostURL("https://events.example/post");
  const auto request = posted(*backend, "{}");
  EXPECT_EQ(*headerOf(request, "X-TRN-Client-Name"), "aX-Evil: 1ä");
  EXPECT_EQ(*headerOf(request, "X-TRN-Service-Name"), "x" + std::string(1023, 'y'));
  std::string wide;
  for (int i = 0; i < 2000; ++i) wide += "ä";
  backend->setUserInfoDict(Dictionary{{kTarnelUserInfoClientName, "x" + wide}});
  EXPECT_EQ(*headerOf(posted(*backend, "{}"), "X-TRN-Client-Name"), "x" + wide.substr(0, 1022));
}

TEST_F(HTTPSPostBackendPostTest, CompressesOnlyWhenThatIsShorter) {
  const auto backend = makeUpdated();
  const auto small = posted(*backend, "{}");
  EXPECT_EQ(*small.body, "{}");
  EXPECT_EQ(headerOf(small, "Content-Encoding"), nullptr);
  EXPECT_EQ(*headerOf(small, "Content-Length"), "2");
  const std::string large(5000, 'x');
  const auto compressed = posted(*backend, large);
  EXPECT_EQ(*headerOf(compressed, "Content-Encoding"), "gzip");
  EXPECT_LT(compressed.body->size(), large.size());
  EXPECT_EQ(inflated(*compressed.body), large);
}

TEST_F(HTTPSPostBackendPostTest, GzipOfEqualLengthIsNotUsed) {
  const auto backend = makeUpdated();
  // Grow a compressible body from below to above the break-even point; each must be the shorter form.
  bool metEqual = false;
  for (size_t length = 1; length < 60; ++length) {
    const std::string body(length, 'x');
    const auto gzip = gzipDeflate(world.log, body);
    const auto request = posted(*backend, body);
    EXPECT_EQ(headerOf(request, "Content-Encoding") != nullptr, gzip->size() < length) << length;
    metEqual = metEqual || gzip->size() == length;
  }
  EXPECT_TRUE(metEqual);
}

TEST_F(HTTPSPostBackendPostTest, EmptyBodyGoesOutAsItIs) {
  const auto request = posted(*makeUpdated(), "");
  EXPECT_EQ(*request.body, "");
  EXPECT_EQ(*headerOf(request, "Content-Length"), "0");
}

TEST_F(HTTPSPostBackendPostTest, RealtimeFlagsChooseTheRealtimeAddress) {
  const auto backend = makeUpdated();
  EXPECT_EQ(posted(*backend, "{}", Flag{0}).url, "https://events.example/post");
  EXPECT_EQ(posted(*backend, "{}", Flag{1}).url, "https://events.example/realtime");
  EXPECT_EQ(posted(*backend, "{}", Flag{2}).url, "https://events.example/post");
  EXPECT_EQ(posted(*backend, "{}", Flag{3}).url, "https://events.example/realtime");
}

TEST_F(HTTPSPostBackendPostTest, WithoutAnAddressTheCompletionIsToldAtOnce) {
  const auto backend = make();
  int answers = 0;
  backend->postJSONMessage("{}", Flag::normal, std::nullopt, std::nullopt,
                           [&answers](MaybeString text, MaybeError error) {
                             ++answers;
                             EXPECT_EQ(text, std::nullopt);
                             EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "postURL is nil"));
                           });
  EXPECT_EQ(answers, 1);
  backend->postJSONMessage("{}", Flag::realtime, std::nullopt, std::nullopt, {});
  EXPECT_TRUE(world.http.requests().empty());
}

}  // namespace
}  // namespace tarnel

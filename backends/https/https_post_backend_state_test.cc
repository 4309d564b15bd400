#include "backends/https/https_post_backend_fixture.h"

namespace tarnel {
namespace {

class HTTPSPostBackendStateTest : public HTTPSPostBackendFixture {
 protected:
  ReportingState updated() {
    backend = makeUpdated();
    return backend->state();
  }
  std::string logPrefix() const { return "HTTPSPostBackend(updateBackendState): "; }

  std::shared_ptr<HTTPSPostBackend> backend;
};

// --- the road to an entry ---

TEST_F(HTTPSPostBackendStateTest, WithoutUserInfoTheStateIsUndecided) {
  userInfo.reset();
  EXPECT_EQ(updated(), ReportingState::undecided);
}

TEST_F(HTTPSPostBackendStateTest, UndecidedBecomesDecidedWhenUserInfoArrives) {
  const auto later = *userInfo;
  userInfo.reset();
  updated();
  backend->setUserInfoDict(later);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, NoMatchingEntryDisables) {
  userInfo->set(kTarnelUserInfoClientName, "Other");
  EXPECT_EQ(updated(), ReportingState::disabled);
  clients = Array{5};
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::warning, kWarning + std::string("clients[0] is not a dictionary and counts as absent"));
}

TEST_F(HTTPSPostBackendStateTest, EmptyClientListDisables) {
  backend = HTTPSPostBackend::initWithName(world.dependencies, "httppost", Dictionary{{"clients", Array()}},
                                           "Slate");
  backend->setRequireUserInfo(true);
  backend->setUserInfoDict(userInfo);
  EXPECT_EQ(backend->updateBackendState(), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendStateTest, ClientNamesCompareWholeAndServiceNamesPartly) {
  entry.set("client", "A,B");
  entry.set("service", "call,chat");
  const auto with = [this](const char* client, const char* service) {
    userInfo = Dictionary{{kTarnelUserInfoClientName, client}, {kTarnelUserInfoServiceName, service}};
    return updated();
  };
  EXPECT_EQ(with("b", "my-CALL"), ReportingState::enabled);
  EXPECT_EQ(with("A", "chatroom"), ReportingState::enabled);
  EXPECT_EQ(with("B ", "call"), ReportingState::disabled);
  EXPECT_EQ(with("AB", "call"), ReportingState::disabled);
  EXPECT_EQ(with("a", "cal"), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendStateTest, EntryWithoutNamesMatchesEveryClient) {
  entry.remove("client");
  entry.remove("service");
  userInfo = Dictionary{{"unrelated", 1}};
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, AbsentNamesDoNotMatchLists) {
  userInfo = Dictionary{{kTarnelUserInfoClientName, "Meetwell"}};
  EXPECT_EQ(updated(), ReportingState::disabled);
  userInfo = Dictionary{{kTarnelUserInfoClientName, 5}, {kTarnelUserInfoServiceName, "video"}};
  EXPECT_EQ(updated(), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendStateTest, FirstMatchingEntryDecides) {
  auto first = entry;
  first.set("hierarchy", 1);
  auto second = entry;
  second.set("hierarchy", 2);
  auto other = entry;
  other.set("client", "Other");
  clients = Array{other, first, second};
  updated();
  EXPECT_EQ(backend->hierarchy(), 1);
}

// --- batching override ---

TEST_F(HTTPSPostBackendStateTest, ExpediteOverridesBatching) {
  entry.set("expedite", 1);
  updated();
  EXPECT_FALSE(backend->batchEvents());
  expectLog(LogLevel::debug, logPrefix() + "Store bag override  _batchEvent=0");
  entry.set("expedite", 0);
  batch = false;
  updated();
  EXPECT_TRUE(backend->batchEvents());
  expectLog(LogLevel::debug, logPrefix() + "Store bag override  _batchEvent=1");
}

TEST_F(HTTPSPostBackendStateTest, BatchingStaysWithoutExpedite) {
  for (const bool asked : {true, false}) {
    batch = asked;
    updated();
    EXPECT_EQ(backend->batchEvents(), asked);
  }
  EXPECT_TRUE(world.log.startingWith(logPrefix() + "Store bag override").empty());
}

TEST_F(HTTPSPostBackendStateTest, OnlyTheFirstMatchingEntryOverridesBatching) {
  auto second = entry;
  second.set("expedite", 1);
  clients = Array{entry, second};
  updated();
  EXPECT_TRUE(backend->batchEvents());
}

TEST_F(HTTPSPostBackendStateTest, BatchingIsOverriddenEvenWithoutUserInfo) {
  entry.remove("client");
  entry.remove("service");
  entry.set("expedite", 1);
  userInfo.reset();
  EXPECT_EQ(updated(), ReportingState::undecided);
  EXPECT_FALSE(backend->batchEvents());
  requireUserInfo = false;
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_FALSE(backend->batchEvents());
}

// --- without required user information ---

TEST_F(HTTPSPostBackendStateTest, WithoutRequiredUserInfoTheStateIsEnabled) {
  requireUserInfo = false;
  userInfo.reset();
  world.consent.allowed = false;
  entry.remove("filters");
  entry.remove("locale_whitelist");
  entry.remove("sampling_threshold");
  entry.set("hierarchy", 4);
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  EXPECT_EQ(backend->hierarchy(), 0);
  clients = Array{1};
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->postURL(), std::nullopt);
}

TEST_F(HTTPSPostBackendStateTest, WithoutRequiredUserInfoTheFirstEntryWithAnAddressIsTaken) {
  requireUserInfo = false;
  userInfo.reset();
  Dictionary noAddress{
      {"client", "x"}, {"event_threshold", 1}, {"realtime_post_url", "https://first.example"}};
  Dictionary taken{{"client", "y"}, {"event_threshold", 2}, {"post_url", "https://second.example"}};
  clients = Array{noAddress, taken, entry};
  updated();
  EXPECT_EQ(backend->postURL(), "https://second.example");
  expectLog(LogLevel::debug, "resetBackendStateWithClient: event_threshold set to 2");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): Storebag 'https://first.example' for realtimePostURL");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): Storebag 'https://second.example' for postURL");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL 'https://second.example'");
  EXPECT_EQ(world.log.startingWith("HTTPSPostBackend(updatePostLink)").size(), 3U);
}

TEST_F(HTTPSPostBackendStateTest, WithoutAnyAddressTheThresholdIsResetToNothing) {
  requireUserInfo = false;
  entry.remove("post_url");
  entry.remove("realtime_post_url");
  entry.set("extras_on_internal", 1);
  EXPECT_EQ(updated(), ReportingState::enabled);
  expectLog(LogLevel::debug, "resetBackendStateWithClient: event_threshold set to 0");
  expectLog(LogLevel::debug, "setBackendStateWithClient: extras on internal is set to 0");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '(null)'");
}

TEST_F(HTTPSPostBackendStateTest, OwnAddressOfTheSettingsLetsNoEntryBeTaken) {
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", "https://own.example");
  requireUserInfo = false;
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->postURL(), "https://own.example");
  expectLog(LogLevel::debug, "resetBackendStateWithClient: event_threshold set to 0");
  expectLog(
      LogLevel::debug,
      "HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/realtime' for realtimePostURL");
}

// --- hierarchy and consent ---

TEST_F(HTTPSPostBackendStateTest, HierarchyIsThatOfTheEntry) {
  updated();
  EXPECT_EQ(backend->hierarchy(), 0);
  entry.set("hierarchy", 2.9);
  updated();
  EXPECT_EQ(backend->hierarchy(), 2);
}

TEST_F(HTTPSPostBackendStateTest, WithheldConsentDisablesAfterTheHierarchyIsSet) {
  world.consent.allowed = false;
  entry.set("hierarchy", 1);
  EXPECT_EQ(updated(), ReportingState::disabled);
  EXPECT_EQ(backend->hierarchy(), 1);
  expectLog(LogLevel::debug, logPrefix() + "reporting disabled by DNU: 0.");
}

TEST_F(HTTPSPostBackendStateTest, OverrideOtherThanOneRespectsConsent) {
  world.consent.allowed = false;
  entry.set("override_dnu", 2);
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "reporting disabled by DNU: 2.");
}

TEST_F(HTTPSPostBackendStateTest, OverrideOfOneReportsWithoutConsent) {
  world.consent.allowed = false;
  for (const Value& one : {Value(1), Value(true), Value(1.7)}) {
    entry.set("override_dnu", one);
    EXPECT_EQ(updated(), ReportingState::enabled);
  }
}

// 1 overrides consent, and no number that is 1 modulo 2^32.
TEST_F(HTTPSPostBackendStateTest, NumbersOfAnEntryAreHeldToTheirBounds) {
  constexpr int64_t kOneTooHigh = (int64_t{1} << 32) + 1;
  entry.set("hierarchy", kOneTooHigh);
  entry.set("event_threshold", -kOneTooHigh);
  for (const char* key : {"extras_on_internal", "expedite"}) entry.set(key, int64_t{1} << 32);
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_FALSE(backend->batchEvents());
  EXPECT_EQ(backend->hierarchy(), INT32_MAX);
  expectLog(LogLevel::debug, "resetBackendStateWithClient: event_threshold set to -2147483648");
  expectLog(LogLevel::debug, "setBackendStateWithClient: extras on internal is set to 2147483647");
  world.consent.allowed = false;
  for (const Value& notOne : {Value(kOneTooHigh), Value(1 - (int64_t{1} << 32)),
                              Value(uint64_t{1} << 63 | 1U), Value(4294967297.0)}) {
    entry.set("override_dnu", notOne);
    EXPECT_EQ(updated(), ReportingState::disabled) << notOne.description();
  }
}

TEST_F(HTTPSPostBackendStateTest, RefusalLeavesWhatEarlierStepsSet) {
  // The first update takes filters, threshold and consent type; the second is refused at the country.
  entry.set("override_dnu", 1);
  entry.set("sampling_threshold", 0.75);
  updated();
  ASSERT_EQ(backend->state(), ReportingState::enabled);
  world.locale.country = "US";
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::disabled);
  EXPECT_EQ(backend->samplingThreshold(), Value(0.75));
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  backend->setState(ReportingState::enabled);
  send(*backend, 3, Flag::realtime, Dictionary{{"secret", "x"}}, 1);
  const auto event = postedEvents().at(0);
  EXPECT_FALSE(event.contains("secret"));
  EXPECT_EQ(*event.find("Opt"), Value(2));
}

TEST_F(HTTPSPostBackendStateTest, ConsentTypeFollowsTheEntryOfTheClient) {
  auto overriding = entry;
  overriding.set("override_dnu", 1);
  overriding.set("client", "First");
  clients = Array{overriding, entry};
  userInfo->set(kTarnelUserInfoClientName, "First");
  updated();
  userInfo->set(kTarnelUserInfoClientName, "Meetwell");
  backend->setUserInfoDict(userInfo);
  backend->updateState();
  send(*backend, 0, Flag::realtime, Dictionary(), 1);
  EXPECT_EQ(*postedEvents().at(0).find("Opt"), Value(0));
}

// --- country, family, model ---

TEST_F(HTTPSPostBackendStateTest, CountryMustBeListed) {
  world.locale.country = "US";
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "(US) isn't in country code list [\"DE\", \"FR\"]");
}

TEST_F(HTTPSPostBackendStateTest, EntryWithoutCountryListDisables) {
  entry.remove("locale_whitelist");
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "(DE) isn't in country code list (null)");
  entry.set("locale_whitelist", Array());
  EXPECT_EQ(updated(), ReportingState::disabled);
  world.locale.country.reset();
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "((null)) isn't in country code list []");
}

TEST_F(HTTPSPostBackendStateTest, UnknownCountryPasses) {
  world.locale.country.reset();
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, CountryItemsMatchPartlyIgnoringCase) {
  entry.set("locale_whitelist", Array{"d"});
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, FamilyMustBeListedWhereAListIsGiven) {
  entry.set("device_whitelist", Array{"Phone"});
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "(Slate) isn't in device whitelist [\"Phone\"]");
  entry.set("device_whitelist", Array{"Phone", "slate"});
  EXPECT_EQ(updated(), ReportingState::enabled);
  entry.set("device_whitelist", Array());
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, ListedModelIsBarred) {
  entry.set("device_blacklist", Array{"Slate7"});
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "(Slate7,1) is in device blacklist [\"Slate7\"]");
  entry.set("device_blacklist", Array{"Slate8"});
  EXPECT_EQ(updated(), ReportingState::enabled);
  entry.set("device_blacklist", Array());
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendStateTest, UnknownModelIsBarredByAnyList) {
  entry.set("device_blacklist", Array{"Slate8"});
  backend = make();
  backend->setHardwareType(std::nullopt);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::disabled);
  expectLog(LogLevel::debug, logPrefix() + "((null)) is in device blacklist [\"Slate8\"]");
}

TEST_F(HTTPSPostBackendStateTest, FiltersAreRequired) {
  entry.remove("filters");
  EXPECT_EQ(updated(), ReportingState::disabled);
  expectLog(LogLevel::warning, logPrefix() + "filters are required.");
  EXPECT_EQ(backend->samplingThreshold(), std::nullopt);
  entry.set("filters", Array());
  EXPECT_EQ(updated(), ReportingState::enabled);
}

// --- what a decision leaves ---

TEST_F(HTTPSPostBackendStateTest, LogsTheClientThatItFound) {
  entry.set("hierarchy", 1);
  updated();
  expectLog(LogLevel::debug,
            logPrefix() +
                "httppost: client found Meetwell:video-call, state=2, samplingFactor=0.500000, "
                "hierarchy=1");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/post' for postURL");
  expectLog(
      LogLevel::debug,
      "HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/realtime' for realtimePostURL");
}

TEST_F(HTTPSPostBackendStateTest, EntryWithoutAddressKeepsTheOldOne) {
  updated();
  auto bare = entry;
  bare.remove("post_url");
  bare.remove("realtime_post_url");
  clients = Array{bare};
  backend = make();
  backend->setPostURL("https://old.example");
  backend->updateState();
  EXPECT_EQ(backend->postURL(), "https://old.example");
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL 'https://old.example'");
}

TEST_F(HTTPSPostBackendStateTest, OwnAddressThatWasTakenAwayIsForgotten) {
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", "https://own.example");
  updated();
  backend->setPostURL(std::nullopt);
  backend->updateState();
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  backend->setPostURL("https://other.example");
  backend->updateState();
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
}

TEST_F(HTTPSPostBackendStateTest, MissingEventThresholdFlushesBeforeTheSecondEvent) {
  entry.remove("event_threshold");
  updated();
  send(*backend);
  EXPECT_TRUE(world.http.requests().empty());
  send(*backend);
  EXPECT_EQ(postedEvents().size(), 1U);
}

TEST_F(HTTPSPostBackendStateTest, UpdateUndoesWhatAServerDisabled) {
  updated();
  backend->setState(ReportingState::disabled);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
}

}  // namespace
}  // namespace tarnel

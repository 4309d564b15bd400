#include "backends/https/https_post_backend_fixture.h"

// Sampling, and what thresholds, addresses and identifiers become over several updates.

namespace tarnel {
namespace {

class HTTPSPostBackendSamplingTest : public HTTPSPostBackendFixture {
 protected:
  ReportingState updated() {
    backend = makeUpdated();
    return backend->state();
  }
  std::string logPrefix() const { return "HTTPSPostBackend(updateBackendState): "; }
  // The fields of a stop message posted now.
  Dictionary stopEvent(TarnelBackend& backend) {
    send(backend, 0, Flag{3}, Dictionary(), 1);
    const auto events = postedEvents();
    EXPECT_FALSE(events.empty());
    return events.empty() ? Dictionary() : events.back();
  }
  void becomeClient(HTTPSPostBackend& backend, const char* name) {
    userInfo->set(kTarnelUserInfoClientName, name);
    backend.setUserInfoDict(userInfo);
    backend.updateState();
  }

  std::shared_ptr<HTTPSPostBackend> backend;
};

TEST_F(HTTPSPostBackendSamplingTest, MissingThresholdDisablesButSetsTheRest) {
  entry.remove("sampling_threshold");
  entry.set("extras_on_internal", 3);
  EXPECT_EQ(updated(), ReportingState::disabled);
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  expectLog(LogLevel::debug, "resetBackendStateWithClient: event_threshold set to 49");
  expectLog(LogLevel::debug, "setBackendStateWithClient: extras on internal is set to 3");
  expectLog(LogLevel::debug,
            logPrefix() +
                "httppost: client found Meetwell:video-call, state=1, samplingFactor=0.500000, "
                "hierarchy=0");
}

TEST_F(HTTPSPostBackendSamplingTest, DrawUpToTheThresholdEnables) {
  entry.set("sampling_threshold", 0.25);
  entry.set("override_sampling", 0);
  world.random.setUniform(0.25);
  EXPECT_EQ(updated(), ReportingState::enabled);
  world.random.setUniform(0.2500001);
  EXPECT_EQ(updated(), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendSamplingTest, ThresholdOfZeroSamplesOutAllButADrawOfZero) {
  entry.set("sampling_threshold", 0);
  world.random.setUniform(0);
  EXPECT_EQ(updated(), ReportingState::enabled);
  world.random.setUniform(1e-9);
  EXPECT_EQ(updated(), ReportingState::sampledOut);
  world.random.setUniform(0.999);
  EXPECT_EQ(updated(), ReportingState::sampledOut);
}

TEST_F(HTTPSPostBackendSamplingTest, OverrideSamplingBoundsTheSampledOut) {
  entry.set("sampling_threshold", 0.1);
  entry.set("override_sampling", 0.5);
  world.random.setUniform(0.5);
  EXPECT_EQ(updated(), ReportingState::sampledOut);
  world.random.setUniform(0.51);
  EXPECT_EQ(updated(), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendSamplingTest, ThresholdOfTheCountryReplacesTheGeneralOne) {
  entry.set("sampling_threshold", 0.126);
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"US", "de"}}, {"threshold", 0.9}},
                  Dictionary{{"country", Array{"FR", "DE"}}, {"threshold", 0.754}},
                  Dictionary{{"country", Array{"DE"}}, {"threshold", 0.1}}});
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->samplingThreshold(), Value(0.754));
  expectLog(LogLevel::debug, logPrefix() + "sampling threshold for DE changed from 0.13 to 0.75");
  EXPECT_EQ(world.log.startingWith(logPrefix() + "sampling threshold for").size(), 1U);
}

TEST_F(HTTPSPostBackendSamplingTest, OtherCountriesKeepTheGeneralThreshold) {
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"US"}}, {"threshold", 0.1}}, Dictionary{{"threshold", 0.1}}});
  EXPECT_EQ(updated(), ReportingState::enabled);
  world.locale.country.reset();
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->samplingThreshold(), Value(1));
}

TEST_F(HTTPSPostBackendSamplingTest, CountryItemWithoutThresholdTakesTheThresholdAway) {
  entry.set("per_country_sampling_thresholds", Array{Dictionary{{"country", Array{"DE"}}}});
  EXPECT_EQ(updated(), ReportingState::disabled);
  EXPECT_EQ(backend->samplingThreshold(), std::nullopt);
  expectLog(LogLevel::debug, logPrefix() + "sampling threshold for DE changed from 1.00 to 0.00");
}

// --- over several updates ---

TEST_F(HTTPSPostBackendSamplingTest, ThresholdsAreLoggedInSinglePrecision) {
  // In double precision these would read 0.01 and 0.04.
  entry.set("sampling_threshold", 0.005);
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"DE"}}, {"threshold", 0.045}}});
  backend = makeUpdated();
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updateBackendState): sampling threshold for DE changed from 0.00 to 0.05");
  EXPECT_EQ(backend->samplingThreshold(), Value(0.045));
}

TEST_F(HTTPSPostBackendSamplingTest, ThresholdOfAnotherCountryIsNotLogged) {
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"FR"}}, {"threshold", 0.5}}});
  makeUpdated();
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(updateBackendState): sampling threshold for").empty());
}

TEST_F(HTTPSPostBackendSamplingTest, EveryUpdateStartsFromTheGeneralThreshold) {
  entry.set("sampling_threshold", 0.75);
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"FR"}}, {"threshold", 0.125}}});
  world.locale.country = "FR";
  backend = makeUpdated();
  EXPECT_EQ(backend->samplingThreshold(), Value(0.125));
  world.locale.country = "DE";
  backend->updateState();
  EXPECT_EQ(backend->samplingThreshold(), Value(0.75));
}

TEST_F(HTTPSPostBackendSamplingTest, ThresholdIsSentAsTheStorebagHoldsIt) {
  for (const Value& threshold : {Value(true), Value(1), Value(1.0), Value(0.75)}) {
    entry.set("sampling_threshold", threshold);
    EXPECT_EQ(*stopEvent(*makeUpdated()).find("SamplingThreshold"), threshold);
  }
}

TEST_F(HTTPSPostBackendSamplingTest, OverrideSamplingIsReadOnlyWhenTheThresholdFails) {
  entry.set("override_sampling", 0.75);
  EXPECT_EQ(*stopEvent(*makeUpdated()).find("OverrideSampling"), Value(-1));
  // Once read, it stays while the threshold admits the backend.
  entry.set("sampling_threshold", 0);
  entry.set("per_country_sampling_thresholds", Array{Dictionary{{"country", Array{"FR"}}, {"threshold", 1}}});
  backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  world.locale.country = "FR";
  backend->updateState();
  ASSERT_EQ(backend->state(), ReportingState::enabled);
  EXPECT_EQ(*stopEvent(*backend).find("OverrideSampling"), Value(0.75));
}

TEST_F(HTTPSPostBackendSamplingTest, OverrideSamplingGoesWithAnEntryThatHasNone) {
  entry.set("sampling_threshold", 0);
  auto first = entry;
  first.set("client", "First");
  first.set("override_sampling", 0.75);
  clients = Array{first, entry};
  userInfo->set(kTarnelUserInfoClientName, "First");
  backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  becomeClient(*backend, "Meetwell");
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  EXPECT_EQ(*stopEvent(*backend).find("OverrideSampling"), Value(-1));
}

TEST_F(HTTPSPostBackendSamplingTest, ExpediteIsReadAsAnInteger) {
  for (const auto& [expedite, batches] : {std::pair{Value(0.5), true},
                                          {Value(-1), false},
                                          {Value(true), false},
                                          {Value(false), true},
                                          {Value(int64_t{1} << 32), false},
                                          {Value(INT64_MIN), false},
                                          {Value(uint64_t{1} << 63), false},
                                          {Value(-0.9), true}}) {
    entry.set("expedite", expedite);
    EXPECT_EQ(makeUpdated()->batchEvents(), batches) << expedite.description();
  }
}

TEST_F(HTTPSPostBackendSamplingTest, CustomIdentifierStaysWhenTheEntryChanges) {
  auto first = entry;
  first.set("client", "First");
  first.set("custom_clientId", 1);
  clients = Array{first, entry};
  userInfo->set(kTarnelUserInfoClientName, "First");
  backend = makeUpdated();
  const auto custom = world.settings.objectForKey("com.orvane.tarnel", "uuid:First:video-call");
  ASSERT_TRUE(custom);
  becomeClient(*backend, "Meetwell");
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(*messages().at(0).find("clientId"), *custom);
}

TEST_F(HTTPSPostBackendSamplingTest, RealtimeAddressFollowsThePostAddressOfTheSettings) {
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", "https://own.example");
  entry.remove("realtime_post_url");
  backend = makeUpdated();
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL 'https://own.example'");
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(world.http.requests().at(0).url, "https://own.example");
}

TEST_F(HTTPSPostBackendSamplingTest, RealtimeAddressOfTheSettingsDoesNotHideThePostAddress) {
  world.settings.setObject("com.orvane.tarnel", "httpsRealtimePostURL", "https://own.example/rt");
  requireUserInfo = false;
  auto other = entry;
  other.set("post_url", "https://other.example");
  clients = Array{entry, other};
  backend = makeUpdated();
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  EXPECT_EQ(world.log.startingWith("HTTPSPostBackend(updatePostLink)").size(), 1U);
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(world.http.requests().at(0).url, "https://own.example/rt");
}

TEST_F(HTTPSPostBackendSamplingTest, RealtimeAddressOfAnEarlierEntryIsDropped) {
  auto first = entry;
  first.set("client", "First");
  entry.remove("realtime_post_url");
  clients = Array{first, entry};
  userInfo->set(kTarnelUserInfoClientName, "First");
  backend = makeUpdated();
  becomeClient(*backend, "Meetwell");
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(world.http.requests().at(0).url, "https://events.example/post");
}

TEST_F(HTTPSPostBackendSamplingTest, FiltersWithoutMethodApplyToTheUserInfoOfAFlush) {
  entry.set("filters", Array{Dictionary{{"method", 0}, {"status", 0}, {"key", "zero"}, {"action", "remove"}},
                             Dictionary{{"status", 8}, {"key", "eight"}, {"action", "remove"}}});
  backend = makeUpdated();
  send(*backend, 3);
  backend->setUserInfoDict(Dictionary{{"zero", "z"}, {"eight", "e"}});
  flush(*backend);
  const auto event = postedEvents().at(0);
  EXPECT_FALSE(event.contains("zero"));
  EXPECT_EQ(*event.find("eight"), Value("e"));
}

}  // namespace
}  // namespace tarnel

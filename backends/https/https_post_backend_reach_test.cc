#include "backends/https/https_post_backend_fixture.h"

// What docs/storebags.md tells authors of storebags under "What may surprise you". Whoever changes one of
// these changes the text too.

namespace tarnel {
namespace {

using HTTPSPostBackendReachTest = HTTPSPostBackendFixture;

std::string textOf(const Dictionary& event, const char* key) {
  const auto* text = findString(event, key);
  return text == nullptr ? "" : *text;
}

Dictionary removing(const char* key) {
  return {{"key", key}, {"action", "remove"}};
}

TEST_F(HTTPSPostBackendReachTest, EventsHeldBeforeADecisionAreNotFiltered) {
  entry.set("filters", Array{removing("callTitle")});
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::undecided);
  send(*backend, 3, Flag::normal, Dictionary{{"callTitle", "early"}});
  backend->setUserInfoDict(late);
  backend->updateState();
  send(*backend, 3, Flag::normal, Dictionary{{"callTitle", "late"}});
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_EQ(textOf(events[0], "callTitle"), "early");
  EXPECT_FALSE(events[1].contains("callTitle"));
}

TEST_F(HTTPSPostBackendReachTest, EventsOfASessionThatIsSampledOutAreFiltered) {
  entry.set("filters", Array{removing("callTitle")});
  entry.set("sampling_threshold", 0);
  const auto backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  send(*backend, 3, Flag::normal, Dictionary{{"callTitle", "held"}});
  send(*backend, 3, Flag::important);
  flush(*backend);
  ASSERT_EQ(postedEvents().size(), 2U);
  EXPECT_FALSE(postedEvents()[0].contains("callTitle"));
}

TEST_F(HTTPSPostBackendReachTest, AMethodsOwnFilterOfAUserInfoKeyHoldsForAPostOfItsOwnAndNotForABatch) {
  entry.set("filters", Array{Dictionary{{"method", 14}, {"key", "accountName"}, {"action", "remove"}}});
  userInfo->set("accountName", "zoe");
  const auto backend = makeUpdated();
  send(*backend, 14, Flag::realtime);
  send(*backend, 14);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_FALSE(events[0].contains("accountName"));
  EXPECT_EQ(textOf(events[1], "accountName"), "zoe");
}

TEST_F(HTTPSPostBackendReachTest, AFilterForEveryMethodOfAUserInfoKeyHoldsForABatchToo) {
  entry.set("filters", Array{removing("accountName")});
  userInfo->set("accountName", "zoe");
  const auto backend = makeUpdated();
  send(*backend, 14);
  flush(*backend);
  EXPECT_FALSE(postedEvents().at(0).contains("accountName"));
}

TEST_F(HTTPSPostBackendReachTest, TheIdentifierOfASessionIsSetBehindTheFilters) {
  entry.set("filters", Array{removing("_sessionID")});
  const auto backend = makeUpdated();
  backend->setCombinedSessionIDString("own");
  send(*backend, 3, Flag::realtime);
  send(*backend);
  backend->setCorrelatedSessionID("parent.own");
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_FALSE(events[0].contains("_sessionID"));
  EXPECT_EQ(textOf(events[1], "_sessionID"), "parent.own");
}

TEST_F(HTTPSPostBackendReachTest, AnEntryWithoutFiltersLeavesThoseOfTheEntryBeforeInForce) {
  auto other = entry;
  other.set("client", "Other");
  other.set("filters", Array());
  auto third = other;
  third.set("client", "Third");
  third.set("filters", Array{Dictionary{{"key", "-"}, {"action", "keep"}}});
  clients = Array{entry, other, third};
  const auto backend = makeUpdated();
  for (const char* client : {"Other", "Third"}) {
    userInfo->set(kTarnelUserInfoClientName, client);
    backend->setUserInfoDict(userInfo);
    backend->updateState();
    send(*backend, 3, Flag::realtime, Dictionary{{"secret", "s"}});
  }
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_FALSE(events[0].contains("secret"));
  EXPECT_EQ(textOf(events[1], "secret"), "s");
}

TEST_F(HTTPSPostBackendReachTest, TypeOneTakesThePlaceOfFieldsOfItsNames) {
  const auto backend = makeUpdated();
  send(*backend, 9, Flag::realtime, Dictionary{{"Batch", "mine"}}, 1);
  EXPECT_EQ(*postedEvents().at(0).find("Batch"), Value(1));
  send(*backend, 9, Flag::realtime);
  EXPECT_EQ(postedEvents().size(), 2U);  // nothing ended by it
}

TEST_F(HTTPSPostBackendReachTest, CaseCountsInCountriesOfThresholdsAndInActions) {
  world.locale.country = "DE";
  entry.set("locale_whitelist", Array{"de"});
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"de"}}, {"threshold", 0.25}}});
  entry.set("filters", Array{Dictionary{{"key", "SECRET"}, {"action", "Remove"}}});
  const auto backend = makeUpdated();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  EXPECT_EQ(*backend->samplingThreshold(), Value(1));
  send(*backend, 3, Flag::realtime, Dictionary{{"secret", "s"}});
  EXPECT_EQ(textOf(postedEvents().at(0), "secret"), "s");
}

}  // namespace
}  // namespace tarnel

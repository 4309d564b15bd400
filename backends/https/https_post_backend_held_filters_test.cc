#include "backends/https/https_post_backend_fixture.h"

// Held events that pass the filters once more before they are posted, as the administrator may want it.

namespace tarnel {
namespace {

class HTTPSPostBackendHeldFiltersTest : public HTTPSPostBackendFixture {
 protected:
  HTTPSPostBackendHeldFiltersTest() {
    world.dependencies.filterHeldEvents = true;
    filterBy({describe("secret", "remove"), describe("hashed", "sha256")});
  }

  static Dictionary describe(const char* key, const char* action) {
    return {{"key", key}, {"action", action}};
  }
  static Dictionary describe(int method, const char* key, const char* action) {
    return {{"method", method}, {"key", key}, {"action", action}};
  }
  void filterBy(const std::vector<Dictionary>& descriptions) {
    Array list;
    for (const auto& description : descriptions) list.append(description);
    entry.set("filters", list);
  }
  static Value digest(const std::string& text) { return TarnelBackend::convertIntoSHA256(text); }

  // Undecided until `decide`, when it has the user information and its filters.
  std::shared_ptr<HTTPSPostBackend> makeUndecided() {
    auto made = make();
    made->setUserInfoDict(std::nullopt);
    made->updateState();
    EXPECT_EQ(made->state(), ReportingState::undecided);
    return made;
  }
  void decide(HTTPSPostBackend& backend) {
    backend.setUserInfoDict(userInfo);
    backend.updateState();
    EXPECT_EQ(backend.state(), ReportingState::enabled);
  }

  const Dictionary payload{{"secret", "s"}, {"hashed", "h"}, {"a", 1}};
};

TEST_F(HTTPSPostBackendHeldFiltersTest, SwitchedOffEventsFromBeforeTheDecisionKeepTheirFields) {
  world.dependencies.filterHeldEvents = false;
  const auto backend = makeUndecided();
  send(*backend, 3, Flag::normal, payload);
  decide(*backend);
  flush(*backend);
  const auto event = postedEvents().at(0);
  EXPECT_EQ(*event.find("secret"), Value("s"));
  EXPECT_EQ(*event.find("hashed"), Value("h"));
}

TEST_F(HTTPSPostBackendHeldFiltersTest, EventsFromBeforeTheDecisionAreFiltered) {
  const auto backend = makeUndecided();
  send(*backend, 3, Flag::normal, payload);
  decide(*backend);
  flush(*backend);
  const auto event = postedEvents().at(0);
  EXPECT_FALSE(event.contains("secret"));
  EXPECT_EQ(*event.find("hashed"), digest("h"));
  EXPECT_EQ(*event.find("a"), Value(1));
}

TEST_F(HTTPSPostBackendHeldFiltersTest, EachEventIsFilteredByItsOwnMethodAndStatus) {
  filterBy(
      {describe(3, "three", "remove"), Dictionary{{"status", 9}, {"key", "nine"}, {"action", "remove"}}});
  const auto backend = makeUndecided();
  const Dictionary both{{"three", 1}, {"nine", 1}};
  send(*backend, 3, Flag::normal, both, 8);
  send(*backend, 4, Flag::normal, both, 9);
  decide(*backend);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_FALSE(events[0].contains("three"));
  EXPECT_TRUE(events[0].contains("nine"));
  EXPECT_TRUE(events[1].contains("three"));
  EXPECT_FALSE(events[1].contains("nine"));
}

TEST_F(HTTPSPostBackendHeldFiltersTest, EventsThatWereFilteredAreDigestedOnce) {
  const auto backend = makeUpdated();
  send(*backend, 3, Flag::normal, payload);
  flush(*backend);
  send(*backend, 3, Flag::realtime, payload);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  for (const auto& event : events) {
    EXPECT_EQ(*event.find("hashed"), digest("h"));
    EXPECT_FALSE(event.contains("secret"));
  }
}

// User information counts as method 0 when it is merged; then it is a part of the event.
TEST_F(HTTPSPostBackendHeldFiltersTest, UserInfoIsFilteredByTheMethodOfItsEventToo) {
  filterBy({describe(3, "removed", "remove"), describe(3, "hashed", "sha256"), describe(0, "zero", "sha256"),
            describe(3, "zero", "sha256"), describe("all", "sha256"), describe(0, "gone", "remove")});
  *userInfo = Dictionary{{kTarnelUserInfoClientName, "Meetwell"},
                         {kTarnelUserInfoServiceName, "video"},
                         {"removed", "u"},
                         {"hashed", "u"},
                         {"zero", "u"},
                         {"all", "u"},
                         {"gone", "u"}};
  const auto backend = makeUndecided();
  send(*backend, 3);
  send(*backend, 4);
  decide(*backend);
  send(*backend, 3);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 3U);
  for (const size_t i : {0U, 2U}) {
    EXPECT_FALSE(events[i].contains("removed")) << i;
    EXPECT_EQ(*events[i].find("hashed"), digest("u")) << i;
  }
  EXPECT_EQ(*events[1].find("removed"), Value("u"));
  EXPECT_EQ(*events[1].find("hashed"), Value("u"));
  for (const auto& event : events) {
    EXPECT_EQ(*event.find("zero"), digest("u"));
    EXPECT_EQ(*event.find("all"), digest("u"));
  }
  EXPECT_FALSE(events[0].contains("gone"));
  EXPECT_FALSE(events[1].contains("gone"));
}

// What one table has digested stays so under the next, which may still remove it.
TEST_F(HTTPSPostBackendHeldFiltersTest, AnotherTableFiltersWhatTheFirstLeft) {
  filterBy({describe("hashed", "sha256"), describe("b", "sha256"), describe("c", "remove")});
  auto second = entry;
  second.set("client", "Second");
  second.set("filters",
             Array{describe("hashed", "sha256"), describe("b", "remove"), describe("d", "sha256")});
  clients = Array{entry, second};
  const auto backend = makeUpdated();
  send(*backend, 3, Flag::normal, Dictionary{{"hashed", "h"}, {"b", "b"}, {"c", "c"}, {"d", "d"}});
  userInfo->set(kTarnelUserInfoClientName, "Second");
  decide(*backend);
  flush(*backend);
  const auto event = postedEvents().at(0);
  EXPECT_EQ(*event.find("hashed"), digest("h"));
  EXPECT_FALSE(event.contains("b"));
  EXPECT_FALSE(event.contains("c"));
  EXPECT_EQ(*event.find("d"), digest("d"));
}

TEST_F(HTTPSPostBackendHeldFiltersTest, ALabelThatComesLateIsFiltered) {
  filterBy({describe("_sessionID", "sha256")});
  const auto backend = makeUpdated();
  backend->setCombinedSessionIDString("own");
  send(*backend);
  backend->setCorrelatedSessionID("top.own");
  send(*backend);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  for (const auto& event : events) EXPECT_EQ(*event.find("_sessionID"), digest("top.own"));
}

// An event that does not fit into a message any more comes first in the next, and is not changed twice.
TEST_F(HTTPSPostBackendHeldFiltersTest, EventsOfSeveralMessagesAreDigestedOnce) {
  filterBy({describe("hashed", "sha256"), describe("user", "sha256"), describe("secret", "remove")});
  const auto backend = makeUndecided();
  for (int i = 0; i < 4; ++i) send(*backend, i, Flag::normal, payload);
  userInfo->set("user", "u");
  userInfo->set("large", std::string(EventBatch::kMaxBytes / 5 * 2, 'x'));
  decide(*backend);
  flush(*backend);
  EXPECT_EQ(world.http.requests().size(), 2U);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 4U);
  for (const auto& event : events) {
    EXPECT_EQ(*event.find("hashed"), digest("h"));
    EXPECT_EQ(*event.find("user"), digest("u"));
    EXPECT_FALSE(event.contains("secret"));
  }
}

// What the filters take away takes no room in a message.
TEST_F(HTTPSPostBackendHeldFiltersTest, AMessageIsFilledWithWhatIsLeft) {
  const auto backend = makeUndecided();
  constexpr size_t kQuarter = EventBatch::kMaxBytes / 4 - 8192;
  for (int i = 0; i < 3; ++i)
    send(*backend, i, Flag::normal, Dictionary{{"secret", std::string(kQuarter, 's')}});
  userInfo->set("large", std::string(kQuarter, 'x'));
  decide(*backend);
  flush(*backend);
  EXPECT_EQ(messages().size(), 1U);
  EXPECT_EQ(postedEvents().size(), 3U);
}

// The names of many digested fields are counted in what a batch may hold.
TEST_F(HTTPSPostBackendHeldFiltersTest, WhatIsRememberedOfDigestsIsBounded) {
  const std::string name(10000, 'n');
  filterBy({describe(name.c_str(), "sha256")});
  const auto backend = makeUpdated();
  backend->setState(ReportingState::sampledOut);
  const size_t kMost = EventBatch::kMaxBytes / (2 * name.size());
  for (size_t i = 0; i < kMost; ++i)
    send(*backend, static_cast<int>(i), Flag::normal, Dictionary{{name, "v"}});
  EXPECT_FALSE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
}

}  // namespace
}  // namespace tarnel

#include "backends/https/https_post_backend_fixture.h"

// A verified profile may still hold values of the wrong type.

namespace tarnel {
namespace {

class HTTPSPostBackendWrongTypesTest : public HTTPSPostBackendFixture {
 protected:
  ReportingState updated() {
    backend = makeUpdated();
    return backend->state();
  }

  std::shared_ptr<HTTPSPostBackend> backend;
};

struct WrongType {
  const char* key;
  Value value;
  const char* expected;
  ReportingState state;  // as for an entry without the key
};

class HTTPSPostBackendWrongTypeTest : public HTTPSPostBackendWrongTypesTest,
                                      public ::testing::WithParamInterface<WrongType> {};

TEST_P(HTTPSPostBackendWrongTypeTest, CountsAsAbsentWithOneWarning) {
  world.random.setUniform(0.5);
  if (std::string_view(GetParam().key) == "override_sampling") entry.set("sampling_threshold", 0.1);
  entry.set(GetParam().key, GetParam().value);
  EXPECT_EQ(updated(), GetParam().state);
  expectLog(LogLevel::warning, kWarning + std::string("clients[0].") + GetParam().key + " is not " +
                                   GetParam().expected + " and counts as absent");
  EXPECT_EQ(world.log.startingWith(kWarning + std::string("clients[0].")).size(), 1U);
  EXPECT_EQ(batch, backend->batchEvents());
}

INSTANTIATE_TEST_SUITE_P(
    Keys, HTTPSPostBackendWrongTypeTest,
    ::testing::Values(WrongType{"expedite", "yes", "a number", ReportingState::enabled},
                      WrongType{"hierarchy", "1", "a number", ReportingState::enabled},
                      WrongType{"override_dnu", Value(), "a number", ReportingState::enabled},
                      WrongType{"locale_whitelist", "DE", "an array", ReportingState::disabled},
                      WrongType{"device_whitelist", Dictionary(), "an array", ReportingState::enabled},
                      WrongType{"device_blacklist", "Slate7,1", "an array", ReportingState::enabled},
                      WrongType{"filters", Dictionary(), "an array", ReportingState::disabled},
                      WrongType{"sampling_threshold", "1", "a number", ReportingState::disabled},
                      WrongType{"per_country_sampling_thresholds", 1, "an array", ReportingState::enabled},
                      WrongType{"override_sampling", Date{1}, "a number", ReportingState::sampledOut},
                      WrongType{"custom_clientId", Value(), "a value", ReportingState::enabled},
                      WrongType{"event_threshold", "5", "a number", ReportingState::enabled},
                      WrongType{"extras_on_internal", Data{1}, "a number", ReportingState::enabled},
                      WrongType{"post_url", 5, "a text", ReportingState::enabled},
                      WrongType{"realtime_post_url", Array(), "a text", ReportingState::enabled}),
    [](const auto& parameter) { return std::string(parameter.param.key); });

// Nobody can tell for whom such an entry is meant, so it is for nobody, rather than for everybody.
TEST_F(HTTPSPostBackendWrongTypesTest, NamesOfAnotherKindMatchNobody) {
  const auto right = entry;
  for (const char* key : {"client", "service"}) {
    for (const auto& value : {Value(1), Value(), Value(Array{"Meetwell", "video"}), Value(Dictionary()),
                              Value(Data{77}), Value(Date{1}), Value(true), Value(0.5)}) {
      world.log.clear();
      entry = right;
      entry.set(key, value);
      EXPECT_EQ(updated(), ReportingState::disabled) << key << " " << value.description();
      expectLog(LogLevel::warning,
                kWarning + std::string("clients[0].") + key + " is not a text and matches nobody");
      EXPECT_EQ(world.log.startingWith(kWarning).size(), 1U);
    }
  }
}

TEST_F(HTTPSPostBackendWrongTypesTest, AnEntryForNobodyLeavesItsPlaceToTheNext) {
  auto wrong = entry;
  wrong.set("client", 1);
  wrong.set("expedite", 1);
  wrong.set("override_dnu", 1);
  clients = Array{wrong, entry};
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_TRUE(backend->batchEvents());
  send(*backend, 0, Flag::realtime, Dictionary(), 1);
  EXPECT_EQ(*postedEvents().at(0).find("Opt"), Value(0)) << "consent was not overridden";
}

TEST_F(HTTPSPostBackendWrongTypesTest, WithoutNamesAnEntryForNobodyStillMatchesNobody) {
  userInfo = Dictionary{{"u", 1}};
  entry.remove("client");
  entry.remove("service");
  EXPECT_EQ(updated(), ReportingState::enabled);
  entry.set("service", 1);
  EXPECT_EQ(updated(), ReportingState::disabled);
}

// Where no user information is required nobody is asked for a name: the first address counts, whosever it is.
TEST_F(HTTPSPostBackendWrongTypesTest, AddressesOfAnEntryForNobodyCountWithoutRequiredUserInfo) {
  requireUserInfo = false;
  entry.set("client", 1);
  entry.set("expedite", 1);
  EXPECT_EQ(updated(), ReportingState::enabled);
  EXPECT_EQ(backend->postURL(), "https://events.example/post");
  EXPECT_TRUE(backend->batchEvents()) << "but batching is for those whom the entry names";
}

TEST_F(HTTPSPostBackendWrongTypesTest, WrongTypesInsideListsCountAsAbsent) {
  entry.set("locale_whitelist", Array{1, "DE", 2});
  entry.set("per_country_sampling_thresholds",
            Array{"x", Dictionary{{"country", "DE"}, {"threshold", 0}},
                  Dictionary{{"country", Array{1, "DE"}}, {"threshold", "0"}}});
  EXPECT_EQ(updated(), ReportingState::disabled);
  for (const char* text : {"clients[0].locale_whitelist[0] is not a text",
                           "clients[0].per_country_sampling_thresholds[0] is not a dictionary",
                           "clients[0].per_country_sampling_thresholds[1].country is not an array",
                           "clients[0].per_country_sampling_thresholds[2].country[0] is not a text",
                           "clients[0].per_country_sampling_thresholds[2].threshold is not a number"}) {
    expectLog(LogLevel::warning, kWarning + std::string(text) + " and counts as absent");
  }
  EXPECT_EQ(world.log.startingWith(kWarning + std::string("clients[0].")).size(), 5U);
}

TEST_F(HTTPSPostBackendWrongTypesTest, ListWithoutAnyTextCountsAsEmpty) {
  entry.set("device_whitelist", Array{1, 2});
  EXPECT_EQ(updated(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendWrongTypesTest, EveryUpdateWarnsAnew) {
  entry.set("hierarchy", "1");
  updated();
  backend->updateState();
  EXPECT_EQ(world.log.startingWith(kWarning + std::string("clients[0].hierarchy")).size(), 2U);
}

TEST_F(HTTPSPostBackendWrongTypesTest, ManyWrongEntriesAreOneWarning) {
  for (int i = 0; i < 100; ++i) clients.append(Dictionary{{"client", 1}, {"service", 1}});
  EXPECT_EQ(updated(), ReportingState::disabled);
  EXPECT_EQ(world.log.startingWith(kWarning).size(), 1U);
}

}  // namespace
}  // namespace tarnel

#include <limits>

#include "backends/https/https_post_backend_fixture.h"

namespace tarnel {
namespace {

using ::testing::ElementsAre;

class HTTPSPostBackendEventsTest : public HTTPSPostBackendFixture {
 protected:
  // A message 10.5 seconds after the start at 12:34:56.789 on some day.
  static constexpr TimeValue kStart{1699964896 + 0, 789000};
  static constexpr int64_t kMinute = 1699964880 + 0;

  Dictionary newEvent(HTTPSPostBackend& backend, const MaybeDictionary& payload = std::nullopt,
                      TimeValue timestamp = {1700000060, 750000}) {
    return backend.newEventDictfromPayload(payload, timestamp, Method{3}, RespCode{8}, EventID{999});
  }
  std::string json(const Dictionary& event) {
    const auto backend = make();
    Array events{Value(event)};
    return backend->createMessageForPostAndLogging(events, nullptr).value_or("none");
  }
};

TEST_F(HTTPSPostBackendEventsTest, SetsTheStandardFieldsInOrder) {
  const auto backend = makeUpdated();
  backend->setCombinedSessionIDString("top.own");
  send(*backend);
  const auto event = newEvent(*backend, Dictionary{{"own", "x"}});
  EXPECT_THAT(namesOf(event),
              ElementsAre("own", "_startTS", "_sender", "_clientVersion", "_sessionID", "_eventNumber",
                          "_method", "_status", "_clientTS", "eventTime", "_productFamily", "_productModel",
                          "_osVersion", "_build", "_internal", "_reportVers", "_timezoneOffset"));
  EXPECT_EQ(event, (Dictionary{{"own", "x"},
                               {"_startTS", 1700000040},
                               {"_sender", "PLMA"},
                               {"_clientVersion", 5},
                               {"_sessionID", "top.own"},
                               {"_eventNumber", 1},
                               {"_method", 3},
                               {"_status", 8},
                               {"_clientTS", 1700000055.5},
                               {"eventTime", 1700000055.5},
                               {"_productFamily", "Slate"},
                               {"_productModel", "Slate7,1"},
                               {"_osVersion", "12.5"},
                               {"_build", "24A100"},
                               {"_internal", 2},
                               {"_reportVers", "3.2"},
                               {"_timezoneOffset", 3600}}));
}

TEST_F(HTTPSPostBackendEventsTest, WritesEachFieldWithItsJsonType) {
  const auto backend = makeUpdated();
  backend->setStartTimestamp({1700000040, 0});
  backend->setCombinedSessionIDString("top.own");
  const auto text = json(newEvent(*backend, std::nullopt, {1700000041, 0}));
  for (const char* field :
       {R"("_startTS":1700000040,)", R"("_sender":"PLMA",)", R"("_clientVersion":5,)",
        R"("_sessionID":"top.own",)", R"("_eventNumber":0,)", R"("_method":3,)", R"("_status":8,)",
        R"("_clientTS":1700000041.0,)", R"("eventTime":1700000041.0,)", R"("_productFamily":"Slate",)",
        R"("_productModel":"Slate7,1",)", R"("_osVersion":"12.5",)", R"("_build":"24A100",)",
        R"("_internal":2,)", R"("_reportVers":"3.2",)", R"("_timezoneOffset":3600})"}) {
    EXPECT_THAT(text, ::testing::HasSubstr(field));
  }
}

TEST_F(HTTPSPostBackendEventsTest, StartIsRoundedToTheMinuteAndTheOffsetKept) {
  const auto backend = make();
  backend->setStartTimestamp(kStart);
  const auto event = newEvent(*backend, std::nullopt, {kStart.seconds + 11, 289000});
  EXPECT_EQ(*event.find("_startTS"), Value(kMinute));
  EXPECT_NEAR(event.find("_clientTS")->doubleValue(), static_cast<double>(kMinute) + 10.5, 1e-6);
  EXPECT_EQ(*event.find("_clientTS"), *event.find("eventTime"));
}

TEST_F(HTTPSPostBackendEventsTest, TimesBeforeTheEpochAreCutTowardZero) {
  const auto backend = make();
  backend->setStartTimestamp({-61, 500000});  // -60.5 s
  EXPECT_EQ(*newEvent(*backend).find("_startTS"), Value(-60));
  backend->setStartTimestamp({-60, 500000});  // -59.5 s
  EXPECT_EQ(*newEvent(*backend).find("_startTS"), Value(0));
  backend->setStartTimestamp({-125, 0});
  const auto event = newEvent(*backend, std::nullopt, {-120, 0});
  EXPECT_EQ(*event.find("_startTS"), Value(-120));
  EXPECT_EQ(*event.find("_clientTS"), Value(-115.0));
}

// Times come as integers: the most extreme are finite, however far apart, and keep their offset.
TEST_F(HTTPSPostBackendEventsTest, ExtremeTimesKeepTheirOffset) {
  const auto backend = make();
  const auto max = std::numeric_limits<int64_t>::max();
  const auto min = std::numeric_limits<int64_t>::min();
  backend->setStartTimestamp({min, 0});
  auto event = newEvent(*backend, std::nullopt, {max, 999999});
  EXPECT_EQ(*event.find("_startTS"), Value(min / 60 * 60));
  EXPECT_EQ(*event.find("_clientTS"), Value(9223372036854775808.0));
  EXPECT_EQ(*event.find("eventTime"), Value(9223372036854775808.0));
  backend->setStartTimestamp({max, 999999});
  event = newEvent(*backend, std::nullopt, {min, 0});
  EXPECT_EQ(*event.find("_startTS"), Value(max / 60 * 60));
  EXPECT_EQ(*event.find("_clientTS"), Value(-9223372036854775808.0));
  world.clock.set({max, 999999});
  Array events{Value(event)};
  EXPECT_EQ(*parsed(*backend->createMessageForPostAndLogging(events, nullptr)).find("postTime"),
            Value(9223372036854775808.0));
}

TEST_F(HTTPSPostBackendEventsTest, PayloadEntriesOfTheSameNameAreReplacedInTheirPlace) {
  const auto backend = make();
  const Dictionary payload{{"_method", "mine"}, {"x", 1}, {"eventTime", 0}};
  const auto event = newEvent(*backend, payload);
  EXPECT_EQ(*event.find("_method"), Value(3));
  EXPECT_EQ(*event.find("eventTime"), *event.find("_clientTS"));
  EXPECT_EQ(namesOf(event)[0], "_method");
  EXPECT_EQ(payload, (Dictionary{{"_method", "mine"}, {"x", 1}, {"eventTime", 0}}));
}

TEST_F(HTTPSPostBackendEventsTest, EventNumberIsTheRunningOneNotTheArgument) {
  const auto backend = makeUpdated();
  EXPECT_EQ(*newEvent(*backend).find("_eventNumber"), Value(0));
  send(*backend);
  send(*backend);
  EXPECT_EQ(*newEvent(*backend).find("_eventNumber"), Value(2));
}

TEST_F(HTTPSPostBackendEventsTest, SessionNumberIsSentOnlyByThreeClientTypesOnInternalBuilds) {
  for (int32_t type = 0; type <= 17; ++type) {
    internal = true;
    auto backend = make();
    backend->setCompType(type);
    backend->setCombinedSessionIDString("text");
    const bool number = type == 7 || type == 11 || type == 13;
    EXPECT_EQ(*newEvent(*backend).find("_sessionID"), number ? Value(77) : Value("text")) << type;
    internal = false;
    backend = make();
    backend->setCompType(type);
    backend->setCombinedSessionIDString("text");
    EXPECT_EQ(*newEvent(*backend).find("_sessionID"), Value("text")) << type;
  }
}

TEST_F(HTTPSPostBackendEventsTest, SessionIdentifierIsAbsentUntilSet) {
  EXPECT_FALSE(newEvent(*make()).contains("_sessionID"));
  internal = true;
  const auto backend = make();
  backend->setCompType(7);
  EXPECT_EQ(*newEvent(*backend).find("_sessionID"), Value(77));
}

TEST_F(HTTPSPostBackendEventsTest, SessionNumberHas32BitsWithoutASign) {
  internal = true;
  const auto backend = make();
  backend->setCompType(11);
  backend->setSessionID(4294967295U);
  EXPECT_THAT(json(newEvent(*backend)), ::testing::HasSubstr(R"("_sessionID":4294967295,)"));
}

TEST_F(HTTPSPostBackendEventsTest, SystemVersionAndBuildAreAbsentWhenUnknown) {
  const auto backend = make();
  backend->setProductVersion(std::nullopt);
  backend->setBuildVersion(std::nullopt);
  backend->setHardwareType(std::nullopt);
  const auto event = newEvent(*backend);
  EXPECT_FALSE(event.contains("_osVersion"));
  EXPECT_FALSE(event.contains("_build"));
  EXPECT_EQ(*event.find("_productModel"), Value(""));
}

TEST_F(HTTPSPostBackendEventsTest, InternalIsThreeOnAnInternalBuild) {
  world.deviceInformation.answers["ReleaseType"] = "Internal";
  EXPECT_EQ(*newEvent(*make()).find("_internal"), Value(3));
}

TEST_F(HTTPSPostBackendEventsTest, ReportVersionFollowsTheSelfVersion) {
  const auto backend = make();
  EXPECT_EQ(*newEvent(*backend).find("_reportVers"), Value("3.2"));
  backend->setSelfVersion("255.0");
  EXPECT_EQ(*newEvent(*backend).find("_reportVers"), Value("255.0"));
  backend->setSelfVersion("0");
  EXPECT_EQ(*newEvent(*backend).find("_reportVers"), Value("0.0"));
}

TEST_F(HTTPSPostBackendEventsTest, TimeZoneOffsetIsThatOfTheTimeOfBuilding) {
  const auto backend = make();
  EXPECT_EQ(*newEvent(*backend).find("_timezoneOffset"), Value(3600));
  world.locale.offset = -7200;
  world.clock.advance(1);
  EXPECT_EQ(*newEvent(*backend).find("_timezoneOffset"), Value(-7200));
}

TEST_F(HTTPSPostBackendEventsTest, UserInformationWinsOverPayloadAndStandardFields) {
  userInfo->set("_sender", "me");
  userInfo->set("own", "from user info");
  const auto backend = make();
  auto event = newEvent(*backend, Dictionary{{"own", "from payload"}, {"other", 1}});
  backend->prepareEventForMessage(event);
  EXPECT_EQ(*event.find("_sender"), Value("me"));
  EXPECT_EQ(*event.find("own"), Value("from user info"));
  EXPECT_EQ(*event.find("other"), Value(1));
  EXPECT_EQ(*event.find(kTarnelUserInfoClientName), Value("Meetwell"));
}

TEST_F(HTTPSPostBackendEventsTest, FiltersSeePayloadStandardFieldsAndUserInformation) {
  entry.set("filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}},
                             Dictionary{{"key", "_build"}, {"action", "remove"}},
                             Dictionary{{"key", kTarnelUserInfoClientName}, {"action", "sha256"}}});
  const auto backend = makeUpdated();
  auto event = newEvent(*backend, Dictionary{{"secret", "s"}});
  backend->prepareEventForMessage(event);
  EXPECT_FALSE(event.contains("secret"));
  EXPECT_FALSE(event.contains("_build"));
  EXPECT_EQ(*event.find(kTarnelUserInfoClientName), Value(TarnelBackend::convertIntoSHA256("Meetwell")));
}

// --- batching ---

TEST_F(HTTPSPostBackendEventsTest, FiftyEventsOfAMethodFitAndTheNextFlushesFirst) {
  const auto backend = makeUpdated();
  for (int i = 0; i < 50; ++i) EXPECT_EQ(send(*backend, 3), std::nullopt);
  for (int i = 0; i < 10; ++i) EXPECT_EQ(send(*backend, 4), std::nullopt);
  EXPECT_TRUE(world.http.requests().empty());
  const auto text = send(*backend, 3);
  ASSERT_TRUE(text);
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for "
            "method 3");
  // All methods go, in order of arrival; the event that came last starts the next batch.
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 60U);
  for (size_t i = 0; i < events.size(); ++i) EXPECT_EQ(*events[i].find("_eventNumber"), Value(i + 1));
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  EXPECT_EQ(*postedEvents().back().find("_eventNumber"), Value(61));
}

TEST_F(HTTPSPostBackendEventsTest, FlushClearsTheCountsOfAllMethods) {
  entry.set("event_threshold", 1);
  const auto backend = makeUpdated();
  send(*backend, 3);
  send(*backend, 3);
  send(*backend, 4);
  send(*backend, 4);
  send(*backend, 3);  // flushes four
  EXPECT_EQ(postedEvents().size(), 4U);
  send(*backend, 4);
  send(*backend, 4);
  EXPECT_EQ(postedEvents().size(), 4U);
  send(*backend, 4);
  EXPECT_EQ(postedEvents().size(), 7U);
}

TEST_F(HTTPSPostBackendEventsTest, ThresholdOfZeroFlushesBeforeTheSecondEventOfAMethod) {
  entry.set("event_threshold", 0);
  const auto backend = makeUpdated();
  send(*backend, 3);
  send(*backend, 4);
  EXPECT_TRUE(world.http.requests().empty());
  send(*backend, 3);
  EXPECT_EQ(postedEvents().size(), 2U);
}

TEST_F(HTTPSPostBackendEventsTest, NegativeThresholdFlushesBeforeEveryEvent) {
  entry.set("event_threshold", -1);
  const auto backend = makeUpdated();
  // The batch is there but empty: an empty list of events is posted.
  send(*backend, 3);
  EXPECT_EQ(messages().size(), 1U);
  EXPECT_EQ(postedEvents().size(), 0U);
  send(*backend, 4);
  EXPECT_EQ(postedEvents().size(), 1U);
  send(*backend, 5);
  EXPECT_EQ(postedEvents().size(), 2U);
}

TEST_F(HTTPSPostBackendEventsTest, EventWithoutAMethodCountsAsMethodZero) {
  entry.set("event_threshold", 0);
  const auto backend = makeUpdated();
  EXPECT_EQ(backend->batchEvent({{"a", 1}}), std::nullopt);
  EXPECT_TRUE(backend->batchEvent({{"a", 2}, {"_method", 0}}));
  EXPECT_EQ(postedEvents().size(), 1U);
}

TEST_F(HTTPSPostBackendEventsTest, DiscardedBatchKeepsItsCounts) {
  entry.set("event_threshold", 1);
  entry.set("sampling_threshold", 0);
  const auto backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  send(*backend, 3);
  send(*backend, 3);
  send(*backend, 4);
  send(*backend, 4);
  EXPECT_EQ(flush(*backend).second->localizedDescription(), "Nothing to flush");
  // Both methods still count two: the next event of each goes over the threshold.
  send(*backend, 4);
  backend->setState(ReportingState::enabled);
  world.log.clear();
  send(*backend, 3);
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for "
            "method 3");
  EXPECT_EQ(postedEvents().size(), 1U);
}

TEST_F(HTTPSPostBackendEventsTest, HeldEventsAreBoundedAndTheOldestDropped) {
  userInfo.reset();
  const auto backend = makeUpdated();
  backend->setState(ReportingState::enabled);
  const Dictionary large{{"text", std::string(900000, 'x')}};
  for (int i = 1; i <= 12; ++i) send(*backend, i, Flag::normal, large);
  EXPECT_EQ(world.log.startingWith("HTTPSPostBackend(batchEvent): httppost: ").size(), 1U);
  EXPECT_TRUE(world.log.contains(
      LogLevel::warning,
      "HTTPSPostBackend(batchEvent): httppost: 3 events are held; dropping the oldest to stay within 10000 "
      "events and 4194304 bytes"));
  backend->setUserInfoDict(Dictionary{{"u", 1}});
  backend->setPostURL("https://events.example/post");
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 4U);
  EXPECT_EQ(*events[0].find("_eventNumber"), Value(9));
  EXPECT_EQ(*events[3].find("_eventNumber"), Value(12));
}

TEST_F(HTTPSPostBackendEventsTest, FullBatchThatMayBeFlushedIsFlushedWhole) {
  const auto backend = makeUpdated();
  const Dictionary large{{"text", std::string(900000, 'x')}};
  for (int i = 1; i <= 12; ++i) send(*backend, i, Flag::normal, large);
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 12U);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
}

}  // namespace
}  // namespace tarnel

#include "backends/dashboard/dashboard_backend_fixture.h"
#include "tarnel/keys.h"

// Making a dashboard backend, and what is left when that fails.

namespace tarnel {
namespace {

using Calls = std::vector<std::string>;

class DashboardBackendInitTest : public DashboardBackendFixture {
 protected:
  static std::vector<Value> valuesWithoutANumber() {
    return {Value("soon"),
            Value(""),
            Value(),
            Value(Array{200}),
            Value(Dictionary{{"ms", 200}}),
            Value(Date{200}),
            Value(Data{50, 48, 48})};
  }
  // Nothing was made, one line says why, and nothing is left once the queue has settled.
  void expectFailure(const std::shared_ptr<DashboardBackend>& backend, const std::string& text) {
    EXPECT_EQ(backend, nullptr);
    expectLog(LogLevel::error, text);
    EXPECT_EQ(world.log.lines().size(), 1U);
    world.workQueues.runUntilIdle();
    EXPECT_TRUE(nothingIsLeft());
    for (const auto& record : world.datagramSockets.records) EXPECT_EQ(record->closes, 1);
  }
};

TEST_F(DashboardBackendInitTest, ProfileWithoutReliableConnectsAndTicksEveryHalfSecond) {
  const auto backend = make(profileOf({{"display_url", "https://show.example"}}));
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(socket().calls, (Calls{"suppressBrokenPipeSignal", "connectTo"}));
  EXPECT_EQ(socket().peer, (Ipv4Address{0xC0000207, 8125}));
  EXPECT_EQ(backend->socketDescriptor(), socket().descriptor);
  EXPECT_EQ(world.workQueues.labels, Calls{"com.orvane.Tarnel.networkProc"});
  using Timers = std::vector<std::pair<std::chrono::nanoseconds, std::chrono::nanoseconds>>;
  EXPECT_EQ(world.workQueues.timersMade, (Timers{{milliseconds(500), milliseconds(100)}}));
  EXPECT_EQ(world.workQueues.timers(), 1U);
  EXPECT_TRUE(world.workQueues.readSourcesMade.empty());
  EXPECT_EQ(backend->displayURL(), "https://show.example");
  EXPECT_EQ(backend->name(), "dashboard");
  EXPECT_EQ(backend->productFamily(), "Slate");
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendInitTest, DisplayUrlMayBeAbsent) {
  EXPECT_EQ(make(profileOf())->displayURL(), std::nullopt);
}

TEST_F(DashboardBackendInitTest, ReliableProfileBindsBeforeItConnects) {
  const auto backend = make(profileOf({{"reliable", 200}}));
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(socket().calls, (Calls{"suppressBrokenPipeSignal", "bindToWildcard", "connectTo"}));
  EXPECT_EQ(world.workQueues.readSourcesMade, std::vector<int>{socket().descriptor});
  EXPECT_EQ(world.workQueues.readSources(), 1U);
  EXPECT_EQ(world.workQueues.timersMade.at(0).first, milliseconds(200));
  EXPECT_EQ(world.workQueues.timersMade.at(0).second, milliseconds(100));
}

TEST_F(DashboardBackendInitTest, AnyReliableValueTurnsReliableDeliveryOn) {
  for (const auto& [value, period] : std::vector<std::pair<Value, int>>{{0, 1},
                                                                        {-7, 1},
                                                                        {false, 1},
                                                                        {true, 1},
                                                                        {1, 1},
                                                                        {2.9, 2},
                                                                        {5, 5},
                                                                        {INT64_MAX, 3600000},
                                                                        {UINT64_MAX, 3600000},
                                                                        {"200", 200},
                                                                        {" +250 ms", 250},
                                                                        {"-3", 1},
                                                                        {"99999999999999999999", 3600000}}) {
    world.log.clear();
    const auto backend = make(profileOf({{"reliable", value}}));
    ASSERT_NE(backend, nullptr);
    EXPECT_EQ(socket().calls.at(1), "bindToWildcard") << value.description();
    EXPECT_EQ(world.workQueues.timersMade.back().first, milliseconds(period)) << value.description();
    const bool isBent = value.int64Value() != period;  // also of what no 64 bits with a sign hold
    EXPECT_EQ(world.log.lines().size(), isBent ? 1U : 0U) << value.description();
  }
  expectLog(
      LogLevel::warning,
      "DashboardBackend(initWithName): dashboard: reliable is 9223372036854775807 ms, which no timer takes, "
      "and counts as 3600000 ms");
}

TEST_F(DashboardBackendInitTest, AReliableValueWithoutANumberHasTheUsualPeriod) {
  for (const auto& value : valuesWithoutANumber()) {
    world.log.clear();
    ASSERT_NE(make(profileOf({{"reliable", value}})), nullptr) << value.description();
    EXPECT_EQ(socket().calls.at(1), "bindToWildcard") << value.description();
    EXPECT_EQ(world.workQueues.timersMade.back().first, milliseconds(500)) << value.description();
    EXPECT_EQ(world.log.lines().size(), 1U);
    expectLog(
        LogLevel::warning,
        "DashboardBackend(initWithName): dashboard: reliable is no number: delivery is reliable, and its "
        "period 500 ms");
  }
}

TEST_F(DashboardBackendInitTest, PortIsCutToSixteenBitsWhateverItsKind) {
  for (const auto& [value, port] : std::vector<std::pair<Value, uint16_t>>{{0x2ABCD, 0xABCD},
                                                                           {-1, 0xFFFF},
                                                                           {8080.9, 8080},
                                                                           {true, 1},
                                                                           {"8080", 8080},
                                                                           {"65537x", 1},
                                                                           {UINT64_MAX, 0xFFFF}}) {
    ASSERT_NE(make(profileOf({{"port", value}})), nullptr) << value.description();
    EXPECT_EQ(socket().peer->port, port) << value.description();
  }
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendInitTest, APortWithoutANumberIsThereAndCountsAsZero) {
  for (const auto& value : valuesWithoutANumber()) {
    world.log.clear();
    ASSERT_NE(make(profileOf({{"port", value}})), nullptr) << value.description();
    EXPECT_EQ(socket().peer->port, 0) << value.description();
    EXPECT_EQ(world.log.lines().size(), 1U);
    expectLog(LogLevel::warning,
              "DashboardBackend(initWithName): dashboard: port is no number and counts as 0");
  }
}

TEST_F(DashboardBackendInitTest, AddressIsReadWithoutResolving) {
  ASSERT_NE(make(profileOf({{"ip", "10.0.0.1        .beyond the sixteenth"}})), nullptr);
  EXPECT_EQ(socket().peer->address, 0x0A000001U);
  ASSERT_NE(make(profileOf({{"ip", "server.example"}})), nullptr);
  EXPECT_EQ(socket().peer->address, 0xFFFFFFFFU);  // which a real socket refuses to connect to
}

TEST_F(DashboardBackendInitTest, ExplicitServerIsAlwaysReliable) {
  const auto backend = makeExplicit();
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(socket().peer, (Ipv4Address{0xC0000209, 9000}));
  EXPECT_EQ(socket().calls.at(1), "bindToWildcard");
  EXPECT_EQ(world.workQueues.timersMade.at(0).first, milliseconds(500));
  EXPECT_EQ(backend->displayURL(), std::nullopt);
  sendNow(*backend, 1);
  EXPECT_EQ(socket().sent.at(0)[63], 3);
}

TEST_F(DashboardBackendInitTest, FlagsInTheDatagramsSayHowItWasMade) {
  const auto plain = make(profileOf());
  sendNow(*plain, 1);
  EXPECT_EQ(socket().sent.at(0)[63], 0);
  const auto reliable = make(reliableProfile());
  sendNow(*reliable, 1);
  EXPECT_EQ(socket().sent.at(0)[63], 1);
}

TEST_F(DashboardBackendInitTest, ExplicitServerWithoutAddressMakesNothingSilently) {
  EXPECT_EQ(
      DashboardBackend::initWithName(world.dependencies, "dashboard", MaybeString(), uint16_t{1}, "Slate"),
      nullptr);
  EXPECT_TRUE(world.log.lines().empty());
  EXPECT_TRUE(world.datagramSockets.records.empty());
}

TEST_F(DashboardBackendInitTest, FullInitializerPrefersTheProfile) {
  const auto backend = DashboardBackend::initWithName(world.dependencies, "dashboard", profileOf(),
                                                      MaybeString("10.0.0.1"), uint16_t{1}, "Slate");
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(socket().peer, (Ipv4Address{0xC0000207, 8125}));
}

TEST_F(DashboardBackendInitTest, FullInitializerTakesAnAddressWithoutAProfile) {
  const auto backend = DashboardBackend::initWithName(world.dependencies, "dashboard", MaybeDictionary(),
                                                      MaybeString("10.0.0.1"), uint16_t{1}, "Slate");
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(socket().peer, (Ipv4Address{0x0A000001, 1}));
}

TEST_F(DashboardBackendInitTest, MayDoWithoutAProductFamily) {
  EXPECT_NE(DashboardBackend::initWithName(world.dependencies, "dashboard", profileOf(), std::nullopt),
            nullptr);
}

TEST_F(DashboardBackendInitTest, FactoryMakesOne) {
  const auto backend =
      TarnelBackend::newBackendWithName(world.dependencies, kTarnelBackendDashboard, profileOf(), "Slate", 3);
  EXPECT_NE(dynamic_cast<DashboardBackend*>(backend.get()), nullptr);
  EXPECT_EQ(TarnelBackend::newBackendWithName(world.dependencies, kTarnelBackendDashboard, Dictionary(),
                                              "Slate", 3),
            nullptr);
}

TEST_F(DashboardBackendInitTest, StateIsEnabledByAnUpdate) {
  const auto backend = make(profileOf());
  EXPECT_EQ(backend->state(), ReportingState::undecided);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
}

// --- failures ---

TEST_F(DashboardBackendInitTest, ProfileWithoutIp) {
  expectFailure(make(Dictionary{{"port", 8125}}), "DashboardBackend(initWithName): can't resolve server IP");
  EXPECT_TRUE(world.datagramSockets.records.empty());
}

TEST_F(DashboardBackendInitTest, ProfileWithoutPort) {
  expectFailure(make(Dictionary{{"ip", "192.0.2.7"}}),
                "DashboardBackend(initWithName): can't resolve server port");
  EXPECT_TRUE(world.datagramSockets.records.empty());
}

TEST_F(DashboardBackendInitTest, EmptyProfileLacksTheIpFirst) {
  expectFailure(make(Dictionary()), "DashboardBackend(initWithName): can't resolve server IP");
}

TEST_F(DashboardBackendInitTest, NeitherProfileNorAddress) {
  expectFailure(make(std::nullopt), "DashboardBackend(initWithName): initWitName with all null params.");
  EXPECT_EQ(world.datagramSockets.records.size(), 1U);
}

TEST_F(DashboardBackendInitTest, NoSocket) {
  world.datagramSockets.createError = 24;
  expectFailure(make(profileOf()), "DashboardBackend(initWithName): socket() failed (24)");
}

TEST_F(DashboardBackendInitTest, NoWorkQueue) {
  world.workQueues.refuseQueues = true;
  expectFailure(make(reliableProfile()), "DashboardBackend(initWithName): can't create work queue.");
}

TEST_F(DashboardBackendInitTest, NoConnection) {
  world.datagramSockets.connectError = 13;
  expectFailure(make(profileOf()), "DashboardBackend(initWithName): socket connect() failed.");
}

TEST_F(DashboardBackendInitTest, NoConnectionWithAReadSource) {
  world.datagramSockets.connectError = 13;
  expectFailure(make(reliableProfile()), "DashboardBackend(initWithName): socket connect() failed.");
  EXPECT_EQ(world.workQueues.readSourcesMade.size(), 1U);
}

TEST_F(DashboardBackendInitTest, SocketIsClosedOnlyAfterItIsNoLongerReadFrom) {
  world.datagramSockets.connectError = 13;
  make(reliableProfile());
  EXPECT_EQ(socket().closes, 0);
  world.workQueues.runUntilIdle();
  EXPECT_EQ(socket().closes, 1);
}

TEST_F(DashboardBackendInitTest, NoConnectionToAnExplicitServer) {
  world.datagramSockets.connectError = 13;
  expectFailure(makeExplicit(), "DashboardBackend(initWithName): socket connect() failed.");
}

TEST_F(DashboardBackendInitTest, NoTimer) {
  world.workQueues.refuseTimers = true;
  expectFailure(make(profileOf()), "DashboardBackend(initWithName): can't create timer source.");
}

TEST_F(DashboardBackendInitTest, NoTimerWithAReadSource) {
  world.workQueues.refuseTimers = true;
  expectFailure(make(reliableProfile()), "DashboardBackend(initWithName): can't create timer source.");
}

TEST_F(DashboardBackendInitTest, SocketThatCannotBeBoundDeliversUnreliably) {
  world.datagramSockets.bindError = 98;
  const auto backend = make(profileOf({{"reliable", 200}}));
  ASSERT_NE(backend, nullptr);
  expectLog(LogLevel::error, "DashboardBackend(useReliableUDP): can't bind socket, 98");
  EXPECT_TRUE(world.workQueues.readSourcesMade.empty());
  EXPECT_EQ(world.workQueues.timersMade.at(0).first, milliseconds(200));
  sendNow(*backend, 1);
  EXPECT_EQ(socket().sent.at(0)[63], 0);
  backend->cleanup();
  world.workQueues.runUntilIdle();
  EXPECT_EQ(socket().closes, 1);
}

TEST_F(DashboardBackendInitTest, WithoutAReadSourceDeliveryStaysReliableAndGivesUpInTheEnd) {
  world.workQueues.refuseReadSources = true;
  auto backend = make(reliableProfile());
  ASSERT_NE(backend, nullptr);
  expectLog(LogLevel::error, "DashboardBackend(useReliableUDP): can't create read source");
  sendNow(*backend, 1);
  EXPECT_EQ(socket().sent.at(0)[63], 1);
  acknowledge(1);  // never read
  tick(25);
  EXPECT_EQ(sentCount(), 5U);
  backend->cleanup();
  world.workQueues.runUntilIdle();
  EXPECT_EQ(world.workQueues.timers(), 0U);
  // The end of the reading closes, that of the timer only without reliable delivery.
  EXPECT_EQ(socket().closes, 0);
  backend.reset();
  EXPECT_TRUE(nothingIsLeft());  // the socket goes with the backend
  EXPECT_EQ(socket().closes, 1);
}

// --- values of the wrong kind ---

struct WrongType {
  const char* key;
  Value value;
  const char* expected;
};

class DashboardBackendWrongTypeTest : public DashboardBackendInitTest,
                                      public ::testing::WithParamInterface<WrongType> {};

TEST_P(DashboardBackendWrongTypeTest, CountsAsAbsentWithOneWarning) {
  const std::string key = GetParam().key;
  const auto backend = make(profileOf({{key, GetParam().value}}));
  expectLog(LogLevel::warning, "DashboardBackend(initWithName): dashboard: " + key + " is not " +
                                   GetParam().expected + " and counts as absent");
  EXPECT_EQ(world.log.startingWith("DashboardBackend(initWithName): dashboard: ").size(), 1U);
  if (key == "ip") {
    EXPECT_EQ(backend, nullptr);
    expectLog(LogLevel::error, "DashboardBackend(initWithName): can't resolve server IP");
    return;
  }
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->displayURL(), std::nullopt);
  EXPECT_EQ(socket().calls, (Calls{"suppressBrokenPipeSignal", "connectTo"}));
}

INSTANTIATE_TEST_SUITE_P(Keys, DashboardBackendWrongTypeTest,
                         ::testing::Values(WrongType{"ip", 127, "a text"},
                                           WrongType{"display_url", Array(), "a text"},
                                           WrongType{"post_url", Dictionary(), "a text"}));

TEST_F(DashboardBackendInitTest, SectionThatIsNoDictionaryHasNoServer) {
  EXPECT_EQ(
      TarnelBackend::newBackendWithName(world.dependencies, kTarnelBackendDashboard, "text", "Slate", 3),
      nullptr);
  expectLog(LogLevel::error, "DashboardBackend(initWithName): initWitName with all null params.");
}

}  // namespace
}  // namespace tarnel

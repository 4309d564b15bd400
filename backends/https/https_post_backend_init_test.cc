#include "backends/https/https_post_backend_fixture.h"

namespace tarnel {
namespace {

class HTTPSPostBackendInitTest : public HTTPSPostBackendFixture {
 protected:
  std::shared_ptr<HTTPSPostBackend> init(const MaybeDictionary& profile,
                                         const MaybeString& productFamily = "Slate") {
    return HTTPSPostBackend::initWithName(world.dependencies, "httppost", profile, productFamily);
  }
};

TEST_F(HTTPSPostBackendInitTest, NeedsAProfileAndAProductFamily) {
  EXPECT_EQ(init(std::nullopt), nullptr);
  EXPECT_EQ(init(profile(), std::nullopt), nullptr);
  EXPECT_TRUE(world.log.lines().empty());
  EXPECT_NE(init(profile()), nullptr);
}

TEST_F(HTTPSPostBackendInitTest, NeedsAClientList) {
  EXPECT_EQ(init(Dictionary{{"display_url", "https://show.example"}}), nullptr);
  EXPECT_EQ(world.log.lines(),
            (std::vector<fake::FakeLog::Line>{
                {LogLevel::error, "HTTPSPostBackend(initWithName): can't find the client list."}}));
}

TEST_F(HTTPSPostBackendInitTest, ClientListOfAnotherTypeCountsAsAbsent) {
  EXPECT_EQ(init(Dictionary{{"clients", "none"}}), nullptr);
  EXPECT_EQ(world.log.lines(),
            (std::vector<fake::FakeLog::Line>{
                {LogLevel::warning,
                 "HTTPSPostBackend(initWithName): httppost: clients is not an array and counts as absent"},
                {LogLevel::error, "HTTPSPostBackend(initWithName): can't find the client list."}}));
}

TEST_F(HTTPSPostBackendInitTest, TakesTheDisplayURL) {
  EXPECT_EQ(init(profile())->displayURL(), "https://show.example");
  EXPECT_EQ(init(Dictionary{{"clients", Array()}})->displayURL(), std::nullopt);
}

TEST_F(HTTPSPostBackendInitTest, DisplayURLOfAnotherTypeCountsAsAbsent) {
  EXPECT_EQ(init(Dictionary{{"clients", Array()}, {"display_url", 1}})->displayURL(), std::nullopt);
  expectLog(LogLevel::warning,
            "HTTPSPostBackend(initWithName): httppost: display_url is not a text and counts as absent");
}

TEST_F(HTTPSPostBackendInitTest, HasNoAddressWithoutSettings) {
  EXPECT_EQ(init(profile())->postURL(), std::nullopt);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend").empty());
}

TEST_F(HTTPSPostBackendInitTest, AddressesOfTheSettingsWinOverTheStorebag) {
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", "https://own.example");
  world.settings.setObject("com.orvane.tarnel", "httpsRealtimePostURL", "https://own.example/rt");
  const auto backend = makeUpdated();
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(initWithName): Using user default 'https://own.example' for postURL");
  expectLog(
      LogLevel::debug,
      "HTTPSPostBackend(initWithName): Using user default 'https://own.example/rt' for realtimePostURL");
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(updatePostLink)").empty());
  send(*backend, 3, Flag::realtime);
  send(*backend);
  flush(*backend);
  ASSERT_EQ(world.http.requests().size(), 2U);
  EXPECT_EQ(world.http.requests()[0].url, "https://own.example/rt");
  EXPECT_EQ(world.http.requests()[1].url, "https://own.example");
}

TEST_F(HTTPSPostBackendInitTest, SettingOfAnotherTypeReadsAsText) {
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", 17);
  EXPECT_EQ(init(profile())->postURL(), "17");
  world.settings.setObject("com.orvane.tarnel", "httpsPostURL", Array{"https://own.example"});
  EXPECT_EQ(init(profile())->postURL(), std::nullopt);
}

TEST_F(HTTPSPostBackendInitTest, ConsentIsAskedOnceAtCreation) {
  world.consent.allowed = false;
  const auto withheld = make();
  world.consent.allowed = true;
  const auto given = make();
  withheld->updateState();
  given->updateState();
  EXPECT_EQ(withheld->state(), ReportingState::disabled);
  EXPECT_EQ(given->state(), ReportingState::enabled);
}

TEST_F(HTTPSPostBackendInitTest, DrawsItsSamplingFactorOnce) {
  world.random.setUniform(0.375);
  const auto backend = make();
  world.random.setUniform(0.9);
  backend->updateState();
  EXPECT_EQ(backend->samplingFactor(), 0.375);
}

TEST_F(HTTPSPostBackendInitTest, EventThresholdIs49UntilAnUpdate) {
  const auto backend = make();
  backend->setState(ReportingState::enabled);
  backend->setPostURL("https://events.example/post");
  for (int i = 0; i < 50; ++i) send(*backend);
  EXPECT_TRUE(world.http.requests().empty());
  send(*backend);
  EXPECT_EQ(postedEvents().size(), 50U);
}

}  // namespace
}  // namespace tarnel

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "session/test_session_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::IsSupersetOf;

class SessionLifecycle : public SessionTest {
 protected:
  Dictionary startPayload() {
    offer({kTarnelBackendHTTPPost});
    session->setSessionInfo(info(), user(), std::nullopt, false);
    session->startConfigWithCompletionHandler(nullptr);
    return backends.last(kTarnelBackendHTTPPost)->sent.at(0).payload.value();
  }
  std::string displayURL() {
    std::string answer;
    session->fetchDisplayURL([&answer](MaybeString text) { answer = text.value(); });
    return answer;
  }
};

TEST_F(SessionLifecycle, InitLogsItsDelegateAndItsIdentifier) {
  EXPECT_TRUE(
      logged(LogLevel::debug, "initWithSessionDelegate: TarneldSession initWithSessionDelegate:<delegate>"));
  EXPECT_TRUE(logged(LogLevel::debug,
                     "initWithSessionDelegate: Initialized session with UUID " + session->sessionIDString()));
}

TEST_F(SessionLifecycle, IdentifierIsTheBase64OfSixteenBytes) {
  EXPECT_EQ(session->sessionIDString(), "AAAAAAAAAAAAAAAAAAAAAQ==");
  EXPECT_EQ(newSession(connection)->sessionIDString(), "AAAAAAAAAAAAAAAAAAAAAg==");
}

TEST_F(SessionLifecycle, DeviceIdentifierIsEmptyWithoutAnAnswer) {
  EXPECT_EQ(session->deviceid(), "0123456789abcdef0123456789abcdef01234567");
  world.deviceInformation.answers.erase("UniqueDeviceID");
  EXPECT_EQ(newSession(connection)->deviceid(), "");
}

TEST_F(SessionLifecycle, DeviceIdentifierIsCutToFortyCharacters) {
  world.deviceInformation.answers["UniqueDeviceID"] = std::string(40, 'a') + "beyond";
  EXPECT_EQ(newSession(connection)->deviceid(), std::string(40, 'a'));
}

TEST_F(SessionLifecycle, FieldsBeginEmpty) {
  EXPECT_EQ(session->sessionID(), 0U);
  EXPECT_FALSE(session->sessionInfo());
  EXPECT_FALSE(session->userInfo());
  EXPECT_FALSE(session->storebagVersion());
  EXPECT_FALSE(session->hasAggregator());
  EXPECT_TRUE(session->backends().empty());
}

TEST_F(SessionLifecycle, SetSessionInfoKeepsWhatItIsGiven) {
  session->setSessionInfo(info(4000000000U), user(), Array{"one"}, true);
  EXPECT_EQ(session->sessionID(), 4000000000U);
  EXPECT_EQ(session->sessionInfo(), info(4000000000U));
  EXPECT_EQ(session->userInfo(), user());
  EXPECT_TRUE(session->hasAggregator());
  EXPECT_TRUE(logged(LogLevel::debug, "setSessionInfo: Configuring session 4000000000"));
  EXPECT_THAT(world.log.startingWith("setSessionInfo: Configure session"), IsEmpty());
}

TEST_F(SessionLifecycle, UserInfoWithoutRequiringItIsKeptWithAWarning) {
  const std::string warning = "setSessionInfo: Configure session: user info provided without requiring it";
  session->setSessionInfo(info(7, false), user(), std::nullopt, false);
  EXPECT_EQ(world.log.count(LogLevel::warning, warning), 1U);
  EXPECT_EQ(session->userInfo(), user());
  session->setSessionInfo(std::nullopt, user(), std::nullopt, false);
  EXPECT_EQ(world.log.count(LogLevel::warning, warning), 2U);
  session->setSessionInfo(info(7, false), std::nullopt, std::nullopt, false);
  EXPECT_EQ(world.log.count(LogLevel::warning, warning), 2U);
}

TEST_F(SessionLifecycle, SetSessionInfoWithoutANumberIsSessionZero) {
  session->setSessionInfo(info(9), std::nullopt, std::nullopt, false);
  session->setSessionInfo(Dictionary{}, std::nullopt, std::nullopt, false);
  EXPECT_EQ(session->sessionID(), 0U);
}

TEST_F(SessionLifecycle, StartConfigWithoutAStorebagAnswersNone) {
  session->setSessionInfo(info(), user(), std::nullopt, false);
  bool called = false;
  session->startConfigWithCompletionHandler([&called](std::optional<std::vector<std::string>> names) {
    called = true;
    EXPECT_FALSE(names);
  });
  EXPECT_TRUE(called);
  EXPECT_TRUE(
      logged(LogLevel::debug, "startConfigWithCompletionHandler: Starting configuration for session 7"));
  EXPECT_THAT(backends.journal.lines(), ElementsAre("storebagForSession"));
}

TEST_F(SessionLifecycle, StartConfigRunsItsStepsInOrder) {
  offer({kTarnelBackendHTTPPost});
  session->setSessionInfo(info(), user(), std::nullopt, false);
  std::optional<std::vector<std::string>> names;
  session->startConfigWithCompletionHandler(
      [&names](std::optional<std::vector<std::string>> given) { names = std::move(given); });
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("storebagForSession", "storebagVersionForSession", "httppost setUserInfoDict",
                          "userInfoUpdatedForSession", "httppost updateState", "updateDownstreamSessions",
                          "httppost send 0/0"));
  EXPECT_EQ(session->storebagVersion(), "5.1");
  ASSERT_TRUE(names);
  EXPECT_THAT(*names, ElementsAre("httppost"));
}

TEST_F(SessionLifecycle, StartConfigLetsAnInvalidClientTypePassAndTheSessionLivesOn) {
  delegate->throws = true;
  EXPECT_THROW(session->startConfigWithCompletionHandler(nullptr), InvalidArgument);
  delegate->throws = false;
  offer({kTarnelBackendHTTPPost});
  session->setSessionInfo(info(), user(), std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(session->backends().size(), 1U);
}

TEST_F(SessionLifecycle, SecondStartConfigFlushesAndCleansUpTheBackendsOfTheFirst) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("storebagForSession", "storebagVersionForSession", "httppost setUserInfoDict",
                          "httppost flush", "httppost cleanup", "userInfoUpdatedForSession",
                          "httppost updateState", "updateDownstreamSessions", "httppost send 0/0"));
  EXPECT_EQ(backends.made().size(), 2U);
}

TEST_F(SessionLifecycle, ASecondStartConfigGoesOnThoughTheFirstBackendsFail) {
  offer({kTarnelBackendHTTPPost, kTarnelBackendDashboard});
  configureAndStart();
  backends.scripts[kTarnelBackendHTTPPost].flushThrows = true;
  backends.scripts[kTarnelBackendHTTPPost].cleanupThrows = true;
  const auto first = backends.last(kTarnelBackendDashboard);
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_THAT(backends.journal.lines(), IsSupersetOf({"dashboard flush", "dashboard cleanup"}));
  EXPECT_EQ(session->backends().size(), 2U);
  EXPECT_NE(session->backends().find(kTarnelBackendDashboard), first.get());
}

TEST_F(SessionLifecycle, StartMessageOfAnExternalBuildHasTwoEntries) {
  EXPECT_EQ(startPayload(), (Dictionary{{"Locale", "DE"}, {"AutomaticTimeSet", true}}));
  EXPECT_TRUE(logged(LogLevel::debug, "internalSendMessage: Sent internal message (method:0 respCode:0)"));
}

TEST_F(SessionLifecycle, StartMessageOfAnInternalBuildHasEightEntries) {
  world.deviceInformation.answers["ReleaseType"] = "Internal";
  EXPECT_EQ(startPayload(), (Dictionary{{"SerialNum", "TN12345"},
                                        {"Version", "12.5"},
                                        {"Build", "24A100"},
                                        {"Hardware", "S7"},
                                        {"Product", "Slate"},
                                        {"ReportVers", "3.2"},
                                        {"Locale", "DE"},
                                        {"AutomaticTimeSet", true}}));
}

TEST_F(SessionLifecycle, StartMessageSaysUnknownForWhatTheDeviceDoesNotAnswer) {
  world.deviceInformation.answers = {{"ReleaseType", "Internal"}};
  world.clientBundle.versionText.reset();
  EXPECT_EQ(startPayload(), (Dictionary{{"SerialNum", "Unknown"},
                                        {"Version", "Unknown"},
                                        {"Build", "Unknown"},
                                        {"Hardware", "Unknown"},
                                        {"Product", "Unknown"},
                                        {"ReportVers", "8.0"},
                                        {"Locale", "DE"},
                                        {"AutomaticTimeSet", true}}));
}

TEST_F(SessionLifecycle, StartMessageLeavesOutACountryThatIsNotKnown) {
  world.locale.country.reset();
  EXPECT_EQ(startPayload(), (Dictionary{{"AutomaticTimeSet", true}}));
}

TEST_F(SessionLifecycle, AutomaticTimeIsTheStoredBooleanOfTheTimeSettings) {
  world.settings.setObject("com.orvane.timed", "TMAutomaticTimeZoneEnabled", false);
  EXPECT_EQ(startPayload(), (Dictionary{{"Locale", "DE"}, {"AutomaticTimeSet", false}}));
}

TEST_F(SessionLifecycle, FetchStatesTakesTheUserInfoFirst) {
  offer({kTarnelBackendHTTPPost, kTarnelBackendDashboard, kTarnelBackendDravik});
  backends.scripts[kTarnelBackendDashboard].decides = ReportingState::disabled;
  backends.scripts[kTarnelBackendDravik].decides = ReportingState::sampledOut;
  backends.scripts[kTarnelBackendVesmer];
  delegate->storebag->set(kTarnelBackendVesmer, Dictionary());
  configureAndStart();
  // The new user info decides the states anew; the answer tells of these.
  backends.scripts[kTarnelBackendVesmer].decides = ReportingState::disabled;
  std::optional<std::vector<std::string>> names;
  session->fetchStatesWithUserInfo(
      user("Other"), [&names](std::optional<std::vector<std::string>> given) { names = std::move(given); });
  EXPECT_TRUE(logged(LogLevel::debug, "fetchStatesWithUserInfo: Fetching states for session 7"));
  EXPECT_EQ(session->userInfo(), user("Other"));
  ASSERT_TRUE(names);
  EXPECT_THAT(*names, ElementsAre("httppost", "dravik"));
}

TEST_F(SessionLifecycle, FetchStatesWithoutBackendsAnswersNone) {
  bool called = false;
  session->fetchStatesWithUserInfo(user(), [&called](std::optional<std::vector<std::string>> names) {
    called = true;
    EXPECT_FALSE(names);
  });
  EXPECT_TRUE(called);
}

TEST_F(SessionLifecycle, UndecidedAndDisabledBackendsAreNotLive) {
  offer({kTarnelBackendHTTPPost});
  backends.scripts[kTarnelBackendHTTPPost].decides = ReportingState::undecided;
  configureAndStart();
  ASSERT_TRUE(session->fetchReportingStates());
  EXPECT_THAT(*session->fetchReportingStates(), IsEmpty());
}

TEST_F(SessionLifecycle, DisplayURLComesFromTheFirstThatHasOne) {
  offer({kTarnelBackendDashboard, kTarnelBackendHTTPPost2, kTarnelBackendHTTPPost});
  backends.scripts[kTarnelBackendHTTPPost].displayURL = "https://one.example";
  backends.scripts[kTarnelBackendHTTPPost2].displayURL = "https://two.example";
  backends.scripts[kTarnelBackendDashboard].displayURL = "https://three.example";
  configureAndStart();
  EXPECT_EQ(displayURL(), "https://one.example");
  EXPECT_TRUE(logged(LogLevel::debug, "fetchDisplayURL: Fetching display URL for session 7"));
  backends.last(kTarnelBackendHTTPPost)->setDisplayURL(std::nullopt);
  EXPECT_EQ(displayURL(), "https://two.example");
  backends.last(kTarnelBackendHTTPPost2)->setDisplayURL(std::nullopt);
  EXPECT_EQ(displayURL(), "https://three.example");
  backends.last(kTarnelBackendDashboard)->setDisplayURL(std::nullopt);
  EXPECT_EQ(displayURL(), "URL not available");
}

TEST_F(SessionLifecycle, DisplayURLIsNotAvailableWithoutHttpsAndDashboard) {
  offer({kTarnelBackendDravik});
  backends.scripts[kTarnelBackendDravik].displayURL = "https://four.example";
  EXPECT_EQ(displayURL(), "URL not available");
  configureAndStart();
  EXPECT_EQ(displayURL(), "URL not available");
}

TEST_F(SessionLifecycle, FinishSendsTypeTwoAndAnswersWithItsResult) {
  offer({kTarnelBackendHTTPPost});
  backends.scripts[kTarnelBackendHTTPPost].sends = SentObject(std::string("posted"));
  configureAndStart();
  MaybeSentObject answer;
  session->finishSessionWithReply([&answer](MaybeSentObject sent) { answer = std::move(sent); });
  EXPECT_TRUE(logged(LogLevel::debug, "finishSessionWithReply: Finishing session 7"));
  const auto& sent = backends.last(kTarnelBackendHTTPPost)->sent.back();
  EXPECT_EQ(sent.method, Method{0});
  EXPECT_EQ(sent.respCode, RespCode{2});
  EXPECT_FALSE(sent.payload);
  EXPECT_EQ(answer, MaybeSentObject(SentObject(std::string("posted"))));
}

TEST_F(SessionLifecycle, MessagesAfterTheFinishAndASecondFinishAreStillSent) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  session->finishSessionWithReply(nullptr);
  session->sendMessageWithCategory(3, 4, std::nullopt, nullptr);
  session->finishSessionWithReply(nullptr);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 0/2", "httppost send 3/4", "httppost send 0/2"));
}

}  // namespace
}  // namespace tarnel::fake

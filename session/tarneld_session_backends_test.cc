#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "session/test_session_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SessionBackends : public SessionTest {
 protected:
  ReportingState stateOf(const std::string& name) { return backends.last(name)->state(); }
};

TEST_F(SessionBackends, CreateBackendsWantsAStorebagAndSessionInfo) {
  EXPECT_FALSE(createBackends(world.dependencies, backends.factory(), std::nullopt, info(), user(), "id"));
  EXPECT_TRUE(logged(LogLevel::error, "createBackends: Attempted to create backends with nil storebag"));
  EXPECT_FALSE(
      createBackends(world.dependencies, backends.factory(), Dictionary(), std::nullopt, user(), "id"));
  EXPECT_TRUE(logged(LogLevel::error, "createBackends: Attempted to create backends with nil session info"));
}

TEST_F(SessionBackends, StorebagWithoutSessionInfoGivesNoBackends) {
  offer({"httppost"});
  bool called = false;
  session->startConfigWithCompletionHandler([&called](std::optional<std::vector<std::string>> names) {
    called = true;
    EXPECT_FALSE(names);
  });
  EXPECT_TRUE(called);
  EXPECT_TRUE(logged(LogLevel::error, "createBackends: Attempted to create backends with nil session info"));
  EXPECT_TRUE(session->backends().empty());
}

TEST_F(SessionBackends, CreateBackendsTellsEachWhoReports) {
  world.deviceInformation.answers["ReleaseType"] = "Internal";
  world.clock.set({1700000007, 500000});
  backends.scripts["httppost"];
  Dictionary sessionInfo = info(77);
  sessionInfo.set(kTarnelSessionInfoClientVersion, 0x20003);
  sessionInfo.set(kTarnelSessionInfoBatchEvent, true);
  const Dictionary profile = {{"clients", Array{}}};
  const auto made = createBackends(world.dependencies, backends.factory(), Dictionary{{"httppost", profile}},
                                   sessionInfo, user(), "0123456789");
  ASSERT_TRUE(made);
  ASSERT_EQ(made->size(), 1U);
  const auto backend = backends.last("httppost");
  EXPECT_EQ(made->find("httppost"), backend.get());
  EXPECT_EQ(made->find("dashboard"), nullptr);
  EXPECT_EQ(backend->sessionID(), 77U);
  EXPECT_EQ(backend->compType(), 8);
  EXPECT_EQ(backend->factoryClientType, 8);
  EXPECT_EQ(backend->clientVersion(), 3);
  EXPECT_EQ(backend->udid(), "0123456789");
  EXPECT_EQ(backend->productVersion(), "12.5");
  EXPECT_EQ(backend->buildVersion(), "24A100");
  EXPECT_EQ(backend->hardwareType(), "Slate7,1");
  EXPECT_EQ(backend->productFamily(), "Slate");
  EXPECT_TRUE(backend->isInternal());
  EXPECT_TRUE(backend->requireUserInfo());
  EXPECT_TRUE(backend->batchEvents());
  EXPECT_EQ(backend->userInfoDict(), user());
  EXPECT_EQ(backend->selfVersion(), std::pair(3, 2));
  EXPECT_DOUBLE_EQ(backend->startTime(), 1700000007.5);
  EXPECT_EQ(backend->profileValue, Value(profile));
}

TEST_F(SessionBackends, CreateBackendsTakesVersionEightWithoutABundle) {
  world.clientBundle.versionText.reset();
  world.deviceInformation.answers.erase("DeviceName");
  backends.scripts["httppost"];
  createBackends(world.dependencies, backends.factory(), sectionOf({"httppost"}), info(7, false), user(), "");
  const auto backend = backends.last("httppost");
  EXPECT_EQ(backend->selfVersion(), std::pair(8, 0));
  EXPECT_FALSE(backend->productFamily());
  EXPECT_FALSE(backend->isInternal());
  EXPECT_FALSE(backend->requireUserInfo());
  EXPECT_FALSE(backend->batchEvents());
}

TEST_F(SessionBackends, AKeyThatIsNoBackendCreatesNothing) {
  world.log.clear();
  const auto made = createBackends(world.dependencies, TarnelBackend::newBackendWithName,
                                   sectionOf({"surprise", "vesmer"}), info(), user(), "");
  ASSERT_TRUE(made);
  EXPECT_EQ(made->size(), 1U);
  EXPECT_NE(made->find("vesmer"), nullptr);
  // The factory names it; to the session it is no error.
  std::vector<FakeLog::Line> errors = world.log.lines();
  std::erase_if(errors, [](const FakeLog::Line& line) { return line.level > LogLevel::warning; });
  EXPECT_THAT(errors,
              ElementsAre(FakeLog::Line{LogLevel::error, "TarnelBackend(newBackendWithName): surprise"}));
}

TEST_F(SessionBackends, ASessionStartsWithTheBackendsBesideAKeyThatIsNone) {
  offer({"httppost"});
  delegate->storebag = sectionOf({"surprise", "httppost"});
  session->setSessionInfo(info(), user(), std::nullopt, false);
  world.log.clear();
  std::optional<std::vector<std::string>> live;
  session->startConfigWithCompletionHandler(
      [&live](std::optional<std::vector<std::string>> names) { live = std::move(names); });
  EXPECT_EQ(live, std::vector<std::string>{"httppost"});
  EXPECT_EQ(session->backends().size(), 1U);
  for (const auto& line : world.log.lines()) EXPECT_GT(line.level, LogLevel::warning) << line.text;
}

TEST_F(SessionBackends, ABackendThatThrowsKeepsItsStateAndUserInfoFromNoOther) {
  offer({"httppost", "dashboard"});
  configureAndStart();
  backends.scripts["httppost"].setUpThrows = true;
  backends.scripts["httppost"].updateStateThrows = true;
  backends.scripts["dashboard"].decides = ReportingState::disabled;
  session->receivedUserInfo(user("Other"));
  EXPECT_EQ(backends.last("dashboard")->userInfoDict(), user("Other"));
  EXPECT_EQ(stateOf("httppost"), ReportingState::enabled);
  EXPECT_EQ(stateOf("dashboard"), ReportingState::disabled);
  EXPECT_TRUE(logged(LogLevel::error, "updateUserInfoForBackends: httppost failed: set-up went wrong"));
  EXPECT_TRUE(logged(LogLevel::error, "updateReportingStates: httppost failed: update went wrong"));
}

TEST_F(SessionBackends, ManyKeysThatAreNoBackendsAreNotAllNamed) {
  Dictionary section;
  const auto addUnknown = [&section](int from, int to) {
    for (int i = from; i < to; ++i) section.set("unknown" + std::to_string(i), 1);
  };
  const auto create = [this, &section] {
    world.log.clear();
    return createBackends(world.dependencies, TarnelBackend::newBackendWithName, section, info(7, false),
                          user(), "");
  };
  const auto named = [this] { return world.log.startingWith("TarnelBackend(newBackendWithName): ").size(); };
  addUnknown(0, 256);
  EXPECT_TRUE(create()->empty());
  EXPECT_EQ(named(), 256U);
  EXPECT_TRUE(world.log.startingWith("createBackends: ").empty());
  addUnknown(256, 50000);
  section.set("vesmer", Dictionary());
  EXPECT_NE(create()->find("vesmer"), nullptr);  // those that are backends are made wherever they stand
  EXPECT_EQ(named(), 256U);
  EXPECT_TRUE(
      logged(LogLevel::error,
             "createBackends: 50000 keys of the storebag are no backends, of which only the first 256 are "
             "named"));
}

TEST_F(SessionBackends, ProfilesOfAnyKindReachTheFactory) {
  offer({"httppost"});
  delegate->storebag = Dictionary{{"httppost", "no dictionary"}};
  configureAndStart();
  EXPECT_EQ(backends.last("httppost")->profileValue, Value("no dictionary"));
}

TEST_F(SessionBackends, NewBackendsCarryTheSessionsIdentifier) {
  offer({"httppost", "dashboard"});
  configureAndStart();
  EXPECT_EQ(backends.last("httppost")->combinedSessionIDString(), session->sessionIDString());
  EXPECT_EQ(backends.last("dashboard")->combinedSessionIDString(), session->sessionIDString());
}

TEST_F(SessionBackends, CreatingBackendsIsLogged) {
  offer({"httppost"});
  session->setSessionInfo(info(), user(), std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_TRUE(logged(LogLevel::debug, "createBackendsWithStorebag: Creating backends for session 7"));
}

TEST_F(SessionBackends, HierarchyIsThatOfHttpPost2ElseOfHttpPostElseZero) {
  offer({"dravik", "httppost", "httppost2"});
  backends.scripts["dravik"].hierarchy = 9;
  backends.scripts["httppost"].hierarchy = 1;
  backends.scripts["httppost2"].hierarchy = 2;
  EXPECT_EQ(session->getSessionHierarchy(), 0);
  configureAndStart();
  EXPECT_EQ(session->getSessionHierarchy(), 2);
  delegate->storebag = sectionOf({"dravik", "httppost"});
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(session->getSessionHierarchy(), 1);
  delegate->storebag = sectionOf({"dravik"});
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(session->getSessionHierarchy(), 0);
}

// User info.

TEST_F(SessionBackends, FirstUserInfoIsNew) {
  offer({"httppost"});
  session->setSessionInfo(info(), std::nullopt, std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  backends.journal.clear();
  session->receivedUserInfo(std::nullopt);
  EXPECT_THAT(backends.journal.lines(), IsEmpty());
  session->receivedUserInfo(user());
  EXPECT_THAT(backends.journal.lines(), ElementsAre("httppost setUserInfoDict", "userInfoUpdatedForSession",
                                                    "httppost updateState", "updateDownstreamSessions"));
  EXPECT_TRUE(logged(LogLevel::debug, "receivedUserInfo: Received new user info for session 7"));
  EXPECT_EQ(backends.last("httppost")->userInfoDict(), user());
}

TEST_F(SessionBackends, SameNamesUpdateTheBackendsButSyncNothing) {
  offer({"httppost"});
  configureAndStart();
  Dictionary more = user();
  more.set("extra", 1);
  session->receivedUserInfo(more);
  EXPECT_THAT(backends.journal.lines(), ElementsAre("httppost setUserInfoDict"));
  EXPECT_EQ(session->userInfo(), more);
  EXPECT_THAT(world.log.startingWith("receivedUserInfo"), IsEmpty());
}

TEST_F(SessionBackends, AChangeOfEitherNameIsNew) {
  offer({"httppost"});
  configureAndStart();
  const std::string line = "receivedUserInfo: Received new user info for session 7";
  session->receivedUserInfo(user("Phone", "Video"));
  EXPECT_EQ(world.log.count(LogLevel::debug, line), 1U);
  session->receivedUserInfo(user("phone", "Video"));  // compared as it stands, case and all
  EXPECT_EQ(world.log.count(LogLevel::debug, line), 2U);
  session->receivedUserInfo(Dictionary{{kTarnelUserInfoServiceName, "Video"}});
  EXPECT_EQ(world.log.count(LogLevel::debug, line), 3U);
  session->receivedUserInfo(Dictionary{{kTarnelUserInfoServiceName, "Video"}, {"extra", 1}});
  EXPECT_EQ(world.log.count(LogLevel::debug, line), 3U);
}

TEST_F(SessionBackends, MissingUserInfoIsIgnoredWhereItIsRequiredAndElseReplaces) {
  offer({"httppost"});
  configureAndStart();
  session->receivedUserInfo(std::nullopt);
  EXPECT_EQ(session->userInfo(), user());
  session->setSessionInfo(info(7, false), user(), std::nullopt, false);
  session->receivedUserInfo(std::nullopt);
  EXPECT_FALSE(session->userInfo());
  EXPECT_FALSE(backends.last("httppost")->userInfoDict());
  EXPECT_TRUE(logged(LogLevel::debug, "receivedUserInfo: Received new user info for session 7"));
}

}  // namespace
}  // namespace tarnel::fake

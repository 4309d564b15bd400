#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "session/test_session_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SessionUploads : public SessionTest {
 protected:
  std::optional<bool> upload(const std::string& url) {
    std::optional<bool> answer;
    session->uploadFileAtPath(url, "token", [&answer](bool success) { answer = success; });
    return answer;
  }
  std::optional<bool> uploadLog() {
    std::optional<bool> answer;
    session->uploadLogData(Array{1, 2}, [&answer](bool success, MaybeError error) {
      answer = success;
      EXPECT_FALSE(error);
    });
    return answer;
  }
  // The end of the journal.
  Lines lastLines(size_t count) const {
    Lines lines = backends.journal.lines();
    lines.erase(lines.begin(), lines.end() - static_cast<std::ptrdiff_t>(std::min(count, lines.size())));
    return lines;
  }
  MaybeString single(const MaybeDictionary& sessionInfo, const MaybeDictionary& userInfo = std::nullopt) {
    MaybeString answer;
    session->sendMessageWithSessionInfo(sessionInfo, userInfo, 3, 4, Dictionary{{"a", 1}},
                                        [&answer](MaybeString text) { answer = std::move(text); });
    return answer;
  }
};

TEST_F(SessionUploads, UploadWithoutBackendsAnswersFalse) {
  EXPECT_EQ(upload("file:///tmp/a%20b.log"), false);
  EXPECT_TRUE(logged(LogLevel::debug, "uploadFileAtPath: Uploading file for session 0"));
  EXPECT_TRUE(logged(LogLevel::error, "uploadFileWithURL: File upload failed for /tmp/a b.log"));
  EXPECT_THAT(messageLog(), ElementsAre("[uploadFileWithURL] Upload failed for file file:///tmp/a%20b.log"));
}

TEST_F(SessionUploads, WhatTheClientSaysStaysOneLineOfTheMessageLog) {
  upload("/tmp/x\n(2026-01-01 00:00:00 +0000) [httppost -> flushMessages] forged\x1b[31m");
  EXPECT_THAT(messageLog(),
              ElementsAre("[uploadFileWithURL] Upload failed for file /tmp/x\\n(2026-01-01 00:00:00 +0000) "
                          "[httppost -> flushMessages] forged\\x1b[31m"));
}

TEST_F(SessionUploads, AllBackendsAreAskedAndOneSuccessIsEnough) {
  offer({"uploadserver", "httppost"});
  backends.scripts["uploadserver"].uploads = true;
  configureAndStart();
  EXPECT_EQ(upload("/tmp/x.log"), true);
  EXPECT_THAT(backends.journal.lines(), ElementsAre("uploadserver upload /tmp/x.log with token",
                                                    "httppost upload /tmp/x.log with token"));
  EXPECT_TRUE(logged(LogLevel::debug, "uploadFileAtPath: Uploading file for session 7"));
  EXPECT_TRUE(logged(LogLevel::debug, "uploadFileWithURL: File upload successful for /tmp/x.log"));
  EXPECT_THAT(messageLog(), ElementsAre("[uploadFileWithURL] Upload succeeded for file /tmp/x.log"));
}

TEST_F(SessionUploads, PathIsThatOfTheURL) {
  offer({"uploadserver"});
  configureAndStart();
  for (const char* url :
       {"file:///tmp/x", "file://localhost/tmp/x", "file:/tmp/x", "file:///tmp/x?q#f", "file:///tmp/%78",
        "/tmp/%78", "file:///tmp/%4A%4b%C3%AB", "file:///tmp/%zz%2", "file:///a%00b", "file://host"}) {
    upload(url);
  }
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("uploadserver upload /tmp/x with token", "uploadserver upload /tmp/x with token",
                          "uploadserver upload /tmp/x with token", "uploadserver upload /tmp/x with token",
                          "uploadserver upload /tmp/x with token", "uploadserver upload /tmp/%78 with token",
                          "uploadserver upload /tmp/JK\xC3\xAB with token",
                          "uploadserver upload /tmp/%zz%2 with token",
                          "uploadserver upload /a%00b with token", "uploadserver upload  with token"));
}

TEST_F(SessionUploads, LogDataIsOfferedToEveryBackend) {
  offer({"dashboard", "httppost"});
  backends.scripts["httppost"].uploads = true;
  configureAndStart();
  EXPECT_EQ(uploadLog(), true);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("dashboard uploadLogData of 2", "httppost uploadLogData of 2"));
  EXPECT_TRUE(logged(LogLevel::debug, "uploadLogData: Log data array upload successful"));
  EXPECT_FALSE(logged(LogLevel::error, "uploadLogData: Log data array upload failed"));
}

TEST_F(SessionUploads, LogDataGoesOnToTheOthersWhenOneHasTakenIt) {
  offer({"dashboard", "httppost"});
  backends.scripts["dashboard"].uploads = true;
  configureAndStart();
  EXPECT_EQ(uploadLog(), true);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("dashboard uploadLogData of 2", "httppost uploadLogData of 2"));
}

TEST_F(SessionUploads, LogDataThatNoBackendTakesFailsWithoutAnError) {
  EXPECT_EQ(uploadLog(), false);
  EXPECT_EQ(world.log.count(LogLevel::error, "uploadLogData: Log data array upload failed"), 1U);
  offer({"httppost"});
  configureAndStart();
  EXPECT_EQ(uploadLog(), false);
  EXPECT_TRUE(logged(LogLevel::error, "uploadLogData: Log data array upload failed"));
}

TEST_F(SessionUploads, SingleMessageWantsClientTypeAndSessionId) {
  const std::string line = "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo";
  const std::vector<MaybeDictionary> incomplete{std::nullopt, Dictionary{{kTarnelSessionInfoClientType, 8}},
                                                Dictionary{{kTarnelSessionInfoSessionID, 7}}};
  for (const auto& sessionInfo : incomplete) {
    session->sendMessageWithSessionInfo(sessionInfo, std::nullopt, 3, 4, std::nullopt,
                                        [](const MaybeString&) { ADD_FAILURE() << "there is no reply"; });
  }
  EXPECT_EQ(world.log.count(LogLevel::error, line), 3U);
  EXPECT_EQ(session->sessionID(), 0U);
  EXPECT_THAT(backends.journal.lines(), IsEmpty());
}

TEST_F(SessionUploads, SingleMessageWithoutAStorebagSaysSo) {
  EXPECT_EQ(single(info(9)), "storebag not available");
  EXPECT_EQ(session->sessionID(), 9U);
  EXPECT_EQ(session->sessionInfo(), info(9));
  EXPECT_TRUE(
      logged(LogLevel::debug, "sendMessageWithSessionInfo: Sending message with session info for session 9"));
  EXPECT_FALSE(
      logged(LogLevel::debug, "sendMessageWithSessionInfo: Sending single message with sessionID 9"));
}

TEST_F(SessionUploads, SingleMessageGoesThroughABackendSetOfItsOwn) {
  offer({"httppost", "dashboard"});
  session->setHasAggregator(true);  // it is not aggregated
  backends.scripts["httppost"].sends = SentObject(Error(kTarnelErrorDomain, -1, "broken"));
  EXPECT_EQ(single(info(9), user()), "finished");
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("userInfoUpdatedForSession", "updateDownstreamSessions", "storebagForSession",
                          "httppost setUserInfoDict", "dashboard setUserInfoDict", "httppost updateState",
                          "httppost send 3/4", "dashboard updateState", "dashboard send 3/4",
                          "httppost cleanup", "dashboard cleanup"));
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithSessionInfo: Sending single message with sessionID 9"));
  EXPECT_THAT(messageLog(),
              ElementsAre("[httppost -> sendMessageWithSessionInfo] TarnelErrorDomain (-1): broken"));
  const auto backend = backends.last("httppost");
  EXPECT_EQ(backend->udid(), "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(backend->sent.at(0).payload, (Dictionary{{"a", 1}}));
  EXPECT_EQ(backend->sent.at(0).flag, Flag::normal);
  EXPECT_EQ(backend->sent.at(0).timestamp.seconds, world.clock.timeOfDay().seconds);
  EXPECT_EQ(backend->sent.at(0).timestamp.microseconds, world.clock.timeOfDay().microseconds);
  EXPECT_TRUE(session->backends().empty());
  EXPECT_THAT(connection->sentToClient(), IsEmpty());
}

TEST_F(SessionUploads, SingleMessageWarnsOfUserInfoThatIsNotRequired) {
  offer({"httppost"});
  const std::string line = "sendMessageWithSessionInfo: user info provided without requiring it.";
  single(info(9), user());
  EXPECT_FALSE(logged(LogLevel::warning, line));
  single(info(9, false));
  EXPECT_FALSE(logged(LogLevel::warning, line));
  single(info(9, false), user());
  EXPECT_EQ(world.log.count(LogLevel::warning, line), 1U);
  Dictionary without = info(9);
  without.remove(kTarnelSessionInfoRequireUserInfo);
  single(without, user());
  EXPECT_EQ(world.log.count(LogLevel::warning, line), 2U);
}

TEST_F(SessionUploads, WhatASingleMessagesBackendAnswersIsLogged) {
  offer({"httppost"});
  backends.scripts["httppost"].sends = SentObject(std::string("what was posted"));
  EXPECT_EQ(single(info(9)), "finished");
  EXPECT_THAT(messageLog(), ElementsAre("[httppost -> sendMessageWithSessionInfo] what was posted"));
}

TEST_F(SessionUploads, ASingleMessageReachesEveryBackendAndAllAreCleanedUpWhateverOneThrows) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].sendThrows = true;
  backends.scripts["httppost"].cleanupThrows = true;
  EXPECT_EQ(single(info(9)), "finished");
  EXPECT_THAT(lastLines(6), ElementsAre("httppost updateState", "httppost send 3/4", "dashboard updateState",
                                        "dashboard send 3/4", "httppost cleanup", "dashboard cleanup"));
  EXPECT_TRUE(logged(LogLevel::error, "sendMessageWithSessionInfo: httppost failed: send went wrong"));
  EXPECT_TRUE(logged(LogLevel::error, "cleanup: httppost failed: cleanup went wrong"));
  EXPECT_THAT(
      messageLog(),
      ElementsAre("[httppost -> sendMessageWithSessionInfo] TarnelErrorDomain (-1): send went wrong"));
}

TEST_F(SessionUploads, ASingleMessageIsNotSentThroughABackendThatCannotDecide) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].updateStateThrows = true;
  EXPECT_EQ(single(info(9)), "finished");
  EXPECT_THAT(lastLines(5), ElementsAre("httppost updateState", "dashboard updateState", "dashboard send 3/4",
                                        "httppost cleanup", "dashboard cleanup"));
}

TEST_F(SessionUploads, ABackendThatThrowsKeepsAnUploadFromNoOther) {
  offer({"dashboard", "httppost"});
  backends.scripts["dashboard"].uploadThrows = true;
  backends.scripts["httppost"].uploads = true;
  configureAndStart();
  EXPECT_EQ(upload("/tmp/x.log"), true);
  EXPECT_EQ(uploadLog(), true);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("dashboard upload /tmp/x.log with token", "httppost upload /tmp/x.log with token",
                          "dashboard uploadLogData of 2", "httppost uploadLogData of 2"));
  EXPECT_TRUE(logged(LogLevel::error, "uploadFileWithURL: dashboard failed: upload went wrong"));
  EXPECT_TRUE(logged(LogLevel::error, "uploadLogData: dashboard failed: upload went wrong"));
  backends.scripts["httppost"].uploads = false;
  EXPECT_EQ(upload("/tmp/x.log"), false);
  EXPECT_EQ(uploadLog(), false);
}

TEST_F(SessionUploads, ACleanUpThatThrowsWhateverItLikesEndsNothing) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].cleanupThrowsNumber = true;
  EXPECT_EQ(single(info(9)), "finished");
  EXPECT_EQ(backends.journal.lines().back(), "dashboard cleanup");
  EXPECT_TRUE(logged(LogLevel::error, "cleanup: httppost failed: unknown failure"));
}

TEST_F(SessionUploads, BackendsThatWereMadeBeforeOneFailedAreCleanedUp) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].cleanupThrows = true;
  backends.scripts["dashboard"].setUpThrows = true;
  EXPECT_THROW(single(info(9)), std::runtime_error);
  EXPECT_THAT(lastLines(4), ElementsAre("httppost setUserInfoDict", "dashboard setUserInfoDict",
                                        "httppost cleanup", "dashboard cleanup"));
  EXPECT_TRUE(logged(LogLevel::error, "cleanup: httppost failed: cleanup went wrong"));
}

TEST_F(SessionUploads, SingleMessageWithoutAnyBackendIsStillFinished) {
  delegate->storebag = sectionOf({"surprise"});
  EXPECT_EQ(single(info(9)), "finished");
  EXPECT_TRUE(
      logged(LogLevel::error, "sendMessageWithSessionInfo: No backends available to send single message"));
}

TEST_F(SessionUploads, ClassOperationWantsSessionInfoAndStorebag) {
  const std::string line =
      "RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters";
  TarneldSession::sendMessageWithSessionInfo(world.dependencies, backends.factory(), std::nullopt,
                                             std::nullopt, Dictionary(), 1, 2, std::nullopt);
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithSessionInfo: Sending single message with sessionID 0"));
  EXPECT_EQ(world.log.count(LogLevel::error, line), 1U);
  TarneldSession::sendMessageWithSessionInfo(world.dependencies, backends.factory(), info(), std::nullopt,
                                             std::nullopt, 1, 2, std::nullopt);
  EXPECT_EQ(world.log.count(LogLevel::error, line), 2U);
}

}  // namespace
}  // namespace tarnel::fake

#include <algorithm>
#include <thread>

#include "backends/dashboard/dashboard_backend_fixture.h"
#include "backends/dashboard/log_data_announcement.h"
#include "formats/archive.h"

// The upload of log records.

namespace tarnel {
namespace {

using fake::FakeHttpClient;

// Reaches the running event number.
struct EventNumberOf : TarnelBackend {
  static uint16_t of(const TarnelBackend& backend) { return (backend.*(&EventNumberOf::eventID))(); }
};

class DashboardBackendLogDataTest : public DashboardBackendFixture {
 protected:
  std::shared_ptr<DashboardBackend> makeUploading() {
    return make(profileOf({{"post_url", "https://upload.example/logs"}, {"reliable", 500}}));
  }
  void expectNoDatagram() {
    EXPECT_EQ(world.workQueues.readyTasks(), 0U);
    EXPECT_EQ(socket().sends, 0);
  }

  const Array records{Dictionary{{"text", "one"}}, Dictionary{{"text", "two"}}};
};

TEST_F(DashboardBackendLogDataTest, PostsTheArchiveOfTheArray) {
  world.http.setAnswer(FakeHttpClient::status(200, "https://logs.example/17"));
  const auto backend = makeUploading();
  EXPECT_TRUE(backend->uploadLogData(records));
  ASSERT_EQ(world.http.requests().size(), 1U);
  const auto request = world.http.requests().front();
  EXPECT_EQ(request.method, "POST");
  EXPECT_TRUE(request.wantsBody);
  EXPECT_EQ(request.url, "https://upload.example/logs");
  ASSERT_EQ(request.headers.size(), 1U);
  EXPECT_EQ(request.headers.front().name, "Content-Type");
  EXPECT_EQ(request.headers.front().value, "application/octet-stream");
  EXPECT_EQ(request.timeout, std::nullopt);
  ASSERT_NE(request.body, nullptr);
  EXPECT_EQ(*unarchiveObject(*request.body), Value(records));
  expectLog(LogLevel::debug, "DashboardBackend(uploadLogData): Log data uploaded to https://logs.example/17");
  EXPECT_EQ(world.log.lines().size(), 1U);
}

TEST_F(DashboardBackendLogDataTest, AnnouncesTheLocationThroughTheFlaggedSendWhichSendsNothing) {
  world.http.setAnswer(FakeHttpClient::status(200, "there"));
  const auto backend = makeUploading();
  backend->uploadLogData(records);
  backend->uploadLogData(records);
  EXPECT_EQ(EventNumberOf::of(*backend), 2);  // one each
  expectNoDatagram();
  EXPECT_TRUE(world.files.files.empty());  // nor is there a line in the message log
}

TEST_F(DashboardBackendLogDataTest, AnnouncementNamesTheLocation) {
  const LogDataAnnouncement message("https://logs.example/17");
  EXPECT_EQ(message.payload, (Dictionary{{"LogDataUploadLocation", "https://logs.example/17"}}));
  EXPECT_EQ(message.method, Method{0});
  EXPECT_EQ(message.respCode, RespCode{2});
  EXPECT_EQ(message.flag, Flag::normal);
  EXPECT_EQ(LogDataAnnouncement("").payload, (Dictionary{{"LogDataUploadLocation", ""}}));
  EXPECT_EQ(LogDataAnnouncement(std::nullopt).payload, Dictionary());
}

TEST_F(DashboardBackendLogDataTest, EmptyArrayIsPostedLikeAnyOther) {
  const auto backend = makeUploading();
  EXPECT_TRUE(backend->uploadLogData(Array()));
  EXPECT_EQ(*unarchiveObject(*world.http.requests().at(0).body), Value(Array()));
}

TEST_F(DashboardBackendLogDataTest, EmptyAnswerIsASuccessWithAnEmptyLocation) {
  world.http.setAnswer(FakeHttpClient::status(200, ""));
  const auto backend = makeUploading();
  EXPECT_TRUE(backend->uploadLogData(records));
  expectLog(LogLevel::debug, "DashboardBackend(uploadLogData): Log data uploaded to ");
  EXPECT_EQ(EventNumberOf::of(*backend), 1);
}

TEST_F(DashboardBackendLogDataTest, StatusOfTheAnswerIsNotLookedAt) {
  for (const int status : {201, 301, 404, 500}) {
    world.http.setAnswer(FakeHttpClient::status(status, "answer " + std::to_string(status)));
    EXPECT_TRUE(makeUploading()->uploadLogData(records));
    expectLog(LogLevel::debug,
              "DashboardBackend(uploadLogData): Log data uploaded to answer " + std::to_string(status));
  }
}

TEST_F(DashboardBackendLogDataTest, AnswerThatIsNoTextNamesNoLocation) {
  world.http.setAnswer(FakeHttpClient::status(200, "\xFF\xFE"));
  const auto backend = makeUploading();
  EXPECT_TRUE(backend->uploadLogData(records));
  expectLog(LogLevel::debug, "DashboardBackend(uploadLogData): Log data uploaded to (null)");
  EXPECT_EQ(EventNumberOf::of(*backend), 1);
}

TEST_F(DashboardBackendLogDataTest, AnswerIsLoggedUpTo4096Bytes) {
  for (const size_t size : {4095U, 4096U, 4097U, 8000U}) {
    world.log.clear();
    world.http.setAnswer(FakeHttpClient::status(200, std::string(size, 'x')));
    EXPECT_TRUE(makeUploading()->uploadLogData(records));
    expectLog(LogLevel::debug, "DashboardBackend(uploadLogData): Log data uploaded to " +
                                   std::string(std::min<size_t>(size, 4096), 'x'));
  }
}

TEST_F(DashboardBackendLogDataTest, LongAnswerIsCutInTheLogAtAWholeCharacter) {
  std::string answer;
  while (answer.size() < 100000) answer += "€";
  world.http.setAnswer(FakeHttpClient::status(200, answer));
  EXPECT_TRUE(makeUploading()->uploadLogData(records));
  expectLog(LogLevel::debug,
            "DashboardBackend(uploadLogData): Log data uploaded to " + answer.substr(0, 4095));
}

TEST_F(DashboardBackendLogDataTest, WithoutAnAddressNothingIsPosted) {
  const std::string text = "DashboardBackend(uploadLogData): Post URL for log data array is nil";
  EXPECT_FALSE(make(profileOf())->uploadLogData(records));
  expectLog(LogLevel::error, text);
  EXPECT_FALSE(makeExplicit()->uploadLogData(records));
  expectLog(LogLevel::error, text, 2);
  EXPECT_TRUE(world.http.requests().empty());
}

TEST_F(DashboardBackendLogDataTest, AnAddressOfAnotherKindIsNone) {
  for (const auto& wrong : {Value(5), Value(true), Value(), Value(Array{"https://upload.example/logs"}),
                            Value(Dictionary{{"url", "https://upload.example/logs"}})}) {
    world.log.clear();
    EXPECT_FALSE(make(profileOf({{"post_url", wrong}}))->uploadLogData(records)) << wrong.description();
    expectLog(LogLevel::error, "DashboardBackend(uploadLogData): Post URL for log data array is nil");
  }
  EXPECT_TRUE(world.http.requests().empty());
}

TEST_F(DashboardBackendLogDataTest, AnAddressThatIsNoUrlIsHandedOverAsItStandsAndItsRefusalIsLogged) {
  for (const char* wrong : {"", "no url", "ftp://upload.example/logs"}) {
    world.log.clear();
    world.http.clear();
    world.http.setAnswer({std::nullopt, std::nullopt, Error(kHttpErrorDomain, kHttpBadRequest, "no URL")});
    const auto backend = make(profileOf({{"post_url", wrong}}));
    EXPECT_FALSE(backend->uploadLogData(records));
    EXPECT_EQ(world.http.requests().at(0).url, wrong);
    expectLog(
        LogLevel::error,
        "DashboardBackend(uploadLogData): Error uploading log data array (TarnelHTTPErrorDomain (-3): no "
        "URL)");
    EXPECT_EQ(EventNumberOf::of(*backend), 0);
  }
}

TEST_F(DashboardBackendLogDataTest, RecordsThatCannotBeArchivedAreNotPosted) {
  const auto backend = makeUploading();
  EXPECT_FALSE(backend->uploadLogData(Array{"\xFF"}));
  expectLog(LogLevel::error,
            "DashboardBackend(uploadLogData): Failed to serialize log data array for upload");
  expectLog(LogLevel::warning,
            "DashboardBackend(uploadLogData): dashboard: TarnelArchiveErrorDomain (3): text that is not "
            "UTF-8; give "
            "it as data");
  EXPECT_TRUE(world.http.requests().empty());
  EXPECT_EQ(EventNumberOf::of(*backend), 0);
}

TEST_F(DashboardBackendLogDataTest, FailedRequestIsLoggedWithItsError) {
  const HttpResult failed = FakeHttpClient::failure("no route to host");
  world.http.setAnswer(failed);
  const auto backend = makeUploading();
  EXPECT_FALSE(backend->uploadLogData(records));
  expectLog(LogLevel::error, "DashboardBackend(uploadLogData): Error uploading log data array (" +
                                 failed.error->description() + ")");
  EXPECT_EQ(EventNumberOf::of(*backend), 0);
}

TEST_F(DashboardBackendLogDataTest, ErrorCountsEvenWithData) {
  HttpResult result = FakeHttpClient::failure("cut off");
  result.data = "half an answer";
  world.http.setAnswer(result);
  EXPECT_FALSE(makeUploading()->uploadLogData(records));
}

TEST_F(DashboardBackendLogDataTest, AnswerWithoutDataIsAFailureWithoutADescription) {
  world.http.setAnswer(HttpResult{std::nullopt, HttpResponse{200, {}}, std::nullopt});
  EXPECT_FALSE(makeUploading()->uploadLogData(records));
  expectLog(LogLevel::error, "DashboardBackend(uploadLogData): Error uploading log data array ((null))");
}

TEST_F(DashboardBackendLogDataTest, HoldsTheCallerUntilTheAnswerAndNobodyElse) {
  world.http.holdAnswers(true);
  const auto backend = makeUploading();
  std::atomic<bool> returned{false};
  std::thread caller([&backend, &returned, this] {
    EXPECT_TRUE(backend->uploadLogData(records));
    returned = true;
  });
  while (world.http.pendingCount() == 0) std::this_thread::yield();
  EXPECT_FALSE(returned.load());
  // The work queue goes on meanwhile.
  sendNow(*backend, 1);
  EXPECT_EQ(sentCount(), 1U);
  EXPECT_FALSE(returned.load());
  world.http.answerOldest(FakeHttpClient::status(200, "late"));
  caller.join();
  EXPECT_TRUE(returned.load());
}

TEST_F(DashboardBackendLogDataTest, EndOfTheDaemonEndsAWaitThatHangs) {
  world.http.holdAnswers(true);
  const auto backend = makeUploading();
  std::thread caller([&backend, this] { EXPECT_FALSE(backend->uploadLogData(records)); });
  while (world.http.pendingCount() == 0) std::this_thread::yield();
  world.uploads.stop();
  caller.join();
  expectLog(
      LogLevel::error,
      "DashboardBackend(uploadLogData): Error uploading log data array (TarnelHTTPErrorDomain (-1): the "
      "daemon ends)");
  EXPECT_EQ(EventNumberOf::of(*backend), 0);
  // The request goes on by itself, and its answer comes to nobody.
  world.http.answerOldest(FakeHttpClient::status(200, "late"));
  EXPECT_EQ(EventNumberOf::of(*backend), 0);
}

TEST_F(DashboardBackendLogDataTest, WhileTheDaemonEndsNothingIsPosted) {
  const auto backend = makeUploading();
  world.uploads.stop();
  EXPECT_FALSE(backend->uploadLogData(records));
  EXPECT_TRUE(world.http.requests().empty());
  expectLog(
      LogLevel::error,
      "DashboardBackend(uploadLogData): Error uploading log data array (TarnelHTTPErrorDomain (-1): the "
      "daemon ends)");
}

}  // namespace
}  // namespace tarnel

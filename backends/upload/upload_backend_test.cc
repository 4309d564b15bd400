#include "backends/upload/upload_backend.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include <thread>

#include "backends/https/https_post_backend_fixture.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

using fake::FakeHttpClient;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class UploadBackendTest : public ::testing::Test {
 protected:
  std::shared_ptr<UploadBackend> make(const MaybeDictionary& from) {
    auto made = UploadBackend::initWithName(world.dependencies, kTarnelBackendUploadServer, from, "Slate");
    if (made != nullptr) {
      made->setUdid("0123456789abcdef0123456789abcdef01234567");
      made->setSessionID(4294967295U);
    }
    return made;
  }
  // Uploads a file with this text; the server replies so.
  bool upload(const std::string& path, const std::string& text = "text", const std::string& reply = "ok") {
    world.clientFiles.files["t"] = {.text = text};
    world.http.setAnswer(FakeHttpClient::status(200, reply));
    return make(profile)->uploadFileAtPath(path, "t");
  }
  bool logged(LogLevel level, const std::string& text) const { return world.log.contains(level, text); }
  std::string url() const { return world.http.requests().at(0).url; }
  const std::vector<std::string>& journal() const { return world.clientFiles.journal; }

  fake::FakeWorld world;
  Dictionary profile{{"post_url", "https://files.example/up"}, {"display_url", "https://files.example/show"}};
};

TEST_F(UploadBackendTest, TheProfileNamesTheServer) {
  const auto backend = make(profile);
  EXPECT_EQ(backend->uploadURL(), "https://files.example/up");
  EXPECT_EQ(backend->displayURL(), "https://files.example/show");
  EXPECT_EQ(backend->name(), "uploadserver");
  EXPECT_EQ(backend->productFamily(), "Slate");
  profile.remove("display_url");
  EXPECT_EQ(make(profile)->displayURL(), std::nullopt);
  EXPECT_THAT(world.log.lines(), IsEmpty());
}

TEST_F(UploadBackendTest, WithoutAnAddressThereIsNoBackend) {
  const std::string line = "UploadBackend(initWithName): can't resolve upload post URL.";
  EXPECT_EQ(make(std::nullopt), nullptr);
  EXPECT_EQ(make(Dictionary()), nullptr);
  EXPECT_EQ(world.log.count(LogLevel::error, line), 2U);
  profile.set("post_url", 5);
  EXPECT_EQ(make(profile), nullptr);
  EXPECT_EQ(world.log.count(LogLevel::error, line), 3U);
  EXPECT_TRUE(
      logged(LogLevel::warning,
             "UploadBackend(initWithName): uploadserver: post_url is not a text and counts as absent"));
}

TEST_F(UploadBackendTest, TheFactoryMakesIt) {
  const auto made =
      TarnelBackend::newBackendWithName(world.dependencies, "uploadserver", Value(profile), "S", 8);
  EXPECT_NE(dynamic_cast<UploadBackend*>(made.get()), nullptr);
  EXPECT_EQ(
      TarnelBackend::newBackendWithName(world.dependencies, "uploadserver", Value(Dictionary()), "S", 8),
      nullptr);
}

TEST_F(UploadBackendTest, MessagesAreNotItsBusiness) {
  const auto backend = make(profile);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  EXPECT_FALSE(backend->sendMessage(Dictionary{{"a", 1}}, {}, Method{2}, RespCode{3}, Flag::realtime));
  EXPECT_FALSE(backend->uploadLogData(Array{1}));
  EXPECT_THAT(world.http.requests(), IsEmpty());
}

TEST_F(UploadBackendTest, TheRequestIsExactlyThis) {
  EXPECT_TRUE(upload("/var/log/a b.log", "contents of the file", "success"));
  const auto requests = world.http.requests();
  ASSERT_EQ(requests.size(), 1U);
  const auto& request = requests[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_TRUE(request.wantsBody);
  EXPECT_EQ(request.url,
            "https://files.example/up?uuid=0123456789abcdef0123456789abcdef01234567&sequence=4294967295"
            "&description=Lumora%20AFRC%20log%20(Uploaded%20by%20QMX)&filename=a%20b.log.gz&raw=true");
  ASSERT_EQ(request.headers.size(), 2U);
  EXPECT_EQ(request.headers[0].name + ": " + request.headers[0].value,
            "Content-Type: application/octet-stream");
  EXPECT_EQ(request.headers[1].name + ": " + request.headers[1].value, "Content-Encoding: gzip");
  EXPECT_EQ(inflated(*request.body), "contents of the file");
  EXPECT_FALSE(request.timeout);
  EXPECT_TRUE(logged(LogLevel::debug, "UploadBackend(uploadFileAtPath): Uploading file /var/log/a b.log"));
  EXPECT_TRUE(
      logged(LogLevel::debug,
             "UploadBackend(uploadFileAtPath): sending to |https://files.example/up|, Json output: success"));
  for (const auto& line : world.log.lines()) EXPECT_EQ(line.level, LogLevel::debug) << line.text;
}

TEST_F(UploadBackendTest, TheNameOfTheFileIsItsLastComponent) {
  const std::vector<std::pair<std::string, std::string>> names{
      {"/a/b&c=d.log", "b&c=d.log"}, {"plain", "plain"},           {"/a/b/", "b"}, {"/", "/"}, {"", ""},
      {"/a/50%#1?", "50%25%231?"},   {"/a/Zo\xC3\xAB", "Zo%C3%AB"}};
  for (const auto& [path, sent] : names) {
    EXPECT_TRUE(upload(path));
    EXPECT_THAT(world.http.requests().back().url, ::testing::EndsWith("&filename=" + sent + ".gz&raw=true"))
        << path;
  }
}

TEST_F(UploadBackendTest, WithoutAnAddressNothingElseIsDone) {
  const auto backend = make(profile);
  backend->setUploadURL(std::nullopt);
  EXPECT_FALSE(backend->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(logged(LogLevel::debug, "UploadBackend(uploadFileAtPath): Uploading file /x"));
  EXPECT_EQ(world.log.lines().size(), 1U);
  EXPECT_THAT(journal(), IsEmpty());
}

TEST_F(UploadBackendTest, OnlyARegularFileIsUploaded) {
  const std::string line = "UploadBackend(uploadFileAtPath): Only upload a regular file.";
  world.clientFiles.files["folder"] = {.text = "x", .isRegular = false};
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/folder", "folder"));
  EXPECT_TRUE(logged(LogLevel::error, line));
  EXPECT_THAT(journal(), ElementsAre("consume folder", "release folder"));
  // A token that is refused stands for no file at all.
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/missing", "unknown"));
  EXPECT_EQ(world.log.count(LogLevel::error, line), 2U);
  EXPECT_THAT(world.http.requests(), IsEmpty());
}

TEST_F(UploadBackendTest, AnEmptyFileIsRefused) {
  EXPECT_FALSE(upload("/x", ""));
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "release t"));
  EXPECT_THAT(world.http.requests(), IsEmpty());
}

TEST_F(UploadBackendTest, AnEmptyFileDoesNotWaitForRoom) {
  auto all = world.uploads.enter(world.uploads.limits().bytesUnderWay, 1);
  ASSERT_TRUE(all);
  std::thread other([this] { EXPECT_TRUE(world.uploads.enter(1, 2)); });
  while (world.uploads.waiting() == 0) std::this_thread::yield();
  // Behind the other it would wait for ever.
  EXPECT_FALSE(upload("/x", ""));
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "release t"));
  EXPECT_EQ(world.uploads.waiting(), 1U);
  all.reset();
  other.join();
}

TEST_F(UploadBackendTest, AFileThatCannotBeReadCountsAsEmpty) {
  world.clientFiles.files["t"] = {.text = "x",
                                  .readError = Error(kClientFileErrorDomain, 5, "Input/output error")};
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(
      logged(LogLevel::warning, "UploadBackend(uploadFileAtPath): /x cannot be read: Input/output error"));
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
}

TEST_F(UploadBackendTest, WhatIsLeftOfAFileThatShrankIsUploaded) {
  world.clientFiles.files["t"] = {.text = "half", .claimedSize = 8};
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(logged(LogLevel::warning,
                     "UploadBackend(uploadFileAtPath): /x shrank from 8 to 4 bytes while it was read"));
  EXPECT_EQ(inflated(*world.http.requests().at(0).body), "half");
}

TEST_F(UploadBackendTest, ALargerFileThanAllowedIsRefusedUnread) {
  const uint64_t limit = world.uploads.limits().fileBytes;
  world.clientFiles.files["t"] = {.text = "x", .claimedSize = limit + 1};
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(logged(LogLevel::error,
                     "UploadBackend(uploadFileAtPath): /x has 33554433 bytes; at most 33554432 are uploaded "
                     "(limits.max_upload_bytes)"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "release t"));
  world.clientFiles.files["t"].claimedSize = limit;
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
}

TEST_F(UploadBackendTest, WithoutRoomItIsRefusedUnread) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.uploads.stop();  // nobody gets room any more
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(
      logged(LogLevel::error,
             "UploadBackend(uploadFileAtPath): /x with 1 bytes found no room among the uploads under way, "
             "whose limit is 33554432 bytes"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "release t"));
}

TEST_F(UploadBackendTest, WhenTheDaemonEndsAfterItGotRoomNothingIsSent) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.clientFiles.onRead = [this] { world.uploads.stop(); };
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_THAT(world.http.requests(), IsEmpty());
  EXPECT_TRUE(logged(LogLevel::error,
                     "UploadBackend(uploadFileAtPath): post TarnelHTTPErrorDomain (-1): the daemon ends"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
}

TEST_F(UploadBackendTest, WhenTheDaemonEndsBeforeTheAnswerTheRequestIsNotCompleted) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.http.holdAnswers(true);
  std::thread end([this] {
    while (world.http.pendingCount() == 0) std::this_thread::yield();
    world.uploads.stop();
  });
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  end.join();
}

TEST_F(UploadBackendTest, RoomComesBackHoweverTheUploadEnds) {
  const uint64_t most = world.uploads.limits().bytesUnderWay;
  world.clientFiles.files["t"] = {.text = "x", .claimedSize = most};
  world.http.setAnswer(FakeHttpClient::failure("unreachable"));
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
  world.clientFiles.files["t"].readError = Error(kClientFileErrorDomain, 5, "broken");
  for (int i = 0; i < 3; ++i) EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(world.uploads.enter(most, 0));
}

TEST_F(UploadBackendTest, AReplyThatSaysSuccessDeletesTheFile) {
  for (const char* reply : {"success", "{\"result\": \"success\"}", "unsuccessful"}) {
    world.clientFiles.journal.clear();
    EXPECT_TRUE(upload("/x", "text", reply));
    EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "delete t", "release t")) << reply;
  }
}

TEST_F(UploadBackendTest, AnyOtherReplyKeepsTheFileAndIsNoFailure) {
  for (const char* reply : {"", "SUCCESS", "Success", "succes s", "no"}) {
    world.clientFiles.journal.clear();
    EXPECT_TRUE(upload("/x", "text", reply));
    EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t")) << reply;
  }
  EXPECT_TRUE(logged(LogLevel::information,
                     "UploadBackend(uploadFileAtPath): the server does not say that it took /x (status 200), "
                     "which stays"));
}

TEST_F(UploadBackendTest, AReplyThatIsNoTextKeepsTheFile) {
  EXPECT_TRUE(upload("/x", "text", "success\xFF"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
  EXPECT_TRUE(
      logged(LogLevel::debug,
             "UploadBackend(uploadFileAtPath): sending to |https://files.example/up|, Json output: (null)"));
}

TEST_F(UploadBackendTest, TheStatusIsNotLookedAt) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.http.setAnswer(FakeHttpClient::status(500, "success"));
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "delete t", "release t"));
}

TEST_F(UploadBackendTest, ATransportFailureKeepsTheFileAndIsStillTrue) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.http.setAnswer(FakeHttpClient::failure("the server cannot be reached"));
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(logged(LogLevel::error,
                     "UploadBackend(uploadFileAtPath): post TarnelHTTPErrorDomain (7): the server cannot be "
                     "reached"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
}

TEST_F(UploadBackendTest, AReplyThatBreaksOffIsATransportFailureWhateverItsStatus) {
  world.clientFiles.files["t"] = {.text = "x"};
  auto result = FakeHttpClient::failure("cut short");
  result.response = HttpResponse{200, {}};
  world.http.setAnswer(result);
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(
      logged(LogLevel::error, "UploadBackend(uploadFileAtPath): post TarnelHTTPErrorDomain (7): cut short"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
}

TEST_F(UploadBackendTest, WhatTheHttpClientDoesNotCarryOutIsAFailure) {
  world.clientFiles.files["t"] = {.text = "x"};
  for (const auto& [code, number] : std::vector<std::pair<int64_t, std::string>>{
           {kHttpClientGoingAway, "-1"}, {kHttpTooMuchQueued, "-2"}, {kHttpNotBegun, "-4"}}) {
    world.clientFiles.journal.clear();
    world.http.setAnswer({std::nullopt, std::nullopt, Error(kHttpErrorDomain, code, "not now")});
    EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
    EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): post TarnelHTTPErrorDomain (" +
                                            number + "): not now"));
    EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
  }
  // The code alone says nothing.
  world.http.setAnswer({std::nullopt, std::nullopt, Error("another", kHttpTooMuchQueued, "no room")});
  EXPECT_TRUE(make(profile)->uploadFileAtPath("/x", "t"));
}

TEST_F(UploadBackendTest, AnAddressThatMakesNoRequestIsRefused) {
  world.clientFiles.files["t"] = {.text = "x"};
  world.http.setAnswer({std::nullopt, std::nullopt, Error(kHttpErrorDomain, kHttpBadRequest, "no URL")});
  EXPECT_FALSE(make(profile)->uploadFileAtPath("/x", "t"));
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Unable to create URL request"));
  EXPECT_THAT(journal(), ElementsAre("consume t", "read t", "release t"));
}

}  // namespace
}  // namespace tarnel

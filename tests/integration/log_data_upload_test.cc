#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <future>

#include "formats/archive.h"
#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/raw_http_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Log records of clients, from the client library through the confined daemon to a dashboard's server.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

class LogDataUploadTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
  }
  // The storebag of client type 8: records go to the address, messages to the lab.
  void serve(const Value& postURL) const {
    lab.serve(
        "brevan",
        storebag("1", {{"httppost", profile({clientEntry(lab.eventsURL(), lab.realtimeURL())})},
                       {"dashboard", Dictionary{{"ip", "127.0.0.1"}, {"port", 9}, {"post_url", postURL}}}}));
  }
  static client::Array oneRecord() {
    client::Dictionary record;
    record.set("text", "no route");
    client::Array records;
    records.append(record);
    return records;
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(LogDataUploadTest, RecordsArriveAsAnArchive) {
  std::promise<std::string> came;
  const RawHttpServer server(RawHttpServer::answering([&came](const std::string& request) {
    came.set_value(request);
    return httpAnswer("500 Whatever", "https://logs.example/1");
  }));
  serve(server.url("/logs"));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  EXPECT_TRUE(session.session.uploadLogDataAndWait(oneRecord(), kDeadline).success);
  const std::string request = came.get_future().get();
  EXPECT_THAT(request, StartsWith("POST /logs HTTP/1.1\r\n"));
  EXPECT_THAT(request, HasSubstr("\r\nContent-Type: application/octet-stream\r\n"));
  const auto value = unarchiveObject(request.substr(request.find("\r\n\r\n") + 4));
  ASSERT_TRUE(value);
  EXPECT_EQ(*value, Value(Array{Dictionary{{"text", "no route"}}}));
  EXPECT_TRUE(
      instance.waitForLog("DashboardBackend(uploadLogData): Log data uploaded to https://logs.example/1"));
}

TEST_F(LogDataUploadTest, AnAddressThatLeadsNowhereFailsAndHarmsNothing) {
  const std::vector<std::pair<Value, std::string>> wrong{
      {5, "Post URL for log data array is nil"},
      {Array{"http://127.0.0.1/"}, "Post URL for log data array is nil"},
      {"", "Error uploading log data array (TarnelHTTPErrorDomain (-3): \"\" is no http or https URL"},
      {"no url",
       "Error uploading log data array (TarnelHTTPErrorDomain (-3): \"no url\" is no http or https"},
      {"ftp://127.0.0.1/logs", "only http and https are supported, not \"ftp\""}};
  for (const auto& [postURL, line] : wrong) {
    PrivateInstance daemon;
    lab.connect(daemon);
    daemon.setConsent(true);
    serve(postURL);
    ASSERT_TRUE(daemon.start());
    TestSession session(daemon, {});
    const auto reply = session.session.uploadLogDataAndWait(oneRecord(), kDeadline);
    EXPECT_TRUE(reply.ok());
    EXPECT_FALSE(reply.success) << line;
    EXPECT_TRUE(daemon.waitForLog(line)) << daemon.log();
    EXPECT_TRUE(session.send(9, 11).ok());
    daemon.expectAlive();
  }
}

TEST_F(LogDataUploadTest, OneThatHangsDelaysNobodyElseNorTheEndOfTheDaemon) {
  std::promise<void> hangs;
  const RawHttpServer server(RawHttpServer::hangingAfterRequest(hangs));
  serve(server.url("/logs"));
  ASSERT_TRUE(instance.start());
  auto options = optionsFor(instance);
  options.linger = std::chrono::milliseconds(0);
  TestSession stuck(options, {.sessionID = 1});
  ASSERT_TRUE(stuck.session.uploadLogData(oneRecord(), [](const client::Reply&) {}));
  hangs.get_future().wait();
  {
    TestSession other(instance, {.sessionID = 2});
    EXPECT_TRUE(other.send(9, 11).ok());
    EXPECT_TRUE(other.session.finishAndWait(kDeadline).ok());
  }
  instance.expectAlive();
  instance.stop();
  EXPECT_THAT(instance.log(), HasSubstr("DashboardBackend(uploadLogData): Error uploading log data array "
                                        "(TarnelHTTPErrorDomain (-1): the daemon ends)"));
}

}  // namespace
}  // namespace tarnel::test

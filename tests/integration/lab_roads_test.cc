#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <random>

#include "formats/archive.h"
#include "formats/document.h"
#include "testing/http_request.h"
#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Files and log data, from the client library through the confined daemon to the lab.

namespace tarnel::test {
namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::SizeIs;
using ::testing::StartsWith;

class LabRoadsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    // The session's log data goes to the dashboard, whose own address takes no part in it.
    lab.serve(
        "brevan",
        storebag("1", {{"httppost", profile({clientEntry(lab.eventsURL(), lab.realtimeURL())})},
                       {"uploadserver", Dictionary{{"post_url", lab.uploadURL()}}},
                       {"dashboard",
                        Dictionary{{"ip", "127.0.0.1"}, {"port", 9}, {"post_url", lab.logDataURL()}}}}));
    ASSERT_TRUE(instance.start());
  }
  std::string write(const std::string& name, const std::string& text) const {
    std::string path = instance.folder().path(name);
    std::ofstream(path) << text;
    return path;
  }
  static bool exists(const std::string& path) { return std::filesystem::exists(path); }
  FinishedProcess uploadLog(std::vector<std::string> more, std::string_view input = {}) const {
    ProcessOptions options;
    options.program = kTarnelctl;
    options.arguments = {"upload-log", "--client-type", "8"};
    std::move(more.begin(), more.end(), std::back_inserter(options.arguments));
    options.environment = instance.environment();
    return runProcess(options, input);
  }
  static client::Array logRecords() {
    client::Dictionary first;
    first.set("level", 3).set("text", "no route");
    client::Dictionary second;
    second.set("level", 6).set("text", "no route");
    client::Array records;
    records.append(first).append(second);
    return records;
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(LabRoadsTest, AFileArrivesUnpackedAndIsDeletedAtTheClient) {
  const std::string contents = "what went wrong\n" + std::string(100'000, 'x');
  const auto path = write("a b&c.log", contents);
  TestSession session(instance, {.sessionID = 77});
  const auto reply = session.session.uploadFileAndWait(path, kDeadline);
  ASSERT_TRUE(reply.ok()) << reply.status.message;
  EXPECT_TRUE(reply.success);
  EXPECT_FALSE(exists(path));
  const auto uploads = lab.uploads();
  ASSERT_THAT(uploads, SizeIs(1));
  const Dictionary& upload = uploads[0];
  EXPECT_EQ(*findArray(upload, "problems"), Array());
  EXPECT_EQ(textIn(upload, "path"), "/v1/uploads");
  EXPECT_EQ(textIn(upload, "filename"), "a b&c.log.gz");
  EXPECT_EQ(textIn(upload, "sequence"), "77");
  EXPECT_EQ(textIn(upload, "description"), "Lumora AFRC log (Uploaded by QMX)");
  EXPECT_EQ(textIn(upload, "raw"), "true");
  EXPECT_EQ(numberIn(upload, "plainBytes"), static_cast<int64_t>(contents.size()));
  EXPECT_THAT(textIn(upload, "file"), StartsWith(lab.folder().path("uploads/")));
  EXPECT_THAT(textIn(upload, "file"), EndsWith("-a_b_c.log"));
  EXPECT_EQ(readWholeFile(textIn(upload, "file")), contents);
  const auto beside = parseDocument(readWholeFile(textIn(upload, "file") + ".json"));
  ASSERT_TRUE(beside);
  EXPECT_EQ(textIn(*beside->dictionary(), "filename"), "a b&c.log.gz");
  instance.expectAlive();
}

TEST_F(LabRoadsTest, AFileThatHardlyShrinksArrivesWhole) {
  std::minstd_rand random(1);
  std::string contents(6U << 20U, '\0');
  for (char& byte : contents) byte = static_cast<char>(random());
  const auto path = write("large.bin", contents);
  TestSession session(instance, {});
  EXPECT_TRUE(session.session.uploadFileAndWait(path, kDeadline).success);
  EXPECT_FALSE(exists(path));
  const auto uploads = lab.uploads();
  ASSERT_THAT(uploads, SizeIs(1));
  EXPECT_GT(numberIn(uploads[0], "wireBytes"), 5 << 20);
  EXPECT_TRUE(readWholeFile(textIn(uploads[0], "file")) == contents);
}

TEST_F(LabRoadsTest, AFileThatTheLabRefusesStaysAndMayBeSentAgain) {
  lab.misbehave("for=uploads&refuse=1");
  // Its name must not be taken for the word that the daemon looks for.
  const auto path = write("success.log", "text");
  TestSession session(instance, {});
  EXPECT_TRUE(session.session.uploadFileAndWait(path, kDeadline).success);
  EXPECT_TRUE(exists(path));
  EXPECT_TRUE(session.session.uploadFileAndWait(path, kDeadline).success);
  EXPECT_FALSE(exists(path));
  const auto uploads = lab.uploads();
  ASSERT_THAT(uploads, SizeIs(2));
  EXPECT_EQ(textIn(uploads[0], "answered"), "refused");
  EXPECT_EQ(textIn(uploads[1], "answered"), "200");
}

TEST_F(LabRoadsTest, AFileSurvivesALabThatEndsTheConnection) {
  const auto path = write("x.log", "text");
  TestSession session(instance, {});
  // On a new connection, then on one that was kept for it: it is sent once.
  EXPECT_TRUE(session.session.uploadFileAndWait(write("before.log", "text"), kDeadline).success);
  for (size_t times = 1; times <= 2; ++times) {
    lab.misbehave("for=uploads&reset=1");
    EXPECT_TRUE(session.session.uploadFileAndWait(path, kDeadline).success);
    EXPECT_TRUE(exists(path));
    EXPECT_THAT(lab.uploads(), SizeIs(2 * times));
    EXPECT_TRUE(session.session.uploadFileAndWait(write("between.log", "text"), kDeadline).success);
  }
}

TEST_F(LabRoadsTest, LogDataArrivesDecodedAndItsLocationIsTold) {
  TestSession session(instance, {});
  const auto reply = session.session.uploadLogDataAndWait(logRecords(), kDeadline);
  ASSERT_TRUE(reply.ok()) << reply.status.message;
  EXPECT_TRUE(reply.success);
  const auto arrivals = lab.logData();
  ASSERT_THAT(arrivals, SizeIs(1));
  const Dictionary& arrival = arrivals[0];
  EXPECT_EQ(*findArray(arrival, "problems"), Array());
  EXPECT_EQ(numberIn(arrival, "recordCount"), 2);
  const Value expected(
      Array{Dictionary{{"level", 3}, {"text", "no route"}}, Dictionary{{"level", 6}, {"text", "no route"}}});
  EXPECT_EQ(*parseDocument(readWholeFile(textIn(arrival, "recordsFile"))), expected);
  const auto raw = unarchiveObject(readWholeFile(textIn(arrival, "archiveFile")));
  ASSERT_TRUE(raw);
  EXPECT_EQ(*raw, expected);
  const std::string location = textIn(arrival, "location");
  instance.waitForLog("DashboardBackend(uploadLogData): Log data uploaded to " + location);
  // The location leads somewhere.
  const size_t slash = location.find('/', std::string("http://").size());
  const auto port = static_cast<uint16_t>(std::stoul(location.substr(location.rfind(':', slash) + 1)));
  const auto shown = httpRequest(port, "GET", location.substr(slash));
  EXPECT_EQ(shown.status, 200);
  EXPECT_EQ(*parseDocument(shown.body), expected);
}

TEST_F(LabRoadsTest, TheToolUploadsRecordsOfAFileAndOfStandardInput) {
  const std::string lines = "{\"level\": 3, \"text\": \"no route\"}\n{\"level\": 6}\n";
  const Value expected(Array{Dictionary{{"level", 3}, {"text", "no route"}}, Dictionary{{"level", 6}}});
  const auto fromFile = uploadLog({write("records.json", lines)});
  EXPECT_EQ(fromFile.end.status, 0) << fromFile.errors;
  EXPECT_THAT(fromFile.output, EndsWith("\nupload: 2 records were taken\n"));
  const auto fromInput = uploadLog({"--json", "-"}, lines);
  EXPECT_EQ(fromInput.end.status, 0) << fromInput.errors;
  const auto answer = parseDocument(fromInput.output);
  ASSERT_TRUE(answer && answer->dictionary() != nullptr) << fromInput.output;
  const Value* upload = answer->dictionary()->find("upload");
  ASSERT_NE(upload, nullptr) << fromInput.output;
  EXPECT_EQ(*upload, Value(Dictionary{{"success", true}, {"records", 2}}));
  EXPECT_THAT(uploadLog({"-"}, "{\"level\": 1}\n").output, EndsWith("\nupload: 1 record was taken\n"));
  const auto arrivals = lab.logData();
  ASSERT_THAT(arrivals, SizeIs(3));
  for (size_t i = 0; i < 2; ++i) {
    EXPECT_EQ(*parseDocument(readWholeFile(textIn(arrivals[i], "recordsFile"))), expected);
  }
  EXPECT_EQ(numberIn(arrivals[2], "recordCount"), 1);
}

TEST_F(LabRoadsTest, StatusCountsWhatArrived) {
  const Dictionary before = lab.status();
  TestSession session(instance, {});
  EXPECT_TRUE(session.session.uploadFileAndWait(write("x.log", "text"), kDeadline).success);
  EXPECT_TRUE(session.session.uploadLogDataAndWait(logRecords(), kDeadline).success);
  const Dictionary after = lab.status();
  for (const auto& [key, more] : std::vector<std::pair<std::string, int64_t>>{
           {"uploads", 1}, {"uploadBytes", 4}, {"logArchives", 1}, {"logRecords", 2}}) {
    EXPECT_EQ(numberIn(after, key), numberIn(before, key) + more) << key;
  }
  EXPECT_EQ(numberIn(after, "uploadsWithProblems"), numberIn(before, "uploadsWithProblems"));
}

}  // namespace
}  // namespace tarnel::test

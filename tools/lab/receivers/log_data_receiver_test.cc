#include "tools/lab/receivers/log_data_receiver.h"

#include <gmock/gmock.h>

#include <filesystem>

#include "formats/archive.h"
#include "formats/document.h"
#include "tools/lab/receivers/storing_receiver_test_fixture.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

const Array& records() {
  static const Array kRecords = {Dictionary{{"time", Date{1700000000.5}}, {"level", 3}, {"text", "no route"}},
                                 Dictionary{{"data", Data{1, 2}}, {"text", "no route"}}};
  return kRecords;
}

class LogDataReceiverTest : public StoringReceiverTest {
 protected:
  LogDataReceiverTest() : StoringReceiverTest("tarnel_log_data_") {}

  static HttpRequest requestWith(std::string archive) {
    HttpRequest request;
    request.method = "POST";
    request.path = "/v1/log-data";
    request.sender = "127.0.0.1:50000";
    request.headers = {{"Content-Type", "application/octet-stream"}};
    request.body = std::move(archive);
    return request;
  }
  LogDataArrival receive(const HttpRequest& request) {
    answer_ = receiver_.receive(request);
    return store_.lastLogData(1).at(0);
  }
  LogDataArrival receive(const Value& root) { return receive(requestWith(*archiveObject(root))); }

  LogDataReceiver receiver_{files_, "http://127.0.0.1:8444/log-data", store_, misbehaviours_, clock_};
  HttpAnswer answer_;
};

TEST_F(LogDataReceiverTest, RecordsAreReadKeptAndAnsweredWithTheirLocation) {
  const LogDataArrival arrival = receive(records());
  EXPECT_THAT(arrival.problems, IsEmpty());
  EXPECT_EQ(arrival.records, records());
  EXPECT_EQ(*readFile(arrival.archiveFile, 1U << 20U), *archiveObject(records()));
  EXPECT_EQ(*parseDocument(*readFile(arrival.recordsFile, 1U << 20U)), Value(records()));
  EXPECT_THAT(*readFile(arrival.recordsFile, 1U << 20U), HasSubstr("\"$date\": \"2023-11-14T22:13:20.5"));
  EXPECT_EQ(arrival.recordsFile, arrival.archiveFile + ".json");
  EXPECT_EQ(arrival.location, "http://127.0.0.1:8444/log-data/20231114-221320-0001-records.archive");
  EXPECT_EQ(answer_.status, 200);
  EXPECT_EQ(answer_.body, arrival.location) << "the whole text is the location";
  EXPECT_EQ(answer_.contentType, "text/plain; charset=utf-8");
  EXPECT_EQ(store_.counts().logRecords, 2U);
}

TEST_F(LogDataReceiverTest, AnEmptyArrayIsLogDataToo) {
  EXPECT_THAT(receive(Array()).problems, IsEmpty());
  EXPECT_EQ(answer_.status, 200);
}

TEST_F(LogDataReceiverTest, WhatIsNotAListOfDictionariesIsTold) {
  EXPECT_THAT(receive(Dictionary{{"a", 1}}).problems,
              ElementsAre("archive: its root must be a list of records"));
  EXPECT_EQ(answer_.status, 200);
  EXPECT_THAT(receive(Array{Dictionary(), 5}).problems, ElementsAre("record 2: must be a dictionary"));
}

TEST_F(LogDataReceiverTest, WhatIsNoArchiveIsKeptAsItCame) {
  const LogDataArrival arrival = receive(requestWith("no archive"));
  EXPECT_THAT(arrival.problems, ElementsAre(StartsWith("archive: ")));
  EXPECT_EQ(answer_.status, 400);
  EXPECT_EQ(answer_.body, arrival.problems[0] + "\n");
  EXPECT_EQ(arrival.location, "");
  EXPECT_EQ(arrival.recordsFile, "");
  EXPECT_EQ(*readFile(arrival.archiveFile, 100), "no archive");
  EXPECT_FALSE(std::filesystem::exists(arrival.archiveFile + ".json"));
}

TEST_F(LogDataReceiverTest, BodiesThatDidNotComeWholeOrPackedAreRefused) {
  HttpRequest request = requestWith("x");
  request.bodyState = BodyState::tooLarge;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: larger than 16.8 MB"));
  EXPECT_EQ(answer_.status, 413);
  request.bodyState = BodyState::cutOff;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: the connection ended within it"));
  EXPECT_EQ(answer_.status, 400);
  request.bodyState = BodyState::complete;
  request.headers.emplace_back("Content-Encoding", "br");
  EXPECT_THAT(receive(request).problems,
              ElementsAre("header Content-Encoding: must be missing, but is \"br\""));
  EXPECT_EQ(answer_.status, 415);
}

TEST_F(LogDataReceiverTest, AFolderThatIsGoneIsTold) {
  std::filesystem::remove_all(folder_);
  const LogDataArrival arrival = receive(records());
  EXPECT_THAT(arrival.problems, ElementsAre(StartsWith("cannot write " + folder_)));
  EXPECT_EQ(answer_.status, 500);
  EXPECT_EQ(arrival.location, "");
}

TEST_F(LogDataReceiverTest, MisbehavesOnPurpose) {
  ASSERT_FALSE(misbehaviours_.add(*misbehaviourFromQuery({{"for", "log-data"}, {"empty", "1"}})));
  EXPECT_EQ(receive(records()).answered, "empty body");
  EXPECT_EQ(answer_.body, "");
}

}  // namespace
}  // namespace tarnel::lab

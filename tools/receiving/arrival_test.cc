#include "tools/receiving/arrival.h"

#include <gmock/gmock.h>
#include <sys/stat.h>

#include <filesystem>

#include "formats/document.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/ndjson_writer.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::SizeIs;

class Recorder final : public ArrivalObserver, public Notices {
 public:
  void arrived(const Arrival& arrival) override { numbers.push_back(arrival.number); }
  void storebagServed(const ServedStorebag&) override {}
  void warning(const std::string& text) override { warnings.push_back(text); }
  std::vector<uint64_t> numbers;
  std::vector<std::string> warnings;
};

Arrival arrivalOf(size_t events, uint64_t bytes = 100) {
  Arrival arrival;
  arrival.arrived = 1795176612.25;
  arrival.path = "/v1/events";
  arrival.sender = "127.0.0.1:5";
  arrival.headers = {{"X-TRN-Sender", "OW"}};
  arrival.clientId = "0f9c";
  arrival.postTime = 1795176611.5;
  for (size_t i = 0; i < events; ++i)
    arrival.events.append(goodEvent(static_cast<int>(i), i % 2 == 0 ? 10 : 9));
  arrival.wireBytes = bytes;
  arrival.plainBytes = bytes;
  arrival.answered = "200";
  return arrival;
}

std::vector<Value> linesOf(const std::string& path) {
  std::vector<Value> lines;
  std::string text = *readFile(path, 1U << 24U);
  for (size_t end = text.find('\n'); end != std::string::npos; end = text.find('\n')) {
    lines.push_back(*parseDocument(text.substr(0, end)));
    text.erase(0, end + 1);
  }
  EXPECT_EQ(text, "") << "every line is ended";
  return lines;
}

TEST(ArrivalStoreTest, NumbersCountsAndTellsInOrder) {
  ArrivalStore store(10);
  Recorder first;
  Recorder second;
  store.addObserver(first);
  store.addObserver(second);
  store.add(arrivalOf(3, 50));
  Arrival bad = arrivalOf(0, 7);
  bad.problems = {"p"};
  store.add(bad);
  EXPECT_THAT(first.numbers, ElementsAre(1, 2));
  EXPECT_EQ(second.numbers, first.numbers);
  const ArrivalCounts counts = store.counts();
  EXPECT_EQ(counts.posts, 2U);
  EXPECT_EQ(counts.events, 3U);
  EXPECT_EQ(counts.postsWithProblems, 1U);
  EXPECT_EQ(counts.wireBytes, 57U);
  store.clear();
  EXPECT_EQ(store.counts().posts, 0U);
  EXPECT_THAT(store.last(9), SizeIs(0));
  store.add(arrivalOf(1));
  EXPECT_EQ(store.last(9).at(0).number, 3U);
}

TEST(ArrivalStoreTest, KeepsTheNewestByCountAndByBytes) {
  ArrivalStore byCount(2);
  for (int i = 0; i < 5; ++i) byCount.add(arrivalOf(1));
  EXPECT_THAT(byCount.last(9), SizeIs(2));
  EXPECT_EQ(byCount.last(1).at(0).number, 5U);
  ArrivalStore byBytes(100, 250);
  for (int i = 0; i < 5; ++i) byBytes.add(arrivalOf(1, 100));
  EXPECT_THAT(byBytes.last(9), SizeIs(2));
  byBytes.add(arrivalOf(1, 251));
  EXPECT_THAT(byBytes.last(9), SizeIs(0));
  ArrivalStore none(0);
  none.add(arrivalOf(1));
  EXPECT_THAT(none.last(9), SizeIs(0));
}

TEST(ArrivalStoreTest, KindsAreNumberedKeptAndCountedApart) {
  ArrivalStore store(2);
  for (uint64_t i = 1; i <= 3; ++i) {
    store.add(arrivalOf(1));
    UploadArrival upload;
    upload.plainBytes = 10;
    upload.problems = {"p"};
    store.addUpload(upload);
    LogDataArrival logData;
    logData.records = {1, 2};
    store.addLogData(logData);
    DatagramArrival datagram;
    datagram.answer = i == 1 ? DatagramAnswer::dropped : DatagramAnswer::acknowledgementDropped;
    store.addDatagram(datagram);
    EXPECT_EQ(store.last(1).at(0).number, i);
    EXPECT_EQ(store.lastUploads(1).at(0).number, i);
    EXPECT_EQ(store.lastLogData(1).at(0).number, i);
    EXPECT_EQ(store.lastDatagrams(1).at(0).number, i);
  }
  EXPECT_THAT(store.lastUploads(9), SizeIs(2));
  EXPECT_THAT(store.lastLogData(9), SizeIs(2));
  EXPECT_THAT(store.lastDatagrams(9), SizeIs(2));
  const ArrivalCounts counts = store.counts();
  EXPECT_EQ(counts.uploads, 3U);
  EXPECT_EQ(counts.uploadsWithProblems, 3U);
  EXPECT_EQ(counts.uploadBytes, 30U);
  EXPECT_EQ(counts.logArchives, 3U);
  EXPECT_EQ(counts.logArchivesWithProblems, 0U);
  EXPECT_EQ(counts.logRecords, 6U);
  EXPECT_EQ(counts.datagrams, 3U);
  EXPECT_EQ(counts.dropped, 1U);
  EXPECT_EQ(counts.acknowledgementsDropped, 2U);
  store.clear();
  EXPECT_EQ(store.counts().uploads, 0U);
  EXPECT_THAT(store.lastUploads(9), SizeIs(0));
  EXPECT_THAT(store.lastLogData(9), SizeIs(0));
  EXPECT_THAT(store.lastDatagrams(9), SizeIs(0));
}

TEST(ArrivalRecords, UploadsAndLogData) {
  UploadArrival upload;
  upload.number = 4;
  upload.arrived = 5.5;
  upload.path = "/u";
  upload.sender = "s";
  upload.query = {.uuid = "id", .filename = "a b.gz"};
  upload.file = "/lab/uploads/x";
  upload.gzip = true;
  upload.wireBytes = 1;
  upload.plainBytes = 2;
  upload.answered = "200";
  EXPECT_EQ(writeTextDocument(recordOfUpload(upload)),
            "{\"upload\":4,\"arrived\":5.5,\"path\":\"/u\",\"sender\":\"s\",\"answered\":\"200\","
            "\"headers\":{},\"uuid\":\"id\",\"filename\":\"a b.gz\",\"file\":\"/lab/uploads/x\","
            "\"wireBytes\":1,\"plainBytes\":2,\"gzip\":true,\"problems\":[]}");
  LogDataArrival logData;
  logData.number = 4;
  logData.arrived = 5.5;
  logData.path = "/l";
  logData.location = "there";
  logData.archiveFile = "a";
  logData.recordsFile = "a.json";
  logData.records = {1};
  EXPECT_EQ(writeTextDocument(recordOfLogData(logData, false)),
            "{\"logData\":4,\"arrived\":5.5,\"path\":\"/l\",\"sender\":\"\",\"answered\":\"\",\"headers\":{},"
            "\"location\":\"there\",\"archiveFile\":\"a\",\"recordsFile\":\"a.json\",\"recordCount\":1,"
            "\"wireBytes\":0,\"problems\":[]}");
  EXPECT_EQ(*findArray(recordOfLogData(logData, true), "records"), logData.records);
}

TEST(ArrivalRecords, MethodsAreCountedInNumericOrder) {
  EXPECT_EQ(writeTextDocument(methodCounts(arrivalOf(5).events)), "{\"9\":2,\"10\":3}");
  EXPECT_TRUE(methodCounts(Array{1, Dictionary{{"_method", "x"}}}).empty());
}

TEST(ArrivalRecords, PostAndEventRecords) {
  Arrival arrival = arrivalOf(1);
  arrival.number = 4;
  const Dictionary post = recordOfPost(arrival, false);
  EXPECT_EQ(writeTextDocument(post),
            "{\"post\":4,\"arrived\":1795176612.25,\"path\":\"/v1/events\",\"sender\":\"127.0.0.1:5\","
            "\"answered\":\"200\",\"headers\":{\"X-TRN-Sender\":\"OW\"},\"clientId\":\"0f9c\","
            "\"postTime\":1795176611.5,\"eventCount\":1,\"methods\":{\"10\":1},\"wireBytes\":100,"
            "\"plainBytes\":100,\"gzip\":false,\"problems\":[]}");
  EXPECT_EQ(*findArray(recordOfPost(arrival, true), "events"), arrival.events);
  EXPECT_EQ(recordOfEvent(arrival, "e"), (Dictionary{{"post", 4},
                                                     {"arrived", 1795176612.25},
                                                     {"path", "/v1/events"},
                                                     {"headers", Dictionary{{"X-TRN-Sender", "OW"}}},
                                                     {"clientId", "0f9c"},
                                                     {"postTime", 1795176611.5},
                                                     {"event", "e"}}));
}

class NdjsonWriterTest : public ::testing::Test {
 protected:
  NdjsonWriterTest() { std::filesystem::create_directories(folder_); }
  ~NdjsonWriterTest() override { std::filesystem::remove_all(folder_); }
  const std::string folder_ = ::testing::TempDir() + "tarnel_ndjson_" +
                              ::testing::UnitTest::GetInstance()->current_test_info()->name();
  Recorder notices_;
};

TEST_F(NdjsonWriterTest, OneLineAnEventAndOneAPostAppended) {
  for (int run = 0; run < 2; ++run) {
    NdjsonWriter writer(folder_, notices_);
    ASSERT_FALSE(writer.open());
    writer.arrived(arrivalOf(3));
  }
  const std::vector<Value> events = linesOf(folder_ + "/events.ndjson");
  ASSERT_THAT(events, SizeIs(6));
  EXPECT_EQ(*events[1].dictionary()->find("event"), arrivalOf(3).events[1]) << "nothing of the event is lost";
  EXPECT_THAT(linesOf(folder_ + "/posts.ndjson"), SizeIs(2));
  struct stat status {};
  ASSERT_EQ(::stat((folder_ + "/events.ndjson").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(NdjsonWriterTest, OneLineForEachArrivalOfAnotherKind) {
  NdjsonWriter writer(folder_, notices_);
  ASSERT_FALSE(writer.open());
  for (uint64_t i = 1; i <= 2; ++i) {
    UploadArrival upload;
    upload.number = i;
    writer.uploadArrived(upload);
    LogDataArrival logData;
    logData.number = i;
    writer.logDataArrived(logData);
    DatagramArrival datagram;
    datagram.number = i;
    writer.datagramArrived(datagram);
  }
  for (const auto& [file, key] : std::vector<std::pair<std::string, std::string>>{
           {"uploads", "upload"}, {"log-data", "logData"}, {"datagrams", "datagram"}}) {
    const std::vector<Value> lines = linesOf(folder_ + "/" + file + ".ndjson");
    ASSERT_THAT(lines, SizeIs(2)) << file;
    EXPECT_EQ(*lines[1].dictionary()->find(key), Value(2));
  }
}

TEST_F(NdjsonWriterTest, AFullFileMakesRoomForTheNext) {
  NdjsonWriter writer(folder_, notices_, 3000);
  ASSERT_FALSE(writer.open());
  for (int i = 0; i < 9; ++i) writer.arrived(arrivalOf(2));
  EXPECT_LE(std::filesystem::file_size(folder_ + "/events.ndjson"), 3000U);
  EXPECT_LE(std::filesystem::file_size(folder_ + "/events.ndjson.1"), 3000U);
  EXPECT_FALSE(std::filesystem::exists(folder_ + "/events.ndjson.2"));
}

TEST_F(NdjsonWriterTest, AFileTakenAwayIsMadeAnew) {
  NdjsonWriter writer(folder_, notices_);
  ASSERT_FALSE(writer.open());
  std::filesystem::remove(folder_ + "/events.ndjson");
  writer.arrived(arrivalOf(2));
  EXPECT_THAT(linesOf(folder_ + "/events.ndjson"), SizeIs(2));
}

TEST_F(NdjsonWriterTest, AFailureIsToldOnce) {
  NdjsonWriter writer(folder_, notices_);
  ASSERT_FALSE(writer.open());
  std::filesystem::remove_all(folder_);
  writer.arrived(arrivalOf(1));
  writer.arrived(arrivalOf(1));
  ASSERT_THAT(notices_.warnings, SizeIs(1));
  EXPECT_THAT(notices_.warnings[0], HasSubstr("cannot write " + folder_ + "/events.ndjson"));
}

}  // namespace
}  // namespace tarnel::lab

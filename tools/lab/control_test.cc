#include "tools/lab/control.h"

#include <gmock/gmock.h>
#include <unistd.h>

#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;

class ControlTest : public ::testing::Test {
 protected:
  HttpAnswer ask(const std::string& method, const std::string& path, const NameValues& query = {},
                 const NameValues& headers = {{"Host", "127.0.0.1:8444"}}) {
    HttpRequest request;
    request.method = method;
    request.path = path;
    request.query = query;
    request.headers = headers;
    return control_.answer(request);
  }
  static Dictionary document(const HttpAnswer& answer) { return *parseDocument(answer.body)->dictionary(); }

  ArrivalStore store_{10};
  Misbehaviours misbehaviours_;
  DatagramFaults faults_;
  int stops_ = 0;
  Control control_{{.store = store_,
                    .misbehaviours = misbehaviours_,
                    .datagramFaults = faults_,
                    .logDataFolder = ::testing::TempDir(),
                    .status =
                        [] {
                          return Dictionary{{"url", "here"}};
                        },
                    .stop = [this] { ++stops_; }}};
};

TEST_F(ControlTest, StatusAndArrivals) {
  EXPECT_EQ(document(ask("GET", "/status")), (Dictionary{{"url", "here"}}));
  for (int i = 0; i < 3; ++i) {
    Arrival arrival;
    arrival.events = {goodEvent(i)};
    store_.add(arrival);
  }
  const Dictionary answer = document(ask("GET", "/arrivals", {{"last", "2"}}));
  const Array& list = *findArray(answer, "arrivals");
  ASSERT_EQ(list.size(), 2U);
  EXPECT_EQ(*list[1].dictionary()->find("post"), Value(3));
  EXPECT_EQ(*findArray(*list[1].dictionary(), "events"), (Array{goodEvent(2)}));
  EXPECT_EQ(ask("GET", "/arrivals", {{"last", "x"}}).status, 400);
}

TEST_F(ControlTest, EveryKindOfArrivalHasItsList) {
  UploadArrival upload;
  upload.file = "/lab/uploads/x";
  store_.addUpload(upload);
  LogDataArrival logData;
  logData.records = {Dictionary{{"level", 3}}};
  store_.addLogData(logData);
  DatagramArrival datagram;
  datagram.size = 5;
  store_.addDatagram(datagram);
  const auto first = [this](const char* path, const char* key) {
    const Dictionary answer = document(ask("GET", path, {{"last", "9"}}));
    const Array& list = *findArray(answer, key);
    EXPECT_EQ(list.size(), 1U) << path;
    return *list[0].dictionary();
  };
  EXPECT_EQ(*findString(first("/uploads", "uploads"), "file"), "/lab/uploads/x");
  EXPECT_EQ(*findArray(first("/log-data", "logData"), "records"), logData.records);
  EXPECT_EQ(*first("/datagrams", "datagrams").find("size"), Value(5));
  EXPECT_EQ(ask("GET", "/datagrams", {{"last", "x"}}).status, 400);
  EXPECT_EQ(ask("POST", "/datagrams").status, 404);
}

TEST_F(ControlTest, LogDataIsShownUnderNamesOfTheLabAlone) {
  const std::string name = "20261120-142501-0001-records.archive";
  const std::string path = ::testing::TempDir() + "/" + name + ".json";
  ASSERT_FALSE(writeFile(path, "[1]", 0600));
  EXPECT_EQ(ask("GET", "/log-data/" + name).body, "[1]");
  ::unlink(path.c_str());
  EXPECT_EQ(ask("GET", "/log-data/" + name).status, 404);
  for (const char* other : {"", "x", "..", "../posts", "20261120-142501-0001-../x"}) {
    EXPECT_EQ(ask("GET", std::string("/log-data/") + other).status, 404) << other;
  }
}

TEST_F(ControlTest, DatagramsAreLostOnRequest) {
  const NameValues query = {{"for", "datagrams"}, {"drop", "100"}};
  EXPECT_EQ(ask("GET", "/misbehave", query).status, 200);
  EXPECT_EQ(faults_.fateOf("x", 1), DatagramFate::drop);
  const Array list = *findArray(document(ask("GET", "/misbehave")), "misbehaviours");
  ASSERT_EQ(list.size(), 1U);
  EXPECT_EQ(*findString(*list[0].dictionary(), "what"), "100 % dropped");
  EXPECT_EQ(ask("GET", "/misbehave", {{"for", "datagrams"}, {"status", "503"}}).status, 400);
  EXPECT_EQ(ask("GET", "/misbehave", {{"clear", "1"}}).status, 200);
  EXPECT_EQ(faults_.fateOf("x", 1), DatagramFate::deliver);
}

TEST_F(ControlTest, ClearAndStopTakePostOnly) {
  store_.add({});
  EXPECT_EQ(ask("GET", "/clear").status, 405);
  EXPECT_EQ(ask("GET", "/stop").status, 405);
  EXPECT_EQ(store_.counts().posts, 1U);
  EXPECT_EQ(stops_, 0);
  EXPECT_EQ(ask("POST", "/clear").status, 200);
  EXPECT_EQ(ask("POST", "/stop").status, 200);
  EXPECT_EQ(store_.counts().posts, 0U);
  EXPECT_EQ(stops_, 1);
}

TEST_F(ControlTest, MisbehaviourIsSetShownAndCleared) {
  EXPECT_EQ(document(ask("GET", "/misbehave")), (Dictionary{{"misbehaviours", Array{}}}));
  const Dictionary set = document(ask("POST", "/misbehave", {{"status", "503"}, {"count", "3"}}));
  EXPECT_EQ(set, (Dictionary{{"misbehaviours",
                              Array{Dictionary{{"for", "all"}, {"what", "status 503"}, {"left", 3}}}}}));
  EXPECT_EQ(document(ask("GET", "/misbehave")), set);
  const HttpAnswer wrong = ask("GET", "/misbehave", {{"statsu", "503"}});
  EXPECT_EQ(wrong.status, 400);
  EXPECT_THAT(wrong.body, HasSubstr("unknown parameter statsu"));
  EXPECT_EQ(document(ask("GET", "/misbehave", {{"clear", "1"}})), (Dictionary{{"misbehaviours", Array{}}}));
  for (size_t i = 0; i < Misbehaviours::kLimit; ++i) ask("GET", "/misbehave", {{"empty", "1"}});
  EXPECT_EQ(ask("GET", "/misbehave", {{"empty", "1"}}).status, 409);
}

TEST_F(ControlTest, PagesOfOtherSitesAreRefused) {
  const auto status = [this](const NameValues& headers) { return ask("GET", "/status", {}, headers).status; };
  EXPECT_EQ(status({}), 200);
  EXPECT_EQ(status({{"Host", "localhost:8444"}}), 200);
  EXPECT_EQ(status({{"Host", "[::1]:8444"}}), 200);
  EXPECT_EQ(status({{"Host", "rebound.example:8444"}}), 403);
  EXPECT_EQ(status({{"Host", "127.0.0.1:8444"}, {"Origin", "https://page.example"}}), 403);
  EXPECT_EQ(status({{"Host", "127.0.0.1:8444"}, {"Origin", "http://127.0.0.1:8444"}}), 200);
  EXPECT_EQ(status({{"Host", "127.0.0.1:8444"}, {"Sec-Fetch-Site", "cross-site"}}), 403);
  EXPECT_EQ(status({{"Host", "127.0.0.1:8444"}, {"Sec-Fetch-Site", "none"}}), 200);
}

TEST_F(ControlTest, UnknownPathsNameWhatThereIs) {
  const HttpAnswer answer = ask("GET", "/");
  EXPECT_EQ(answer.status, 404);
  EXPECT_THAT(answer.body, HasSubstr("GET /arrivals, /uploads, /log-data and /datagrams with ?last=N"));
}

}  // namespace
}  // namespace tarnel::lab

// What the lab serves and takes in.
#include "tools/lab/lab.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "tools/lab/lab_test_fixture.h"
#include "tools/receiving/test_post.h"
#include "tools/storebag/signed_storebag.h"

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;
using ::testing::SizeIs;

TEST_F(LabTest, ServesASignedStorebagThatTheBundlesKeyVerifies) {
  start();
  putStorebag("brevan", "1.0");
  Client daemon = client();
  for (const char* path : {"/storebags/brevan", "/bags/alder/brevan", "/storebags/alder/brevan"}) {
    const Client::Reply reply = daemon.get(at("url") + path + "?version=8.0");
    ASSERT_EQ(reply.code, CURLE_OK) << reply.problem;
    EXPECT_EQ(reply.status, 200);
    EXPECT_EQ(field(reply, "Cache-Control"), "max-age=60");
    const Result<Value> inner = verifySignedStorebag(reply.body, *publicKey());
    ASSERT_TRUE(inner) << inner.error().description();
    EXPECT_THAT(writeTextDocument(*inner), HasSubstr("\"post_url\":\"" + at("eventsURL") + "\""));
  }
}

TEST_F(LabTest, NotModifiedIsAnEmptyBodyWithTheDate) {
  start();
  putStorebag("brevan", "1.0");
  Client daemon = client();
  const std::string url = at("storebagURL") + "/brevan?version=8.0";
  const std::string date = field(daemon.get(url), "Last-Modified");
  ASSERT_NE(date, "");
  const Client::Reply same = daemon.get(url, {"If-Modified-Since: " + date});
  EXPECT_EQ(same.status, 304);
  EXPECT_EQ(same.body, "");
  EXPECT_EQ(field(same, "Last-Modified"), date);
  putStorebag("brevan", "2.0");
  const Client::Reply changed = daemon.get(url, {"If-Modified-Since: " + date});
  EXPECT_EQ(changed.status, 200);
  EXPECT_THAT(writeTextDocument(*verifySignedStorebag(changed.body, *publicKey())),
              HasSubstr("\"version\":\"2.0\""));
}

TEST_F(LabTest, PostsArriveOnDiskAndAtTheControlAddress) {
  start();
  Client daemon = client();
  const Array events = {goodEvent(1), goodEvent(2)};
  EXPECT_EQ(daemon.post(at("eventsURL"), goodRequest(goodMessage(events), true)).status, 200);
  EXPECT_EQ(daemon.post(at("realtimeURL"), goodRequest(goodMessage({goodEvent(3)}))).status, 200);
  const Client::Reply shown = client().get(at("controlURL") + "/arrivals?last=1");
  const Result<Value> document = parseDocument(shown.body);
  ASSERT_TRUE(document);
  const Array& arrivals = *findArray(*document->dictionary(), "arrivals");
  ASSERT_THAT(arrivals, SizeIs(1));
  EXPECT_EQ(*findString(*arrivals[0].dictionary(), "path"), "/v1/realtime");
  EXPECT_EQ(*findArray(*arrivals[0].dictionary(), "problems"), Array{}) << shown.body;
  const std::string lines = *readFile(at("eventsFile"), 1U << 20U);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 3);
  const Result<Value> first = parseDocument(lines.substr(0, lines.find('\n')));
  EXPECT_EQ(*first->dictionary()->find("event"), Value(goodEvent(1)));
  EXPECT_EQ(*findString(*findDictionary(*first->dictionary(), "headers"), "Content-Encoding"), "gzip");
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 3);
  EXPECT_EQ(lab_->status().find("postsWithProblems")->int64Value(), 0);
}

TEST_F(LabTest, MisbehavesAsToldAndNoLonger) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  Client daemon = client();
  misbehave("status=503&count=2");
  EXPECT_EQ(daemon.get(url).status, 503);
  EXPECT_EQ(daemon.get(url).status, 503);
  EXPECT_EQ(daemon.get(url).status, 200);
  misbehave("empty=1");
  EXPECT_EQ(daemon.get(url).body, "");
  misbehave("break-signature=1");
  EXPECT_FALSE(verifySignedStorebag(daemon.get(url).body, *publicKey()));
  misbehave("for=events&status=599");
  EXPECT_EQ(daemon.get(url).status, 200);
  EXPECT_EQ(daemon.post(at("eventsURL"), goodRequest(goodMessage({goodEvent(1)}))).status, 599);
  EXPECT_TRUE(verifySignedStorebag(daemon.get(url).body, *publicKey()));
}

TEST_F(LabTest, ResetsTheConnectionAtTheByteItIsToldTo) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  misbehave("reset=1");
  Client::Reply reply = client().get(url);
  EXPECT_THAT(reply.problem, HasSubstr("reset by peer"));
  EXPECT_EQ(reply.head + reply.body, "");
  misbehave("reset-after=300");
  reply = client().get(url);
  EXPECT_NE(reply.code, CURLE_OK);
  EXPECT_EQ(reply.head.size() + reply.body.size(), 300U);
}

TEST_F(LabTest, ManyClientsAtOnce) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  const std::string events = at("eventsURL");
  const std::string caFile = at("caFile");
  std::vector<std::thread> threads;
  std::atomic<int> good = 0;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&good, &url, &events, &caFile] {
      Client daemon(caFile);
      for (int round = 0; round < 5; ++round) {
        good += daemon.get(url).status == 200 ? 1 : 0;
        good += daemon.post(events, goodRequest(goodMessage({goodEvent(round)}), true)).status == 200 ? 1 : 0;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(good, 80);
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 40);
  const std::string lines = *readFile(at("eventsFile"), 1U << 24U);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 40);
}

}  // namespace
}  // namespace tarnel::lab

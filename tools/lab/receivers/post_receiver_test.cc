#include "tools/lab/receivers/post_receiver.h"

#include <gmock/gmock.h>

#include "platform/fake/fake_clock.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

class PostReceiverTest : public ::testing::Test {
 protected:
  Arrival receive(const HttpRequest& request) {
    answer_ = receiver_.receive(request);
    return store_.last(1).at(0);
  }

  ArrivalStore store_{100};
  Misbehaviours misbehaviours_;
  fake::FakeClock clock_;
  PostReceiver receiver_{store_, misbehaviours_, clock_};
  HttpAnswer answer_;
};

TEST_F(PostReceiverTest, AGoodPostArrivesWhole) {
  const Array events = {goodEvent(1), goodEvent(2)};
  for (const bool gzip : {false, true}) {
    const HttpRequest request = goodRequest(goodMessage(events), gzip);
    const Arrival arrival = receive(request);
    EXPECT_THAT(arrival.problems, IsEmpty());
    EXPECT_EQ(arrival.events, events);
    EXPECT_EQ(arrival.clientId, "0f9c");
    EXPECT_EQ(arrival.postTime, Value(1795176611.5));
    EXPECT_EQ(arrival.gzip, gzip);
    EXPECT_EQ(arrival.wireBytes, request.body.size());
    EXPECT_EQ(arrival.plainBytes, writeTextDocument(goodMessage(events)).size());
    EXPECT_EQ(arrival.arrived, 1700000000.0);
    EXPECT_EQ(arrival.path, "/v1/events");
    EXPECT_EQ(arrival.sender, "127.0.0.1:50000");
    EXPECT_EQ(answer_.status, 200);
    EXPECT_EQ(answer_.body, "{\"received\":2,\"problems\":[]}\n");
  }
}

TEST_F(PostReceiverTest, WhatIsNoMessageIsRefusedAndStillShown) {
  HttpRequest request = goodRequest(goodMessage({goodEvent(1)}));
  request.body = "{\"postTime\":";
  EXPECT_THAT(receive(request).problems, ElementsAre(StartsWith("body: no JSON: ")));
  EXPECT_EQ(answer_.status, 400);
  request.body = "[]";
  receive(request);
  EXPECT_EQ(answer_.status, 400);
  request.bodyState = BodyState::tooLarge;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: larger than 16.8 MB"));
  EXPECT_EQ(answer_.status, 413);
  request.bodyState = BodyState::cutOff;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: the connection ended within it"));
  EXPECT_EQ(answer_.status, 400);
}

TEST_F(PostReceiverTest, BodiesPackedOtherwiseAreRefused) {
  HttpRequest request = goodRequest(goodMessage({goodEvent(1)}));
  setHeader(request, "Content-Encoding", "br");
  EXPECT_THAT(receive(request).problems, ElementsAre(HasSubstr("must be gzip or missing, but is \"br\"")));
  EXPECT_EQ(answer_.status, 415);
  setHeader(request, "Content-Encoding", "gzip");
  EXPECT_THAT(receive(request).problems, ElementsAre(StartsWith("body: gzip: incorrect header check")));
  EXPECT_EQ(answer_.status, 400);
  setHeader(request, "Content-Encoding", "identity");
  EXPECT_THAT(receive(request).problems, IsEmpty());
  request.body = gzipped(std::string(PostReceiver::kMaxPlainBytes + 1, ' '));
  setHeader(request, "Content-Encoding", "gzip");
  EXPECT_THAT(receive(request).problems, ElementsAre("body: gzip: unpacks to more than 16777216 bytes"));
}

TEST_F(PostReceiverTest, ProblemsAreAnsweredAndDoNotRefuse) {
  const Arrival arrival = receive(goodRequest(goodMessage({goodEvent(1), 5})));
  EXPECT_THAT(arrival.problems, ElementsAre("event 2: must be an object"));
  EXPECT_EQ(answer_.status, 200);
  EXPECT_EQ(answer_.body, "{\"received\":2,\"problems\":[\"event 2: must be an object\"]}\n");
}

TEST_F(PostReceiverTest, MisbehaviourIsDoneAndNoted) {
  ASSERT_FALSE(misbehaviours_.add(*misbehaviourFromQuery({{"status", "503"}})));
  const Arrival arrival = receive(goodRequest(goodMessage({goodEvent(1)})));
  EXPECT_EQ(answer_.status, 503);
  EXPECT_EQ(arrival.answered, "status 503");
  EXPECT_EQ(receive(goodRequest(goodMessage({goodEvent(1)}))).answered, "200");
}

TEST_F(PostReceiverTest, WhatStrangersSendIsFitForPrinting) {
  HttpRequest request = goodRequest(goodMessage({goodEvent(1)}));
  request.path = "/\033[2J\xff";
  request.headers.emplace_back("X-\033", "\xff" + std::string(5000, 'x'));
  const Arrival arrival = receive(request);
  EXPECT_EQ(arrival.path, "/?[2J?");
  EXPECT_EQ(*findHeader(arrival.headers, "X-?"), "?" + std::string(1023, 'x') + "...");
}

}  // namespace
}  // namespace tarnel::lab

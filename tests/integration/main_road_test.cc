#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <set>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// From a client's message to the event that arrives at a reporting server, through real processes, sockets
// and TLS.

namespace tarnel::test {
namespace {

using client::Flag;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using ::testing::UnorderedElementsAre;

class MainRoadTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
  }

  Dictionary entry() const { return clientEntry(lab.eventsURL(), lab.realtimeURL()); }
  // One backend with one entry, under the name that client type 8 has.
  void serveEntry(const Dictionary& clientEntry) const {
    lab.serve("brevan", storebag("1.0-test", {{"httppost", profile({clientEntry})}}));
  }
  void expectNoProblems() const {
    for (const auto& post : lab.posts()) {
      EXPECT_EQ(*findArray(post, "problems"), Array()) << description(post);
    }
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(MainRoadTest, AMessageArrivesBetweenStartFinishAndStop) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  {
    TestSession session(instance, {});
    EXPECT_THAT(session.backends(), ElementsAre("httppost"));
    client::Dictionary payload;
    payload.set("text", "Zoë ☕").set("number", 42).set("real", 0.25).set("flag", true);
    payload.set("when", client::Date{1700000000.5}).set("list", client::Array().append(1));
    const auto reply = session.send(2, 10, payload);
    ASSERT_TRUE(reply.ok()) << reply.status.message;
    // The answer is the text of what was posted, as the user consents to see it logged.
    ASSERT_TRUE(reply.text);
    EXPECT_THAT(*reply.text, HasSubstr("Zoë ☕"));
    EXPECT_TRUE(session.session.finishAndWait(kDeadline).ok());
  }
  const auto arrivals = lab.waitForEvents(4);
  std::multiset<std::string> kinds;
  for (const auto& kind : kindsOf(arrivals)) kinds.insert(kind);
  EXPECT_THAT(kinds, UnorderedElementsAre("0/0", "2/10", "0/2", "0/1"));
  for (const auto& arrival : arrivals) {
    const auto& event = eventOf(arrival);
    EXPECT_EQ(textIn(event, "clientName"), "Meetwell");
    EXPECT_EQ(textIn(event, "_sender"), "OW");
    EXPECT_EQ(numberIn(event, "_clientVersion"), 3);
    EXPECT_EQ(textIn(event, "_sessionID").size(), 24U);
    EXPECT_EQ(textIn(*findDictionary(arrival, "headers"), "X-TRN-Client-Name"), "Meetwell");
    EXPECT_EQ(textIn(arrival, "clientId").size(), 36U);
    const std::string kind = kindOf(arrival);
    if (kind == "2/10") {
      EXPECT_EQ(textIn(event, "text"), "Zoë ☕");
      EXPECT_EQ(numberIn(event, "number"), 42);
      EXPECT_EQ(event.find("real")->doubleValue(), 0.25);
      EXPECT_EQ(*event.find("flag"), Value(true));
      EXPECT_EQ(event.find("when")->doubleValue(), 1700000000.5);
      EXPECT_FALSE(event.contains("list"));
      EXPECT_EQ(numberIn(event, "_eventNumber"), 2);
    }
    EXPECT_EQ(textIn(event, "StorebagVersion"), kind == "0/1" ? "1.0-test" : "");
    EXPECT_EQ(textIn(event, "Locale"), kind == "0/0" ? "DE" : "");
  }
  expectNoProblems();
  EXPECT_THAT(instance.messageLog(), HasSubstr("[httppost -> sendMessageWithDictionary] "));
  EXPECT_THAT(instance.messageLog(), HasSubstr("Zoë ☕"));
}

TEST_F(MainRoadTest, ARealtimeMessageBringsTheBatchBeforeIt) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.batch = true});
  for (uint16_t type = 1; type <= 3; ++type) ASSERT_TRUE(session.send(5, type + 10).ok());
  const auto reply = session.send(6, 20, {}, Flag::realtime);
  EXPECT_THAT(reply.text.value_or(""), StartsWith("Flushed events:\n"));
  lab.waitForEvents(5);
  std::vector<Dictionary> posts = lab.posts();
  ASSERT_EQ(posts.size(), 2U);
  std::sort(posts.begin(), posts.end(), [](const Dictionary& a, const Dictionary& b) {
    return a.find("postTime")->doubleValue() < b.find("postTime")->doubleValue();
  });
  EXPECT_EQ(textIn(posts[0], "path"), "/v1/events");
  EXPECT_EQ(numberIn(posts[0], "eventCount"), 4);
  EXPECT_EQ(textIn(posts[1], "path"), "/v1/realtime");
  EXPECT_EQ(numberIn(posts[1], "eventCount"), 1);
  std::vector<std::string> batched;
  for (const auto& arrival : lab.events()) {
    if (textIn(arrival, "path") == "/v1/events") batched.push_back(kindOf(arrival));
  }
  EXPECT_THAT(batched, ElementsAre("0/0", "5/11", "5/12", "5/13"));
  expectNoProblems();
}

TEST_F(MainRoadTest, ABatchIsPostedWhenOneMethodExceedsItsThreshold) {
  serveEntry(with(entry(), "event_threshold", 2));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.batch = true});
  for (uint16_t type = 11; type <= 13; ++type) ASSERT_TRUE(session.send(5, type).ok());
  EXPECT_THAT(lab.posts(), IsEmpty());
  ASSERT_TRUE(session.send(5, 14).ok());
  EXPECT_THAT(kindsOf(lab.waitForEvents(4)), ElementsAre("0/0", "5/11", "5/12", "5/13"));
}

// An event from before the user is named is made without filters.
TEST_F(MainRoadTest, HeldEventsAreFilteredWhereTheConfigurationSaysSo) {
  const Array filters{Dictionary{{"key", "callTitle"}, {"action", "remove"}}};
  for (const bool filtersHeld : {false, true}) {
    lab.reset();
    serveEntry(with(entry(), "filters", filters));
    instance.setConfiguration(std::string("[locale]\ncountry = \"DE\"\n[privacy]\nfilter_held_events = ") +
                              (filtersHeld ? "true\n" : "false\n"));
    ASSERT_TRUE(instance.start());
    {
      TestSession session(instance, {.client = "", .service = ""});
      client::Dictionary payload;
      payload.set("callTitle", "secret").set("other", "stays");
      ASSERT_TRUE(session.send(14, 10, payload).ok());
      const auto user = userInfo("Meetwell", "video-call");
      ASSERT_TRUE(session.session.fetchStatesAndWait(user, kDeadline).ok());
      ASSERT_TRUE(session.session.flushAndWait(kDeadline).ok());
    }
    size_t seen = 0;
    for (const auto& arrival : lab.waitForEvents(3)) {
      if (kindOf(arrival) != "14/10") continue;
      ++seen;
      EXPECT_EQ(textIn(eventOf(arrival), "callTitle"), filtersHeld ? "" : "secret");
      EXPECT_EQ(textIn(eventOf(arrival), "other"), "stays");
    }
    EXPECT_EQ(seen, 1U);
    instance.stop();
  }
}

TEST_F(MainRoadTest, FiltersRemoveAndHash) {
  const Array filters{Dictionary{{"method", 1}, {"key", "title"}, {"action", "keep"}},
                      Dictionary{{"key", "TITLE"}, {"action", "remove"}},
                      Dictionary{{"key", "userName"}, {"action", "sha256"}}};
  serveEntry(with(entry(), "filters", filters));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  client::Dictionary payload;
  payload.set("title", "secret").set("userName", "zoe").set("other", "stays");
  ASSERT_TRUE(session.send(1, 10, payload).ok());
  ASSERT_TRUE(session.send(2, 10, payload).ok());
  for (const auto& arrival : lab.waitForEvents(3)) {
    const auto& event = eventOf(arrival);
    const std::string kind = kindOf(arrival);
    if (kind == "0/0") continue;
    EXPECT_EQ(textIn(event, "title"), kind == "1/10" ? "secret" : "");
    EXPECT_EQ(textIn(event, "userName"), "9d017e2681b7f31725e1c0fbe2612e89079c22806b02cf7a894b500dd5a219c1");
    EXPECT_EQ(textIn(event, "other"), "stays");
  }
}

TEST_F(MainRoadTest, TwoBackendsGetEveryMessageAndAFlushIsAnsweredOnce) {
  auto second = entry();
  second.set("post_url", lab.url() + "/second");
  second.set("realtime_post_url", lab.url() + "/second");
  lab.serve(
      "brevan",
      storebag("2", {{"httppost", profile({entry()})}, {"httppost2", profile({second})}, {"nonsense", 1}}));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.batch = true});
  EXPECT_THAT(session.backends(), UnorderedElementsAre("httppost", "httppost2"));
  instance.waitForLog("TarnelBackend(newBackendWithName): nonsense");
  ASSERT_TRUE(session.send(3, 4).ok());
  std::atomic<int> answers{0};
  ASSERT_TRUE(session.session.flush([&answers](const client::Reply& reply) {
    EXPECT_TRUE(reply.ok()) << reply.status.message;
    EXPECT_FALSE(reply.error) << reply.error->description;
    EXPECT_TRUE(reply.text);
    ++answers;
  }));
  ASSERT_TRUE(session.session.drain(kDeadline));
  EXPECT_EQ(answers, 1);
  std::multiset<std::string> seen;
  for (const auto& arrival : lab.waitForEvents(4))
    seen.insert(textIn(arrival, "path") + " " + kindOf(arrival));
  EXPECT_THAT(seen, UnorderedElementsAre("/v1/events 0/0", "/v1/events 3/4", "/second 0/0", "/second 3/4"));
  // Nothing is left: the first backend says so, the second does not answer again.
  const auto empty = session.session.flushAndWait(kDeadline);
  ASSERT_TRUE(empty.error);
  EXPECT_EQ(empty.error->description, "Nothing to flush");
  EXPECT_EQ(empty.error->code, -1);
  EXPECT_EQ(empty.error->domain, kTarnelErrorDomain);
  ASSERT_TRUE(session.send(3, 5).ok());
  expectNoProblems();
}

TEST_F(MainRoadTest, WithoutConsentNothingIsPosted) {
  serveEntry(entry());
  instance.setConsent(false);
  ASSERT_TRUE(instance.start());
  {
    TestSession session(instance, {});
    EXPECT_THAT(session.backends(), IsEmpty());
    EXPECT_TRUE(session.send(2, 10, {}, Flag::realtime).ok());
    instance.waitForLog("reporting disabled by DNU: 0.");
  }
  instance.stop();
  EXPECT_THAT(lab.posts(), IsEmpty());
}

TEST_F(MainRoadTest, ConsentIsOffUntilSomebodyTurnsItOn) {
  serveEntry(entry());
  instance.folder().remove("config/consent.toml");
  ASSERT_TRUE(instance.start());
  EXPECT_THAT(TestSession(instance, {}).backends(), IsEmpty());
}

TEST_F(MainRoadTest, ASessionThatAwaitsItsUserHoldsItsEventsUntilHeIsKnown) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.client = "", .service = ""});
  EXPECT_THAT(session.backends(), IsEmpty());
  ASSERT_TRUE(session.send(4, 11, {}, Flag::realtime).ok());
  const auto flushed = session.session.flushAndWait(kDeadline);
  ASSERT_TRUE(flushed.error);
  EXPECT_EQ(flushed.error->description, "Can not flush: userInfo is required");
  ASSERT_TRUE(session.send(4, 12, {}, Flag::realtime).ok());
  EXPECT_THAT(lab.posts(), IsEmpty());
  const auto states = session.session.fetchStatesAndWait(userInfo("Meetwell", "video-call"), kDeadline);
  EXPECT_THAT(*states.names, ElementsAre("httppost"));
  ASSERT_TRUE(session.send(4, 13, {}, Flag::realtime).ok());
  const auto arrivals = lab.waitForEvents(4);
  for (const auto& arrival : arrivals) EXPECT_EQ(textIn(eventOf(arrival), "clientName"), "Meetwell");
  EXPECT_THAT(kindsOf(arrivals), ElementsAre("0/0", "4/11", "4/12", "4/13"));
}

TEST_F(MainRoadTest, ASampledOutSessionIsReleasedByAnImportantMessage) {
  serveEntry(with(entry(), "sampling_threshold", 0));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.batch = true});
  EXPECT_THAT(session.backends(), ElementsAre("httppost")) << "sampled out, but live";
  ASSERT_TRUE(session.send(4, 11).ok());
  ASSERT_TRUE(session.send(4, 12, {}, Flag::important).ok());
  ASSERT_FALSE(session.session.flushAndWait(kDeadline).error);
  EXPECT_THAT(kindsOf(lab.waitForEvents(3)), ElementsAre("0/0", "4/11", "4/12"));
}

TEST_F(MainRoadTest, TheDisplayAddressIsToldOrItsAbsence) {
  serveEntry(entry());
  lab.serve("moldaro", storebag("1", {{"httppost", without(profile({entry()}), "display_url")}}));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  EXPECT_EQ(session.session.fetchDisplayURLAndWait(kDeadline).text, "https://display.example/");
  TestSession other(instance, {.clientType = 9});
  EXPECT_EQ(other.session.fetchDisplayURLAndWait(kDeadline).text, "URL not available");
}

TEST_F(MainRoadTest, ASingleMessageNeedsNoConfiguring) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  client::Session session(optionsFor(instance));
  const auto user = userInfo("Meetwell", "video-call");
  const auto reply = session.sendSingleMessageAndWait(sessionInfo({}), user, 7, 8,
                                                      client::Dictionary().set("k", "v"), kDeadline);
  EXPECT_EQ(reply.text, "finished");
  const auto arrivals = lab.waitForEvents(1);
  EXPECT_EQ(kindOf(arrivals[0]), "7/8");
  EXPECT_EQ(textIn(eventOf(arrivals[0]), "k"), "v");
}

TEST_F(MainRoadTest, ASingleMessageWithoutIdentifiersIsNotAnsweredAndTheClientIsToldSo) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  client::Session session(optionsFor(instance));
  std::vector<client::Dictionary> lacking(3);
  lacking[1].set(kTarnelSessionInfoClientType, 8);
  lacking[2].set(kTarnelSessionInfoSessionID, 42);
  for (const auto& info : lacking) {
    const auto reply = session.sendSingleMessageAndWait(info, {}, 7, 8, {}, kDeadline);
    EXPECT_EQ(reply.status.code, TARNEL_ERROR_NO_REPLY) << reply.status.message;
    EXPECT_EQ(reply.text, std::nullopt);
  }
  instance.waitForLog("sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo");
  EXPECT_EQ(session.sendSingleMessageAndWait(sessionInfo({}), {}, 7, 8, {}, kDeadline).text, "finished");
}

TEST_F(MainRoadTest, DefaultsOfTheAdministratorWinOverTheStorebagsAddresses) {
  serveEntry(entry());
  instance.setSetting("httpsPostURL", lab.url() + "/chosen");
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  ASSERT_TRUE(session.send(2, 10).ok());
  for (const auto& arrival : lab.waitForEvents(2)) EXPECT_EQ(textIn(arrival, "path"), "/chosen");
}

TEST_F(MainRoadTest, FiveHundredMessagesOfAClientThatDoesNotWaitArriveCompleteAndInOrder) {
  serveEntry(with(entry(), "event_threshold", 49));
  ASSERT_TRUE(instance.start());
  {
    TestSession session(instance, {.batch = true});
    for (uint16_t i = 0; i < 500; ++i) {
      ASSERT_TRUE(session.session.sendMessage(9, static_cast<uint16_t>(i + 10)));
    }
  }
  auto arrivals = lab.waitForEvents(502);
  ASSERT_EQ(arrivals.size(), 502U);
  std::set<int64_t> numbers;
  for (const auto& arrival : arrivals) {
    const auto& event = eventOf(arrival);
    numbers.insert(numberIn(event, "_eventNumber"));
    if (numberIn(event, "_method") == 9) {
      EXPECT_EQ(numberIn(event, "_status"), numberIn(event, "_eventNumber") + 8);
    }
  }
  EXPECT_EQ(numbers.size(), 502U);
  EXPECT_EQ(*numbers.rbegin(), 502);
  expectNoProblems();
}

}  // namespace
}  // namespace tarnel::test

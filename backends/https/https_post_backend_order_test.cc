#include "backends/https/https_post_backend_fixture.h"

// In which order the steps of an update, a send and a flush happen, as their log lines and effects show.

namespace tarnel {
namespace {

using Lines = std::vector<fake::FakeLog::Line>;

class HTTPSPostBackendOrderTest : public HTTPSPostBackendFixture {
 protected:
  Lines linesOfUpdate(HTTPSPostBackend& backend) {
    world.log.clear();
    backend.updateState();
    return world.log.lines();
  }
  static fake::FakeLog::Line debug(std::string text) { return {LogLevel::debug, std::move(text)}; }
};

TEST_F(HTTPSPostBackendOrderTest, UpdateForAClient) {
  entry.set("expedite", 1);
  entry.set("custom_clientId", 1);
  entry.set("extras_on_internal", 4);
  entry.set("per_country_sampling_thresholds",
            Array{Dictionary{{"country", Array{"DE"}}, {"threshold", 0.75}}});
  const auto backend = make();
  const auto lines = linesOfUpdate(*backend);
  const auto identifier = world.settings.objectForKey("com.orvane.tarnel", "uuid:Meetwell:video-call");
  ASSERT_TRUE(identifier);
  EXPECT_EQ(
      lines,
      (Lines{
          debug("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=0"),
          debug("HTTPSPostBackend(updateBackendState): sampling threshold for DE changed from 1.00 to 0.75"),
          debug("resetBackendStateWithClient: event_threshold set to 49"),
          debug("setBackendStateWithClient: extras on internal is set to 4"),
          {LogLevel::information,
           "getPersistentIdentifierForCustomClientIDSuffix: The value for uuid:Meetwell:video-call: " +
               *identifier->string()},
          debug("HTTPSPostBackend(updateBackendState): httppost: client found Meetwell:video-call, state=2, "
                "samplingFactor=0.500000, hierarchy=0"),
          debug("HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/post' for postURL"),
          debug("HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/realtime' for "
                "realtimePostURL")}));
}

TEST_F(HTTPSPostBackendOrderTest, UpdateWithoutRequiredUserInfo) {
  requireUserInfo = false;
  entry.set("expedite", 0);
  const auto backend = make();
  EXPECT_EQ(linesOfUpdate(*backend),
            (Lines{debug("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=1"),
                   debug("HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/post' for "
                         "postURL"),
                   debug("HTTPSPostBackend(updatePostLink): Storebag 'https://events.example/realtime' for "
                         "realtimePostURL"),
                   debug("resetBackendStateWithClient: event_threshold set to 49"),
                   debug("setBackendStateWithClient: extras on internal is set to 0")}));
}

// A client that consent, country, family, model and filters would all refuse is refused by the first of them.
TEST_F(HTTPSPostBackendOrderTest, RefusalsComeInTheirOrder) {
  const auto refusal = [this] {
    const auto backend = make();
    const auto lines = linesOfUpdate(*backend);
    EXPECT_EQ(backend->state(), ReportingState::disabled);
    EXPECT_EQ(lines.size(), 1U);
    return lines.empty() ? std::string() : lines.front().text;
  };
  const std::string prefix = "HTTPSPostBackend(updateBackendState): ";
  world.consent.allowed = false;
  entry.set("locale_whitelist", Array{"US"});
  entry.set("device_whitelist", Array{"Phone"});
  entry.set("device_blacklist", Array{"Slate7"});
  entry.remove("filters");
  entry.remove("sampling_threshold");
  EXPECT_EQ(refusal(), prefix + "reporting disabled by DNU: 0.");
  world.consent.allowed = true;
  EXPECT_EQ(refusal(), prefix + "(DE) isn't in country code list [\"US\"]");
  entry.set("locale_whitelist", Array{"DE"});
  EXPECT_EQ(refusal(), prefix + "(Slate) isn't in device whitelist [\"Phone\"]");
  entry.remove("device_whitelist");
  EXPECT_EQ(refusal(), prefix + "(Slate7,1) is in device blacklist [\"Slate7\"]");
  entry.remove("device_blacklist");
  EXPECT_EQ(refusal(), prefix + "filters are required.");
}

TEST_F(HTTPSPostBackendOrderTest, RealtimeStopMessageAfterABatch) {
  const auto backend = makeUpdated();
  send(*backend);
  world.log.clear();
  send(*backend, 0, Flag::realtime, std::nullopt, 1);
  EXPECT_EQ(
      world.log.startingWith("HTTPSPostBackend("),
      (Lines{debug("HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to "
                   "SESSION_TYPE_STOP message dictionary"),
             {LogLevel::error, "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil"},
             debug("HTTPSPostBackend(sendMessage): realtime is 1"),
             debug("HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been "
                   "batched. Forcing Flush here to keep events in order."),
             debug("HTTPSPostBackend(flushMessagesWithCompletion): called"),
             debug("HTTPSPostBackend(sendMessage): Sending 2, 1, 1")}));
}

TEST_F(HTTPSPostBackendOrderTest, RealtimeMessageIsPostedThoughTheServerRefusedTheBatchBeforeIt) {
  const auto backend = makeUpdated();
  send(*backend);
  world.http.setAnswer(fake::FakeHttpClient::status(500));
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(world.http.requests().size(), 2U);
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Sending 1, 1, 1");
}

TEST_F(HTTPSPostBackendOrderTest, BatchThatIsDiscardedOrKeptIsNotSaidToBeFlushed) {
  const auto backend = makeUpdated();
  send(*backend);
  backend->setUserInfoDict(std::nullopt);
  EXPECT_EQ(flush(*backend).second->localizedDescription(), "Can not flush: userInfo is required");
  backend->setState(ReportingState::sampledOut);
  EXPECT_EQ(flush(*backend).second->localizedDescription(), "Nothing to flush");
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(flushMessagesWithCompletion)").empty());
}

TEST_F(HTTPSPostBackendOrderTest, BackendIsDisabledBeforeTheCompletionIsTold) {
  const auto backend = makeUpdated();
  world.http.setAnswer(fake::FakeHttpClient::status(500));
  auto seen = ReportingState::undecided;
  backend->postJSONMessage(
      "{}", Flag::normal, std::nullopt, std::nullopt,
      [&backend, &seen](const MaybeString&, const MaybeError&) { seen = backend->state(); });
  EXPECT_EQ(seen, ReportingState::disabled);
}

// The batch is gone before its post is answered: what the answer's completion sends waits for the next flush.
TEST_F(HTTPSPostBackendOrderTest, BatchIsDroppedBeforeItIsPosted) {
  const auto backend = makeUpdated();
  send(*backend);
  int answers = 0;
  backend->flushMessagesWithCompletion([&](const MaybeString&, const MaybeError&) {
    ++answers;
    EXPECT_EQ(flush(*backend).second->localizedDescription(), "Nothing to flush");
  });
  EXPECT_EQ(answers, 1);
  EXPECT_EQ(world.http.requests().size(), 1U);
}

TEST_F(HTTPSPostBackendOrderTest, CountStartsAnewEvenWhenTheFlushIsRefused) {
  constexpr char kFlushing[] =
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 3";
  userInfo.reset();
  const auto backend = make();
  backend->setState(ReportingState::enabled);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(send(*backend), std::nullopt);
  EXPECT_EQ(world.log.count(LogLevel::debug, kFlushing), 1U);
  send(*backend);
  EXPECT_EQ(world.log.count(LogLevel::debug, kFlushing), 2U);
  // Nothing was lost on the way.
  backend->setUserInfoDict(Dictionary{{"u", 1}});
  backend->setPostURL("https://events.example/post");
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 101U);
}

}  // namespace
}  // namespace tarnel

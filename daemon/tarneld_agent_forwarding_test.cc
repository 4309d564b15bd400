#include <gmock/gmock.h>

#include "daemon/test_agent_fixture.h"
#include "platform/fake/fake_http_client.h"

// Sessions with the real backends that forward messages on the device.

namespace tarnel {
namespace {

using testing::ElementsAre;

constexpr char kBundle[] =
    "/System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";
constexpr char kComplaint[] =
    "DravikBackend(sendMessage): Dravik adaptor (null) does not respond to forwarding selector "
    "sendMessageWithMethod:respCode:dict:";

class ForwardingTest : public fake::AgentTest {
 protected:
  // No server answers, so that client type 7 is served by the built-in storebag.
  ForwardingTest() { world.http.setAnswer(fake::FakeHttpClient::failure("no route")); }

  Client startForwarding(std::shared_ptr<TarneldAgent>& agent) {
    auto connection = entitledConnection();
    EXPECT_TRUE(agent->shouldAcceptNewConnection(listener, connection));
    auto session = std::static_pointer_cast<TarneldSession>(connection->exportedObject);
    session->setSessionInfo(info(1, 7), user(), std::nullopt, false);
    std::optional<std::vector<std::string>> names;
    session->startConfigWithCompletionHandler(
        [&names](std::optional<std::vector<std::string>> live) { names = std::move(live); });
    EXPECT_THAT(names.value_or(std::vector<std::string>()), ElementsAre("dravik"));
    return {connection, session};
  }
  static void send(Client& client, uint16_t category, uint16_t type) {
    client.session->sendMessageWithCategory(category, type, Dictionary{{"a", 1}}, nullptr);
  }

  std::shared_ptr<TarneldAgent> realAgent = TarneldAgent::init(world.dependencies);
};

TEST_F(ForwardingTest, WithoutTheBundleTheBuiltInStorebagsSessionSaysSoPerSendAndGoesOn) {
  Client client = startForwarding(realAgent);
  EXPECT_EQ(world.log.count(LogLevel::error, kComplaint), 1U) << "the start message";
  send(client, 3, 4);
  send(client, 3, 5);
  EXPECT_EQ(world.log.count(LogLevel::error, kComplaint), 3U);
  bool finished = false;
  client.session->finishSessionWithReply([&finished](const MaybeSentObject&) { finished = true; });
  EXPECT_TRUE(finished);
  EXPECT_EQ(world.log.count(LogLevel::error, kComplaint), 4U) << "the client's finish";
  client.disconnect();
  EXPECT_EQ(world.log.count(LogLevel::error, kComplaint), 5U) << "the stop message";
}

TEST_F(ForwardingTest, WithTheBundleTheAdaptorGetsEveryMessageOfTheSession) {
  world.codeBundles.scripts[kBundle] = {};
  Client client = startForwarding(realAgent);
  send(client, 3, 4);
  client.disconnect();
  const auto calls = world.codeBundles.journal.calls();
  ASSERT_EQ(calls.size(), 3U);
  const auto numbers = [](const fake::BundleJournal::Call& call) {
    return std::pair(static_cast<int>(call.first), static_cast<int>(call.second));
  };
  EXPECT_EQ(numbers(calls[0]), std::pair(0, 0));
  EXPECT_EQ(numbers(calls[1]), std::pair(3, 4));
  EXPECT_EQ(calls[1].dictionary, (Dictionary{{"a", 1}}));
  EXPECT_EQ(numbers(calls[2]), std::pair(0, 1));
  EXPECT_TRUE(calls[2].dictionary && calls[2].dictionary->contains("StorebagVersion"));
  EXPECT_EQ(world.log.count(LogLevel::error, kComplaint), 0U);
  EXPECT_THAT(world.codeBundles.journal.lines(), testing::Contains("destroyed 1"));
}

}  // namespace
}  // namespace tarnel

// Sessions of one hierarchy at work at the same time, each on its own thread. Worth most under
// ThreadSanitizer: the fake backends take no lock, as the real ones.

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <thread>
#include <vector>

#include "daemon/test_agent_fixture.h"

namespace tarnel::fake {
namespace {

class HierarchyThreads : public AgentTest {
 protected:
  static constexpr int kRounds = 200;

  HierarchyThreads() {
    world.log.setActiveLevel(LogLevel::error);
    // One storebag per level, told apart by client type.
    fetch = [](int32_t clientType, StorebagFetchSlots slots) -> std::optional<Dictionary> {
      slots.maxAge = 86400;
      slots.version = "1";
      return Dictionary{{names().at(static_cast<size_t>(clientType - 8)), Dictionary()}};
    };
    int32_t level = 0;
    for (const auto& name : names()) {
      auto& script = backends.scripts[name];
      script.threshold = Value(0.5);
      script.hierarchy = level++;
    }
  }
  static const std::array<std::string, 2>& names() {
    static const std::array<std::string, 2> both{kTarnelBackendHTTPPost, kTarnelBackendHTTPPost2};
    return both;
  }
  // A whole life of one client, again and again.
  void live(int number, int clientType, bool hasAggregator) {
    for (int round = 0; round < kRounds; ++round) {
      Client client = accept();
      client.session->setSessionInfo(info(number, clientType), user(), std::nullopt, hasAggregator);
      client.session->startConfigWithCompletionHandler(nullptr);
      for (int message = 0; message < 5; ++message) {
        client.session->sendMessageWithCategory(1, 2, Dictionary{{"n", message}});
        client.session->receivedUserInfo(user("Phone", message % 2 == 0 ? "Call" : "Video"));
      }
      client.session->flushMessagesWithCompletion(nullptr);
      client.disconnect();
    }
  }
  Client accept() {
    auto connection = entitledConnection();
    agent->shouldAcceptNewConnection(listener, connection);
    return {connection, std::static_pointer_cast<TarneldSession>(connection->exportedObject)};
  }
};

TEST_F(HierarchyThreads, ParentsAndChildrenComeAndGoAtTheSameTime) {
  std::vector<std::thread> threads;
  threads.emplace_back([this] { live(1, 8, true); });
  threads.emplace_back([this] { live(2, 9, false); });
  threads.emplace_back([this] { live(3, 9, true); });
  for (auto& thread : threads) thread.join();
  EXPECT_TRUE(agent->sessionList().empty());
  for (const auto& [key, list] : agent->correlatedSessions()) EXPECT_TRUE(list.empty()) << key;
  EXPECT_EQ(world.keepAlive.begun, world.keepAlive.ended);
}

TEST_F(HierarchyThreads, AChildSendsWhileItsParentSyncsIt) {
  Client parent = accept();
  parent.session->setSessionInfo(info(1, 8), user(), std::nullopt, true);
  parent.session->startConfigWithCompletionHandler(nullptr);
  Client child = accept();
  child.session->setSessionInfo(info(2, 9), user(), std::nullopt, false);
  child.session->startConfigWithCompletionHandler(nullptr);

  std::atomic<bool> stop{false};
  std::thread sender([&child, &stop] {
    do {
      child.session->sendMessageWithCategory(1, 2, Dictionary{{"n", 1}});
      child.session->updateReportingStates();
    } while (!stop);
  });
  for (int round = 0; round < kRounds; ++round) {
    agent->updateDownstreamSessions(*parent.session);
    child.session->shutdownSessionAggregation();
  }
  stop = true;
  sender.join();
  // The child's last word is the parent's label.
  child.session->sendMessageWithCategory(1, 2, std::nullopt);
  const auto backend = child.session->backends().find(names()[1]);
  EXPECT_EQ(backend->combinedSessionIDString(),
            parent.session->sessionIDString() + "." + child.session->sessionIDString());
  child.disconnect();
  parent.disconnect();
}

TEST_F(HierarchyThreads, AcceptanceGoesOnWhileAStorebagIsFetched) {
  std::atomic<bool> fetching{false};
  std::atomic<bool> goOn{false};
  fetch = [&fetching, &goOn](int32_t /*clientType*/,
                             StorebagFetchSlots /*slots*/) -> std::optional<Dictionary> {
    fetching = true;
    fetching.notify_all();
    goOn.wait(false);
    return std::nullopt;
  };
  Client slow = accept();
  slow.session->setSessionInfo(info(1, 8), std::nullopt, std::nullopt, false);
  std::thread fetcher([&slow] { slow.session->startConfigWithCompletionHandler(nullptr); });
  fetching.wait(false);
  Client other = accept();
  EXPECT_EQ(agent->sessionList().size(), 2U);
  other.session->sendMessageWithCategory(1, 2, std::nullopt);
  goOn = true;
  goOn.notify_all();
  fetcher.join();
  slow.disconnect();
  other.disconnect();
}

TEST_F(HierarchyThreads, FlushAnswersFromManyThreadsGiveOneReply) {
  for (auto& [name, script] : backends.scripts) script.holdFlush = true;
  fetch = [](int32_t /*clientType*/, StorebagFetchSlots slots) -> std::optional<Dictionary> {
    slots.maxAge = 86400;
    return sectionOf({names()[0], names()[1]});
  };
  for (int round = 0; round < kRounds; ++round) {
    Client client = accept();
    client.session->setSessionInfo(info(1, 8), std::nullopt, std::nullopt, false);
    client.session->startConfigWithCompletionHandler(nullptr);
    int replies = 0;
    client.session->flushMessagesWithCompletion(
        [&replies](MaybeString /*text*/, MaybeError /*error*/) { ++replies; });
    std::vector<std::thread> threads;
    for (const auto& name : names()) {
      threads.emplace_back(
          [this, &name] { backends.last(name)->heldFlushes.at(0)(std::nullopt, Error("d", 1, "failed")); });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(replies, 1);
    client.disconnect();
  }
}

}  // namespace
}  // namespace tarnel::fake

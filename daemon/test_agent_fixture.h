#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "daemon/tarneld_agent.h"
#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "platform/fake/lock_probe.h"
#include "session/fake_backends.h"
#include "tarnel/keys.h"

namespace tarnel::fake {

// The real agent and real sessions with fake backends, connections and storebag fetches.
class AgentTest : public ::testing::Test {
 protected:
  struct Client {
    std::shared_ptr<FakeIpcConnection> connection;
    std::shared_ptr<TarneldSession> session;
    // Lets the last references go, as at the end of a connection.
    void disconnect() {
      session.reset();
      connection->invalidate();
    }
  };
  class NoListener final : public IpcListener {
   public:
    void setDelegate(IpcListenerDelegate* /*delegate*/) override {}
    MaybeError resume() override { return std::nullopt; }
  };

  ~AgentTest() override {
    for (const auto& weak : connections_) {
      if (const auto connection = weak.lock()) connection->invalidate();
    }
  }

  static std::shared_ptr<FakeIpcConnection> entitledConnection(const std::string& name = "<connection>") {
    auto made = std::make_shared<FakeIpcConnection>(name);
    made->entitlements["com.orvane.private.tarneld"] = true;
    return made;
  }
  // Connects, and gives the session an identifier if there is one.
  Client connect(const std::string& name = "<connection>", const std::string& sessionIDString = {}) {
    auto connection = entitledConnection(name);
    connections_.push_back(connection);
    EXPECT_TRUE(agent->shouldAcceptNewConnection(listener, connection));
    auto session = std::static_pointer_cast<TarneldSession>(connection->exportedObject);
    if (!sessionIDString.empty()) session->setSessionIDString(sessionIDString);
    return {connection, session};
  }
  // A connected, configured and started session whose one HTTPS backend stands at this level.
  Client start(const std::string& sessionIDString, int number, int32_t level, bool hasAggregator = false,
               const std::string& clientName = "Phone") {
    Client client = connect("<connection>", sessionIDString);
    backends.scripts[kTarnelBackendHTTPPost].hierarchy = level;
    client.session->setSessionInfo(info(number, 8), user(clientName), std::nullopt, hasAggregator);
    client.session->startConfigWithCompletionHandler(nullptr);
    return client;
  }
  static Dictionary info(int number, int clientType) {
    return {{kTarnelSessionInfoSessionID, number},
            {kTarnelSessionInfoClientType, clientType},
            {kTarnelSessionInfoRequireUserInfo, true}};
  }
  static Dictionary user(const std::string& client = "Phone", const std::string& service = "Call") {
    return {{kTarnelUserInfoClientName, client}, {kTarnelUserInfoServiceName, service}};
  }
  bool logged(LogLevel level, const std::string& text) const { return world.log.contains(level, text); }

  FakeWorld world;
  FakeBackends backends;
  // What the next fetches do; the count is of all.
  std::function<std::optional<Dictionary>(int32_t clientType, StorebagFetchSlots slots)> fetch =
      [](int32_t /*clientType*/, StorebagFetchSlots slots) {
        slots.maxAge = 86400;
        slots.version = "5.1";
        return sectionOf({kTarnelBackendHTTPPost});
      };
  int fetches = 0;
  NoListener listener;
  std::shared_ptr<TarneldAgent> agent = TarneldAgent::init(
      world.dependencies, backends.factory(),
      [this](const Dependencies& /*dependencies*/, int32_t clientType, StorebagFetchSlots slots) {
        ++fetches;
        return fetch(clientType, slots);
      });

 private:
  std::vector<std::weak_ptr<FakeIpcConnection>> connections_;
};

}  // namespace tarnel::fake

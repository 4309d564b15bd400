#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/server/ipc_test_support.h"

namespace tarnel {
namespace {

using ::testing::ElementsAre;

class IpcLifecycleTest : public ::testing::Test {
 protected:
  Service service;
};

TEST_F(IpcLifecycleTest, APeerWithoutTheEntitlementIsClosed) {
  service.entitlements().grants = false;
  service.start();
  const RawClient client(service.path());
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_EQ(service.rejected(), 1U);
  EXPECT_EQ(service.accepted(), 0U);
  EXPECT_TRUE(eventually([&] { return service.listener().connections() == 0; }));
  EXPECT_EQ(service.listener().threads(), 0U);
}

TEST_F(IpcLifecycleTest, AConnectionThatGetsNoThreadIsClosedAndNothingOfItRuns) {
  std::atomic<bool> hasThreads{false};
  service.createThread = [&hasThreads](pthread_t* thread, const pthread_attr_t* attributes,
                                       void* (*run)(void*), void* argument) {
    return hasThreads ? pthread_create(thread, attributes, run, argument) : EAGAIN;
  };
  service.start();
  const RawClient client(service.path());
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_TRUE(eventually([&] { return service.listener().connections() == 0; }));
  EXPECT_TRUE(eventually([&] { return service.session() == nullptr && service.connection(0) == nullptr; }));
  EXPECT_EQ(service.listener().threads(), 0U);
  EXPECT_EQ(service.invalidations(), 0U);
  EXPECT_EQ(service.notServed(), 1U);
  EXPECT_EQ(service.interruptions(), 0U);
  EXPECT_TRUE(service.logged("IpcConnection: Closing the connection of pid "));
  EXPECT_TRUE(service.logged(": no thread can be started: Resource temporarily unavailable"));
  // The next one is served.
  hasThreads = true;
  BusClient next(service.path());
  EXPECT_NE(next.call("StartConfig", ""), nullptr);
}

TEST_F(IpcLifecycleTest, AConnectionWithoutAnObjectToCallIsClosedAndNothingOfItRuns) {
  service.exportsObjects = false;
  service.start();
  const RawClient client(service.path());
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_TRUE(eventually([&] { return service.listener().connections() == 0; }));
  EXPECT_TRUE(eventually([&] { return service.session() == nullptr && service.connection(0) == nullptr; }));
  EXPECT_EQ(service.listener().threads(), 0U);
  EXPECT_EQ(service.invalidations(), 0U);
  EXPECT_EQ(service.notServed(), 1U);
  EXPECT_TRUE(service.logged("IpcConnection: No object is exported to pid "));
}

TEST_F(IpcLifecycleTest, RepliesAfterTheConnectionsDeathAreHarmless) {
  std::promise<SentReply> held;
  service.prepare = [&held](RecordingSession& session) {
    session.answerSend = [&held](SentReply reply) { held.set_value(std::move(reply)); };
  };
  service.start();
  SentReply reply;
  {
    BusClient client(service.path());
    auto call = client.newCall("SendMessage");
    sd_bus_message_append(call.get(), "qqaa{sv}", 1, 2, 0);
    EXPECT_GE(sd_bus_call_async(client.bus(), nullptr, call.get(), nullptr, nullptr, 0), 0);
    EXPECT_GE(sd_bus_flush(client.bus()), 0);
    reply = held.get_future().get();
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  reply(SentObject("too late"));
  SentReply another = std::move(reply);
}

TEST_F(IpcLifecycleTest, TheProxyCallsTheClientsObject) {
  service.start();
  BusClient client(service.path());
  struct Got {
    int count = 0;
    std::string signature;
    MaybeDictionary info;
    MaybeDictionary payload;
    double timestamp = 0;
  } got;
  const auto onCall = [](sd_bus_message* m, void* into, sd_bus_error*) {
    auto& g = *static_cast<Got*>(into);
    ++g.count;
    g.signature = sd_bus_message_get_signature(m, 1);
    g.info = *wire::readMaybeDictionary(m);
    uint16_t category = 0;
    uint16_t type = 0;
    sd_bus_message_read(m, "dqq", &g.timestamp, &category, &type);
    EXPECT_EQ(category, 7);
    EXPECT_EQ(type, 8);
    EXPECT_EQ(sd_bus_message_get_expect_reply(m), 0);
    EXPECT_STREQ(sd_bus_message_get_member(m), "SendMessageToClient");
    g.payload = *wire::readMaybeDictionary(m);
    return 1;
  };
  sd_bus_add_object(client.bus(), nullptr, wire::kReplyPath, onCall, &got);
  ASSERT_NE(client.call("StartConfig", ""), nullptr);
  const auto proxy = service.connection(0)->remoteObjectProxyWithErrorHandler(
      [](const Error& error) { ADD_FAILURE() << error.description(); });
  ASSERT_NE(proxy, nullptr);
  proxy->sendMessageToClient(Dictionary{{"k", Value(1)}}, 12.5, 7, 8, std::nullopt);
  while (got.count == 0) {
    ASSERT_GE(sd_bus_process(client.bus(), nullptr), 0);
    if (got.count == 0) sd_bus_wait(client.bus(), UINT64_MAX);
  }
  EXPECT_EQ(got.signature, "aa{sv}dqqaa{sv}");
  EXPECT_EQ(got.info, (Dictionary{{"k", Value(1)}}));
  EXPECT_EQ(got.timestamp, 12.5);
  EXPECT_EQ(got.payload, std::nullopt);
}

TEST_F(IpcLifecycleTest, WhatCannotBeSentToTheClientReachesTheErrorHandler) {
  service.start();
  BusClient client(service.path());
  ASSERT_NE(client.call("StartConfig", ""), nullptr);
  std::promise<std::string> failed;
  const auto proxy = service.connection(0)->remoteObjectProxyWithErrorHandler(
      [&failed](const Error& error) { failed.set_value(error.localizedDescription()); });
  proxy->sendMessageToClient(Dictionary{{"k", Value("\xFF")}}, 0, 0, 0, std::nullopt);
  EXPECT_EQ(failed.get_future().get(), "at key \"k\": the text is not UTF-8");
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
}

TEST_F(IpcLifecycleTest, WithoutAWayToTheClientThereIsNoProxy) {
  service.start();
  std::shared_ptr<IpcConnection> connection;
  {
    BusClient client(service.path());
    ASSERT_NE(client.call("StartConfig", ""), nullptr);
    connection = service.connection(0);
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  std::vector<std::string> errors;
  EXPECT_EQ(connection->remoteObjectProxyWithErrorHandler(
                [&errors](const Error& error) { errors.push_back(error.localizedDescription()); }),
            nullptr);
  EXPECT_THAT(errors, ElementsAre("the connection is closed"));
}

TEST_F(IpcLifecycleTest, InvalidationRunsOnceAndLetsGoOfEverything) {
  service.start();
  {
    BusClient client(service.path());
    ASSERT_NE(client.call("StartConfig", ""), nullptr);
    EXPECT_NE(service.session(), nullptr);
  }
  EXPECT_TRUE(eventually([&] { return service.session() == nullptr && service.connection(0) == nullptr; }));
  EXPECT_TRUE(eventually([&] { return service.listener().threads() == 0; }));
  EXPECT_EQ(service.invalidations(), 1U);
  EXPECT_EQ(service.interruptions(), 0U);
  EXPECT_EQ(service.listener().connections(), 0U);
}

TEST_F(IpcLifecycleTest, InvalidationWaitsForTheCallThatRuns) {
  std::promise<void> entered;
  std::promise<void> proceed;
  service.prepare = [&](RecordingSession& session) {
    session.onCall = [&](const std::string&) {
      entered.set_value();
      proceed.get_future().wait();
      EXPECT_EQ(service.invalidations(), 0U);
    };
  };
  service.start();
  {
    BusClient client(service.path());
    auto call = client.newCall("StartConfig");
    EXPECT_GE(sd_bus_call_async(client.bus(), nullptr, call.get(), nullptr, nullptr, 0), 0);
    EXPECT_GE(sd_bus_flush(client.bus()), 0);
    entered.get_future().wait();
  }
  proceed.set_value();
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
}

TEST_F(IpcLifecycleTest, WhatAClientSentBeforeItsDeathIsCarriedOut) {
  constexpr size_t kCount = 50;
  std::promise<void> entered;
  std::promise<void> proceed;
  service.prepare = [&](RecordingSession& session) {
    session.onCall = [&](const std::string& call) {
      if (call == "startConfig") {
        entered.set_value();
        proceed.get_future().wait();
      }
    };
  };
  service.start();
  {
    const RawClient client(service.path());
    client.authenticate();
    EXPECT_TRUE(client.write(rawCall("StartConfig")));
    entered.get_future().wait();
    for (size_t i = 0; i < kCount; ++i) EXPECT_TRUE(client.write(rawCall("FlushMessages")));
  }
  const auto session = service.session();
  proceed.set_value();
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  EXPECT_EQ(session->count(), kCount + 1);
}

TEST(IpcInterruptionTest, AHalfClosedConnectionIsInterruptedThenInvalidated) {
  IpcLimits limits;
  limits.interruption = std::chrono::milliseconds(50);
  Service service(limits);
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  shutdown(client.fd().get(), SHUT_WR);
  EXPECT_TRUE(eventually([&] { return service.interruptions() == 1; }));
  EXPECT_EQ(service.session()->count(), 1U);
  // Its answer still comes.
  std::array<char, 4> first{};
  EXPECT_EQ(recv(client.fd().get(), first.data(), 1, 0), 1);
  EXPECT_EQ(first[0], 'l');
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  EXPECT_EQ(service.interruptions(), 1U);
}

TEST_F(IpcLifecycleTest, StoppingTheListenerEndsAllConnections) {
  service.start();
  std::vector<std::unique_ptr<BusClient>> clients;
  for (int i = 0; i < 5; ++i) {
    clients.push_back(std::make_unique<BusClient>(service.path()));
    ASSERT_NE(clients.back()->call("StartConfig", ""), nullptr);
  }
  service.stop();
  EXPECT_EQ(service.invalidations(), 5U);
  for (const auto& client : clients) EXPECT_EQ(client->call("StartConfig", ""), nullptr);
  EXPECT_FALSE(std::filesystem::exists(service.path()));
  EXPECT_EQ(service.callsLeftBehind, 0U);
}

// A client can make a call last: it hands over a socket that lingers when it is closed, or a file of a file
// system that never answers.
TEST(IpcEndTest, ACallThatDoesNotReturnIsLeftBehindInTheEnd) {
  IpcLimits limits;
  limits.ending = std::chrono::milliseconds(50);
  Service service(limits);
  std::promise<void> begun;
  std::promise<void> mayReturn;
  service.prepare = [&begun, &mayReturn](RecordingSession& session) {
    session.onCall = [&begun, &mayReturn](const std::string& call) {
      if (call != "startConfig") return;
      begun.set_value();
      mayReturn.get_future().wait();
    };
  };
  service.start();
  BusClient stuck(service.path());
  EXPECT_GE(stuck.post(stuck.newCall("StartConfig")), 0);
  EXPECT_GE(sd_bus_flush(stuck.bus()), 0);
  begun.get_future().wait();
  BusClient other(service.path());
  EXPECT_NE(other.call("FetchDisplayURL", ""), nullptr);
  service.stop();
  EXPECT_EQ(service.callsLeftBehind, 1U);
  EXPECT_EQ(service.invalidations(), 1U);
  EXPECT_TRUE(service.logged("IpcListener: Calls that had not returned after 50 ms and are left behind: 1"));
  mayReturn.set_value();
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 2; }));
}

}  // namespace
}  // namespace tarnel

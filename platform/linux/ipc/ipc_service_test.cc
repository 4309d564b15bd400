#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <stdexcept>

#include "platform/ipc/dbus_codec.h"
#include "platform/linux/ipc/ipc_test_support.h"

namespace tarnel {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

class IpcServiceTest : public ::testing::Test {
 protected:
  Service service;
};

TEST_F(IpcServiceTest, EveryMethodArrivesWithItsArgumentsAndIsAnswered) {
  service.start();
  BusClient client(service.path());
  auto reply = client.call("SetSessionInfo", "aa{sv}aa{sv}aavb", 1, 1, "k", "i", 1, 0, 1, 1, "s", "f", 1);
  ASSERT_NE(reply, nullptr) << client.errorText;
  EXPECT_STREQ(sd_bus_message_get_signature(reply.get(), 1), "");
  reply = client.call("StartConfig", "");
  ASSERT_NE(reply, nullptr) << client.errorText;
  EXPECT_EQ(*wire::readMaybeNames(reply.get()), (std::vector<std::string>{"httppost", "dashboard"}));
  reply = client.call("FetchStates", "aa{sv}", 0);
  EXPECT_EQ(*wire::readMaybeNames(reply.get()), std::nullopt);
  reply = client.call("FetchDisplayURL", "");
  EXPECT_EQ(*wire::readMaybeString(reply.get()), "URL not available");
  reply = client.call("SendMessage", "qqaa{sv}", 65535, 2, 1, 1, "k", "i", 1);
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject("5"));
  reply = client.call("SendMessageDictionary", "a{sv}", 1, "category", "q", 7);
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject("6"));
  reply = client.call("FlushMessages", "");
  EXPECT_EQ(*wire::readMaybeString(reply.get()), "text");
  EXPECT_EQ(*wire::readMaybeError(reply.get()), Error("domain", -1, "No backends available to send message"));
  reply = client.call("FinishSession", "");
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject(Error("domain", 503, "off")));
  reply = client.call("UploadLogData", "av", 1, "s", "record");
  int success = 0;
  EXPECT_GT(sd_bus_message_read_basic(reply.get(), 'b', &success), 0);
  EXPECT_EQ(success, 1);
  EXPECT_EQ(*wire::readMaybeError(reply.get()), std::nullopt);
  reply = client.call("SendSingleMessage", "aa{sv}aa{sv}qqaa{sv}", 1, 1, "a", "b", 1, 0, 3, 4, 1, 0);
  EXPECT_EQ(*wire::readMaybeString(reply.get()), std::nullopt);
  EXPECT_THAT(service.session()->calls(),
              ElementsAre("setSessionInfo {\"k\": 1} none [\"f\"] yes", "startConfig", "fetchStates none",
                          "fetchDisplayURL", "send 65535 2 {\"k\": 1}", "dictionary {\"category\": 7}",
                          "flush", "finish", "uploadLogData [\"record\"]", "single {\"a\": 1} none 3 4 {}"));
}

TEST_F(IpcServiceTest, ABatchIsCarriedOutInOrderAndAnsweredAsAWhole) {
  service.start();
  BusClient client(service.path());
  const auto reply =
      client.call("SendMessages", "a(qquaa{sv})", 3, 1, 2, 0, 1, 1, "k", "i", 1, 3, 4, 2, 1, 0, 5, 6, 1, 0);
  ASSERT_NE(reply, nullptr) << client.errorText;
  ASSERT_GT(sd_bus_message_enter_container(reply.get(), 'a', "av"), 0);
  for (const char* text : {"1", "2", "3"}) {
    EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject(text));
  }
  EXPECT_GT(sd_bus_message_at_end(reply.get(), 0), 0);
  EXPECT_THAT(service.session()->calls(),
              ElementsAre("send 1 2 {\"k\": 1}",
                          "dictionary {\"category\": 3, \"type\": 4, \"flag\": 2, \"payload\": {}}",
                          "dictionary {\"category\": 5, \"type\": 6, \"flag\": 1}"));
}

TEST_F(IpcServiceTest, AnEmptyBatchIsAnswered) {
  service.start();
  BusClient client(service.path());
  const auto reply = client.call("SendMessages", "a(qquaa{sv})", 0);
  ASSERT_NE(reply, nullptr) << client.errorText;
  EXPECT_STREQ(sd_bus_message_get_signature(reply.get(), 1), "aav");
  EXPECT_EQ(service.session()->count(), 0U);
}

TEST_F(IpcServiceTest, AFailureInABatchStaysWithItsMessage) {
  service.prepare = [](RecordingSession& session) {
    session.onCall = [](const std::string& call) {
      if (call.starts_with("send 2")) throw InvalidArgument("no second");
    };
    session.answerSend = [count = 0](SentReply reply) mutable {
      if (++count == 1) return;  // let go of
      reply(SentObject("sent"));
    };
  };
  service.start();
  BusClient client(service.path());
  const auto reply = client.call("SendMessages", "a(qquaa{sv})", 3, 1, 0, 0, 0, 2, 0, 0, 0, 3, 0, 0, 0);
  ASSERT_NE(reply, nullptr) << client.errorText;
  ASSERT_GT(sd_bus_message_enter_container(reply.get(), 'a', "av"), 0);
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()),
            SentObject(Error(wire::kErrorNoReply, -1, "no answer will come")));
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject(Error(wire::kErrorFailed, -1, "no second")));
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject("sent"));
}

TEST_F(IpcServiceTest, ABadMessageRefusesItsWholeBatch) {
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(client.call("SendMessages", "a(qquaa{sv})", 2, 1, 2, 0, 0, 3, 4, 0, 1, 1, "k", "(ii)", 1, 2),
            nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorInvalidArguments);
  EXPECT_THAT(client.errorText, HasSubstr("in message 1: at key \"k\": a structure (ii)"));
  EXPECT_EQ(service.session()->count(), 0U);
}

TEST_F(IpcServiceTest, APeerWithoutTheEntitlementIsClosed) {
  service.entitlements().grants = false;
  service.start();
  const RawClient client(service.path());
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_EQ(service.rejected(), 1U);
  EXPECT_EQ(service.accepted(), 0U);
  EXPECT_TRUE(eventually([&] { return service.listener().connections() == 0; }));
  EXPECT_EQ(service.listener().threads(), 0U);
}

TEST_F(IpcServiceTest, WrongArgumentsAreRefusedWithTheRightSignature) {
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(client.call("SendMessage", "s", "x"), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorInvalidArguments);
  EXPECT_EQ(client.errorText, "SendMessage takes the arguments \"qqaa{sv}\", not \"s\"");
  EXPECT_EQ(client.call("StartConfig", "s", "x"), nullptr);
  EXPECT_EQ(client.errorText, "StartConfig takes the arguments \"\", not \"s\"");
  // Two where at most one may be.
  EXPECT_EQ(client.call("FetchStates", "aa{sv}", 2, 0, 0), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorInvalidArguments);
  EXPECT_EQ(service.session()->count(), 0U);
}

TEST_F(IpcServiceTest, UnknownMethodsAndObjectsGetTheStandardErrors) {
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(client.call("Nothing", ""), nullptr);
  EXPECT_EQ(client.errorName, SD_BUS_ERROR_UNKNOWN_METHOD);
  EXPECT_THAT(client.errorText, HasSubstr("Nothing"));
  sd_bus_error error = SD_BUS_ERROR_NULL;
  EXPECT_LT(sd_bus_call_method(client.bus(), nullptr, "/elsewhere", wire::kSessionInterface, "StartConfig",
                               &error, nullptr, ""),
            0);
  EXPECT_STREQ(error.name, SD_BUS_ERROR_UNKNOWN_OBJECT);
  sd_bus_error_free(&error);
  ASSERT_NE(client.call("StartConfig", ""), nullptr);
}

TEST_F(IpcServiceTest, AnExceptionIsLoggedAndAnsweredAndTheConnectionGoesOn) {
  service.prepare = [](RecordingSession& session) {
    session.onCall = [](const std::string& call) {
      if (call == "startConfig") throw InvalidArgument("no storebag name for client type 99");
      if (call == "flush") throw std::runtime_error("bad \xFF bytes");
    };
  };
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(client.call("StartConfig", ""), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorFailed);
  EXPECT_EQ(client.errorText, "no storebag name for client type 99");
  EXPECT_EQ(client.call("FlushMessages", ""), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorFailed);
  EXPECT_NE(client.call("FinishSession", ""), nullptr);
  const auto lines = service.log().startingWith("IpcConnection: StartConfig of pid ");
  ASSERT_EQ(lines.size(), 1U);
  EXPECT_EQ(lines[0].level, LogLevel::error);
  EXPECT_THAT(lines[0].text, HasSubstr("failed: no storebag name for client type 99"));
}

TEST_F(IpcServiceTest, AReplyLetGoOfIsAnsweredWithNoReply) {
  service.prepare = [](RecordingSession& session) {
    session.answerSend = [](SentReply reply) { const SentReply gone = std::move(reply); };
  };
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(client.call("SendMessage", "qqaa{sv}", 1, 2, 0), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorNoReply);
  EXPECT_EQ(client.errorText, "no answer will come");
}

TEST_F(IpcServiceTest, RepliesMayComeLaterAndFromOtherThreads) {
  std::vector<std::thread> threads;
  service.prepare = [&threads](RecordingSession& session) {
    session.answerSend = [&threads, count = 0](SentReply reply) mutable {
      threads.emplace_back([reply = std::move(reply), isLetGo = ++count == 2]() mutable {
        if (!isLetGo) reply(SentObject("later"));
      });
    };
  };
  service.start();
  BusClient client(service.path());
  const auto reply = client.call("SendMessage", "qqaa{sv}", 1, 2, 0);
  ASSERT_NE(reply, nullptr) << client.errorText;
  EXPECT_EQ(*wire::readMaybeSentObject(reply.get()), SentObject("later"));
  EXPECT_EQ(client.call("SendMessage", "qqaa{sv}", 1, 2, 0), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorNoReply);
  for (auto& thread : threads) thread.join();
}

TEST_F(IpcServiceTest, RepliesAfterTheConnectionsDeathAreHarmless) {
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

TEST_F(IpcServiceTest, ACallThatWantsNoReplyGetsAnEmptyOne) {
  service.start();
  BusClient client(service.path());
  auto call = client.newCall("SendMessage");
  sd_bus_message_append(call.get(), "qqaa{sv}", 1, 2, 0);
  sd_bus_message_set_expect_reply(call.get(), 0);
  EXPECT_GE(client.post(call), 0);
  call = client.newCall("SendMessages");
  sd_bus_message_append(call.get(), "a(qquaa{sv})", 1, 3, 4, 0, 0);
  sd_bus_message_set_expect_reply(call.get(), 0);
  EXPECT_GE(client.post(call), 0);
  call = client.newCall("Nothing");
  sd_bus_message_set_expect_reply(call.get(), 0);
  EXPECT_GE(client.post(call), 0);
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
  EXPECT_THAT(service.session()->calls(),
              ElementsAre("send 1 2 none noreply", "send 3 4 none noreply", "startConfig"));
}

TEST_F(IpcServiceTest, TheProxyCallsTheClientsObject) {
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

TEST_F(IpcServiceTest, WhatCannotBeSentToTheClientReachesTheErrorHandler) {
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

TEST_F(IpcServiceTest, WithoutAWayToTheClientThereIsNoProxy) {
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

TEST_F(IpcServiceTest, InvalidationRunsOnceAndLetsGoOfEverything) {
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

TEST_F(IpcServiceTest, InvalidationWaitsForTheCallThatRuns) {
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

TEST_F(IpcServiceTest, WhatAClientSentBeforeItsDeathIsCarriedOut) {
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

TEST_F(IpcServiceTest, StoppingTheListenerEndsAllConnections) {
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
}

TEST_F(IpcServiceTest, GeneralToolsSayHelloAndIntrospect) {
  service.start();
  BusClient client(service.path());
  const auto ask = [&client](const char* path, const char* interface, const char* member) {
    sd_bus_message* reply = nullptr;
    const char* text = nullptr;
    const int r =
        sd_bus_call_method(client.bus(), "org.example.any", path, interface, member, nullptr, &reply, "");
    const BusMessage owned(reply);
    return r >= 0 && sd_bus_message_read_basic(reply, 's', static_cast<void*>(&text)) > 0 ? std::string(text)
                                                                                          : "refused";
  };
  EXPECT_EQ(ask("/org/freedesktop/DBus", "org.freedesktop.DBus", "Hello"), ":1.0");
  EXPECT_EQ(ask("/org/freedesktop/DBus", "org.freedesktop.DBus", "ListNames"), "refused");
  const auto xml = ask(wire::kSessionPath, "org.freedesktop.DBus.Introspectable", "Introspect");
  EXPECT_THAT(xml, HasSubstr("<interface name=\"com.orvane.tarneld.ClientSession\">"));
  EXPECT_THAT(xml,
              HasSubstr("<method name=\"SendMessages\">\n   <arg type=\"a(qquaa{sv})\" direction=\"in\"/>\n"
                        "   <arg type=\"aav\" direction=\"out\"/>"));
  EXPECT_THAT(xml,
              HasSubstr("<arg type=\"as\" direction=\"out\"/>\n   <arg type=\"a(sxs)\" direction=\"out\"/>"));
  EXPECT_THAT(ask("/", "org.freedesktop.DBus.Introspectable", "Introspect"),
              HasSubstr("<node name=\"com\"/>"));
  EXPECT_THAT(ask("/com/orvane", "org.freedesktop.DBus.Introspectable", "Introspect"),
              HasSubstr("<node name=\"tarneld\"/>"));
  EXPECT_EQ(ask("/elsewhere", "org.freedesktop.DBus.Introspectable", "Introspect"), "refused");
  EXPECT_GE(sd_bus_call_method(client.bus(), nullptr, "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               "AddMatch", nullptr, nullptr, "s", "type='signal'"),
            0);
  EXPECT_GE(sd_bus_call_method(client.bus(), nullptr, "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               "StartServiceByName", nullptr, nullptr, "su", "x", 0),
            0);
  EXPECT_GE(sd_bus_call_method(client.bus(), nullptr, wire::kSessionPath, "org.freedesktop.DBus.Peer", "Ping",
                               nullptr, nullptr, ""),
            0);
}

}  // namespace
}  // namespace tarnel

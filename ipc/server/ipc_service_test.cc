#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <stdexcept>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/server/ipc_test_support.h"

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

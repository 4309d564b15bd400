#include "ipc/server/send_call.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <array>
#include <cmath>
#include <random>
#include <string>
#include <vector>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/server/ipc_test_support.h"

namespace tarnel {
namespace {

using ::testing::ElementsAre;

// One end of a connection on the bus library, the other to write and read bytes by hand.
class HalfBus {
 public:
  explicit HalfBus(bool isServer) {
    std::array<int, 2> ends{};
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()), 0);
    raw_.reset(ends[1]);
    sd_bus* bus = nullptr;
    EXPECT_GE(sd_bus_new(&bus), 0);
    bus_.reset(bus);
    EXPECT_GE(sd_bus_set_fd(bus, ends[0], ends[0]), 0);
    EXPECT_GE(sd_bus_negotiate_fds(bus, 0), 0);
    if (isServer) {
      EXPECT_GE(sd_bus_set_server(bus, 1, {}), 0);
      EXPECT_GE(sd_bus_set_anonymous(bus, 1), 0);
    }
    EXPECT_GE(sd_bus_start(bus), 0);
    write(isServer ? std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27)
                   : "DATA\r\nOK 0123456789abcdef0123456789abcdef\r\n");
    while (sd_bus_is_ready(bus) <= 0) EXPECT_GE(sd_bus_process(bus, nullptr), 0);
    while (sd_bus_process(bus, nullptr) > 0) {
    }
    readAll();
  }
  sd_bus* bus() { return bus_.get(); }
  void write(std::string_view bytes) {
    EXPECT_EQ(::write(raw_.get(), bytes.data(), bytes.size()), bytes.size());
  }
  std::string readAll() {
    std::string all;
    std::array<char, 65536> some{};
    for (ssize_t got = 0; (got = ::read(raw_.get(), some.data(), some.size())) > 0;) {
      all.append(some.data(), static_cast<size_t>(got));
    }
    return all;
  }

 private:
  struct Close {
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
  };
  UniqueFd raw_;
  std::unique_ptr<sd_bus, Close> bus_;
};

// What the bus library puts on the wire for a call whose arguments `append` adds.
template <class Append>
std::string bytesOf(const char* member, bool wantsReply, Append append) {
  HalfBus client(false);
  sd_bus_message* made = nullptr;
  EXPECT_GE(sd_bus_message_new_method_call(client.bus(), &made, nullptr, wire::kSessionPath,
                                           wire::kSessionInterface, member),
            0);
  const BusMessage message(made);
  EXPECT_GE(sd_bus_message_set_expect_reply(made, wantsReply ? 1 : 0), 0);
  append(made);
  EXPECT_GE(sd_bus_send(client.bus(), made, nullptr), 0);
  return client.readAll();
}

std::string messageBytes(const MaybeDictionary& payload, bool wantsReply = true) {
  return bytesOf("SendMessage", wantsReply, [&](sd_bus_message* m) {
    EXPECT_GE(sd_bus_message_append(m, "qq", 7, 65535), 0);
    EXPECT_FALSE(wire::appendMaybeDictionary(m, payload));
  });
}

std::string dictionaryBytes(const Dictionary& dictionary) {
  return bytesOf("SendMessageDictionary", true,
                 [&](sd_bus_message* m) { EXPECT_FALSE(wire::appendDictionary(m, dictionary)); });
}

std::string batchBytes(const std::vector<MaybeDictionary>& payloads) {
  return bytesOf("SendMessages", true, [&](sd_bus_message* m) {
    EXPECT_GE(sd_bus_message_open_container(m, 'a', "(qquaa{sv})"), 0);
    uint16_t number = 0;
    for (const auto& payload : payloads) {
      EXPECT_GE(sd_bus_message_open_container(m, 'r', "qquaa{sv}"), 0);
      EXPECT_GE(sd_bus_message_append(m, "qqu", ++number, 3, 0x80000001U), 0);
      EXPECT_FALSE(wire::appendMaybeDictionary(m, payload));
      EXPECT_GE(sd_bus_message_close_container(m), 0);
    }
    EXPECT_GE(sd_bus_message_close_container(m), 0);
  });
}

Dictionary everything() {
  return {{"true", true},
          {"false", false},
          {"integer", INT64_MIN},
          {"unsigned", UINT64_MAX},
          {"real", -0.25},
          {"date", Date{1e9}},
          {"text", "Zo\u00eb & Ravi \u2013 Wochenplanung"},
          {"a text of more than eight letters", ""},
          {"data", Data{0, 1, 255}},
          {"no data", Data()},
          {"array", Array{1, "two", Array{3.0}, Dictionary{{"four", 4}}}},
          {"no array", Array()},
          {"dictionary", Dictionary{{"inner", Dictionary{{"innermost", Data{9}}}}, {"x", 1}}},
          {"no dictionary", Dictionary()}};
}

// The same call as the library reads it; nothing when it does not take it.
std::optional<SendCall> readByLibrary(std::string_view bytes) {
  HalfBus server(true);
  BusMessage message;
  EXPECT_GE(sd_bus_add_filter(
                server.bus(), nullptr,
                [](sd_bus_message* got, void* into, sd_bus_error*) {
                  static_cast<BusMessage*>(into)->reset(sd_bus_message_ref(got));
                  return 1;
                },
                &message),
            0);
  server.write(bytes);
  while (message == nullptr && sd_bus_process(server.bus(), nullptr) > 0) {
  }
  if (message == nullptr) return std::nullopt;
  SendCall call;
  uint64_t serial = 0;
  EXPECT_GE(sd_bus_message_get_cookie(message.get(), &serial), 0);
  call.serial = static_cast<uint32_t>(serial);
  call.wantsReply = sd_bus_message_get_expect_reply(message.get()) > 0;
  const std::string member = sd_bus_message_get_member(message.get());
  const std::string signature = sd_bus_message_get_signature(message.get(), 1);
  if (member == "SendMessages" && signature == wire::kSendMessages.arguments) {
    call.kind = SendCall::Kind::batch;
    auto batch = readBatch(message.get());
    if (!batch) return std::nullopt;
    call.messages = *std::move(batch);
  } else if (member == "SendMessageDictionary" && signature == wire::kSendMessageDictionary.arguments) {
    call.kind = SendCall::Kind::dictionary;
    auto dictionary = wire::readDictionary(message.get());
    if (!dictionary) return std::nullopt;
    call.dictionary = *std::move(dictionary);
  } else if (member == "SendMessage" && signature == wire::kSendMessage.arguments) {
    auto& only = call.messages.emplace_back();
    sd_bus_message_read(message.get(), "qq", &only.category, &only.type);
    auto payload = wire::readMaybeDictionary(message.get());
    if (!payload) return std::nullopt;
    only.payload = *std::move(payload);
  } else {
    return std::nullopt;
  }
  return call;
}

// Everything in it, types included; numbers that are not one print alike.
std::string typed(const Value& value) {
  std::string text = std::to_string(static_cast<int>(value.type())) + ':';
  if (const auto* dictionary = value.dictionary()) {
    for (const auto& [key, inner] : *dictionary) text += '<' + key + '=' + typed(inner) + '>';
    return text;
  }
  if (const auto* array = value.array()) {
    for (const auto& inner : *array) text += '[' + typed(inner) + ']';
    return text;
  }
  return text + value.description();
}

std::string textOf(const SendCall& call) {
  std::string text =
      std::string(call.member()) + ' ' + std::to_string(call.serial) + (call.wantsReply ? "" : " noreply");
  for (const auto& message : call.messages) {
    text += " (" + std::to_string(message.category) + ' ' + std::to_string(message.type) + ' ' +
            std::to_string(message.flag) + ' ' + (message.payload ? typed(*message.payload) : "none") + ')';
  }
  return text + ' ' + typed(call.dictionary);
}

void expectReadAlike(const std::string& bytes) {
  const auto direct = readSendCall(bytes);
  const auto byLibrary = readByLibrary(bytes);
  ASSERT_TRUE(direct);
  ASSERT_TRUE(byLibrary);
  EXPECT_EQ(textOf(*direct), textOf(*byLibrary));
  EXPECT_TRUE(mayBeSendCall(bytes));
}

TEST(SendCallTest, EveryCallIsReadAsTheLibraryReadsIt) {
  expectReadAlike(messageBytes(everything()));
  expectReadAlike(messageBytes(std::nullopt));
  expectReadAlike(messageBytes(Dictionary()));
  expectReadAlike(messageBytes(Dictionary{{"k", 1}}, false));
  expectReadAlike(dictionaryBytes(everything()));
  expectReadAlike(dictionaryBytes({}));
  expectReadAlike(batchBytes({everything(), std::nullopt, Dictionary(), Dictionary{{"k", "v"}}}));
  expectReadAlike(batchBytes({}));
}

TEST(SendCallTest, NumbersOfEveryWidthAreRead) {
  const auto bytes = bytesOf("SendMessageDictionary", true, [](sd_bus_message* m) {
    EXPECT_GE(sd_bus_message_append(m, "a{sv}", 8, "y", "y", 255, "n", "n", -2, "q", "q", 65535, "i", "i", -3,
                                    "u", "u", 4294967295U, "x", "x", int64_t{-4}, "t", "t", uint64_t{5},
                                    "twice", "i", 1),
              0);
  });
  expectReadAlike(bytes);
  EXPECT_EQ(readSendCall(bytes)->dictionary.find("n")->int64Value(), -2);
}

TEST(SendCallTest, AKeyThatComesTwiceKeepsItsPlaceAndItsLastValue) {
  const auto bytes = bytesOf("SendMessageDictionary", true, [](sd_bus_message* m) {
    EXPECT_GE(sd_bus_message_append(m, "a{sv}", 3, "a", "i", 1, "b", "i", 2, "a", "i", 3), 0);
  });
  expectReadAlike(bytes);
  EXPECT_EQ(description(readSendCall(bytes)->dictionary), "{\"a\": 3, \"b\": 2}");
}

TEST(SendCallTest, WhatIsUnusualIsLeftToTheLibrary) {
  const auto left = [](const std::string& bytes) { return !readSendCall(bytes); };
  const auto withPayload = [](const char* types, auto... values) {
    return bytesOf("SendMessageDictionary", true,
                   [&](sd_bus_message* m) { EXPECT_GE(sd_bus_message_append(m, types, values...), 0); });
  };
  EXPECT_TRUE(left(withPayload("a{sv}", 1, "k", "o", "/path")));
  EXPECT_TRUE(left(withPayload("a{sv}", 1, "k", "as", 1, "text")));
  EXPECT_TRUE(left(withPayload("a{sv}", 1, "k", "(dd)", 1.0, 2.0)));
  EXPECT_TRUE(left(withPayload("a{sv}", 1, "k", "s", "\U0001F600")));
  EXPECT_TRUE(left(withPayload("a{ss}", 1, "k", "v")));
  EXPECT_TRUE(left(bytesOf("SendMessage", true, [](sd_bus_message* m) {
    EXPECT_GE(sd_bus_message_append(m, "qqaa{sv}", 1, 2, 2, 0, 0), 0);  // two payloads
  })));
  EXPECT_TRUE(left(bytesOf("FlushMessages", true, [](sd_bus_message*) {})));
  Value deep(1);
  for (int i = 0; i < 9; ++i) deep = Value(Dictionary{{"k", deep}});
  EXPECT_TRUE(left(dictionaryBytes(*deep.dictionary())));
  EXPECT_FALSE(left(dictionaryBytes(*deep.dictionary()->find("k")->dictionary())));
}

TEST(SendCallTest, OtherHeadersAreLeftToTheLibrary) {
  const std::string good = messageBytes(Dictionary{{"k", 1}});
  ASSERT_TRUE(readSendCall(good));
  const auto changed = [&good](size_t at, char to) {
    std::string bytes = good;
    bytes[at] = to;
    return readSendCall(bytes);
  };
  EXPECT_FALSE(changed(0, 'B'));
  EXPECT_FALSE(changed(1, 4));   // a signal
  EXPECT_FALSE(changed(2, 4));   // a flag that means something
  EXPECT_FALSE(changed(3, 2));   // another version
  EXPECT_FALSE(changed(8, 0));   // no serial
  EXPECT_FALSE(changed(16, 6));  // a destination for a path
  EXPECT_FALSE(changed(24, '.'));
  EXPECT_FALSE(readSendCall(good + std::string(8, '\0')));
  for (size_t size = 0; size < good.size(); ++size) EXPECT_FALSE(readSendCall(good.substr(0, size))) << size;
}

TEST(SendCallTest, TheFirstBytesTellWhatIsCertainlyNoSendCall) {
  const auto start = [](const std::string& bytes) {
    return mayBeSendCall(std::string_view(bytes).substr(0, kSendCallStart));
  };
  EXPECT_TRUE(start(batchBytes({everything()})));
  EXPECT_TRUE(start(dictionaryBytes(everything())));
  EXPECT_TRUE(start(messageBytes(everything())));
  EXPECT_FALSE(start(rawCall("UploadLogData", std::string(300, 'x'), "av")));
  EXPECT_FALSE(start(rawCall("FlushMessages")));
  EXPECT_FALSE(start(""));
}

// Whatever is done to the bytes: what is read directly is what the library would have read.
TEST(SendCallTest, DamagedBytesAreReadAlikeOrLeftToTheLibrary) {
  std::mt19937 random(20260131);
  const std::vector<std::string> originals{messageBytes(everything()), dictionaryBytes(everything()),
                                           batchBytes({everything(), std::nullopt, Dictionary{{"k", "v"}}})};
  size_t readDirectly = 0;
  for (int i = 0; i < 60'000; ++i) {
    std::string bytes = originals[random() % originals.size()];
    const size_t changes = 1 + random() % 3;
    for (size_t change = 0; change < changes; ++change) {
      char& byte = bytes[random() % bytes.size()];
      byte = random() % 2 == 0 ? static_cast<char>(random()) : static_cast<char>(byte ^ (1 << random() % 8));
    }
    const auto direct = readSendCall(bytes);
    if (!direct) continue;
    if (++readDirectly % 16 != 0) continue;  // the library takes its time
    const auto byLibrary = readByLibrary(bytes);
    ASSERT_TRUE(byLibrary) << textOf(*direct);
    ASSERT_EQ(textOf(*direct), textOf(*byLibrary));
  }
  EXPECT_GT(readDirectly, 5'000U);
}

TEST(SendCallServiceTest, CallsRunInTheOrderInWhichTheyComeWhoeverReadsThem) {
  Service service;
  service.start();
  RawClient client(service.path());
  client.authenticate();
  const std::string large(40'000, 'x');  // more than the buffer between socket and bus
  std::string all;
  std::vector<std::string> expected;
  for (int i = 0; i < 40; ++i) {
    const bool isUnusual = i % 3 == 1;
    const std::string text = (i % 7 == 0 ? large : std::string("t")) + (isUnusual ? "\U0001F600" : "");
    all += messageBytes(Dictionary{{"k", text}}, false);
    expected.push_back("send 7 65535 " + description(Dictionary{{"k", text}}) + " noreply");
    if (i % 5 == 0) {
      all += rawCall("FetchDisplayURL");
      expected.emplace_back("fetchDisplayURL");
    }
  }
  ASSERT_TRUE(client.write(all));
  ASSERT_TRUE(
      eventually([&] { return service.accepted() == 1 && service.session()->count() == expected.size(); }));
  EXPECT_EQ(service.session()->calls(), expected);
}

TEST(SendCallServiceTest, ACallThatComesByteByByteIsCarriedOut) {
  Service service;
  service.start();
  RawClient client(service.path());
  client.authenticate();
  for (const char byte : messageBytes(Dictionary{{"k", 1}}, false)) ASSERT_TRUE(client.write({&byte, 1}));
  ASSERT_TRUE(eventually([&] { return service.session()->count() == 1; }));
  EXPECT_THAT(service.session()->calls(), ElementsAre("send 7 65535 {\"k\": 1} noreply"));
}

TEST(SendCallServiceTest, ADamagedSendCallEndsTheConnectionAsAnyOther) {
  Service service;
  service.start();
  RawClient client(service.path());
  client.authenticate();
  std::string bytes = messageBytes(Dictionary{{"k", "text"}});
  bytes[bytes.size() - 2] = '\xFF';
  ASSERT_TRUE(client.write(bytes));
  // The library answers what it can read of it, or drops the peer; nothing was carried out.
  ASSERT_TRUE(client.write(rawCall("FetchDisplayURL")));
  eventually([&] { return service.invalidations() == 1 || service.session()->count() == 1; });
  for (const auto& call :
       service.invalidations() == 1 ? std::vector<std::string>() : service.session()->calls()) {
    EXPECT_EQ(call, "fetchDisplayURL");
  }
}

}  // namespace
}  // namespace tarnel

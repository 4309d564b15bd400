#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <filesystem>
#include <iterator>

#include "testing/private_instance.h"
#include "testing/raw_bus_client.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Clients that say anything, in any order, and die at any instant: each harms nobody but itself.

namespace tarnel::test {
namespace {

using client::Flag;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr uint32_t kMaxMessageBytes = 1U << 20U;

class ProtocolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    storebags.connect(instance);
    instance.setConsent(true);
    const std::string url = reports.url("/v1");
    storebags.serve("brevan", storebag("1", {{"httppost", profile({clientEntry(url, url)})}}));
    ASSERT_TRUE(instance.start());
    bystander = std::make_unique<TestSession>(instance, SessionSetup{});
    ASSERT_THAT(bystander->backends(), ElementsAre("httppost"));
  }
  void TearDown() override {
    expectOthersUnaffected();
    bystander.reset();
    instance.stop();
  }

  // A client that was there before, and one that comes now.
  void expectOthersUnaffected() {
    EXPECT_TRUE(bystander->send(1, 2).text) << "its message was not posted";
    EXPECT_THAT(TestSession(instance, {}).backends(), ElementsAre("httppost"));
    instance.expectAlive();
  }
  // What the daemon answers to one message of the wire, as bytes.
  std::string answerTo(const std::string& bytes) const {
    const RawBusClient client(instance.socketPath());
    EXPECT_TRUE(client.authenticate());
    EXPECT_TRUE(client.write(bytes));
    return client.readSome();
  }
  void expectClosedAfter(const std::string& bytes) const {
    const RawBusClient client(instance.socketPath());
    EXPECT_TRUE(client.authenticate());
    client.write(bytes);
    EXPECT_TRUE(client.isClosedByDaemon());
  }

  StorebagServer storebags;
  RawHttpServer reports{RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK"); })};
  PrivateInstance instance;
  std::unique_ptr<TestSession> bystander;
};

TEST_F(ProtocolTest, GarbageInsteadOfAHandshake) {
  for (const std::string& bytes :
       {std::string(200'000, 'x'), std::string("GET / HTTP/1.1\r\n\r\n"), std::string(300'000, '\0'),
        std::string("\0AUTH EXTERNAL 30\r\nNONSENSE\r\n", 29) + std::string(100'000, 'y')}) {
    const RawBusClient client(instance.socketPath());
    client.write(bytes);
    ::shutdown(client.socket().get(), SHUT_WR);
    EXPECT_TRUE(client.isClosedByDaemon());
  }
}

// The bounds hold for messages; what follows a line that ends the authentication for one side only must not
// get past them.
TEST_F(ProtocolTest, AnAuthenticationThatOnlySeemsToEndHidesNoLargeMessage) {
  const std::string authenticated("\0AUTH ANONYMOUS 74\r\n", 20);
  // The header of a message in which the calls hide.
  const std::string cover("B\1\0\1\0\x0F\xF0\0\0\0\0\1\0\0\0\0", 16);
  const std::string large = bytesOf(
      {.member = "SetSessionInfo", .signature = "aa{sv}aa{sv}aavb", .bodySize = kMaxMessageBytes * 60});
  const size_t before = instance.logSize();
  for (const auto& [handshake, why] :
       {std::pair{authenticated + "NOPE\nBEGIN\r\n" + cover + "\r\nBEGIN\r\n",
                  "exceeds the limit of 1048576 bytes"},
        std::pair{std::string("\0BEGIN\r\n", 8) + cover + "\r\nAUTH ANONYMOUS 74\r\nBEGIN\r\n",
                  "its authentication did not end with BEGIN"}}) {
    const RawBusClient client(instance.socketPath());
    client.write(handshake + bytesOf({.member = "StartConfig"}) + large + std::string(2000, '\0'));
    EXPECT_TRUE(client.isClosedByDaemon());
    instance.waitForLog(why, before);
  }
}

TEST_F(ProtocolTest, GarbageInsteadOfMessages) {
  expectClosedAfter(std::string(100'000, 'x'));
  expectClosedAfter(std::string(100'000, '\0'));
  std::string call = bytesOf({.member = "StartConfig"});
  call[0] = '?';
  expectClosedAfter(call);
  // Lengths that lie: of the header's fields, and of the body.
  call = bytesOf({.member = "StartConfig"});
  const uint32_t huge = 0x7fffffff;
  std::memcpy(call.data() + 12, &huge, sizeof huge);
  expectClosedAfter(call + std::string(100, '\0'));
  expectClosedAfter(bytesOf({.member = "SendMessage", .signature = "qqaa{sv}", .bodySize = UINT32_MAX - 1}) +
                    std::string(100, '\0'));
}

TEST_F(ProtocolTest, AMessageBeyondTheLimitEndsTheConnection) {
  const size_t before = instance.logSize();
  const std::string body = messageBody(1, 2, std::string(kMaxMessageBytes * 3, 'x'));
  expectClosedAfter(bytesOf({.member = "SendMessage", .signature = "qqaa{sv}", .body = body}));
  instance.waitForLog("exceeds the limit of 1048576 bytes", before);
  // One that fits is served.
  const std::string fits = messageBody(1, 2, std::string(kMaxMessageBytes / 2, 'x'));
  EXPECT_THAT(answerTo(bytesOf({.member = "SendMessage", .signature = "qqaa{sv}", .body = fits})),
              Not(HasSubstr("Error")));
}

TEST_F(ProtocolTest, ByteByByteIsServedAllTheSame) {
  const RawBusClient client(instance.socketPath());
  ASSERT_TRUE(client.authenticate());
  for (const char byte : bytesOf({.member = "FetchDisplayURL"})) ASSERT_TRUE(client.write({&byte, 1}));
  EXPECT_THAT(client.readSome(), HasSubstr("URL not available"));
}

TEST_F(ProtocolTest, UnknownMethodsAndWrongArgumentsAreNamedErrors) {
  EXPECT_THAT(answerTo(bytesOf({.member = "Explode"})), HasSubstr("Unknown method Explode"));
  EXPECT_THAT(answerTo(bytesOf({.member = "StartConfig", .interface = "com.example.Nonsense"})),
              HasSubstr("org.freedesktop.DBus.Error.Unknown"));
  EXPECT_THAT(answerTo(bytesOf({.member = "StartConfig", .path = "/nowhere"})),
              HasSubstr("org.freedesktop.DBus.Error.Unknown"));
  const std::string text("\3\0\0\0abc\0", 8);
  EXPECT_THAT(answerTo(bytesOf({.member = "SendMessage", .signature = "s", .body = text})),
              HasSubstr("SendMessage takes the arguments"));
  // A text that is not UTF-8: the library ends the connection or the call is refused, never passed on.
  const RawBusClient client(instance.socketPath());
  ASSERT_TRUE(client.authenticate());
  ASSERT_TRUE(client.write(
      bytesOf({.member = "SendMessage", .signature = "qqaa{sv}", .body = messageBody(1, 2, "a\xff\xfe")})));
  const std::string answer = client.readSome();
  EXPECT_TRUE(answer.empty() || answer.find("not UTF-8") != std::string::npos) << answer;
}

TEST_F(ProtocolTest, NestingBeyondTheLimitIsANamedError) {
  const auto nested = [](int depth) {
    client::Dictionary dictionary;
    for (int i = 1; i < depth; ++i) dictionary = client::Dictionary().set("k", dictionary);
    return dictionary;
  };
  EXPECT_TRUE(bystander->send(3, 4, nested(10)).ok());
  const auto reply = bystander->send(3, 4, nested(40));
  EXPECT_FALSE(reply.ok());
  EXPECT_THAT(reply.status.message, HasSubstr("nest deeper than 32 levels"));
}

TEST_F(ProtocolTest, DescriptorsThatNobodyAskedForEndTheConnection) {
  const RawBusClient client(instance.socketPath());
  ASSERT_TRUE(client.authenticate());
  const std::string call = bytesOf({.member = "FetchDisplayURL"});
  iovec part{const_cast<char*>(call.data()), call.size()};
  std::array<int, 100> descriptors{};
  descriptors.fill(client.socket().get());
  std::array<char, CMSG_SPACE(sizeof descriptors)> control{};
  msghdr header{};
  header.msg_iov = &part;
  header.msg_iovlen = 1;
  header.msg_control = control.data();
  header.msg_controllen = control.size();
  cmsghdr* message = CMSG_FIRSTHDR(&header);
  message->cmsg_level = SOL_SOCKET;
  message->cmsg_type = SCM_RIGHTS;
  message->cmsg_len = CMSG_LEN(sizeof descriptors);
  std::memcpy(CMSG_DATA(message), descriptors.data(), sizeof descriptors);
  ASSERT_GT(::sendmsg(client.socket().get(), &header, MSG_NOSIGNAL), 0);
  // Whether it answers or ends the connection, it keeps none of them.
  client.write(call);
  client.readSome();
  const auto open = std::distance(
      std::filesystem::directory_iterator("/proc/" + std::to_string(instance.daemon().pid()) + "/fd"),
      std::filesystem::directory_iterator());
  EXPECT_LT(open, 100);
}

TEST_F(ProtocolTest, CallsInAnyOrder) {
  // Before any configuration.
  client::Session early(optionsFor(instance));
  EXPECT_TRUE(early.sendMessageAndWait(1, 2, {}, Flag::normal, kDeadline).ok());
  EXPECT_EQ(early.flushAndWait(kDeadline).error->description, "No backends available to send message");
  EXPECT_EQ(early.fetchDisplayURLAndWait(kDeadline).text, "URL not available");
  EXPECT_FALSE(early.fetchStatesAndWait(userInfo("Meetwell", "video-call"), kDeadline).names);
  EXPECT_FALSE(early.uploadLogDataAndWait(client::Array().append(1), kDeadline).success);
  EXPECT_TRUE(early.finishAndWait(kDeadline).ok());
  const auto started = early.startConfigAndWait(kDeadline);
  EXPECT_FALSE(started.ok() && started.names) << "no client type was given";
  // Messages without what they must have.
  EXPECT_TRUE(bystander->session.sendMessageDictionaryAndWait(client::Dictionary(), kDeadline).ok());
  instance.waitForLog("sendMessageWithDictionary: Missing mandatory parameter 'category'");
  EXPECT_TRUE(
      bystander->session.sendMessageDictionaryAndWait(client::Dictionary().set("category", 1), kDeadline)
          .ok());
  instance.waitForLog("sendMessageWithDictionary: Missing mandatory parameter 'type'");
  EXPECT_TRUE(
      bystander->session
          .sendMessageDictionaryAndWait(
              client::Dictionary().set("category", "x").set("type", client::Array()).set("payload", 3),
              kDeadline)
          .ok());
  // Twice, and after the end.
  TestSession twice(instance, {});
  EXPECT_TRUE(twice.session.setSessionInfo(sessionInfo({}), userInfo("Meetwell", "video-call")));
  EXPECT_THAT(*twice.session.startConfigAndWait(kDeadline).names, ElementsAre("httppost"));
  EXPECT_THAT(*twice.session.startConfigAndWait(kDeadline).names, ElementsAre("httppost"));
  EXPECT_TRUE(twice.session.finishAndWait(kDeadline).ok());
  EXPECT_TRUE(twice.session.finishAndWait(kDeadline).ok());
  EXPECT_TRUE(twice.send(1, 2).text);
  // Infos of every wrong kind.
  client::Dictionary odd;
  odd.set(kTarnelSessionInfoSessionID, "seven").set(kTarnelSessionInfoClientType, client::Date{8.0});
  odd.set(kTarnelSessionInfoClientVersion, client::Dictionary()).set(kTarnelSessionInfoBatchEvent, -1);
  client::Dictionary oddUser;
  oddUser.set(kTarnelUserInfoClientName, 3).set(kTarnelUserInfoServiceName, client::Array());
  client::Session strange(optionsFor(instance));
  EXPECT_TRUE(strange.setSessionInfo(odd, oddUser));
  strange.startConfigAndWait(kDeadline);
  EXPECT_TRUE(strange.sendMessageAndWait(1, 2, {}, Flag::normal, kDeadline).ok());
  odd.set(kTarnelSessionInfoClientType, 8);
  EXPECT_TRUE(strange.setSessionInfo(odd, oddUser));
  EXPECT_TRUE(strange.startConfigAndWait(kDeadline).ok());
  EXPECT_TRUE(strange.sendMessageAndWait(1, 2, {}, Flag::normal, kDeadline).ok());
}

TEST_F(ProtocolTest, DeathAtAnyInstant) {
  const std::string conversation =
      std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27) + bytesOf({.member = "StartConfig"}) +
      bytesOf(
          {.member = "SendMessage", .signature = "qqaa{sv}", .body = messageBody(1, 2, "x"), .serial = 2}) +
      bytesOf({.member = "FlushMessages", .serial = 3});
  for (size_t length = 0; length <= conversation.size(); length += 7) {
    const RawBusClient client(instance.socketPath());
    client.write(std::string_view(conversation).substr(0, length));
  }
  expectOthersUnaffected();
}

TEST_F(ProtocolTest, TextsOfAClientCannotForgeLines) {
  const std::string forged =
      "x\n<3>tarneld[1]: forged by a client\r\n(2026-01-01 00:00:00 +0000) [httppost] forged";
  TestSession session(instance, {.client = forged, .service = forged});
  client::Dictionary payload;
  payload.set("text", forged).set(forged, forged).set("data", std::vector<uint8_t>{10, 13});
  EXPECT_TRUE(bystander->send(5, 6, payload).text);
  session.send(5, 6, payload);
  auto user = userInfo("Meetwell", "video-call");
  user.set(forged, forged);
  EXPECT_TRUE(session.session.fetchStatesAndWait(user, kDeadline).ok());
  EXPECT_TRUE(session.send(5, 6, payload).ok());
  instance.waitForLog("forged by a client");
  for (const std::string& text : {instance.log(), instance.messageLog()}) {
    EXPECT_EQ(text.find("\n<3>tarneld[1]: forged"), std::string::npos);
    EXPECT_EQ(text.find("\n(2026-01-01 00:00:00 +0000) [httppost] forged"), std::string::npos);
    EXPECT_EQ(text.find('\r'), std::string::npos);
  }
}

}  // namespace
}  // namespace tarnel::test

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include "platform/linux/ipc/ipc_test_support.h"

// What a client may make the daemon hold, and what happens beyond it.

namespace tarnel {
namespace {

using ::testing::HasSubstr;

void expectServed(const Service& service) {
  BusClient client(service.path());
  EXPECT_NE(client.call("StartConfig", ""), nullptr) << client.errorText;
}

TEST(IpcUnansweredTest, UnansweredCallsAreBounded) {
  IpcLimits limits;
  limits.unansweredCalls = 10;
  Service service(limits);
  std::mutex mutex;
  std::vector<SentReply> held;
  service.prepare = [&](RecordingSession& session) {
    session.answerSend = [&](SentReply reply) {
      const std::lock_guard lock(mutex);
      held.push_back(std::move(reply));
    };
  };
  service.start();
  BusClient client(service.path());
  for (int i = 0; i < 30; ++i) {
    auto call = client.newCall("SendMessage");
    sd_bus_message_append(call.get(), "qqaa{sv}", 1, 2, 0);
    ASSERT_GE(sd_bus_call_async(
                  client.bus(), nullptr, call.get(), [](sd_bus_message*, void*, sd_bus_error*) { return 1; },
                  nullptr, 0),
              0);
  }
  ASSERT_GE(sd_bus_flush(client.bus()), 0);
  const auto session = [&] { return service.session(); };
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && session()->count() == 10; }));
  for (size_t answered = 0; answered < 30;) {
    std::vector<SentReply> now;
    EXPECT_TRUE(eventually([&] {
      const std::lock_guard lock(mutex);
      now = std::exchange(held, {});
      return !now.empty();
    }));
    answered += now.size();
    EXPECT_LE(now.size(), 10U);
    for (auto& reply : now) reply(std::nullopt);
  }
  EXPECT_EQ(session()->count(), 30U);
}

// What makes a message of about 70 kB.
constexpr size_t kLargeText = 70'000;

TEST(IpcLargeMessagesTest, WhatASessionKeepsIsBounded) {
  Service service;
  service.start();
  BusClient client(service.path());
  const std::string text(kLargeText, 'x');
  EXPECT_EQ(client.call("SetSessionInfo", "aa{sv}aa{sv}aavb", 1, 1, "k", "s", text.c_str(), 0, 0, 0),
            nullptr);
  EXPECT_THAT(client.errorText, HasSubstr("what a session keeps may have 65536 bytes, not 70"));
  EXPECT_EQ(client.call("FetchStates", "aa{sv}", 1, 1, "k", "s", text.c_str()), nullptr);
  EXPECT_THAT(client.errorText, HasSubstr("what a session keeps may have 65536 bytes, not 70"));
  EXPECT_TRUE(service.logged("FetchStates of pid "));
  EXPECT_EQ(service.session()->count(), 0U);
  EXPECT_NE(client.call("SetSessionInfo", "aa{sv}aa{sv}aavb", 1, 1, "k", "s", "x", 0, 0, 0), nullptr);
}

TEST(IpcLargeMessagesTest, AFileURLIsNoLongerThanAPathMayBe) {
  Service service;
  service.start();
  BusClient client(service.path());
  const std::string longest = "file://" + std::string(3 * 4096, 'x');
  const UniqueFd file(open("/dev/null", O_RDONLY | O_CLOEXEC));
  EXPECT_NE(client.call("UploadFile", "sh", longest.c_str(), file.get()), nullptr) << client.errorText;
  EXPECT_EQ(client.call("UploadFile", "sh", (longest + 'x').c_str(), file.get()), nullptr);
  EXPECT_EQ(client.errorText, "the file's URL is longer than 12295 bytes");
  EXPECT_EQ(service.session()->count(), 1U);
}

TEST(IpcLargeMessagesTest, LogDataBehindAServerThatHangsIsRefusedInTheEnd) {
  IpcLimits limits;
  limits.largeBytesAtWork = 100'000;
  limits.waitForLogData = std::chrono::milliseconds(20);
  Service service(limits);
  std::promise<void> begun;
  std::promise<void> mayReturn;
  std::atomic<int> uploads{0};
  service.prepare = [&](RecordingSession& session) {
    session.onCall = [&](const std::string& call) {
      if (!call.starts_with("uploadLogData") || uploads++ > 0) return;
      begun.set_value();
      mayReturn.get_future().wait();
    };
  };
  service.start();
  const std::string text(kLargeText, 'x');
  BusClient stuck(service.path());
  auto upload = stuck.newCall("UploadLogData");
  ASSERT_GE(sd_bus_message_append(upload.get(), "av", 1, "s", text.c_str()), 0);
  ASSERT_GE(stuck.post(upload), 0);
  ASSERT_GE(sd_bus_flush(stuck.bus()), 0);
  begun.get_future().wait();
  BusClient other(service.path());
  EXPECT_EQ(other.call("UploadLogData", "av", 1, "s", text.c_str()), nullptr);
  EXPECT_EQ(other.errorText,
            "the log data of this user that is under way leaves no room for more; try again later");
  EXPECT_TRUE(service.logged("found no room among that of its user: at most 100000 bytes are under way"));
  // Messages, and small log data, do not wait for it.
  EXPECT_NE(other.call("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str()), nullptr);
  EXPECT_NE(other.call("UploadLogData", "av", 1, "s", "x"), nullptr);
  mayReturn.set_value();
  EXPECT_TRUE(eventually([&] { return other.call("UploadLogData", "av", 1, "s", text.c_str()) != nullptr; }));
}

TEST(IpcLargeMessagesTest, LargeMessagesOfManyClientsAllArrive) {
  IpcLimits limits;
  limits.largeBytesAtWork = 1;  // one after the other
  Service service(limits);
  service.start();
  const std::string text(kLargeText, 'x');
  std::vector<std::thread> clients;
  for (int i = 0; i < 8; ++i) {
    clients.emplace_back([&service, &text] {
      BusClient client(service.path());
      for (int k = 0; k < 5; ++k) {
        EXPECT_NE(client.call("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str()), nullptr);
      }
    });
  }
  for (auto& client : clients) client.join();
}

TEST(IpcQueueTest, AClientThatNeverReadsItsCallsIsDropped) {
  IpcLimits limits;
  limits.queuedBytes = 100'000;
  Service service(limits);
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 1; }));
  std::atomic<size_t> errors = 0;
  const auto proxy =
      service.connection(0)->remoteObjectProxyWithErrorHandler([&errors](const Error&) { ++errors; });
  const Dictionary payload{{"k", Value(std::string(1000, 'x'))}};
  size_t sent = 0;
  while (errors == 0 && sent < 100'000) {
    proxy->sendMessageToClient(payload, 0, 1, 2, payload);
    ++sent;
  }
  EXPECT_GT(errors, 0U);
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  EXPECT_TRUE(service.logged("the limit of 100000 queued bytes is reached"));
}

TEST(IpcLimitTest, ConnectionsOfAUserAreLimited) {
  IpcLimits limits;
  limits.connectionsPerUser = 3;
  limits.connections = 5;
  std::atomic<uint32_t> nextUser{getuid()};
  Service service(limits, [&nextUser](int) {
    PeerCredentials peer;
    peer.uid = nextUser;
    return peer;
  });
  service.start();
  std::vector<std::unique_ptr<BusClient>> clients;
  const auto connect = [&] {
    clients.push_back(std::make_unique<BusClient>(service.path()));
    return clients.back()->call("StartConfig", "") != nullptr;
  };
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(connect());
  EXPECT_TRUE(isClosedByPeer(RawClient(service.path()).fd()));
  // Another user has a limit of its own: its connection reaches the delegate.
  nextUser = getuid() + 1;
  EXPECT_TRUE(isClosedByPeer(RawClient(service.path()).fd()));
  EXPECT_EQ(service.rejected(), 1U);
  nextUser = getuid();
  EXPECT_TRUE(
      service.logged("the limit of 3 connections per user is reached by user " + std::to_string(getuid())));
  clients.clear();
  EXPECT_TRUE(eventually([&] { return service.listener().connections() == 0; }));
  EXPECT_TRUE(connect());
}

TEST(IpcLimitTest, AThousandConnectionsAtOnceAreCutToTheLimit) {
  IpcLimits limits;
  limits.connectionsPerUser = 1000;
  limits.connections = 100;
  Service service(limits);
  service.start();
  const size_t descriptors = openDescriptors();
  rlimit files{};
  getrlimit(RLIMIT_NOFILE, &files);
  files.rlim_cur = files.rlim_max;
  setrlimit(RLIMIT_NOFILE, &files);
  std::vector<UniqueFd> clients;
  for (int i = 0; i < 1000; ++i) clients.push_back(connectTo(service.path()));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 100; }));
  // The last in the queue was looked at, so all were.
  EXPECT_TRUE(isClosedByPeer(clients.back()));
  EXPECT_EQ(service.accepted(), 100U);
  const auto lines = service.log().startingWith("IpcListener: Connections closed:");
  ASSERT_FALSE(lines.empty());
  EXPECT_LT(lines.size(), 10U);
  EXPECT_THAT(lines[0].text, HasSubstr("the limit of 100 connections is reached"));
  clients.clear();
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 100; }));
  EXPECT_TRUE(eventually([&] { return service.listener().threads() == 0; }));
  EXPECT_EQ(service.listener().connections(), 0U);
  EXPECT_TRUE(eventually([&] { return openDescriptors() <= descriptors; }));
}

TEST(IpcLimitTest, AThousandConnectionsLeaveNoThreadBehind) {
  Service service;
  service.start();
  for (int i = 0; i < 1000; ++i) {
    const RawClient client(service.path());
    if (i % 2 == 0) client.authenticate();
    EXPECT_TRUE(eventually([&] { return service.listener().connections() < 32; }));
  }
  EXPECT_TRUE(eventually([&] { return service.listener().threads() == 0; }));
  EXPECT_EQ(service.invalidations(), service.accepted());
}

TEST(IpcLimitTest, WithoutDescriptorsClientsAreClosedAndLaterOnesServed) {
  Service service;
  service.start();
  expectServed(service);
  EXPECT_TRUE(eventually([&] { return service.listener().threads() == 0; }));
  rlimit before{};
  getrlimit(RLIMIT_NOFILE, &before);
  // The client's own socket comes first; then the process may not open one more.
  const UniqueFd client(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  std::vector<UniqueFd> hoard;
  rlimit tight = before;
  tight.rlim_cur = openDescriptors() + 8;
  setrlimit(RLIMIT_NOFILE, &tight);
  for (UniqueFd fd(dup(0)); fd; fd = UniqueFd(dup(0))) hoard.push_back(std::move(fd));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  service.path().copy(address.sun_path, sizeof(address.sun_path) - 1);
  ASSERT_EQ(connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
  EXPECT_TRUE(isClosedByPeer(client));
  EXPECT_TRUE(eventually([&] { return service.logged("the limit of open files is reached"); }));
  hoard.clear();
  setrlimit(RLIMIT_NOFILE, &before);
  expectServed(service);
}

}  // namespace
}  // namespace tarnel

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include "ipc/server/ipc_test_support.h"

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
  // Told once of each connection.
  EXPECT_TRUE(service.logged("SetSessionInfo of pid "));
  EXPECT_FALSE(service.logged("FetchStates of pid "));
  EXPECT_EQ(service.session()->count(), 0U);
  EXPECT_NE(client.call("SetSessionInfo", "aa{sv}aa{sv}aavb", 1, 1, "k", "s", "x", 0, 0, 0), nullptr);
}

TEST(IpcLargeMessagesTest, WhatASingleMessageLeavesWithTheSessionIsBounded) {
  Service service;
  service.start();
  BusClient client(service.path());
  // As much for each of session info, user info and payload.
  const auto send = [&client](size_t sessionInfo, size_t userInfo, size_t payload) {
    const auto text = [](size_t bytes) { return std::string(bytes, 'x'); };
    return client.call("SendSingleMessage", "aa{sv}aa{sv}qqaa{sv}", 1, 1, "k", "s", text(sessionInfo).c_str(),
                       1, 1, "k", "s", text(userInfo).c_str(), 1, 2, 1, 1, "k", "s",
                       text(payload).c_str()) != nullptr;
  };
  // Beside the texts, 49 bytes are counted for each.
  EXPECT_TRUE(send(30'000, 65'536 - 98 - 30'000, 900'000)) << client.errorText;
  EXPECT_EQ(service.session()->count(), 1U);
  EXPECT_FALSE(send(30'000, 65'537 - 98 - 30'000, 1));
  EXPECT_EQ(client.errorName, wire::kErrorTooLarge);
  EXPECT_EQ(client.errorText,
            "what a session keeps may have 65536 bytes, and session info and user info take about 65537");
  EXPECT_FALSE(send(1'000'000, 1, 1));
  EXPECT_FALSE(send(1, 1'000'000, 1));
  EXPECT_EQ(service.session()->count(), 1U);
  EXPECT_TRUE(send(1, 1, 1'000'000));
  EXPECT_EQ(service.log().startingWith("IpcConnection: SendSingleMessage of ").size(), 1U);
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

// The first large call of one kind hangs until it is told to go on.
class HangingCallTest : public ::testing::Test {
 protected:
  void TearDown() override { goOn(); }
  Service& make(const IpcLimits& limits) {
    service_ = std::make_unique<Service>(limits);
    return *service_;
  }
  void hangIn(const std::string& operation) {
    service_->prepare = [this, operation](RecordingSession& session) {
      session.onCall = [this, operation](const std::string& call) {
        if (!call.starts_with(operation) || isHanging_.exchange(true)) return;
        begun_.set_value();
        mayReturn_.get_future().wait();
      };
    };
    service_->start();
    stuck_ = std::make_unique<BusClient>(service_->path());
  }
  template <class... Arguments>
  void post(const char* member, const char* signature, Arguments... arguments) {
    auto call = stuck_->newCall(member);
    ASSERT_GE(sd_bus_message_append(call.get(), signature, arguments...), 0);
    ASSERT_GE(stuck_->post(call), 0);
    ASSERT_GE(sd_bus_flush(stuck_->bus()), 0);
    begun_.get_future().wait();
  }
  void goOn() {
    if (isHanging_ && !std::exchange(isTold_, true)) mayReturn_.set_value();
  }
  BusMessage upload(BusClient& client) { return client.call("UploadLogData", "av", 1, "s", text.c_str()); }
  BusMessage sendMessage(BusClient& client) {
    return client.call("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str());
  }
  BusMessage sendSingle(BusClient& client) {
    return client.call("SendSingleMessage", "aa{sv}aa{sv}qqaa{sv}", 0, 0, 1, 2, 1, 1, "k", "s", text.c_str());
  }
  size_t refusalsLogged() const {
    size_t count = 0;
    for (const auto& line : service_->log().lines()) {
      if (line.text.find(
              "found no room among the large calls of its user: at most 100000 bytes are under way") !=
          std::string::npos) {
        ++count;
      }
    }
    return count;
  }
  static IpcLimits limits() {
    IpcLimits limits;
    limits.largeBytesAtWork = 100'000;
    return limits;
  }

  const std::string text = std::string(kLargeText, 'x');

 private:
  std::atomic<bool> isHanging_{false};
  bool isTold_ = false;
  std::promise<void> begun_;
  std::promise<void> mayReturn_;
  std::unique_ptr<Service> service_;
  std::unique_ptr<BusClient> stuck_;
};

constexpr char kNoRoom[] =
    "the large calls of this user that are under way leave no room for more; try again later";

TEST_F(HangingCallTest, LogDataBehindAServerThatHangsIsRefusedInTheEnd) {
  auto limits = HangingCallTest::limits();
  limits.waitForUploads = std::chrono::milliseconds(20);
  Service& service = make(limits);
  hangIn("uploadLogData");
  post("UploadLogData", "av", 1, "s", text.c_str());
  BusClient other(service.path());
  // Twice, and told once. Another call that may wait for a server is one of them.
  EXPECT_EQ(upload(other), nullptr);
  EXPECT_EQ(other.errorText, kNoRoom);
  EXPECT_EQ(sendSingle(other), nullptr);
  EXPECT_EQ(other.errorText, kNoRoom);
  EXPECT_EQ(refusalsLogged(), 1U);
  // Messages, and small log data, do not wait for it.
  EXPECT_NE(sendMessage(other), nullptr);
  EXPECT_NE(other.call("UploadLogData", "av", 1, "s", "x"), nullptr);
  goOn();
  EXPECT_TRUE(eventually([&] { return upload(other) != nullptr; }));
}

TEST_F(HangingCallTest, MessagesBehindAnAdaptorThatHangsAreRefusedInTheEnd) {
  auto limits = HangingCallTest::limits();
  limits.waitForMessages = std::chrono::milliseconds(20);
  Service& service = make(limits);
  hangIn("send");
  post("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str());
  BusClient other(service.path());
  EXPECT_EQ(sendMessage(other), nullptr);
  EXPECT_EQ(other.errorName, wire::kErrorFailed);
  EXPECT_EQ(other.errorText, kNoRoom);
  // By its name only: the library reads this one.
  EXPECT_EQ(other.call("FlushMessages", "s", text.c_str()), nullptr);
  EXPECT_EQ(other.errorText, kNoRoom);
  EXPECT_EQ(refusalsLogged(), 1U);
  // What is small, and what waits for servers anyway, goes on.
  EXPECT_NE(other.call("SendMessage", "qqaa{sv}", 1, 2, 0), nullptr) << other.errorText;
  EXPECT_NE(upload(other), nullptr);
  EXPECT_NE(sendSingle(other), nullptr);
  goOn();
  EXPECT_TRUE(eventually([&] { return sendMessage(other) != nullptr; }));
}

TEST_F(HangingCallTest, WhoWaitsForItsTurnDoesNotKeepTheDaemonFromEnding) {
  auto limits = HangingCallTest::limits();
  limits.waitForMessages = std::chrono::minutes(10);
  Service& service = make(limits);
  hangIn("send");
  post("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str());
  BusClient other(service.path());
  EXPECT_NE(other.call("StartConfig", ""), nullptr);
  std::thread ending([&service] { service.stop(); });
  EXPECT_EQ(sendMessage(other), nullptr);
  EXPECT_EQ(other.errorText.find("timed out"), std::string::npos) << other.errorText;
  EXPECT_EQ(service.callsLeftBehind, 0U);
  goOn();
  ending.join();
  EXPECT_EQ(service.callsLeftBehind, 0U);
}

TEST(IpcLargeMessagesTest, LargeMessagesOfManyClientsAllArriveOneAfterTheOther) {
  IpcLimits limits;
  limits.largeBytesAtWork = 1;
  Service service(limits);
  std::atomic<int> atWork{0};
  std::atomic<int> most{0};
  service.prepare = [&atWork, &most](RecordingSession& session) {
    session.onCall = [&atWork, &most](const std::string&) {
      const int now = ++atWork;
      if (now > most) most = now;
      // Long enough that others would come meanwhile.
      for (int i = 0; i < 300; ++i) std::this_thread::yield();
      --atWork;
    };
  };
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
  EXPECT_EQ(most, 1);
}

TEST(IpcLargeMessagesTest, AfterThemMemoryIsGivenBackButNotAfterEach) {
  IpcLimits limits;
  limits.largeBytesAtWork = 100'000;
  Service service(limits);
  service.start();
  BusClient client(service.path());
  const std::string text(kLargeText, 'x');
  const auto send = [&] {
    return client.call("SendMessage", "qqaa{sv}", 1, 2, 1, 1, "k", "s", text.c_str()) != nullptr;
  };
  EXPECT_TRUE(send());
  EXPECT_TRUE(send());
  EXPECT_TRUE(eventually([&] { return service.trims == 1; }));
  for (int i = 0; i < 10; ++i) EXPECT_TRUE(send());
  EXPECT_EQ(service.trims, 1U);
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

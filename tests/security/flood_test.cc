#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/resource.h>

#include <atomic>
#include <list>
#include <thread>
#include <utility>

#include "testing/private_instance.h"
#include "testing/raw_bus_client.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Clients that send without end, read nothing or come in crowds: what they make the daemon hold is bounded,
// and the others are served meanwhile.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr size_t kMiB = 1U << 20U;

// So many descriptors as the test needs at once.
void allowDescriptors(rlim_t count) {
  rlimit limit{};
  ::getrlimit(RLIMIT_NOFILE, &limit);
  if (limit.rlim_cur >= count) return;
  limit.rlim_cur = std::min(count, limit.rlim_max);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  ASSERT_GE(limit.rlim_cur, count);
}

class FloodTest : public ::testing::Test {
 protected:
  void SetUp() override {
    storebags.connect(instance);
    instance.setConsent(true);
    instance.setLogLevel("warning");
    serve(reports.url("/v1"));
  }

  void serve(const std::string& url) {
    storebags.serve("brevan", storebag("1", {{"httppost", profile({clientEntry(url, url)})}}));
  }
  void configure(const std::string& limits) {
    instance.setConfiguration("[locale]\ncountry = \"DE\"\n" + limits);
  }
  void expectMemoryBelow(size_t bytes) const {
    EXPECT_TRUE(!kMemoryIsMeasurable || instance.residentBytes() < bytes)
        << instance.residentBytes() / kMiB << " MiB of " << bytes / kMiB;
  }
  // Calls of another client are answered.
  void expectService() {
    TestSession session(instance, {});
    EXPECT_THAT(session.backends(), ElementsAre("httppost"));
    for (int i = 0; i < 20; ++i) EXPECT_TRUE(session.send(1, 2).ok());
  }

  StorebagServer storebags;
  RawHttpServer reports{RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK"); })};
  PrivateInstance instance;
};

TEST_F(FloodTest, ClientsThatNeverReadAreNotReadThemselves) {
  ASSERT_TRUE(instance.start());
  expectService();
  const size_t before = instance.residentBytes();
  constexpr size_t kFlooders = 4;
  constexpr size_t kCalls = 400'000;
  std::string calls;
  for (uint32_t serial = 1; serial <= 100; ++serial) {
    calls += bytesOf(
        {.member = "SendMessage", .signature = "qqaa{sv}", .body = messageBody(1, 2), .serial = serial});
  }
  std::atomic<size_t> held{0};
  std::atomic<bool> over{false};
  std::list<RawBusClient> clients;
  std::vector<std::thread> threads;
  for (size_t i = 0; i < kFlooders; ++i) {
    const RawBusClient& client = clients.emplace_back(instance.socketPath());
    ASSERT_TRUE(client.authenticate());
    threads.emplace_back([&client, &calls, &held, &over] {
      bool counted = false;
      for (size_t sent = 0; sent < kCalls / 100 * calls.size() && !over;) {
        const ssize_t count = client.writeSome(std::string_view(calls).substr(sent % calls.size()));
        if (count < 0) break;
        sent += static_cast<size_t>(count);
        if (count > 0) continue;
        pollfd entry{client.socket().get(), POLLOUT, 0};
        // No room for a while: the daemon reads no further.
        if (::poll(&entry, 1, 200) == 0 && !std::exchange(counted, true)) {
          ++held;
          held.notify_all();
        }
      }
      if (!counted) ++held;
      held.notify_all();
    });
  }
  for (size_t seen = 0; (seen = held) < kFlooders;) held.wait(seen);
  expectService();
  expectMemoryBelow(before + 32 * kMiB);
  over = true;
  for (auto& thread : threads) thread.join();
  clients.clear();
  expectService();
}

TEST_F(FloodTest, EventsThatAreNeverPostedAreBounded) {
  ASSERT_TRUE(instance.start());
  expectService();
  const size_t before = instance.residentBytes();
  // Undecided for want of user info, so that everything is held; every message of another method.
  TestSession session(instance, {.client = "", .service = ""});
  client::Dictionary payload;
  payload.set("text", std::string(100'000, 'x'));
  for (uint16_t method = 1; method <= 1000; ++method) {
    const auto status = session.session.sendMessage(method, 10, payload);
    if (status.code == TARNEL_ERROR_QUEUE_FULL) {
      ASSERT_TRUE(session.session.drain(kDeadline));
      ASSERT_TRUE(session.session.sendMessage(method, 10, payload));
    }
  }
  ASSERT_TRUE(session.session.drain(kDeadline));
  expectMemoryBelow(before + 48 * kMiB);
  expectService();
}

TEST_F(FloodTest, PostsToAServerThatHangsAreBounded) {
  RawHttpServer hanging([](RawConnection& connection) { connection.waitForClose(); });
  serve(hanging.url("/v1"));
  configure("[http]\nmax_queued_bytes = 4194304\n");
  ASSERT_TRUE(instance.start());
  {
    TestSession session(instance, {});
    std::string text(100'000, '\0');
    uint32_t state = 1;
    // Nothing that gzip could make small.
    for (char& letter : text)
      letter = static_cast<char>('0' + ((state = state * 1664525U + 1013904223U) >> 26U));
    const size_t before = instance.residentBytes();
    for (int i = 0; i < 500; ++i) {
      EXPECT_TRUE(session.send(1, 2, client::Dictionary().set("text", text), client::Flag::realtime).ok());
    }
    instance.waitForLog("HTTPSPostBackend(postJsonMessage): post error: ");
    expectMemoryBelow(before + 48 * kMiB);
    expectService();
  }
  instance.kill();
}

TEST_F(FloodTest, TheSixtyFifthConnectionOfAUserIsClosed) {
  ASSERT_TRUE(instance.start());
  std::list<RawBusClient> clients;
  for (int i = 0; i < 64; ++i) ASSERT_TRUE(clients.emplace_back(instance.socketPath()).authenticate()) << i;
  const RawBusClient more(instance.socketPath());
  EXPECT_TRUE(more.isClosedByDaemon());
  instance.waitForLog("<4>tarneld[");
  instance.waitForLog(
      "IpcListener: Connections closed: 1; the limit of 64 connections per user is reached by user ");
  TestSession refused(instance, {});
  EXPECT_EQ(refused.started.status.code, TARNEL_ERROR_REFUSED) << refused.started.status.message;
  // The others go on.
  ASSERT_TRUE(clients.back().write(bytesOf({.member = "FetchDisplayURL"})));
  EXPECT_THAT(clients.back().readSome(), HasSubstr("URL not available"));
  clients.clear();
  // Room is made as soon as the daemon has seen them go.
  const Deadline deadline;
  while (!TestSession(instance, {}).started.ok() && !deadline.passed()) {
  }
  expectService();
}

TEST_F(FloodTest, AThousandConnectionsAtOnceAreServed) {
  allowDescriptors(4096);
  configure("[limits]\nconnections = 1002\nconnections_per_user = 2000\n");
  ASSERT_TRUE(instance.start());
  std::list<RawBusClient> clients;
  for (int i = 0; i < 1000; ++i) ASSERT_TRUE(clients.emplace_back(instance.socketPath()).isConnected()) << i;
  for (const auto& client : clients) ASSERT_TRUE(client.authenticate());
  expectService();
  const std::string call = bytesOf({.member = "FetchDisplayURL"});
  for (const auto& client : clients) ASSERT_TRUE(client.write(call));
  for (const auto& client : clients) EXPECT_THAT(client.readSome(), HasSubstr("URL not available"));
  expectMemoryBelow(128 * kMiB);
  // Beyond the limit of all clients together.
  std::list<RawBusClient> more;
  for (int i = 0; i < 3; ++i) more.emplace_back(instance.socketPath());
  EXPECT_TRUE(more.back().isClosedByDaemon());
  instance.waitForLog("the limit of 1002 connections is reached");
  clients.clear();
  more.clear();
  const Deadline deadline;
  while (!TestSession(instance, {}).started.ok() && !deadline.passed()) {
  }
  expectService();
}

TEST_F(FloodTest, ACrowdBeyondTheLimitHarmsNobody) {
  allowDescriptors(4096);
  ASSERT_TRUE(instance.start());
  TestSession before(instance, {});
  std::list<RawBusClient> clients;
  for (int i = 0; i < 1000; ++i) clients.emplace_back(instance.socketPath());
  EXPECT_TRUE(clients.back().isClosedByDaemon());
  for (int i = 0; i < 20; ++i) EXPECT_TRUE(before.send(1, 2).ok());
  instance.waitForLog("the limit of 64 connections per user is reached by user ");
  instance.expectAlive();
}

}  // namespace
}  // namespace tarnel::test

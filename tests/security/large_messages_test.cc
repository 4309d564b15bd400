#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <vector>

#include "testing/private_instance.h"
#include "testing/raw_http_server.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Messages of the largest size whose values take many times their bytes once they are decoded.

namespace tarnel::test {
namespace {

constexpr size_t kMiB = 1U << 20U;
constexpr size_t kClients = 32;

client::Array manyValues() {
  client::Array values;
  for (int i = 0; i < 120'000; ++i) values.append(true);
  return values;
}

TEST(LargeMessagesTest, LogDataOfManyClientsForAServerThatHangsIsBounded) {
  RawHttpServer hanging([](RawConnection& connection) { connection.waitForClose(); });
  StorebagServer storebags;
  PrivateInstance instance;
  storebags.connect(instance);
  const Dictionary dashboard{{"ip", "127.0.0.1"}, {"port", 9}, {"post_url", hanging.url("/log")}};
  storebags.serve("brevan", storebag("1", {{"dashboard", dashboard}}));
  instance.setConsent(true);
  instance.setLogLevel("error");
  ASSERT_TRUE(instance.start());
  auto options = optionsFor(instance);
  options.linger = std::chrono::milliseconds(0);
  std::vector<std::unique_ptr<TestSession>> clients;
  for (uint32_t i = 0; i < kClients; ++i) {
    clients.push_back(std::make_unique<TestSession>(options, SessionSetup{.sessionID = i}));
    ASSERT_THAT(clients.back()->backends(), ::testing::ElementsAre("dashboard"));
  }
  const size_t before = instance.residentBytes();
  const client::Array values = manyValues();
  for (const auto& client : clients) ASSERT_TRUE(client->session.uploadLogData(values, nullptr));
  const Deadline deadline;
  while (hanging.connectionCount() < 4 && !deadline.passed()) std::this_thread::yield();
  EXPECT_EQ(hanging.connectionCount(), 4U);
  // Another client's messages, also large ones, are served meanwhile.
  TestSession other(instance, {.sessionID = 100});
  const std::string text(200'000, 'x');
  for (int i = 0; i < 5; ++i) EXPECT_TRUE(other.send(1, 2, client::Dictionary().set("text", text)).ok());
  EXPECT_EQ(hanging.connectionCount(), 4U);
  const size_t held = instance.residentBytes() - before;
  EXPECT_TRUE(!kMemoryIsMeasurable || held < 160 * kMiB) << held / kMiB << " MiB";
  instance.kill();
}

}  // namespace
}  // namespace tarnel::test

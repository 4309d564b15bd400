#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>

#include <chrono>
#include <map>
#include <random>
#include <thread>

#include "formats/document.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// A daemon that is killed at any instant.

namespace tarnel::test {
namespace {

// The identifiers in the daemon's own settings, by key; fails the test when the file is not whole.
std::map<std::string, std::string> identifiersOf(const PrivateInstance& instance) {
  ProcessOptions options;
  options.program = kTarnelctl;
  options.arguments = {"settings", "list", "com.orvane.tarnel", "--json"};
  options.environment = instance.environment();
  options.account = unprivilegedAccount();
  const auto listed = runProcess(options);
  EXPECT_EQ(listed.end.status, 0) << listed.errors;
  EXPECT_EQ(listed.errors, "");
  std::map<std::string, std::string> identifiers;
  const auto document = parseDocument(listed.output);
  if (!document || document->array() == nullptr) {
    ADD_FAILURE() << listed.output;
    return identifiers;
  }
  for (const Value& item : *document->array()) {
    const Dictionary& entry = *item.dictionary();
    const std::string* key = findString(entry, "key");
    const std::string* value = findString(entry, "value");
    if (key != nullptr && value != nullptr && (key->starts_with("uuid:") || key->starts_with("dnu:"))) {
      EXPECT_EQ(value->size(), 36U) << *key;
      identifiers[*key] = *value;
    }
  }
  return identifiers;
}

class KillTest : public ::testing::Test {
 protected:
  void SetUp() override {
    storebags.connect(instance);
    instance.setConsent(true);
    instance.setLogLevel("warning");
    // Every client gets an identifier of its own.
    Dictionary entry = clientEntry("http://127.0.0.1:1/", "http://127.0.0.1:1/");
    entry = with(without(without(entry, "client"), "service"), "custom_clientId", 1);
    storebags.serve("brevan", storebag("1", {{"httppost", profile({entry})}}));
  }

  // One client after the other, each with a new name, until the daemon is gone or the number is reached.
  void makeIdentifiers(int count) {
    for (int i = 0; i < count; ++i) {
      auto options = optionsFor(instance);
      options.linger = std::chrono::milliseconds(0);
      client::Session session(std::move(options));
      session.setSessionInfo(sessionInfo({}), userInfo("client" + std::to_string(next_++), "service"));
      if (!session.startConfigAndWait(kDeadline).ok()) return;
      session.sendMessage(1, 2);
    }
  }

  StorebagServer storebags;
  PrivateInstance instance;

 private:
  int next_ = 0;
};

TEST_F(KillTest, SettingsStayWholeAndIdentifiersStable) {
  constexpr int kKills = 50;
  std::minstd_rand random(20261120);
  std::map<std::string, std::string> known;
  for (int i = 0; i < kKills && !HasFailure(); ++i) {
    instance.launch();
    // Some are killed while they start, the others while identifiers are being made.
    const bool whileStarting = i % 5 == 4;
    std::thread clients;
    const auto instant = std::chrono::microseconds(random() % (whileStarting ? 30'000 : 60'000));
    if (!whileStarting) {
      ASSERT_TRUE(instance.waitUntilReady()) << instance.log();
      clients = std::thread([this] { makeIdentifiers(100); });
    }
    // No event tells the instant: any is as good.
    pollfd none{-1, 0, 0};
    timespec time{0, std::chrono::nanoseconds(instant).count()};
    ::ppoll(&none, 1, &time, nullptr);
    instance.kill();
    if (clients.joinable()) clients.join();
    if (i % 10 != 9) continue;
    auto now = identifiersOf(instance);
    for (const auto& [key, value] : known) EXPECT_EQ(now[key], value) << key << " has changed";
    EXPECT_GT(now.size(), known.size());
    known = std::move(now);
  }
  // The stale socket does not hinder the next one, which serves with the identifiers of old.
  ASSERT_TRUE(instance.start());
  makeIdentifiers(1);
  auto last = identifiersOf(instance);
  for (const auto& [key, value] : known) EXPECT_EQ(last[key], value);
  EXPECT_EQ(instance.countInLog("damaged"), 0U);
}

TEST_F(KillTest, ClientsOfAKilledDaemonAreToldAndGoOnWithTheNext) {
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  ASSERT_TRUE(session.started.ok());
  instance.kill();
  const auto lost = session.send(1, 2);
  EXPECT_FALSE(lost.ok());
  ASSERT_TRUE(instance.start());
  ASSERT_TRUE(session.session.reconnect());
  ASSERT_TRUE(session.session.setSessionInfo(sessionInfo({}), userInfo("Meetwell", "video-call")));
  EXPECT_TRUE(session.session.startConfigAndWait(kDeadline).ok());
}

}  // namespace
}  // namespace tarnel::test

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "backends/upload/upload_backend.h"
#include "ipc/server/ipc_test_support.h"
#include "platform/fake/fake_world.h"
#include "tarnel/tarnel.h"
#include "testing/waiting.h"

// Uploads from the client library through the IPC service to the upload backend, while the server that should
// answer hangs.

namespace tarnel {
namespace {

using fake::FakeHttpClient;

constexpr std::chrono::seconds kLong = test::kDeadline;

// Fails when it does not become true in time.
template <class Condition>
void waitUntil(const Condition& condition) {
  const test::Deadline deadline;
  while (!condition() && !deadline.passed()) std::this_thread::yield();
  ASSERT_TRUE(condition());
}

class HangingUploadTest : public ::testing::Test {
 protected:
  HangingUploadTest() {
    world.http.holdAnswers(true);
    service.prepare = [this](RecordingSession& session) {
      session.uploadFile = [this](const std::string& token) {
        const auto backend = UploadBackend::initWithName(
            dependencies, "uploadserver", Dictionary{{"post_url", "https://up.example/"}}, std::nullopt);
        return backend->uploadFileAtPath("/x.log", token);
      };
    };
    service.start();
  }
  ~HangingUploadTest() override {
    uploads.stop();
    service.stop();
  }

  client::Options options() const {
    client::Options options;
    options.socketPath = service.path();
    options.linger = kLong;
    return options;
  }
  std::string write(const std::string& name, size_t size = 10) const {
    std::string path = service.folder().path() + '/' + name;
    std::ofstream(path) << std::string(size, 'x');
    return path;
  }
  void waitForRequests(size_t count) const {
    waitUntil([this, count] { return world.http.pendingCount() >= count; });
  }
  static void expectThatMessagesFlow(client::Session& session) {
    for (uint16_t type = 0; type < 200; ++type) {
      EXPECT_TRUE(session.sendMessageAndWait(1, type, {}, client::Flag::normal, kLong).ok());
    }
  }
  static bool isReady(const std::future<bool>& future) {
    return future.wait_for(std::chrono::seconds(0)) == std::future_status::ready;
  }
  // Uploads it; what comes is whether it succeeded.
  static std::future<bool> upload(client::Session& session, const std::string& path) {
    const auto told = std::make_shared<std::promise<bool>>();
    EXPECT_TRUE(
        session.uploadFile(path, [told](const client::Reply& reply) { told->set_value(reply.success); }));
    return told->get_future();
  }

  fake::FakeWorld world;
  Service service;
  Uploads uploads{service.clientFiles(), {100, 100, std::chrono::hours(1)}};
  const Dependencies dependencies{.log = world.log,
                                  .clock = world.clock,
                                  .random = world.random,
                                  .http = world.http,
                                  .deviceInformation = world.deviceInformation,
                                  .settings = world.settings,
                                  .consent = world.consent,
                                  .locale = world.locale,
                                  .files = world.files,
                                  .clientBundle = world.clientBundle,
                                  .keepAlive = world.keepAlive,
                                  .codeBundles = world.codeBundles,
                                  .powerLog = world.powerLog,
                                  .consentIdentifiers = world.consentIdentifiers,
                                  .process = world.process,
                                  .uploads = uploads,
                                  .workQueues = world.workQueues,
                                  .datagramSockets = world.datagramSockets,
                                  .messageLogDirectory = ""};
};

TEST_F(HangingUploadTest, MessagesAndUploadsOfOtherSessionsGoOn) {
  const auto file = write("file");
  client::Session stuck(options());
  auto answer = upload(stuck, file);
  waitForRequests(1);
  client::Session other(options());
  expectThatMessagesFlow(other);
  const auto second = write("second");
  auto secondAnswer = upload(other, second);
  waitForRequests(2);
  client::Session third(options());
  expectThatMessagesFlow(third);
  EXPECT_FALSE(isReady(answer));
  EXPECT_FALSE(isReady(secondAnswer));
  world.http.answerOldest(FakeHttpClient::status(200, "success"));
  EXPECT_TRUE(answer.get());
  EXPECT_FALSE(std::filesystem::exists(file));
  EXPECT_FALSE(isReady(secondAnswer));
  world.http.answerOldest(FakeHttpClient::status(500, "no"));
  EXPECT_TRUE(secondAnswer.get());
  EXPECT_TRUE(std::filesystem::exists(second));
}

TEST_F(HangingUploadTest, AnUploadThatWaitsForRoomDelaysItsOwnSessionAlone) {
  client::Session first(options());
  auto firstAnswer = upload(first, write("first", 80));
  waitForRequests(1);
  client::Session second(options());
  auto secondAnswer = upload(second, write("second", 30));
  waitUntil([this] { return uploads.waiting() != 0; });
  client::Session other(options());
  expectThatMessagesFlow(other);
  EXPECT_EQ(world.http.pendingCount(), 1U);
  world.http.answerOldest(FakeHttpClient::status(200, "no"));
  EXPECT_TRUE(firstAnswer.get());
  waitForRequests(1);
  world.http.answerOldest(FakeHttpClient::status(200, "no"));
  EXPECT_TRUE(secondAnswer.get());
}

TEST_F(HangingUploadTest, ManySessionsUploadAtOnceAndNoneIsLost) {
  world.http.setAnswer(FakeHttpClient::status(200, "success"));
  world.http.holdAnswers(false);
  std::vector<std::thread> clients;
  for (int number = 0; number < 8; ++number) {
    clients.emplace_back([this, number] {
      client::Session session(options());
      for (int i = 0; i < 20; ++i) {
        const auto file = write(std::to_string(number) + '-' + std::to_string(i), 40);
        EXPECT_TRUE(session.uploadFileAndWait(file, kLong).success);
        EXPECT_FALSE(std::filesystem::exists(file));
      }
    });
  }
  for (auto& client : clients) client.join();
  EXPECT_EQ(world.http.requests().size(), 160U);
}

}  // namespace
}  // namespace tarnel

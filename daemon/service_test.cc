#include "daemon/service.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "session/fake_backends.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;

class FakeListener final : public IpcListener {
 public:
  FakeListener(Journal& journal, MaybeError failure) : journal_(journal), failure_(std::move(failure)) {}
  ~FakeListener() override {
    if (connection_ != nullptr) connection_->invalidate();
    journal_.add("end of the listener");
  }
  void setDelegate(IpcListenerDelegate* delegate) override {
    journal_.add(delegate != nullptr ? "delegate" : "no delegate");
    delegate_ = delegate;
  }
  MaybeError resume() override {
    journal_.add("resume");
    if (failure_) return failure_;
    connection_ = std::make_shared<FakeIpcConnection>();
    connection_->entitlements["com.orvane.private.tarneld"] = true;
    EXPECT_TRUE(delegate_->shouldAcceptNewConnection(*this, connection_));
    return std::nullopt;
  }

 private:
  Journal& journal_;
  const MaybeError failure_;
  IpcListenerDelegate* delegate_ = nullptr;
  std::shared_ptr<FakeIpcConnection> connection_;
};

class FakeHost final : public ServiceHost {
 public:
  void setUtilityQualityOfService() override { journal.add("utility class"); }
  Log& startLogging(const char* processName, const char* facility) override {
    journal.add(std::string("logging ") + processName + " " + facility);
    return world.log;
  }
  void prepareForConfinement() override { journal.add("prepare"); }
  std::optional<std::string> enterSandbox(const char* profileName) override {
    journal.add(std::string("sandbox ") + profileName);
    return sandboxFailure;
  }
  const Dependencies& dependencies() override { return world.dependencies; }
  std::unique_ptr<IpcListener> createListener(const char* serviceName) override {
    journal.add(std::string("listener ") + serviceName);
    return std::make_unique<FakeListener>(journal, listenerFailure);
  }
  void notifyReady() override { journal.add("ready"); }
  int runEventLoop() override {
    journal.add("loop");
    EXPECT_TRUE(
        world.log.contains(LogLevel::information, "main: Listener resumes with sandbox, start loop."));
    EXPECT_EQ(world.keepAlive.begun, 1);
    EXPECT_EQ(world.keepAlive.ended, 0);
    return loopStatus;
  }
  void finishPosts() override {
    journal.add("finish posts");
    EXPECT_EQ(world.keepAlive.begun, world.keepAlive.ended);
  }
  void stopLogging() override { journal.add("stop logging"); }

  FakeWorld world;
  Journal journal;
  std::optional<std::string> sandboxFailure;
  MaybeError listenerFailure;
  int loopStatus = 0;
};

TEST(Service, StartsAndEndsInTheFixedOrder) {
  FakeHost host;
  EXPECT_EQ(runService(host), 0);
  EXPECT_THAT(host.journal.lines(),
              ElementsAre("utility class", "logging tarneld Daemon", "prepare", "sandbox com.orvane.tarneld",
                          "listener com.orvane.tarneld", "delegate", "resume", "ready", "loop",
                          "end of the listener", "finish posts", "stop logging"));
}

TEST(Service, WithoutASandboxItEndsWithMinusOneBeforeAnythingListens) {
  FakeHost host;
  host.sandboxFailure = "there is no profile";
  EXPECT_EQ(runService(host), -1);
  EXPECT_THAT(host.journal.lines(), ElementsAre("utility class", "logging tarneld Daemon", "prepare",
                                                "sandbox com.orvane.tarneld"));
  EXPECT_THAT(
      host.world.log.lines(),
      ElementsAre(FakeLog::Line{LogLevel::error, "main: sandbox_init() fails: there is no profile\n"}));
}

TEST(Service, AServiceThatCannotBeOpenedEndsWithOneAndTheReason) {
  FakeHost host;
  host.listenerFailure = Error("IPC", 98, "/run/x: another daemon listens there");
  EXPECT_EQ(runService(host), 1);
  EXPECT_THAT(host.world.log.lines(),
              ElementsAre(FakeLog::Line{LogLevel::error,
                                        "main: the service com.orvane.tarneld cannot be opened: "
                                        "/run/x: another daemon listens there"}));
  EXPECT_THAT(host.journal.lines(), ::testing::Not(::testing::Contains("loop")));
  EXPECT_THAT(host.journal.lines(), ::testing::Not(::testing::Contains("ready")));
}

TEST(Service, SessionsEndWithTheListenerWhileTheirAgentLives) {
  FakeHost host;
  runService(host);
  EXPECT_TRUE(host.world.log.contains(LogLevel::debug, "dealloc: TarneldSession dealloc: 0"));
}

TEST(Service, AFailedLoopGivesItsStatus) {
  FakeHost host;
  host.loopStatus = 1;
  EXPECT_EQ(runService(host), 1);
}

}  // namespace
}  // namespace tarnel::fake

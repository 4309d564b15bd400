#include "backends/dashboard/dashboard_backend_fixture.h"

// From the request to clean up until nothing is left.

namespace tarnel {
namespace {

class DashboardBackendCleanupTest : public DashboardBackendFixture {
 protected:
  void expectGone(const std::weak_ptr<DashboardBackend>& backend) {
    EXPECT_TRUE(backend.expired());
    EXPECT_TRUE(nothingIsLeft());
    EXPECT_EQ(socket().closes, 1);
  }

  static constexpr char kCleanUp[] = "DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.";
  static constexpr char kLastResort[] =
      "DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 9500 ms.";
};

TEST_F(DashboardBackendCleanupTest, BackendLivesWithoutItsOwnerUntilItIsCleanedUp) {
  auto backend = make(reliableProfile());
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  tick(100);
  ASSERT_FALSE(weak.expired());
  weak.lock()->cleanup();
  world.workQueues.runUntilIdle();
  expectGone(weak);
}

TEST_F(DashboardBackendCleanupTest, ReturnsAtOnceAndCleansUpOnTheQueue) {
  const auto backend = make(reliableProfile());
  backend->cleanup();
  EXPECT_EQ(world.workQueues.timers(), 1U);
  EXPECT_EQ(socket().closes, 0);
  world.workQueues.runUntilIdle();
  EXPECT_TRUE(nothingIsLeft());
  EXPECT_EQ(backend->socketDescriptor(), -1);
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendCleanupTest, SocketIsClosedOnceWithAndWithoutReliableDelivery) {
  for (const auto& profile : {profileOf(), reliableProfile()}) {
    auto backend = make(profile);
    const std::weak_ptr<DashboardBackend> weak = backend;
    backend->cleanup();
    backend->cleanup();
    backend.reset();
    world.workQueues.runUntilIdle();
    expectGone(weak);
  }
}

TEST_F(DashboardBackendCleanupTest, WaitsForWhatIsPendingAndCleansUpAtTheTickThatFindsNothing) {
  auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  backend->cleanup();
  tick();
  expectLog(LogLevel::debug, kLastResort);
  EXPECT_EQ(world.workQueues.timers(), 1U);
  acknowledge(1);
  EXPECT_EQ(world.workQueues.timers(), 1U);  // not before the tick
  expectLog(LogLevel::debug, kCleanUp, 0);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  tick();
  expectLog(LogLevel::debug, kCleanUp);
  expectGone(weak);
}

TEST_F(DashboardBackendCleanupTest, MessageSentJustBeforeIsStillSentAndAwaited) {
  const auto backend = make(reliableProfile());
  send(*backend, 1);
  backend->cleanup();
  world.workQueues.runUntilIdle();
  EXPECT_EQ(sentCount(), 1U);
  EXPECT_EQ(world.workQueues.timers(), 1U);
  tick(2);
  EXPECT_EQ(sentCount(), 2U);
}

TEST_F(DashboardBackendCleanupTest, UnreliableDatagramThatGoesOutAtATickEndsIt) {
  const auto backend = make(profileOf());
  failSends(2);
  sendNow(*backend, 1);
  backend->cleanup();
  tick();
  expectLog(LogLevel::debug, kLastResort);
  tick();
  EXPECT_EQ(sentCount(), 1U);
  expectLog(LogLevel::debug, kCleanUp);
  EXPECT_TRUE(nothingIsLeft());
}

TEST_F(DashboardBackendCleanupTest, LastResortComes9500MillisecondsAfterTheFirstTick) {
  auto backend = make(profileOf());
  socket().sendResults.assign(1000, -1);  // never goes out
  sendNow(*backend, 1);
  backend->cleanup();
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  world.workQueues.advance(milliseconds(500));
  expectLog(LogLevel::debug, kLastResort);
  world.workQueues.advance(milliseconds(9499));
  EXPECT_EQ(world.workQueues.timers(), 1U);
  EXPECT_FALSE(weak.expired());
  world.workQueues.advance(milliseconds(1));
  expectGone(weak);
  expectLog(LogLevel::debug, kLastResort);
  expectLog(LogLevel::debug, kCleanUp, 0);
  EXPECT_EQ(socket().sends, 20);
}

TEST_F(DashboardBackendCleanupTest, UnacknowledgedDatagramsAreRetransmittedUntilTheLastResort) {
  auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  backend->cleanup();
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  tick(19);
  EXPECT_EQ(sentCount(), 5U);
  EXPECT_FALSE(weak.expired());
  tick();
  expectGone(weak);
}

TEST_F(DashboardBackendCleanupTest, LastResortThatComesLateFindsNothingToDo) {
  auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  backend->cleanup();
  tick();
  EXPECT_EQ(world.workQueues.delayedTasks(), 1U);
  acknowledge(1);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  tick();
  expectGone(weak);  // it keeps nobody waiting
  tick(30);
  EXPECT_EQ(world.workQueues.delayedTasks(), 0U);
  EXPECT_EQ(socket().closes, 1);
}

TEST_F(DashboardBackendCleanupTest, SecondRequestSchedulesItsOwnLastResort) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  backend->cleanup();
  tick();
  backend->cleanup();
  tick();
  expectLog(LogLevel::debug, kLastResort, 2);
  tick(30);
  EXPECT_TRUE(nothingIsLeft());
}

TEST_F(DashboardBackendCleanupTest, NothingIsSentAfterwardsAndNothingKeepsTheBackend) {
  auto backend = make(reliableProfile());
  backend->cleanup();
  world.workQueues.runUntilIdle();
  for (int i = 0; i < 100; ++i) EXPECT_TRUE(send(*backend, 1));
  world.workQueues.runUntilIdle();
  tick(5);
  EXPECT_EQ(sentCount(), 0U);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend.reset();
  expectGone(weak);
}

TEST_F(DashboardBackendCleanupTest, RunningBackendIsNotCleanedUpByAnEmptyQueue) {
  const auto backend = make(reliableProfile());
  tick(50);
  EXPECT_EQ(world.workQueues.timers(), 1U);
  EXPECT_EQ(world.workQueues.readSources(), 1U);
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendCleanupTest, TenThousandRoundsLeaveNothing) {
  for (int i = 0; i < 10000; ++i) {
    auto backend = i % 3 == 0 ? makeExplicit() : make(i % 3 == 1 ? profileOf() : reliableProfile());
    ASSERT_NE(backend, nullptr);
    if (i % 2 == 0) sendNow(*backend, 1);
    const std::weak_ptr<DashboardBackend> weak = backend;
    backend->cleanup();
    backend.reset();
    tick(21);
    ASSERT_TRUE(weak.expired()) << i;
    ASSERT_TRUE(nothingIsLeft()) << i;
    ASSERT_EQ(socket().closes, 1);
    ASSERT_EQ(world.workQueues.readyTasks() + world.workQueues.delayedTasks(), 0U);
    world.datagramSockets.records.clear();
    world.log.clear();
  }
}

}  // namespace
}  // namespace tarnel

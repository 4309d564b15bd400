#include <sys/resource.h>

#include <filesystem>
#include <future>
#include <iterator>

#include "backends/dashboard/dashboard_backend_fixture.h"
#include "platform/linux/queues/asio_work_queues.h"
#include "platform/linux/queues/udp_sockets.h"
#include "testing/waiting.h"

// What backends take from the system, and that they give it back. With the real queues and sockets.

namespace tarnel {
namespace {

size_t descriptors() {
  return static_cast<size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                                           std::filesystem::directory_iterator()));
}

// Queues that make no timers.
class TimerlessQueues final : public WorkQueues {
 public:
  explicit TimerlessQueues(WorkQueues& queues) : queues_(queues) {}
  std::shared_ptr<WorkQueue> makeQueue(std::string label) override {
    return std::make_shared<Queue>(queues_.makeQueue(std::move(label)));
  }

 private:
  class Queue final : public WorkQueue {
   public:
    explicit Queue(std::shared_ptr<WorkQueue> queue) : queue_(std::move(queue)) {}
    void async(Task task) override { queue_->async(std::move(task)); }
    void after(std::chrono::nanoseconds delay, Task task) override { queue_->after(delay, std::move(task)); }
    std::unique_ptr<EventSource> makeTimer(std::chrono::nanoseconds /*period*/,
                                           std::chrono::nanoseconds /*leeway*/) override {
      return nullptr;
    }
    std::unique_ptr<EventSource> makeReadSource(int descriptor) override {
      return queue_->makeReadSource(descriptor);
    }

   private:
    std::shared_ptr<WorkQueue> queue_;
  };
  WorkQueues& queues_;
};

class DashboardBackendResourcesTest : public DashboardBackendFixture {
 protected:
  DashboardBackendResourcesTest() {
    world.workQueues.real = &queues;
    world.datagramSockets.real = &sockets;
    settle();  // the thread and its descriptors stay
    before = descriptors();
  }

  static Dictionary loopbackProfile() { return profileOf({{"ip", "127.0.0.1"}}); }
  static Dictionary reliableLoopbackProfile() { return profileOf({{"ip", "127.0.0.1"}, {"reliable", 5}}); }
  // An address to which a socket may not connect.
  static Dictionary refusedProfile(std::vector<Dictionary::Entry> more = {}) {
    more.emplace_back("ip", "255.255.255.255");
    return profileOf(std::move(more));
  }

  // Returns once all that was handed over has run, and what that handed over in turn.
  void settle() {
    for (int i = 0; i < 3; ++i) {
      std::promise<void> done;
      queue->async([&done] { done.set_value(); });
      ASSERT_EQ(done.get_future().wait_for(test::kDeadline), std::future_status::ready);
    }
  }
  void expectFailure(const std::shared_ptr<DashboardBackend>& backend, const std::string& text) {
    EXPECT_EQ(backend, nullptr);
    expectLog(LogLevel::error, text);
    settle();
    EXPECT_EQ(descriptors(), before);
    EXPECT_EQ(queues.sourcesUnderWay(), 0U);
  }

  AsioWorkQueues queues{world.log};
  UdpSockets sockets;
  std::shared_ptr<WorkQueue> queue = queues.makeQueue("com.example.test");
  size_t before = 0;
};

TEST_F(DashboardBackendResourcesTest, BackendTakesOneDescriptorAndTwoSources) {
  const auto backend = make(reliableLoopbackProfile());
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(descriptors(), before + 1);
  EXPECT_EQ(queues.sourcesUnderWay(), 2U);
  backend->cleanup();
  settle();
  EXPECT_EQ(descriptors(), before);
  EXPECT_EQ(queues.sourcesUnderWay(), 0U);
}

TEST_F(DashboardBackendResourcesTest, FailedConnectionGivesEverythingBack) {
  const std::string text = "DashboardBackend(initWithName): socket connect() failed.";
  expectFailure(make(refusedProfile()), text);
  world.log.clear();
  expectFailure(make(refusedProfile({{"reliable", 5}})), text);
  world.log.clear();
  expectFailure(make(profileOf({{"ip", "no.address.example"}})), text);
  world.log.clear();
  expectFailure(DashboardBackend::initWithName(world.dependencies, "dashboard",
                                               MaybeString("255.255.255.255"), uint16_t{9}, "Slate"),
                text);
}

TEST_F(DashboardBackendResourcesTest, MissingServerGivesEverythingBack) {
  expectFailure(make(Dictionary()), "DashboardBackend(initWithName): can't resolve server IP");
  expectFailure(make(Dictionary{{"ip", "127.0.0.1"}}),
                "DashboardBackend(initWithName): can't resolve server port");
  expectFailure(make(std::nullopt), "DashboardBackend(initWithName): initWitName with all null params.");
}

TEST_F(DashboardBackendResourcesTest, MissingTimerGivesEverythingBack) {
  TimerlessQueues timerless(queues);
  world.workQueues.real = &timerless;
  const std::string text = "DashboardBackend(initWithName): can't create timer source.";
  expectFailure(make(loopbackProfile()), text);
  world.log.clear();
  expectFailure(make(reliableLoopbackProfile()), text);
}

TEST_F(DashboardBackendResourcesTest, MissingQueueGivesEverythingBack) {
  world.workQueues.refuseQueues = true;
  expectFailure(make(reliableLoopbackProfile()), "DashboardBackend(initWithName): can't create work queue.");
}

TEST_F(DashboardBackendResourcesTest, NoDescriptorLeft) {
  rlimit limit{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit none{3, limit.rlim_max};  // only the standard streams
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto backend = make(reliableLoopbackProfile());
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  expectFailure(backend, "DashboardBackend(initWithName): socket() failed (24)");
}

TEST_F(DashboardBackendResourcesTest, TenThousandRoundsLeaveNothing) {
  constexpr int kAtOnce = 100;
  std::vector<std::weak_ptr<DashboardBackend>> gone;
  for (int round = 0; round < 10000 / kAtOnce; ++round) {
    std::vector<std::shared_ptr<DashboardBackend>> backends;
    for (int i = 0; i < kAtOnce; ++i) {
      backends.push_back(make(i % 2 == 0 ? loopbackProfile() : reliableLoopbackProfile()));
      ASSERT_NE(backends.back(), nullptr);
      gone.push_back(backends.back());
    }
    for (const auto& backend : backends) backend->cleanup();
    backends.clear();
    settle();
    ASSERT_EQ(descriptors(), before);
    ASSERT_EQ(queues.sourcesUnderWay(), 0U);
  }
  for (const auto& backend : gone) ASSERT_TRUE(backend.expired());
}

TEST_F(DashboardBackendResourcesTest, BackendsThatAreStillThereGoWithTheQueues) {
  std::weak_ptr<DashboardBackend> weak;
  {
    AsioWorkQueues ending(world.log);
    world.workQueues.real = &ending;
    auto backend = make(reliableLoopbackProfile());
    weak = backend;
    for (uint16_t event = 0; event < 50; ++event) send(*backend, event);
    backend->cleanup();
  }
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(descriptors(), before);
}

}  // namespace
}  // namespace tarnel

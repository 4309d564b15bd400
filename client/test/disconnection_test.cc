#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <future>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "client/test/test_daemon.h"
#include "tarnel/tarnel.h"

// No daemon, a daemon that refuses, dies, or sits still.

namespace tarnel::client {
namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;

constexpr auto kLong = 30s;

// Collects the disconnections of a session.
class Watch {
 public:
  void attach(Options& options) {
    options.onInterruption = [this](const Disconnection& d) { add("interrupted", d); };
    options.onInvalidation = [this](const Disconnection& d) { add("invalidated", d); };
  }
  struct Seen {
    std::string kind;
    Disconnection disconnection;
  };
  std::vector<Seen> waitFor(size_t count) {
    std::unique_lock lock(mutex_);
    EXPECT_TRUE(changed_.wait_for(lock, kLong, [this, count] { return seen_.size() >= count; }));
    return seen_;
  }

 private:
  void add(std::string kind, const Disconnection& disconnection) {
    const std::lock_guard lock(mutex_);
    seen_.push_back({std::move(kind), disconnection});
    changed_.notify_all();
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Seen> seen_;
};

class DisconnectionTest : public ::testing::Test {
 protected:
  Options options() {
    Options options;
    options.socketPath = path_;
    watch_.attach(options);
    return options;
  }

  test::ScratchFolder folder_;
  const std::string path_ = folder_.file("socket");
  Watch watch_;
};

TEST_F(DisconnectionTest, AMissingDaemonIsToldWithItsRemedy) {
  const std::string expected = "no daemon is listening at " + path_ +
                               ": start the daemon of that instance, or name another socket (TARNEL_SOCKET)";
  Session session(options());
  const auto seen = watch_.waitFor(1);
  EXPECT_EQ(seen[0].kind, "interrupted");
  EXPECT_EQ(seen[0].disconnection.why.code, TARNEL_ERROR_NO_DAEMON);
  EXPECT_EQ(seen[0].disconnection.why.message, expected);
  EXPECT_EQ(session.state(), State::interrupted);
  const auto sent = session.sendMessage(1, 1);
  EXPECT_EQ(sent.code, TARNEL_ERROR_NO_DAEMON);
  EXPECT_EQ(sent.message, expected);
  EXPECT_EQ(session.startConfigAndWait(kLong).status.message, expected);
}

TEST_F(DisconnectionTest, ASocketThatADeadDaemonLeftIsTheSame) {
  { test::TestDaemon daemon(path_); }
  Session session(options());
  EXPECT_EQ(watch_.waitFor(1)[0].disconnection.why.code, TARNEL_ERROR_NO_DAEMON);
}

TEST_F(DisconnectionTest, TheEnvironmentNamesTheSocket) {
  test::TestDaemon daemon(path_);
  ASSERT_EQ(::setenv("TARNEL_SOCKET", path_.c_str(), 1), 0);
  Session session;
  ::unsetenv("TARNEL_SOCKET");
  EXPECT_TRUE(session.startConfigAndWait(kLong).ok());
}

TEST_F(DisconnectionTest, AProcessWithoutTheEntitlementIsToldSo) {
  test::TestDaemon daemon(path_);
  daemon.closesAtOnce = true;
  Session session(options());
  const auto seen = watch_.waitFor(1);
  EXPECT_EQ(seen[0].kind, "invalidated");
  EXPECT_EQ(seen[0].disconnection.why.code, TARNEL_ERROR_REFUSED);
  EXPECT_THAT(seen[0].disconnection.why.message,
              HasSubstr("the daemon closed the connection: this process lacks the entitlement "
                        "com.orvane.private.tarneld"));
  EXPECT_THAT(seen[0].disconnection.why.message, HasSubstr("tarneld.conf(5)"));
  EXPECT_EQ(session.state(), State::invalidated);
  EXPECT_EQ(session.sendMessage(1, 1).code, TARNEL_ERROR_REFUSED);

  daemon.closesAtOnce = false;
  EXPECT_TRUE(session.reconnect());
  EXPECT_TRUE(session.startConfigAndWait(kLong).ok());
}

TEST_F(DisconnectionTest, ADaemonThatDoesNotTakeTheConnectionIsNotWaitedForForEver) {
  test::TestDaemon daemon(path_);
  daemon.stopsAccepting = true;
  daemon.nudge();
  auto impatient = options();
  impatient.connectTimeout = 30ms;
  Session session(std::move(impatient));
  const auto seen = watch_.waitFor(1);
  EXPECT_EQ(seen[0].kind, "interrupted");
  EXPECT_EQ(seen[0].disconnection.why.code, TARNEL_ERROR_TIMED_OUT);
}

TEST_F(DisconnectionTest, EverythingUnderWayIsToldOnceWhenTheDaemonDies) {
  test::TestDaemon daemon(path_);
  daemon.isSilent = true;
  auto few = options();
  few.maxUnanswered = 4;
  Session session(std::move(few));
  std::vector<int> order;
  std::vector<Status> statuses;
  for (int i = 0; i < 20; ++i) {
    ASSERT_TRUE(session.sendMessage(1, 1, {}, Flag::normal, [&order, &statuses, i](const Reply& reply) {
      order.push_back(i);
      statuses.push_back(reply.status);
    }));
  }
  ASSERT_TRUE(session.sendMessage(2, 2));  // nobody is told of this one, but counted it is
  daemon.waitFor(4);
  daemon.dropConnections();

  const auto seen = watch_.waitFor(1);
  EXPECT_EQ(seen[0].kind, "interrupted");
  EXPECT_EQ(seen[0].disconnection.why.code, TARNEL_ERROR_INTERRUPTED);
  EXPECT_EQ(seen[0].disconnection.lostCalls, 1U);
  ASSERT_EQ(order.size(), 20U);
  for (int i = 0; i < 20; ++i) EXPECT_EQ(order[static_cast<size_t>(i)], i);
  for (const Status& status : statuses) EXPECT_EQ(status.code, TARNEL_ERROR_INTERRUPTED);
  EXPECT_EQ(statuses.front().message, "the connection to the daemon was lost before it answered");
  EXPECT_EQ(statuses.back().message, "the connection to the daemon was lost before this was sent");
  EXPECT_EQ(session.sendMessage(1, 1).message,
            "the connection to the daemon was lost: reconnect and configure the session again");
}

TEST_F(DisconnectionTest, AWaitingCallerHearsOfTheDeath) {
  test::TestDaemon daemon(path_);
  daemon.isSilent = true;
  Session session(options());
  auto waiting = std::async(std::launch::async, [&session] { return session.flushAndWait(kLong); });
  daemon.waitFor(1);
  daemon.die();
  EXPECT_EQ(waiting.get().status.code, TARNEL_ERROR_INTERRUPTED);
}

TEST_F(DisconnectionTest, ReconnectsOnlyWhenAsked) {
  std::optional<test::TestDaemon> daemon(path_);
  Session session(options());
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  EXPECT_TRUE(session.reconnect());  // nothing to do
  daemon.reset();
  watch_.waitFor(1);
  daemon.emplace(path_);
  EXPECT_EQ(session.sendMessage(1, 1).code, TARNEL_ERROR_INTERRUPTED);
  ASSERT_TRUE(session.reconnect());
  ASSERT_TRUE(session.sendMessage(5, 5));
  EXPECT_EQ(daemon->waitFor(1)[0].category, 5);
  EXPECT_EQ(session.state(), State::connected);
}

TEST_F(DisconnectionTest, MayReconnectFromTheHandler) {
  auto again = options();
  std::promise<void> done;
  Session* reached = nullptr;
  std::promise<void> isSet;
  auto ready = isSet.get_future().share();
  int times = 0;
  again.onInterruption = [&reached, &done, &times, ready](const Disconnection&) {
    ready.wait();
    if (++times == 5) {
      done.set_value();
    } else {
      EXPECT_TRUE(reached->reconnect());
    }
  };
  Session session(std::move(again));
  reached = &session;
  isSet.set_value();
  done.get_future().wait();
}

TEST_F(DisconnectionTest, WritingToALostConnectionRaisesNoSignal) {
  std::signal(SIGPIPE, SIG_DFL);
  test::TestDaemon daemon(path_);
  daemon.stopsReading = true;
  Session session(options());
  const auto payload = Dictionary().set("s", std::string(100'000, 'x'));
  for (int i = 0; i < 50; ++i) ASSERT_TRUE(session.sendMessage(1, 1, payload));
  daemon.dropConnections();
  watch_.waitFor(1);
}

TEST_F(DisconnectionTest, ADaemonThatReadsNothingHoldsUpNobodyForEver) {
  test::TestDaemon daemon(path_);
  auto brief = options();
  brief.linger = 20ms;
  std::atomic<int> told{0};
  {
    Session session(std::move(brief));
    ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
    daemon.stopsReading = true;
    daemon.nudge();
    const auto payload = Dictionary().set("s", std::string(100'000, 'x'));
    for (int i = 0; i < 50; ++i) {
      ASSERT_TRUE(session.sendMessage(1, 1, payload, Flag::normal, [&told](const Reply& reply) {
        EXPECT_EQ(reply.status.code, TARNEL_ERROR_CLOSED);
        ++told;
      }));
    }
  }
  EXPECT_EQ(told, 50);
  daemon.stopsReading = false;
  daemon.nudge();
}

}  // namespace
}  // namespace tarnel::client

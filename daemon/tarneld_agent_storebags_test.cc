#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "daemon/test_agent_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::IsEmpty;

class AgentStorebags : public AgentTest {
 protected:
  Client client(int clientType, int number = 7) {
    Client made = connect();
    made.session->setSessionInfo(info(number, clientType), std::nullopt, std::nullopt, false);
    return made;
  }
  std::optional<Dictionary> ask(int clientType) {
    return agent->storebagForSession(*client(clientType).session);
  }
  MaybeString version(int clientType) {
    return agent->storebagVersionForSession(*client(clientType).session);
  }
  StorebagCacheEntry entry(const std::string& name = "brevan") { return agent->cachedStorebags().at(name); }

  void fetchSucceeds(int32_t maxAge, const std::string& data, const std::string& withVersion = "1",
                     const MaybeString& lastModified = std::nullopt) {
    fetch = [maxAge, data, withVersion, lastModified](int32_t /*clientType*/,
                                                      StorebagFetchSlots slots) -> std::optional<Dictionary> {
      slots.maxAge = maxAge;
      slots.version = withVersion;
      if (lastModified) *slots.lastModified = lastModified;
      return Dictionary{{"data", data}};
    };
  }
  void fetchFails() {
    fetch = [](int32_t /*clientType*/, StorebagFetchSlots /*slots*/) -> std::optional<Dictionary> {
      return std::nullopt;
    };
  }
  void fetchIsNotModified(int32_t maxAge) {
    fetch = [maxAge](int32_t /*clientType*/, StorebagFetchSlots slots) -> std::optional<Dictionary> {
      slots.maxAge = maxAge;
      slots.notModified = true;
      return std::nullopt;
    };
  }
  static std::optional<Dictionary> holding(const std::string& data) { return Dictionary{{"data", data}}; }
  Date now() { return {secondsFromTimeValue(world.clock.timeOfDay())}; }
};

constexpr char kWait[] =
    "storebagForSession: Not fetching storebag for client type 8 - must wait 900 seconds between attempts";
constexpr char kCached[] = "storebagForSession: Cached storebag found for client type 8";

TEST_F(AgentStorebags, FirstLookupFetchesAndFillsTheEntry) {
  fetchSucceeds(3600, "one", "2.1", "Mon, 05 Jan 2026 10:00:00 GMT");
  EXPECT_EQ(ask(8), holding("one"));
  EXPECT_EQ(fetches, 1);
  EXPECT_TRUE(
      logged(LogLevel::debug, "storebagForSession: Retrieving storebag for session 7 with client type 8"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Fetching storebag for client type 8"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Storebag max age: 3600 seconds"));
  EXPECT_EQ(entry().StorebagData, holding("one"));
  EXPECT_EQ(entry().StorebagVersion, "2.1");
  EXPECT_EQ(entry().StorebagLastModified, "Mon, 05 Jan 2026 10:00:00 GMT");
  EXPECT_EQ(entry().StorebagFetchTime, now());
  EXPECT_EQ(entry().StorebagFetchState, "Fetch Successful");
  EXPECT_EQ(entry().StorebagMaxAge, 3600);
  EXPECT_EQ(version(8), "2.1");
}

TEST_F(AgentStorebags, SuccessIsServedWhileYoungerThanItsMaximumAge) {
  fetchSucceeds(3600, "one");
  ask(8);
  fetchSucceeds(3600, "two");
  world.clock.advance(3599.999);
  EXPECT_EQ(ask(8), holding("one"));
  EXPECT_TRUE(logged(LogLevel::debug, kCached));
  EXPECT_EQ(fetches, 1);
  world.clock.advance(0.001);  // exactly the maximum age: no longer younger
  EXPECT_EQ(ask(8), holding("two"));
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, LookupHoldsTheAgentsLockForTheFetchAndGivesItBack) {
  bool isLocked = false;
  fetch = [this, &isLocked](int32_t /*clientType*/,
                            StorebagFetchSlots /*slots*/) -> std::optional<Dictionary> {
    isLocked = !isFree(agent->agentLock());
    return std::nullopt;
  };
  ask(8);
  EXPECT_TRUE(isLocked);
  EXPECT_TRUE(isFree(agent->agentLock()));
}

TEST_F(AgentStorebags, ExpiredSuccessIsRefetchedWithoutWaiting) {
  fetchSucceeds(10, "one");
  ask(8);
  world.clock.advance(11);
  fetchSucceeds(10, "two", "2");
  EXPECT_EQ(ask(8), holding("two"));
  EXPECT_EQ(version(8), "2");
  EXPECT_FALSE(logged(LogLevel::information, kWait));
}

TEST_F(AgentStorebags, ClockSetBackCountsByMagnitude) {
  fetchSucceeds(3600, "one");
  ask(8);
  world.clock.advance(-3599);
  ask(8);
  EXPECT_EQ(fetches, 1);
  world.clock.advance(-1);
  ask(8);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, MaximumAgeZeroRefetchesEveryTime) {
  fetchSucceeds(0, "one");
  ask(8);
  ask(8);
  ask(8);
  EXPECT_EQ(fetches, 3);
}

TEST_F(AgentStorebags, NegativeMaximumAgeRefetchesEveryTime) {
  fetchSucceeds(-5, "one");
  ask(8);
  ask(8);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, FailureIsNotRetriedFor900Seconds) {
  fetchFails();
  EXPECT_FALSE(ask(8));
  EXPECT_TRUE(logged(LogLevel::error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 8"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Storebag max age: 0 seconds"));
  EXPECT_EQ(entry().StorebagFetchState, "Fetch Failure");
  EXPECT_EQ(entry().StorebagFetchTime, now());
  EXPECT_FALSE(entry().StorebagVersion);
  world.clock.advance(899.999);
  EXPECT_FALSE(ask(8));
  EXPECT_TRUE(logged(LogLevel::information, kWait));
  EXPECT_EQ(fetches, 1);
  world.clock.advance(0.001);
  fetchSucceeds(60, "late");
  EXPECT_EQ(ask(8), holding("late"));
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, EveryAttemptBeginsTheWaitAnew) {
  fetchFails();
  ask(8);
  world.clock.advance(900);
  ask(8);
  world.clock.advance(899);
  ask(8);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, LastGoodDataIsServedWhileAFailureWaits) {
  fetchSucceeds(10, "good", "1.0", "Monday");
  ask(8);
  world.clock.advance(10);
  fetchFails();
  EXPECT_EQ(ask(8), holding("good"));
  EXPECT_EQ(entry().StorebagFetchState, "Fetch Failure");
  EXPECT_EQ(entry().StorebagLastModified, "Monday");
  world.clock.advance(500);
  EXPECT_EQ(ask(8), holding("good"));
  EXPECT_EQ(version(8), "1.0");
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, MaximumAgeOfAFailedFetchDecidesNothing) {
  fetch = [](int32_t /*clientType*/, StorebagFetchSlots slots) -> std::optional<Dictionary> {
    slots.maxAge = 86400;
    return std::nullopt;
  };
  ask(8);
  EXPECT_EQ(entry().StorebagMaxAge, 86400);
  world.clock.advance(900);
  ask(8);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, NotModifiedStaysSuccessfulAndRenewsTimeAndAge) {
  fetchSucceeds(10, "good", "1.0", "Monday");
  ask(8);
  world.clock.advance(11);
  fetchIsNotModified(86400);
  EXPECT_EQ(ask(8), holding("good"));
  EXPECT_EQ(entry().StorebagFetchState, "Fetch Successful");
  EXPECT_EQ(entry().StorebagFetchTime, now());
  EXPECT_EQ(entry().StorebagMaxAge, 86400);
  EXPECT_EQ(entry().StorebagVersion, "1.0");
  EXPECT_EQ(entry().StorebagLastModified, "Monday");
  EXPECT_TRUE(world.log.startingWith("fetchAndCacheStorebag: Unable").empty());
  world.clock.advance(86399);
  ask(8);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, LastModifiedIsHandedToTheNextFetch) {
  fetchSucceeds(0, "one", "1", "Monday");
  ask(8);
  MaybeString seen;
  fetch = [&seen](int32_t /*clientType*/, StorebagFetchSlots slots) -> std::optional<Dictionary> {
    seen = *slots.lastModified;
    *slots.lastModified = "Tuesday";
    return std::nullopt;
  };
  ask(8);
  EXPECT_EQ(seen, "Monday");
  EXPECT_EQ(entry().StorebagLastModified, "Tuesday");  // also after a failure
}

TEST_F(AgentStorebags, ClientTypesOfOneNameShareOneEntryAndOneFetch) {
  for (const int clientType : {7, 11, 13}) EXPECT_TRUE(ask(clientType));
  EXPECT_EQ(fetches, 1);
  EXPECT_EQ(agent->cachedStorebags().size(), 1U);
  EXPECT_EQ(entry("calvisto").StorebagVersion, "5.1");
  ask(6);
  EXPECT_EQ(fetches, 2);
}

TEST_F(AgentStorebags, VersionNeverFetches) {
  EXPECT_FALSE(version(8));
  EXPECT_FALSE(version(2));
  EXPECT_EQ(fetches, 0);
  EXPECT_THAT(agent->cachedStorebags(), IsEmpty());
}

TEST_F(AgentStorebags, ClientTypeWithoutANameFailsBeforeAnyFetchAndLeavesNothingBehind) {
  for (const int clientType : {0, 1, 2, 3, 4, -1, 18}) {
    EXPECT_THROW(ask(clientType), InvalidArgument) << clientType;
  }
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Fetching storebag for client type 18"));
  EXPECT_EQ(fetches, 0);
  EXPECT_THAT(agent->cachedStorebags(), IsEmpty());
  // The lock is free for others, and the next session works.
  std::thread([this] { EXPECT_TRUE(ask(8)); }).join();
}

TEST_F(AgentStorebags, SessionWithoutSessionInfoIsOfClientTypeZero) {
  const Client made = connect();
  EXPECT_THROW(made.session->startConfigWithCompletionHandler(nullptr), InvalidArgument);
}

TEST_F(AgentStorebags, ClientTypeIsReadAsAnInteger) {
  const Client made = connect();
  made.session->setSessionInfo(Dictionary{{kTarnelSessionInfoClientType, "8 and more"}}, std::nullopt,
                               std::nullopt, false);
  agent->storebagForSession(*made.session);
  EXPECT_TRUE(agent->cachedStorebags().contains("brevan"));
}

TEST_F(AgentStorebags, FetchThatUnwindsCountsAsAFailedAttempt) {
  fetch = [](int32_t /*clientType*/, StorebagFetchSlots /*slots*/) -> std::optional<Dictionary> {
    throw InvalidArgument("the storebag has no version");
  };
  EXPECT_THROW(ask(8), InvalidArgument);
  EXPECT_EQ(entry().StorebagFetchState, "Fetch Failure");
  EXPECT_FALSE(ask(8));
  EXPECT_EQ(fetches, 1);
  world.clock.advance(900);
  fetchSucceeds(60, "fixed");
  EXPECT_EQ(ask(8), holding("fixed"));
}

}  // namespace
}  // namespace tarnel::fake

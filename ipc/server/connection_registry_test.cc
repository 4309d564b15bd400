#include "ipc/server/connection_registry.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <future>

#include "testing/failing_memory.h"

namespace tarnel {
namespace {

class ConnectionRegistryTest : public ::testing::Test {
 protected:
  std::shared_ptr<ConnectionRegistry> registry(ConnectionRegistry::CreateThread createThread) const {
    return std::make_shared<ConnectionRegistry>(
        limits, [] {}, std::move(createThread));
  }

  const IpcLimits limits;
  const std::shared_ptr<ConnectionLink> link = std::make_shared<ConnectionLink>(1000);
};

TEST_F(ConnectionRegistryTest, AThreadThatCannotBeMadeIsNotListed) {
  const auto threads =
      registry([](pthread_t*, const pthread_attr_t*, void* (*)(void*), void*) { return EAGAIN; });
  bool ran = false;
  EXPECT_EQ(threads->start(link, [&ran] { ran = true; }), EAGAIN);
  EXPECT_EQ(threads->threads(), 0U);
  EXPECT_EQ(link.use_count(), 1) << "nothing of it is kept";
  EXPECT_EQ(threads->stopAll(), 0U);
  EXPECT_FALSE(ran);
}

// Once the thread runs, what it was given must stay, whatever is short.
TEST_F(ConnectionRegistryTest, MemoryThatEndsOnceTheThreadIsMadeDoesNotMatter) {
  const auto threads =
      registry([](pthread_t* thread, const pthread_attr_t* attributes, void* (*run)(void*), void* argument) {
        const int error = pthread_create(thread, attributes, run, argument);
        test::failAllocationsFrom(0);
        return error;
      });
  std::promise<void> proceed;
  std::promise<void> ran;
  int error = -1;
  const std::function<void()> body = [&proceed, &ran] {
    proceed.get_future().wait();
    ran.set_value();
  };
  try {
    error = threads->start(link, body);
  } catch (const std::bad_alloc&) {
    error = ENOMEM;
  }
  test::failNoAllocations();
  EXPECT_EQ(error, 0);
  EXPECT_EQ(threads->threads(), 1U);
  proceed.set_value();
  ran.get_future().wait();
  EXPECT_EQ(threads->stopAll(), 0U);
  EXPECT_EQ(threads->threads(), 0U);
}

TEST_F(ConnectionRegistryTest, WithoutMemoryForTheListNoThreadIsMade) {
  bool isMade = false;
  const auto threads = registry([&isMade](pthread_t*, const pthread_attr_t*, void* (*)(void*), void*) {
    isMade = true;
    return EAGAIN;
  });
  std::function<void()> body = [] {};
  auto own = link;
  test::failAllocationsFrom(0);
  EXPECT_THROW(static_cast<void>(threads->start(std::move(own), std::move(body))), std::bad_alloc);
  test::failNoAllocations();
  EXPECT_FALSE(isMade);
  EXPECT_EQ(threads->threads(), 0U);
}

}  // namespace
}  // namespace tarnel

#include <cstdlib>
#include <new>

#include "backends/dashboard/dashboard_backend_fixture.h"

// A program of its own: it replaces the allocation of the whole program.

namespace {

thread_local size_t refusedSize = 0;  // the allocation that fails, once; 0 for none

}  // namespace

void* operator new(size_t size) {
  if (size == refusedSize) {
    refusedSize = 0;
    throw std::bad_alloc();
  }
  if (void* memory = std::malloc(size == 0 ? 1 : size)) return memory;
  throw std::bad_alloc();
}
void operator delete(void* memory) noexcept {
  std::free(memory);
}
void operator delete(void* memory, size_t /*size*/) noexcept {
  std::free(memory);
}

namespace tarnel {
namespace {

class DashboardBackendMemoryTest : public DashboardBackendFixture {};

TEST_F(DashboardBackendMemoryTest, WithoutMemoryForTheDatagramThereIsNoLineAndNothingIsSent) {
  const auto backend = make(profileOf());
  refusedSize = sizeof(DashboardBuffer);
  EXPECT_EQ(send(*backend, 1), std::nullopt);
  EXPECT_EQ(refusedSize, 0U);
  expectLog(LogLevel::error, "DashboardBackend(sendMessage): can't malloc.");
  EXPECT_EQ(world.workQueues.readyTasks(), 0U);
  EXPECT_TRUE(send(*backend, 2));  // and then again
}

}  // namespace
}  // namespace tarnel

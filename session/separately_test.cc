#include "session/separately.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <new>
#include <stdexcept>

#include "platform/fake/fake_log.h"
#include "tarnel/keys.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

TEST(Separately, AStepThatIsDoneSaysNothing) {
  FakeLog log;
  bool done = false;
  EXPECT_EQ(separately(log, "dealloc", "the last flush", [&done] { done = true; }), std::nullopt);
  EXPECT_TRUE(done);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Separately, WhatAStepThrowsIsLoggedAndReturned) {
  FakeLog log;
  EXPECT_EQ(separately(log, "dealloc", "the last flush", [] { throw std::runtime_error("no memory"); }),
            Error(kTarnelErrorDomain, -1, "no memory"));
  EXPECT_EQ(separately(log, "cleanup", "httppost", [] { throw 5; }),
            Error(kTarnelErrorDomain, -1, "unknown failure"));
  EXPECT_THAT(log.lines(),
              ElementsAre(FakeLog::Line{LogLevel::error, "dealloc: the last flush failed: no memory"},
                          FakeLog::Line{LogLevel::error, "cleanup: httppost failed: unknown failure"}));
}

TEST(Separately, ALogThatFailsKeepsNothingFromWhoeverAsks) {
  FakeLog log;
  log.whenWritten = [](std::string_view) { throw std::bad_alloc(); };
  EXPECT_EQ(separately(log, "cleanup", "httppost", [] { throw std::runtime_error("why"); }),
            Error(kTarnelErrorDomain, -1, "why"));
  separatelyNoexcept(log, "dealloc", "the last flush", [] { throw 5; });
  EXPECT_THAT(log.lines(),
              ElementsAre(FakeLog::Line{LogLevel::error, "cleanup: httppost failed: why"},
                          FakeLog::Line{LogLevel::error, "dealloc: the last flush failed: unknown failure"}));
}

TEST(Separately, WithoutExceptionsAStepIsDone) {
  FakeLog log;
  bool done = false;
  separatelyNoexcept(log, "dealloc", "the last flush", [&done] { done = true; });
  EXPECT_TRUE(done);
  EXPECT_THAT(log.lines(), IsEmpty());
}

}  // namespace
}  // namespace tarnel::fake

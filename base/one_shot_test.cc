#include "base/one_shot.h"

#include <memory>
#include <stdexcept>
#include <string>
#include <utility>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

TEST(OneShotTest, answersOnceAndIgnoresTheRest) {
  int answers = 0;
  OneShot<void(int)> reply = [&answers](int value) { answers += value; };
  EXPECT_TRUE(reply);
  reply(5);
  reply(7);
  EXPECT_EQ(answers, 5);
  EXPECT_FALSE(reply);
}

TEST(OneShotTest, mayBeEmpty) {
  OneShot<void(int)> none;
  OneShot<void(int)> null = nullptr;
  none(1);
  null(1);
  EXPECT_FALSE(none);
  EXPECT_FALSE(null);
}

TEST(OneShotTest, movesTheDutyToAnswer) {
  int answers = 0;
  OneShot<void()> first = [&answers] { ++answers; };
  OneShot<void()> second = std::move(first);
  EXPECT_TRUE(second);
  first();  // NOLINT(bugprone-use-after-move): a used one does nothing
  EXPECT_EQ(answers, 0);
  second();
  EXPECT_EQ(answers, 1);
}

TEST(OneShotTest, letsGoOfWhatItCapturedAsSoonAsTheAnswerIsGiven) {
  auto held = std::make_shared<int>(1);
  OneShot<void()> reply = [held] {};
  EXPECT_EQ(held.use_count(), 2);
  reply();
  EXPECT_EQ(held.use_count(), 1);
}

TEST(OneShotTest, letsGoOfWhatItCapturedWhenDestroyedOrReplacedUncalled) {
  auto held = std::make_shared<int>(1);
  {
    const OneShot<void()> reply = [held] {};
    EXPECT_EQ(held.use_count(), 2);
  }
  EXPECT_EQ(held.use_count(), 1);
  OneShot<void()> replaced = [held] {};
  replaced = nullptr;
  EXPECT_EQ(held.use_count(), 1);
}

TEST(OneShotTest, takesAndPassesThingsThatOnlyMove) {
  std::string seen;
  OneShot<void(std::unique_ptr<std::string>, const std::string&)> reply =
      [&seen, own = std::make_unique<std::string>("c")](std::unique_ptr<std::string> a,
                                                        const std::string& b) { seen = *a + b + *own; };
  reply(std::make_unique<std::string>("a"), "b");
  EXPECT_EQ(seen, "abc");
}

TEST(OneShotTest, isUsedWhenItIsCalledFromWithinItself) {
  int answers = 0;
  OneShot<void()> reply;
  reply = [&answers, &reply] {
    ++answers;
    reply();
  };
  reply();
  EXPECT_EQ(answers, 1);
}

TEST(OneShotTest, isUsedAlsoWhenTheAnswerThrows) {
  auto held = std::make_shared<int>(1);
  OneShot<void()> reply = [held] { throw std::runtime_error("refused"); };
  EXPECT_THROW(reply(), std::runtime_error);
  EXPECT_FALSE(reply);
  EXPECT_EQ(held.use_count(), 1);
}

}  // namespace
}  // namespace tarnel

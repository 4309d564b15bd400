#include "daemon/hierarchy_walks.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <vector>

namespace tarnel {
namespace {

using ::testing::ElementsAre;
using ::testing::Key;

// Stands at another level each time somebody looks, and where it began once it has been everywhere.
class RestlessSession {
 public:
  explicit RestlessSession(std::vector<int32_t> levels, bool hasAggregator = false)
      : levels_(std::move(levels)), hasAggregator_(hasAggregator) {}

  int32_t getSessionHierarchy() const { return levels_.at(looks_++ % levels_.size()); }
  bool hasAggregator() const { return hasAggregator_; }
  size_t looks() const { return looks_; }

 private:
  const std::vector<int32_t> levels_;
  const bool hasAggregator_;
  mutable size_t looks_ = 0;
};

using List = std::vector<std::shared_ptr<RestlessSession>>;

std::shared_ptr<RestlessSession> standing(std::vector<int32_t> levels, bool hasAggregator = false) {
  return std::make_shared<RestlessSession>(std::move(levels), hasAggregator);
}

TEST(HierarchyWalks, EverySessionButTheOwnIsLookedAtOnce) {
  const List list{standing({3, 0}), standing({1, 2}), standing({0, 5})};
  const auto first = firstOfLevelsBeside(*list[1], list);
  EXPECT_THAT(first, ElementsAre(Key(0), Key(3)));
  EXPECT_EQ(first.at(0), list[2]);
  EXPECT_EQ(list[0]->looks(), 1U);
  EXPECT_EQ(list[1]->looks(), 0U);
  EXPECT_EQ(list[2]->looks(), 1U);
}

TEST(HierarchyWalks, TheFirstOfALevelIsTheOneFiledFirst) {
  const List list{standing({7}), standing({4}), standing({4}), standing({4})};
  EXPECT_EQ(getFirstSessionWithHierarchy(4, firstOfLevelsBeside(*list[0], list)), list[1]);
  EXPECT_EQ(getFirstSessionWithHierarchy(4, firstOfLevelsBeside(*list[1], list)), list[2]);
  EXPECT_EQ(getFirstSessionWithHierarchy(5, firstOfLevelsBeside(*list[0], list)), nullptr);
}

TEST(HierarchyWalks, NobodyStandsBeyondTheNumbersOfALevel) {
  const List list{standing({0}), standing({INT32_MAX}), standing({INT32_MIN})};
  const auto first = firstOfLevelsBeside(*list[0], list);
  EXPECT_EQ(getFirstSessionWithHierarchy(INT32_MAX, first), list[1]);
  EXPECT_EQ(getFirstSessionWithHierarchy(INT32_MIN, first), list[2]);
  EXPECT_EQ(getFirstSessionWithHierarchy(int64_t{INT32_MIN} - 1, first), nullptr);
  EXPECT_EQ(getFirstSessionWithHierarchy(int64_t{INT32_MAX} + 1, first), nullptr);
}

// One that configures anew stands at its level, then at none, then at its level again.
TEST(HierarchyWalks, AnAncestorThatLeavesItsLevelBetweenTwoLooksIsFoundWhereItWasSeen) {
  const List list{standing({2}), standing({1, 0}, true), standing({0, 3})};
  EXPECT_EQ(topMostAggregator(2, firstOfLevelsBeside(*list[0], list)), list[1]);
}

TEST(HierarchyWalks, TheAggregatorIsTheTopMostFirstOfItsLevelAboveTheSession) {
  const auto aggregatorFor = [](int32_t hierarchy, const List& list) {
    return topMostAggregator(hierarchy, firstOfLevelsBeside(*list[0], list));
  };
  const auto own = standing({5}, true);
  const auto lower = standing({3}, true);
  const auto upper = standing({0}, true);
  EXPECT_EQ(aggregatorFor(5, {own, lower, upper}), upper);
  EXPECT_EQ(aggregatorFor(5, {own, lower, standing({0})}), lower);
  EXPECT_EQ(aggregatorFor(4, {own, standing({3}), lower}), nullptr);  // only the first of a level counts
  EXPECT_EQ(aggregatorFor(3, {own, lower}), nullptr);                 // its own level is not above it
  EXPECT_EQ(aggregatorFor(5, {own, standing({-1}, true)}), nullptr);
  EXPECT_EQ(aggregatorFor(INT32_MAX, {own, standing({INT32_MAX - 1}, true)})->looks(), 1U);
}

}  // namespace
}  // namespace tarnel

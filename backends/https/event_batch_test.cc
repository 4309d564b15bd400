#include "backends/https/event_batch.h"

#include <gtest/gtest.h>

#include <cmath>
#include <vector>

namespace tarnel {
namespace {

Dictionary numbered(int number) {
  return {{"n", number}};
}

TEST(EventBatchTest, GivesEventsInOrderOfArrival) {
  EventBatch batch;
  for (int i = 0; i < 3; ++i) batch.append(numbered(i), 10);
  EXPECT_EQ(batch.size(), 3U);
  const Array events = batch.takeEvents();
  EXPECT_EQ(events, (Array{numbered(0), numbered(1), numbered(2)}));
  EXPECT_EQ(batch.size(), 0U);
  EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes + 1));
}

TEST(EventBatchTest, MergesIntoEveryEvent) {
  EventBatch batch;
  batch.append({{"a", 1}}, 10);
  batch.append({{"b", 1}}, 10);
  EXPECT_EQ(batch.mergeIntoAll({{"a", 2}}), 0U);
  EXPECT_EQ(batch.takeEvents(), (Array{Dictionary{{"a", 2}}, Dictionary{{"b", 1}, {"a", 2}}}));
}

// What is merged may be much larger than the events, and comes once for each.
TEST(EventBatchTest, MergingStaysWithinTheBoundByDroppingTheOldest) {
  EventBatch batch;
  for (int i = 0; i < 100; ++i) batch.append(numbered(i), EventBatch::estimateSize(numbered(i)));
  const Dictionary quarter{{"text", std::string(EventBatch::kMaxBytes / 4, 'x')}};
  EXPECT_EQ(batch.mergeIntoAll(quarter), 97U);
  EXPECT_FALSE(batch.hasRoomFor(EventBatch::kMaxBytes / 4));
  EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes / 8));
  // Set once more, it takes no more room.
  EXPECT_EQ(batch.mergeIntoAll(quarter), 0U);
  const Array events = batch.takeEvents();
  ASSERT_EQ(events.size(), 3U);
  for (size_t i = 0; i < 3; ++i) {
    EXPECT_EQ(*events[i].dictionary()->find("n"), Value(97 + i));
    EXPECT_TRUE(events[i].dictionary()->contains("text"));
  }
}

TEST(EventBatchTest, TheNewestEventStaysWhateverIsMerged) {
  EventBatch batch;
  for (int i = 0; i < 3; ++i) batch.append(numbered(i), 10);
  EXPECT_EQ(batch.mergeIntoAll({{"text", std::string(EventBatch::kMaxBytes + 1, 'x')}}), 2U);
  const Array events = batch.takeEvents();
  ASSERT_EQ(events.size(), 1U);
  EXPECT_EQ(*events[0].dictionary()->find("n"), Value(2));
}

// Where all stay, what they take is counted as exactly as where some go.
TEST(EventBatchTest, WhatIsMergedCountsInTheBound) {
  EventBatch batch;
  const std::string text(1000, 'x');
  const std::vector<Dictionary> events{
      {{"n", 1}},
      {{"n", 2}, {"label", "short"}},
      {{"n", 3}, {"label", std::string(5000, 'y')}},
      {{"n", 4}, {"label", text}},
      {{"n", 5}, {"label", Array{text, Dictionary{{text, text}}}}, {"list", Array{text}}},
      {{"n", 6}, {"list", 1}, {"flag", 1}},
  };
  for (const auto& event : events) batch.append(event, EventBatch::estimateSize(event));
  const Dictionary fields{{"label", text}, {"list", Array{1, text, text}}, {"flag", true}, {"real", 0.5}};
  for (int times = 0; times < 2; ++times) {
    EXPECT_EQ(batch.mergeIntoAll(fields), 0U);
    size_t bytes = 0;
    for (auto event : events) {
      event.merge(fields);
      bytes += EventBatch::estimateSize(event);
    }
    EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes - bytes));
    EXPECT_FALSE(batch.hasRoomFor(EventBatch::kMaxBytes - bytes + 1));
  }
  // Each event counts for what it has become.
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes), events.size());
  batch.append(numbered(1), EventBatch::kMaxBytes);
  EXPECT_TRUE(batch.hasRoomFor(0));
  EXPECT_FALSE(batch.hasRoomFor(1));
}

TEST(EventBatchTest, MergingReplacesWhatOnlyLooksEqual) {
  EventBatch batch;
  batch.append({{"flag", 1}, {"zero", 0.0}, {"text", "same"}}, 10);
  EXPECT_EQ(batch.mergeIntoAll({{"flag", true}, {"zero", -0.0}, {"text", "same"}}), 0U);
  const Array events = batch.takeEvents();
  const Dictionary& event = *events[0].dictionary();
  EXPECT_EQ(*event.find("flag"), Value(true));
  EXPECT_TRUE(std::signbit(*event.find("zero")->real()));
  EXPECT_EQ(*event.find("text"), Value("same"));
}

TEST(EventBatchTest, BoundsBytesByDroppingTheOldest) {
  EventBatch batch;
  for (int i = 0; i < 4; ++i) batch.append(numbered(i), EventBatch::kMaxBytes / 4);
  EXPECT_FALSE(batch.hasRoomFor(1));
  EXPECT_TRUE(batch.hasRoomFor(0));
  EXPECT_EQ(batch.makeRoomFor(1), 1U);
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes / 2), 1U);
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes / 2), 0U);
  EXPECT_EQ(batch.takeEvents(), (Array{numbered(2), numbered(3)}));
}

TEST(EventBatchTest, OneEventIsHeldHoweverLarge) {
  EventBatch batch;
  batch.append(numbered(1), 10);
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes * 2), 1U);
  batch.append(numbered(2), EventBatch::kMaxBytes * 2);
  EXPECT_EQ(batch.makeRoomFor(10), 1U);
  EXPECT_EQ(batch.size(), 0U);
}

TEST(EventBatchTest, BoundsTheNumberOfEvents) {
  EventBatch batch;
  for (size_t i = 0; i < EventBatch::kMaxEvents; ++i) {
    ASSERT_TRUE(batch.hasRoomFor(1));
    batch.append({}, 1);
  }
  EXPECT_FALSE(batch.hasRoomFor(1));
  EXPECT_EQ(batch.makeRoomFor(1), 1U);
}

TEST(EventBatchTest, EstimateCountsWhatAnEventHolds) {
  const size_t small = EventBatch::estimateSize({{"n", 1}});
  EXPECT_GE(small, sizeof(Dictionary::Entry));
  const std::string text(1000, 'x');
  EXPECT_GE(EventBatch::estimateSize({{"n", text}}), small + 1000);
  EXPECT_GE(EventBatch::estimateSize({{text, 1}}), small + 999);
  EXPECT_GE(EventBatch::estimateSize({{"n", Data(1000)}}), small + 1000);
  EXPECT_GE(EventBatch::estimateSize({{"n", Array{text, Array{text}}}}), small + 2000);
  EXPECT_GE(EventBatch::estimateSize({{"n", Dictionary{{"m", text}}}}), small + 1000);
}

}  // namespace
}  // namespace tarnel

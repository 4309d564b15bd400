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
  const Array events = batch.takeEvents({});
  EXPECT_EQ(events, (Array{numbered(0), numbered(1), numbered(2)}));
  EXPECT_EQ(batch.size(), 0U);
  EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes + 1));
}

TEST(EventBatchTest, SetsFieldsInEveryEventThatIsTaken) {
  EventBatch batch;
  batch.append({{"a", 1}}, 10);
  batch.append({{"b", 1}}, 10);
  EXPECT_EQ(batch.takeEvents({.fields = {{"a", 2}}}),
            (Array{Dictionary{{"a", 2}}, Dictionary{{"b", 1}, {"a", 2}}}));
}

// What is set may be much larger than the events, and comes once for each. None is lost, and never are there
// more bytes at a time than a batch holds.
TEST(EventBatchTest, EventsThatOutgrowTheBoundAreTakenInSeveralPieces) {
  EventBatch batch;
  for (int i = 0; i < 100; ++i) batch.append(numbered(i), EventBatch::estimateSize(numbered(i)));
  const EventBatch::Finish finish{.fields = {{"text", std::string(EventBatch::kMaxBytes / 4, 'x')}}};
  int next = 0;
  while (batch.size() > 0) {
    const Array events = batch.takeEvents(finish);
    ASSERT_EQ(events.size(), next < 99 ? 3U : 1U);
    for (const auto& event : events) {
      EXPECT_EQ(*event.dictionary()->find("n"), Value(next++));
      EXPECT_TRUE(event.dictionary()->contains("text"));
    }
  }
  EXPECT_EQ(next, 100);
}

TEST(EventBatchTest, AnEventThatAloneIsTooLargeIsAPieceOfItsOwn) {
  EventBatch batch;
  for (int i = 0; i < 3; ++i) batch.append(numbered(i), EventBatch::estimateSize(numbered(i)));
  const EventBatch::Finish finish{.fields = {{"text", std::string(EventBatch::kMaxBytes + 1, 'x')}}};
  for (int i = 0; i < 3; ++i) {
    const Array events = batch.takeEvents(finish);
    ASSERT_EQ(events.size(), 1U);
    EXPECT_EQ(*events[0].dictionary()->find("n"), Value(i));
  }
  EXPECT_EQ(batch.size(), 0U);
}

// As many as fit exactly, counted as what they become.
TEST(EventBatchTest, APieceIsFilledToTheBound) {
  const std::string text(5000, 'y');
  const Dictionary full{{"n", 1}, {"label", text}};
  const size_t each = EventBatch::estimateSize(full);
  const size_t fitting = EventBatch::kMaxBytes / each;
  EventBatch batch;
  for (size_t i = 0; i < fitting + 1; ++i) {
    const Dictionary event = i % 2 == 0 ? Dictionary{{"n", 1}, {"label", Array{text, text}}} : numbered(1);
    batch.append(event, EventBatch::estimateSize(event));
  }
  EXPECT_EQ(batch.takeEvents({.fields = {{"label", text}}}).size(), fitting);
  EXPECT_EQ(batch.size(), 1U);
  // What was left is counted as what it has become.
  EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes - each));
  EXPECT_FALSE(batch.hasRoomFor(EventBatch::kMaxBytes - each + 1));
}

TEST(EventBatchTest, ALabelIsSetInTheEventsThatWereHeldThen) {
  EventBatch batch;
  for (int i = 0; i < 3; ++i) batch.append(numbered(i), 10);
  batch.labelAll({{"label", "first"}});
  batch.append(numbered(3), 10);
  batch.labelAll({{"label", "second"}});
  batch.append(numbered(4), 10);
  const Array events = batch.takeEvents({.fields = {{"a", 1}}});
  ASSERT_EQ(events.size(), 5U);
  for (size_t i = 0; i < 4; ++i) EXPECT_EQ(*events[i].dictionary()->find("label"), Value("second")) << i;
  EXPECT_FALSE(events[4].dictionary()->contains("label"));
}

TEST(EventBatchTest, ALabelGoesWithItsEvents) {
  EventBatch batch;
  for (int i = 0; i < 4; ++i) batch.append(numbered(i), EventBatch::kMaxBytes / 4);
  batch.labelAll({{"label", 1}});
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes / 2), 2U);
  batch.append(numbered(4), 10);
  const Array events = batch.takeEvents({});
  ASSERT_EQ(events.size(), 3U);
  EXPECT_TRUE(events[0].dictionary()->contains("label"));
  EXPECT_TRUE(events[1].dictionary()->contains("label"));
  EXPECT_FALSE(events[2].dictionary()->contains("label"));
}

// However long, it takes no room from the events.
TEST(EventBatchTest, ALabelCostsNoRoom) {
  EventBatch batch;
  batch.append(numbered(0), EventBatch::kMaxBytes / 2);
  batch.append(numbered(1), EventBatch::kMaxBytes / 2);
  batch.labelAll({{"label", std::string(EventBatch::kMaxBytes, 'x')}});
  EXPECT_TRUE(batch.hasRoomFor(0));
  EXPECT_EQ(batch.makeRoomFor(0), 0U);
  EXPECT_EQ(batch.takeEvents({}).size(), 1U);
  const Array last = batch.takeEvents({});
  ASSERT_EQ(last.size(), 1U);
  EXPECT_TRUE(last[0].dictionary()->contains("label"));
}

TEST(EventBatchTest, WhatIsSetGoesBeforeTheLabel) {
  EventBatch batch;
  batch.append(numbered(0), 10);
  batch.labelAll({{"a", "label"}, {"b", "label"}});
  EXPECT_EQ(batch.takeEvents({.fields = {{"a", "set"}}}),
            (Array{Dictionary{{"n", 0}, {"a", "set"}, {"b", "label"}}}));
}

// Each event counts for what it is.
TEST(EventBatchTest, DroppingGivesBackWhatWasTaken) {
  EventBatch batch;
  for (size_t i = 1; i <= 6; ++i) batch.append(numbered(1), i * 1000);
  EXPECT_TRUE(batch.hasRoomFor(EventBatch::kMaxBytes - 21000));
  EXPECT_FALSE(batch.hasRoomFor(EventBatch::kMaxBytes - 21000 + 1));
  EXPECT_EQ(batch.makeRoomFor(EventBatch::kMaxBytes), 6U);
  batch.append(numbered(1), EventBatch::kMaxBytes);
  EXPECT_TRUE(batch.hasRoomFor(0));
  EXPECT_FALSE(batch.hasRoomFor(1));
}

TEST(EventBatchTest, ReplacesWhatOnlyLooksEqual) {
  EventBatch batch;
  batch.append({{"flag", 1}, {"zero", 0.0}, {"text", "same"}}, 10);
  const Array events = batch.takeEvents({.fields = {{"flag", true}, {"zero", -0.0}, {"text", "same"}}});
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
  EXPECT_EQ(batch.takeEvents({}), (Array{numbered(2), numbered(3)}));
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
  EXPECT_GE(EventBatch::estimateSize({{"n", 1}}, {0, 0, {text}}), small + 1000);
}

}  // namespace
}  // namespace tarnel

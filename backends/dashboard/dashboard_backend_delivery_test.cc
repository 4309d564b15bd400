#include "backends/dashboard/dashboard_backend_fixture.h"

// Sending, retransmitting and acknowledging, tick by tick.

namespace tarnel {
namespace {

using Events = std::vector<uint16_t>;

class DashboardBackendDeliveryTest : public DashboardBackendFixture {};

TEST_F(DashboardBackendDeliveryTest, UnreliableDatagramThatWentOutIsForgotten) {
  const auto backend = make(profileOf());
  sendNow(*backend, 1);
  tick(30);
  EXPECT_EQ(socket().sends, 1);
}

TEST_F(DashboardBackendDeliveryTest, UnreliableDatagramIsTriedAtEveryTickUntilItGoesOut) {
  const auto backend = make(profileOf());
  failSends(4);
  sendNow(*backend, 1);
  EXPECT_EQ(socket().sends, 1);
  for (int i = 2; i <= 4; ++i) {
    tick();
    EXPECT_EQ(socket().sends, i);
    EXPECT_EQ(sentCount(), 0U);
  }
  tick();
  EXPECT_EQ(sentCount(), 1U);
  tick(30);
  EXPECT_EQ(socket().sends, 5);
}

TEST_F(DashboardBackendDeliveryTest, DatagramThatWentOutInPartCountsAsNotSent) {
  for (const std::ptrdiff_t part : {0, 1, 63, 64, 71}) {
    const auto backend = make(profileOf());
    failSends(2, part);
    send(*backend, 1, Dictionary{{"a", ""}});  // 72 bytes
    world.workQueues.runUntilIdle();
    tick(2);
    EXPECT_EQ(socket().sends, 3) << part;
    EXPECT_EQ(sentCount(), 1U) << part;
  }
}

TEST_F(DashboardBackendDeliveryTest, NothingIsReportedOfFailedSends) {
  const auto backend = make(profileOf());
  failSends(3);
  sendNow(*backend, 1);
  tick(5);
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendDeliveryTest, ReliableDatagramIsRetransmittedAtTicks2And5And10And19AndDroppedAt20) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  EXPECT_EQ(sentCount(), 1U);
  std::vector<int> ticks;
  for (int i = 1; i <= 19; ++i) {
    const size_t before = sentCount();
    tick();
    if (sentCount() != before) ticks.push_back(i);
  }
  EXPECT_EQ(ticks, (std::vector<int>{2, 5, 10, 19}));
  // Held until the 20th tick: what is acknowledged before is this one, not the next with its number.
  sendNow(*backend, 1);
  acknowledge(1);
  tick(2);
  EXPECT_EQ(sentCount(), 7U);  // the second one is there still
}

TEST_F(DashboardBackendDeliveryTest, DatagramIsGivenUpAtTick20) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  tick(20);
  EXPECT_EQ(sentCount(), 5U);
  sendNow(*backend, 1);
  acknowledge(1);  // the first is gone, so this is for the second
  tick(30);
  EXPECT_EQ(sentCount(), 6U);
  EXPECT_TRUE(world.log.lines().empty());
}

TEST_F(DashboardBackendDeliveryTest, EveryRetransmissionIsTheSameDatagram) {
  const auto backend = make(reliableProfile());
  send(*backend, 1, Dictionary{{"a", "b"}});
  tick(20);
  ASSERT_EQ(sentCount(), 5U);
  for (const auto& datagram : socket().sent) EXPECT_EQ(datagram, socket().sent.front());
}

TEST_F(DashboardBackendDeliveryTest, PeriodOfTheProfileSetsThePace) {
  const auto backend = make(profileOf({{"reliable", 200}}));
  sendNow(*backend, 1);
  world.workQueues.advance(milliseconds(399));
  EXPECT_EQ(sentCount(), 1U);
  world.workQueues.advance(milliseconds(1));
  EXPECT_EQ(sentCount(), 2U);
  world.workQueues.advance(milliseconds(599));
  EXPECT_EQ(sentCount(), 2U);
  world.workQueues.advance(milliseconds(1));
  EXPECT_EQ(sentCount(), 3U);
}

TEST_F(DashboardBackendDeliveryTest, RetransmissionThatFailsIsTriedAgainAtTheNextTickAndCountsOnlyThen) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  tick();
  failSends(3);
  tick(3);  // the 2nd to the 4th
  EXPECT_EQ(socket().sends, 4);
  EXPECT_EQ(sentCount(), 1U);
  tick();  // the 5th
  EXPECT_EQ(sentCount(), 2U);
  tick(2);
  EXPECT_EQ(sentCount(), 2U);
  tick();  // three checks later
  EXPECT_EQ(sentCount(), 3U);
}

TEST_F(DashboardBackendDeliveryTest, ReliableDatagramThatCouldNotBeSentStartsItsCountWhenItIs) {
  const auto backend = make(reliableProfile());
  failSends(3);
  sendNow(*backend, 1);
  tick(2);
  EXPECT_EQ(sentCount(), 0U);
  tick();  // goes out here
  EXPECT_EQ(sentCount(), 1U);
  tick();
  EXPECT_EQ(sentCount(), 1U);
  tick();
  EXPECT_EQ(sentCount(), 2U);
  acknowledge(1);
  tick(30);
  EXPECT_EQ(sentCount(), 2U);
}

// --- acknowledgements ---

TEST_F(DashboardBackendDeliveryTest, AcknowledgedDatagramIsNotSentAgain) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 0xABCD);
  tick();
  acknowledge(0xABCD);
  tick(30);
  EXPECT_EQ(sentCount(), 1U);
}

TEST_F(DashboardBackendDeliveryTest, AcknowledgementBetweenRetransmissionsEndsThem) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 7);
  tick(9);
  EXPECT_EQ(sentCount(), 3U);
  acknowledge(7);
  tick(30);
  EXPECT_EQ(sentCount(), 3U);
}

TEST_F(DashboardBackendDeliveryTest, AcknowledgementOfAnUnknownEventChangesNothing) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 0x0102);
  // Neither byte counts alone, nor in the other order.
  for (const uint16_t other : Events{0x0201, 0x0103, 0x0100, 0x0002, 0x0202, 0x0101, 0}) acknowledge(other);
  tick(2);
  EXPECT_EQ(sentCount(), 2U);
}

TEST_F(DashboardBackendDeliveryTest, EqualEventNumbersNeedAnAcknowledgementEach) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 5);
  sendNow(*backend, 5);
  acknowledge(5);
  tick(2);
  EXPECT_EQ(sentEvents(), (Events{5, 5, 5}));
  acknowledge(5);
  tick(30);
  EXPECT_EQ(sentCount(), 3U);
}

TEST_F(DashboardBackendDeliveryTest, AcknowledgementTakesTheFirstInTheQueue) {
  const auto backend = make(reliableProfile());
  send(*backend, 5, Dictionary{{"first", 1}});
  send(*backend, 5, Dictionary{{"second", 1}});
  world.workQueues.runUntilIdle();
  acknowledge(5);
  tick(2);
  ASSERT_EQ(sentCount(), 3U);
  EXPECT_EQ(socket().sent.at(2), socket().sent.at(1));
}

TEST_F(DashboardBackendDeliveryTest, DatagramThatWasNeverSentCanBeAcknowledgedToo) {
  const auto backend = make(reliableProfile());
  failSends(1);
  sendNow(*backend, 5);
  acknowledge(5);
  tick(5);
  EXPECT_EQ(sentCount(), 0U);
}

TEST_F(DashboardBackendDeliveryTest, OnlyTheEventNumberOfAnAcknowledgementCounts) {
  const auto backend = make(reliableProfile());
  for (const size_t size : {62U, 63U, 64U, 1087U, 1088U, 5000U}) {
    sendNow(*backend, 5);
    const size_t before = sentCount();
    receive(acknowledgement(5, size));
    tick(30);
    EXPECT_EQ(sentCount(), before) << size;
  }
}

TEST_F(DashboardBackendDeliveryTest, DatagramsTooShortForAnEventNumberMatchNothing) {
  const auto backend = make(reliableProfile());
  // Whatever would be read beyond their end.
  for (const uint16_t event : Events{0, 0xEEEE, 0x00EE, 0xEE00}) sendNow(*backend, event);
  for (size_t size = 0; size < 62; ++size) receive(acknowledgement(0xEEEE, size));
  tick(2);
  EXPECT_EQ(sentCount(), 8U);
}

TEST_F(DashboardBackendDeliveryTest, WakeWithoutADatagramChangesNothing) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 0);
  world.workQueues.signalReadable(socket().descriptor);
  tick(2);
  EXPECT_EQ(sentCount(), 2U);
}

TEST_F(DashboardBackendDeliveryTest, OneEventReadsOneDatagram) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  socket().incoming.push_back(acknowledgement(9));
  socket().incoming.push_back(acknowledgement(1));
  world.workQueues.signalReadable(socket().descriptor);
  EXPECT_EQ(socket().incoming.size(), 1U);
}

// --- the queue ---

TEST_F(DashboardBackendDeliveryTest, Datagram51EvictsTheOldest) {
  const auto backend = make(profileOf());
  socket().sendResults.assign(51, -1);
  for (uint16_t event = 1; event <= 51; ++event) sendNow(*backend, event);
  EXPECT_EQ(sentCount(), 0U);
  tick();
  Events expected;
  for (uint16_t event = 2; event <= 51; ++event) expected.push_back(event);
  EXPECT_EQ(sentEvents(), expected);
}

TEST_F(DashboardBackendDeliveryTest, FiftyDatagramsAreAllKept) {
  const auto backend = make(reliableProfile());
  for (uint16_t event = 1; event <= 50; ++event) sendNow(*backend, event);
  tick(2);
  EXPECT_EQ(sentCount(), 100U);
}

TEST_F(DashboardBackendDeliveryTest, QueueNeverHoldsMoreThanFifty) {
  const auto backend = make(reliableProfile());
  for (uint16_t event = 1; event <= 200; ++event) sendNow(*backend, event);
  const size_t before = sentCount();
  EXPECT_EQ(before, 200U);  // each was sent once
  tick(2);
  EXPECT_EQ(sentCount(), before + 50);
  EXPECT_EQ(sentEvents().at(200), 151);
}

TEST_F(DashboardBackendDeliveryTest, RemovalsSkipNobody) {
  const auto backend = make(profileOf());
  socket().sendResults = {-1, -1, -1, -1, -1};
  for (uint16_t event = 1; event <= 5; ++event) sendNow(*backend, event);
  socket().sendResults = {64, -1, 64, 64, -1};
  tick();
  EXPECT_EQ(sentEvents(), (Events{1, 3, 4}));
  tick();
  EXPECT_EQ(sentEvents(), (Events{1, 3, 4, 2, 5}));
}

TEST_F(DashboardBackendDeliveryTest, EachDatagramKeepsItsOwnCount) {
  const auto backend = make(reliableProfile());
  sendNow(*backend, 1);
  tick();
  sendNow(*backend, 2);
  tick();  // the 2nd of the first
  EXPECT_EQ(sentEvents(), (Events{1, 2, 1}));
  tick();  // the 2nd of the second
  EXPECT_EQ(sentEvents(), (Events{1, 2, 1, 2}));
}

}  // namespace
}  // namespace tarnel

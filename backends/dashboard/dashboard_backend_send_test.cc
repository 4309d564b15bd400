#include "backends/dashboard/dashboard_backend_fixture.h"

// The send operation on the caller's side.

namespace tarnel {
namespace {

class DashboardBackendSendTest : public DashboardBackendFixture {};

// Reaches the running event number.
struct EventNumberOf : TarnelBackend {
  static uint16_t of(const TarnelBackend& backend) { return (backend.*(&EventNumberOf::eventID))(); }
};

TEST_F(DashboardBackendSendTest, SendsTheDatagramAndReturnsItsLine) {
  const auto backend = make(profileOf());
  const auto line = send(*backend, 0x0102, Dictionary{{"a", "b"}});
  EXPECT_EQ(
      line,
      "1700000000.248 0123456789abcdef0123456789abcdef01234567 127.0.0.1 PLMA  1286 16909060   258     3     "
      "8  a=b");
  world.workQueues.runUntilIdle();
  ASSERT_EQ(sentCount(), 1U);
  const auto& datagram = socket().sent.at(0);
  ASSERT_EQ(datagram.size(), 68U);
  EXPECT_EQ(writeLocalLog(datagram), line);
  EXPECT_EQ(datagram[0], 3);  // the daemon's own major version
}

TEST_F(DashboardBackendSendTest, PayloadWithoutEntriesIsTheHeaderAlone) {
  const auto backend = make(profileOf());
  const auto line = send(*backend, 1, Dictionary());
  ASSERT_TRUE(line);
  EXPECT_TRUE(line->ends_with("    8 ")) << *line;
  EXPECT_EQ(send(*backend, 1), line);  // like no payload at all
  world.workQueues.runUntilIdle();
  EXPECT_EQ(socket().sent.at(0).size(), 64U);
  EXPECT_EQ(socket().sent.at(1).size(), 64U);
}

TEST_F(DashboardBackendSendTest, LongTextIsCutAndTheLengthMatchesWhatIsSent) {
  const auto backend = make(profileOf());
  send(*backend, 1, Dictionary{{"key", std::string(3000, 'x')}});
  world.workQueues.runUntilIdle();
  const auto& datagram = socket().sent.at(0);
  EXPECT_EQ(datagram.size(), 1087U);
  EXPECT_EQ(static_cast<uint16_t>(~(datagram[14] << 8U | datagram[15])), datagram.size());
}

TEST_F(DashboardBackendSendTest, ValuesAreDescribedAndSanitized) {
  const auto backend = make(profileOf());
  const auto line =
      send(*backend, 1, Dictionary{{"v", "a=b\\c"}, {"empty", ""}, {"list", Array{1}}, {"n", 7}});
  EXPECT_TRUE(line->ends_with("  empty=empty n=7 list=null v=a\\=b\\\\c")) << *line;
}

TEST_F(DashboardBackendSendTest, OnlyTheWorkQueueSends) {
  const auto backend = make(profileOf());
  send(*backend, 1);
  EXPECT_EQ(socket().sends, 0);
  world.workQueues.runUntilIdle();
  EXPECT_EQ(socket().sends, 1);
}

TEST_F(DashboardBackendSendTest, WhatWasHandedOverIsBoundedAndTheRestDroppedWithOneLine) {
  const auto backend = make(profileOf());
  for (uint32_t i = 0; i < DashboardBackend::kMaxHandedOver + 10; ++i) {
    EXPECT_TRUE(send(*backend, static_cast<uint16_t>(i)));
  }
  const std::string text =
      "DashboardBackend(sendMessage): dashboard: 256 datagrams wait for the work queue; more are dropped";
  expectLog(LogLevel::warning, text);
  world.workQueues.runUntilIdle();
  EXPECT_EQ(sentCount(), DashboardBackend::kMaxHandedOver);
  EXPECT_EQ(sentEvents().back(), DashboardBackend::kMaxHandedOver - 1);
  // Then it goes on, and the next time there is a line again.
  for (uint32_t i = 0; i < DashboardBackend::kMaxHandedOver; ++i) send(*backend, 1);
  expectLog(LogLevel::warning, text, 1);
  send(*backend, 1);
  expectLog(LogLevel::warning, text, 2);
}

// The two sends differ in their last argument alone and must not be taken for each other.

template <class Last>
concept FlaggedSend = requires(TarnelBackend& backend, Last last) {
  {backend.sendMessage(MaybeDictionary(), TimeValue(), Method{}, RespCode{}, last)};
};
static_assert(FlaggedSend<Flag>);
static_assert(!FlaggedSend<EventID>);
static_assert(!FlaggedSend<int>);

TEST_F(DashboardBackendSendTest, FlaggedSendDoesNothingAsInTheBase) {
  const auto backend = make(reliableProfile());
  TarnelBackend& asSessionsSeeIt = *backend;
  const Dictionary payload{{"a", 1}};
  for (const Flag flag : {Flag::normal, Flag::realtime, Flag::important}) {
    EXPECT_EQ(asSessionsSeeIt.sendMessage(payload, TimeValue{1, 2}, Method{3}, RespCode{4}, flag),
              std::nullopt);
    EXPECT_EQ(backend->sendMessage(payload, TimeValue{1, 2}, Method{3}, RespCode{4}, flag), std::nullopt);
    EXPECT_EQ(backend->sendMessage(payload, TimeValue{1, 2}, Method{3}, RespCode{4}, EventID{5}, flag),
              std::nullopt);
  }
  EXPECT_EQ(world.workQueues.readyTasks(), 0U);
  tick(3);
  EXPECT_EQ(socket().sends, 0);
}

TEST_F(DashboardBackendSendTest, UnflaggedSendTakesNoEventNumberOfTheBackend) {
  const auto backend = make(profileOf());
  sendNow(*backend, 77);
  EXPECT_EQ(sentEvents(), std::vector<uint16_t>{77});
  EXPECT_EQ(EventNumberOf::of(*backend), 0);
}

TEST_F(DashboardBackendSendTest, FlushIsTheBasesDefault) {
  const auto backend = make(profileOf());
  int answers = 0;
  EXPECT_EQ(
      backend->flushMessagesWithCompletion([&answers](const MaybeString& text, const MaybeError& error) {
        ++answers;
        EXPECT_FALSE(text || error);
      }),
      std::nullopt);
  EXPECT_EQ(answers, 1);
}

}  // namespace
}  // namespace tarnel

#include "backends/vesmer/vesmer_backend.h"

#include <gmock/gmock.h>

#include "platform/fake/fake_world.h"

namespace tarnel {
namespace {

using testing::IsEmpty;

constexpr TimeValue kTime{1700000000, 250000};

class VesmerBackendTest : public testing::Test {
 protected:
  fake::FakeWorld world;
  const std::shared_ptr<VesmerBackend> backend =
      VesmerBackend::initWithName(world.dependencies, "vesmer", Dictionary{{"a", 1}}, "family");
};

TEST_F(VesmerBackendTest, IsMadeWithTheBasesInitializerAndNothingMore) {
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->name(), "vesmer");
  EXPECT_EQ(backend->productFamily(), "family");
  EXPECT_NE(VesmerBackend::initWithName(world.dependencies, "vesmer", std::nullopt, std::nullopt), nullptr);
  EXPECT_THAT(world.log.lines(), IsEmpty());
}

TEST_F(VesmerBackendTest, TheUnflaggedSendRecordsAnEvent) {
  EXPECT_EQ(
      backend->sendMessage(Dictionary{{"codec", "opus"}}, kTime, Method{3}, RespCode{65535}, EventID{7}),
      std::nullopt);
  const auto events = world.powerLog.events();
  ASSERT_EQ(events.size(), 1U);
  EXPECT_EQ(events[0].client, 28);
  EXPECT_EQ(events[0].eventName, "Halvend-TRN");
  EXPECT_EQ(events[0].dictionary,
            (Dictionary{{"codec", "opus"}, {"method", 3}, {"respCode", 65535}, {"event", 7}}));
  EXPECT_EQ(events[0].extra, std::nullopt);
}

TEST_F(VesmerBackendTest, EntriesOfThePayloadWithThoseNamesAreReplaced) {
  const Dictionary payload{{"event", "mine"}, {"method", Array{1}}, {"respCode", -1}, {"other", true}};
  backend->sendMessage(payload, kTime, Method{1}, RespCode{0}, EventID{65535});
  ASSERT_EQ(world.powerLog.events().size(), 1U);
  EXPECT_EQ(world.powerLog.events()[0].dictionary,
            (Dictionary{{"event", 65535}, {"method", 1}, {"respCode", 0}, {"other", true}}));
  EXPECT_EQ(*payload.find("event"), Value("mine")) << "the caller's payload stays as it is";
}

TEST_F(VesmerBackendTest, MethodZeroAndEmptyPayloadsRecordNothing) {
  backend->sendMessage(Dictionary{{"a", 1}}, kTime, Method{0}, RespCode{1}, EventID{1});
  backend->sendMessage(Dictionary(), kTime, Method{1}, RespCode{1}, EventID{1});
  backend->sendMessage(std::nullopt, kTime, Method{1}, RespCode{1}, EventID{1});
  EXPECT_THAT(world.powerLog.events(), IsEmpty());
}

// Sessions call the flagged sends: as long as these end in the base, no client's message gets into the power
// log.
TEST_F(VesmerBackendTest, TheFlaggedSendsDoNothing) {
  const std::shared_ptr<TarnelBackend> base = backend;
  for (const Flag flag : {Flag::normal, Flag::realtime, Flag::important, Flag{3}}) {
    EXPECT_EQ(base->sendMessage(Dictionary{{"a", 1}}, kTime, Method{3}, RespCode{4}, flag), std::nullopt);
    EXPECT_EQ(backend->sendMessage(Dictionary{{"a", 1}}, kTime, Method{3}, RespCode{4}, flag), std::nullopt);
    EXPECT_EQ(backend->sendMessage(Dictionary{{"a", 1}}, kTime, Method{3}, RespCode{4}, EventID{1}, flag),
              std::nullopt);
  }
  EXPECT_THAT(world.powerLog.events(), IsEmpty());
  EXPECT_THAT(world.log.lines(), IsEmpty());
}

}  // namespace
}  // namespace tarnel

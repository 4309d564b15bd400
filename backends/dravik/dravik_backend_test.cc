#include "backends/dravik/dravik_backend.h"

#include <gmock/gmock.h>

#include "platform/fake/fake_world.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using Line = fake::FakeLog::Line;

constexpr char kBundle[] =
    "/System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";
constexpr char kSelector[] = "sendMessageWithMethod:respCode:dict:";
constexpr TimeValue kTime{1700000000, 250000};

class DravikBackendTest : public testing::Test {
 protected:
  std::shared_ptr<DravikBackend> make(int32_t clientType = 7) {
    return DravikBackend::initWithName(world.dependencies, "dravik", Dictionary{{"active", true}}, "family",
                                       clientType);
  }
  static MaybeSentObject send(DravikBackend& backend, const MaybeDictionary& payload) {
    return backend.sendMessage(payload, kTime, Method{3}, RespCode{4}, Flag::important);
  }
  static Line complaint(const std::string& adaptor) {
    return {LogLevel::error, "DravikBackend(sendMessage): Dravik adaptor " + adaptor +
                                 " does not respond to forwarding selector " + kSelector};
  }
  fake::FakeWorld world;
  fake::BundleScript& script = world.codeBundles.scripts[kBundle];
};

TEST_F(DravikBackendTest, ThreeClientTypesAreAllowed) {
  for (int32_t type = -1; type <= 18; ++type) {
    const bool allowed = type == 7 || type == 11 || type == 13;
    EXPECT_EQ(DravikBackend::isClientTypeAllowed(type), allowed) << type;
    EXPECT_EQ(make(type) != nullptr, allowed) << type;
  }
}

TEST_F(DravikBackendTest, AnAllowedClientTypeLoadsTheAdaptorsClass) {
  const auto backend = make(13);
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->name(), "dravik");
  EXPECT_EQ(backend->productFamily(), "family");
  EXPECT_THAT(world.codeBundles.journal.lines(),
              ElementsAre(std::string("bundle ") + kBundle, "load", "class DravikAdaptor", "made 1"));
  EXPECT_THAT(
      world.log.lines(),
      ElementsAre(Line{LogLevel::information,
                       "DravikBackend(initWithName): Loading Dravik adaptor class for client type 13"}));
}

TEST_F(DravikBackendTest, ALoadedBundleIsNotLoadedAgain) {
  script.isLoaded = true;
  make();
  EXPECT_THAT(world.codeBundles.journal.lines(), testing::Not(testing::Contains("load")));
  EXPECT_THAT(world.codeBundles.journal.lines(), testing::Contains("made 1"));
}

TEST_F(DravikBackendTest, ARefusedClientTypeTouchesNoBundle) {
  EXPECT_EQ(make(8), nullptr);
  EXPECT_THAT(world.log.lines(),
              ElementsAre(Line{LogLevel::information,
                               "DravikBackend(initWithName): Loading Dravik adaptor class for client type 8"},
                          Line{LogLevel::error,
                               "DravikBackend(initWithName): No matching bundle found for client type 8"}));
  EXPECT_THAT(world.codeBundles.journal.lines(), IsEmpty());
}

TEST_F(DravikBackendTest, WithoutAClientTypeItIsTypeZeroAndRefused) {
  EXPECT_EQ(DravikBackend::initWithName(world.dependencies, "dravik", Dictionary(), "family"), nullptr);
  EXPECT_TRUE(world.log.contains(LogLevel::error,
                                 "DravikBackend(initWithName): No matching bundle found for client type 0"));
}

TEST_F(DravikBackendTest, MethodRespCodeAndPayloadAreForwardedAndNothingComesBack) {
  const auto backend = make();
  world.log.clear();
  const Dictionary payload{{"codec", "opus"}, {"nested", Dictionary{{"a", Array{1, 2.5}}}}};
  EXPECT_EQ(send(*backend, payload), std::nullopt);
  EXPECT_EQ(
      backend->sendMessage(Dictionary(), kTime, Method{65535}, RespCode{65535}, EventID{9}, Flag::realtime),
      std::nullopt);
  EXPECT_EQ(send(*backend, std::nullopt), std::nullopt);
  const auto calls = world.codeBundles.journal.calls();
  ASSERT_EQ(calls.size(), 3U);
  EXPECT_EQ(calls[0].method, kSelector);
  EXPECT_EQ(calls[0].first, Method{3});
  EXPECT_EQ(calls[0].second, RespCode{4});
  EXPECT_EQ(calls[0].dictionary, payload);
  EXPECT_EQ(calls[1].first, Method{65535});
  EXPECT_EQ(calls[1].second, RespCode{65535});
  EXPECT_EQ(calls[1].dictionary, Dictionary());
  EXPECT_EQ(calls[2].dictionary, std::nullopt);
  EXPECT_THAT(world.log.lines(), IsEmpty());
}

TEST_F(DravikBackendTest, EachBackendHasAnInstanceOfItsOwn) {
  const auto first = make();
  const auto second = make(11);
  send(*second, Dictionary());
  send(*first, Dictionary());
  EXPECT_EQ(world.codeBundles.journal.calls().at(0).instance, 2);
  EXPECT_EQ(world.codeBundles.journal.calls().at(1).instance, 1);
}

TEST_F(DravikBackendTest, WithoutTheBundleEverySendSaysSo) {
  world.codeBundles.scripts.clear();
  const auto backend = make();
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(world.log.lines().size(), 1U) << "a missing bundle is not worth a line";
  world.log.clear();
  EXPECT_EQ(send(*backend, Dictionary{{"a", 1}}), std::nullopt);
  EXPECT_EQ(send(*backend, std::nullopt), std::nullopt);
  EXPECT_THAT(world.log.lines(), ElementsAre(complaint("(null)"), complaint("(null)")));
}

TEST_F(DravikBackendTest, WithoutCodeClassOrInstanceTheAdaptorIsAbsent) {
  const std::array<void (*)(fake::BundleScript&), 3> faults{
      [](fake::BundleScript& bundle) { bundle.loads = false; },
      [](fake::BundleScript& bundle) { bundle.className = "Other"; },
      [](fake::BundleScript& bundle) { bundle.makesInstances = false; }};
  for (const auto fault : faults) {
    script = {};
    fault(script);
    const auto backend = make();
    ASSERT_NE(backend, nullptr);
    world.log.clear();
    send(*backend, Dictionary());
    EXPECT_THAT(world.log.lines(), ElementsAre(complaint("(null)")));
  }
  EXPECT_THAT(world.codeBundles.journal.calls(), IsEmpty());
}

TEST_F(DravikBackendTest, AnAdaptorWithoutTheMethodIsDescribed) {
  script.methodName = "somethingElse:";
  const auto backend = make();
  world.log.clear();
  EXPECT_EQ(send(*backend, Dictionary()), std::nullopt);
  EXPECT_THAT(world.log.lines(), ElementsAre(complaint("<DravikAdaptor>")));
  EXPECT_THAT(world.codeBundles.journal.calls(), IsEmpty());
}

TEST_F(DravikBackendTest, DisposalEndsTheInstanceBeforeItsBundle) {
  make().reset();
  const auto lines = world.codeBundles.journal.lines();
  ASSERT_GE(lines.size(), 2U);
  EXPECT_EQ(lines[lines.size() - 2], "destroyed 1");
  EXPECT_EQ(lines.back(), "released the bundle");
}

TEST_F(DravikBackendTest, ItReportsAndTheRestIsTheBases) {
  const auto backend = make();
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  EXPECT_FALSE(backend->uploadLogData({}));
  EXPECT_EQ(backend->flushMessagesWithCompletion({}), std::nullopt);
}

}  // namespace
}  // namespace tarnel

#include "backends/tarnel_backend.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "backends/dravik/dravik_backend.h"
#include "backends/https/https_post_backend.h"
#include "backends/vesmer/vesmer_backend.h"
#include "platform/fake/fake_world.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

// Shows what the base hands to the full send operation, and the version it keeps.
class RecordingBackend final : public TarnelBackend {
 public:
  explicit RecordingBackend(const Dependencies& dependencies)
      : TarnelBackend(dependencies, "recording", std::nullopt, std::nullopt) {}
  using TarnelBackend::sendMessage;
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, EventID eventID, Flag flag) override {
    lastPayload = payload;
    lastTimestamp = timestamp;
    lastMethod = method;
    lastRespCode = respCode;
    lastEventID = static_cast<uint16_t>(eventID);
    lastFlag = flag;
    return SentObject("sent");
  }
  using TarnelBackend::selfVersionMajor;
  using TarnelBackend::selfVersionMinor;
  using TarnelBackend::startTimeStamp;

  MaybeDictionary lastPayload;
  TimeValue lastTimestamp;
  Method lastMethod{};
  RespCode lastRespCode{};
  int lastEventID = -1;
  Flag lastFlag{};
};

class TarnelBackendTest : public ::testing::Test {
 protected:
  std::shared_ptr<TarnelBackend> base() {
    return TarnelBackend::initWithName(world.dependencies, "name", Dictionary{{"a", 1}}, "family");
  }
  std::shared_ptr<TarnelBackend> fromFactory(const std::string& name, const Value& profile) {
    return TarnelBackend::newBackendWithName(world.dependencies, name, profile, "family", 7);
  }
  fake::FakeWorld world;
  const Value profile = Dictionary{{"clients", Array()}};
};

TEST_F(TarnelBackendTest, StartsUndecidedAndEmpty) {
  world.random.setUniform(0.125);
  const auto backend = base();
  EXPECT_EQ(backend->state(), ReportingState::undecided);
  EXPECT_EQ(backend->name(), "name");
  EXPECT_EQ(backend->productFamily(), "family");
  EXPECT_EQ(backend->samplingFactor(), 0.125);
  EXPECT_EQ(backend->sessionID(), 0U);
  EXPECT_EQ(backend->combinedSessionIDString(), std::nullopt);
  EXPECT_EQ(backend->hierarchy(), 0);
  EXPECT_EQ(backend->compType(), 0);
  EXPECT_EQ(backend->clientVersion(), 0);
  EXPECT_EQ(backend->udid(), "");
  EXPECT_EQ(backend->displayURL(), std::nullopt);
  EXPECT_EQ(backend->productVersion(), std::nullopt);
  EXPECT_EQ(backend->buildVersion(), std::nullopt);
  EXPECT_EQ(backend->hardwareType(), std::nullopt);
  EXPECT_EQ(backend->userInfoDict(), std::nullopt);
  EXPECT_FALSE(backend->isInternal());
  EXPECT_FALSE(backend->requireUserInfo());
  EXPECT_FALSE(backend->batchEvents());
  EXPECT_EQ(backend->samplingThreshold(), std::nullopt);
}

TEST_F(TarnelBackendTest, EachBackendDrawsItsOwnSamplingFactor) {
  world.random.setUniform(0.25);
  const auto first = base();
  world.random.setUniform(0.75);
  const auto second = base();
  EXPECT_EQ(first->samplingFactor(), 0.25);
  EXPECT_EQ(second->samplingFactor(), 0.75);
}

TEST_F(TarnelBackendTest, DefaultOperationsAreHarmless) {
  const auto backend = base();
  EXPECT_EQ(backend->sendMessage(Dictionary(), {}, Method{1}, RespCode{2}, Flag::realtime), std::nullopt);
  EXPECT_FALSE(backend->uploadFileAtPath("/file", "token"));
  EXPECT_FALSE(backend->uploadLogData(Array()));
  backend->cleanup();
  backend->setCorrelatedSessionID("a.b");
  EXPECT_EQ(backend->combinedSessionIDString(), "a.b");
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::enabled);
}

TEST_F(TarnelBackendTest, FlushAnswersAtOnceWithNothing) {
  const auto backend = base();
  EXPECT_EQ(backend->flushMessagesWithCompletion({}), std::nullopt);
  int answers = 0;
  const auto text = backend->flushMessagesWithCompletion([&answers](MaybeString flushed, MaybeError error) {
    ++answers;
    EXPECT_EQ(flushed, std::nullopt);
    EXPECT_EQ(error, std::nullopt);
  });
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(answers, 1);
}

TEST_F(TarnelBackendTest, SendCountsEventsFromOneAndWrapsToZero) {
  const auto backend = std::make_shared<RecordingBackend>(world.dependencies);
  for (int number = 1; number <= 65535; ++number) {
    backend->sendMessage(std::nullopt, {}, Method{0}, RespCode{0}, Flag::normal);
    ASSERT_EQ(backend->lastEventID, number);
  }
  backend->sendMessage(std::nullopt, {}, Method{0}, RespCode{0}, Flag::normal);
  EXPECT_EQ(backend->lastEventID, 0);
}

TEST_F(TarnelBackendTest, SendPassesTheMessageOnAsItIs) {
  const auto backend = std::make_shared<RecordingBackend>(world.dependencies);
  const auto sent =
      backend->sendMessage(Dictionary{{"k", "v"}}, {12, 34}, Method{65535}, RespCode{9}, Flag::important);
  EXPECT_EQ(sent, MaybeSentObject("sent"));
  EXPECT_EQ(backend->lastPayload, (Dictionary{{"k", "v"}}));
  EXPECT_EQ(backend->lastTimestamp, (TimeValue{12, 34}));
  EXPECT_EQ(backend->lastMethod, Method{65535});
  EXPECT_EQ(backend->lastRespCode, RespCode{9});
  EXPECT_EQ(backend->lastFlag, Flag::important);
}

TEST_F(TarnelBackendTest, SelfVersionTakesTwoComponentsOfEightBits) {
  struct Case {
    const char* text;
    int major;
    int minor;
  };
  RecordingBackend backend(world.dependencies);
  for (const auto& [text, major, minor] :
       {Case{"3.2", 3, 2}, Case{"7", 7, 0}, Case{"1.2.3", 1, 2}, Case{"300.1", 44, 1}, Case{"1.257", 1, 1},
        Case{"x.y", 0, 0}, Case{"", 0, 0}, Case{".5", 0, 5}, Case{"9.", 9, 0}, Case{"4x.2y", 4, 2}}) {
    backend.setSelfVersion(text);
    EXPECT_EQ(backend.selfVersionMajor(), major) << text;
    EXPECT_EQ(backend.selfVersionMinor(), minor) << text;
  }
}

TEST_F(TarnelBackendTest, StartTimestampIsInSeconds) {
  RecordingBackend backend(world.dependencies);
  backend.setStartTimestamp({1700000000, 250000});
  EXPECT_EQ(backend.startTimeStamp(), 1700000000.25);
}

TEST(ConvertIntoSHA256Test, DigestsTextAsLowerCaseHexadecimal) {
  EXPECT_EQ(TarnelBackend::convertIntoSHA256(""),
            "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");
  EXPECT_EQ(TarnelBackend::convertIntoSHA256("abc"),
            "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
}

TEST(ConvertIntoSHA256Test, CoversAsManyBytesAsTheTextHasUtf16Units) {
  // Two bytes, one unit: only the first byte counts, so that both of these are the digest of C3.
  const auto digestOfC3 = TarnelBackend::convertIntoSHA256("\xC3");
  EXPECT_EQ(TarnelBackend::convertIntoSHA256("\xC3\xA9"), digestOfC3);
  EXPECT_EQ(TarnelBackend::convertIntoSHA256("\xC3\xBC"), digestOfC3);
  EXPECT_EQ(digestOfC3, "ae3f4619b0413d70d3004b9131c3752153074e45725be13b9a148978895e359e");
  // Four bytes, two units.
  EXPECT_EQ(TarnelBackend::convertIntoSHA256("\xF0\x9F\x98\x80"),
            TarnelBackend::convertIntoSHA256("\xF0\x9F\x98\x81"));
  EXPECT_NE(TarnelBackend::convertIntoSHA256("\xF0\x9F\x98\x80"),
            TarnelBackend::convertIntoSHA256("\xF0\x90\x98\x80"));
  // Three bytes, one unit; the ASCII before it moves the cut by as much.
  EXPECT_EQ(TarnelBackend::convertIntoSHA256("a\xE2\x82\xAC"),
            TarnelBackend::convertIntoSHA256("a\xE2\x82\xAD"));
  EXPECT_NE(TarnelBackend::convertIntoSHA256("a\xE2\x82\xAC"), TarnelBackend::convertIntoSHA256("a"));
}

TEST_F(TarnelBackendTest, FactoryMakesHttpsBackendsForBothNames) {
  for (const char* name : {kTarnelBackendHTTPPost, kTarnelBackendHTTPPost2}) {
    const auto backend = fromFactory(name, profile);
    ASSERT_NE(std::dynamic_pointer_cast<HTTPSPostBackend>(backend), nullptr) << name;
    EXPECT_EQ(backend->name(), name);
    EXPECT_EQ(backend->productFamily(), "family");
  }
  EXPECT_TRUE(world.log.startingWith("TarnelBackend").empty());
}

TEST_F(TarnelBackendTest, FactoryComparesNamesExactly) {
  for (const char* name : {"HTTPPost", "httppost ", "httppost3", "", "version"}) {
    world.log.clear();
    EXPECT_EQ(fromFactory(name, profile), nullptr);
    EXPECT_TRUE(
        world.log.contains(LogLevel::error, std::string("TarnelBackend(newBackendWithName): ") + name));
  }
}

TEST_F(TarnelBackendTest, FactoryMakesTheForwardingBackends) {
  EXPECT_NE(std::dynamic_pointer_cast<VesmerBackend>(fromFactory(kTarnelBackendVesmer, profile)), nullptr);
  EXPECT_NE(std::dynamic_pointer_cast<DravikBackend>(fromFactory(kTarnelBackendDravik, profile)), nullptr);
  EXPECT_TRUE(world.log.startingWith("TarnelBackend").empty());
}

TEST_F(TarnelBackendTest, FactoryHandsTheClientTypeToTheDravikBackendAlone) {
  for (const int32_t refused : {6, 8, 12, 14}) {
    const auto make = [this, refused](const char* name) {
      return TarnelBackend::newBackendWithName(world.dependencies, name, profile, "family", refused);
    };
    EXPECT_EQ(make(kTarnelBackendDravik), nullptr);
    EXPECT_NE(make(kTarnelBackendVesmer), nullptr);
    EXPECT_NE(make(kTarnelBackendHTTPPost), nullptr);
  }
  EXPECT_TRUE(world.log.startingWith("TarnelBackend").empty()) << "the name is known";
}

TEST_F(TarnelBackendTest, FactoryTakesOnlyTheWholeNameOfTheDesktopMachine) {
  for (const char* type : {"", "Deskbox1,1", "deskbox", "Deskbox "}) {
    world.deviceInformation.answers["ProductType"] = type;
    EXPECT_NE(fromFactory(kTarnelBackendDravik, profile), nullptr) << type;
  }
  world.deviceInformation.answers.erase("ProductType");
  EXPECT_NE(fromFactory(kTarnelBackendDravik, profile), nullptr) << "no answer";
  world.deviceInformation.answers["ProductType"] = "Deskbox";
  EXPECT_NE(fromFactory(kTarnelBackendVesmer, profile), nullptr);
  EXPECT_NE(fromFactory(kTarnelBackendHTTPPost, profile), nullptr);
}

TEST_F(TarnelBackendTest, FactoryMakesNoDravikBackendOnADesktopMachine) {
  world.deviceInformation.answers["ProductType"] = "Deskbox";
  EXPECT_EQ(fromFactory(kTarnelBackendDravik, profile), nullptr);
  EXPECT_EQ(
      world.log.lines(),
      (std::vector<fake::FakeLog::Line>{{LogLevel::error, "TarnelBackend(newBackendWithName): dravik"}}));
}

TEST_F(TarnelBackendTest, FactoryPassesAnInitializersRefusalOn) {
  EXPECT_EQ(fromFactory("httppost", Dictionary()), nullptr);
  EXPECT_EQ(TarnelBackend::newBackendWithName(world.dependencies, "httppost", profile, std::nullopt, 7),
            nullptr);
}

TEST_F(TarnelBackendTest, SectionThatIsNoDictionaryCountsAsAbsentWithOneWarning) {
  EXPECT_EQ(fromFactory("httppost", 5), nullptr);
  EXPECT_TRUE(world.log.contains(LogLevel::warning,
                                 "TarnelBackend(newBackendWithName): httppost: the section httppost is not a "
                                 "dictionary and counts as absent"));
  EXPECT_EQ(world.log.lines().size(), 1U);
}

TEST_F(TarnelBackendTest, SettersKeepWhatTheyAreGiven) {
  const auto backend = base();
  backend->setSessionID(4294967295U);
  backend->setHierarchy(-3);
  backend->setCompType(13);
  backend->setClientVersion(65535);
  backend->setUdid("udid");
  backend->setDisplayURL("display");
  backend->setProductVersion("1");
  backend->setBuildVersion("2");
  backend->setHardwareType("3");
  backend->setUserInfoDict(Dictionary{{"a", "b"}});
  backend->setIsInternal(true);
  backend->setRequireUserInfo(true);
  backend->setBatchEvents(true);
  backend->setSamplingThreshold(Value(0.5));
  EXPECT_EQ(backend->sessionID(), 4294967295U);
  EXPECT_EQ(backend->hierarchy(), -3);
  EXPECT_EQ(backend->compType(), 13);
  EXPECT_EQ(backend->clientVersion(), 65535);
  EXPECT_EQ(backend->udid(), "udid");
  EXPECT_EQ(backend->displayURL(), "display");
  EXPECT_EQ(backend->productVersion(), "1");
  EXPECT_EQ(backend->buildVersion(), "2");
  EXPECT_EQ(backend->hardwareType(), "3");
  EXPECT_EQ(backend->userInfoDict(), (Dictionary{{"a", "b"}}));
  EXPECT_TRUE(backend->isInternal());
  EXPECT_TRUE(backend->requireUserInfo());
  EXPECT_TRUE(backend->batchEvents());
  EXPECT_EQ(backend->samplingThreshold(), Value(0.5));
}

}  // namespace
}  // namespace tarnel

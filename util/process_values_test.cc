#include "util/process_values.h"

#include <gmock/gmock.h>

#include <thread>
#include <vector>

#include "platform/fake/fake_device.h"
#include "platform/fake/fake_log.h"
#include "platform/fake/fake_random.h"
#include "platform/fake/fake_settings_store.h"

namespace tarnel {
namespace {

class ProcessValuesTest : public testing::Test {
 protected:
  void set(const char* key, const Value& value) { settings_.setObject("com.orvane.tarnel", key, value); }

  fake::FakeLog log_;
  fake::FakeDeviceInformation device_;
  fake::FakeSettingsStore settings_;
  fake::FakeRandom random_;
  ProcessValues values_{log_, device_, settings_, random_};
};

TEST_F(ProcessValuesTest, OnlyReleaseTypeInternalIsAnInternalBuild) {
  device_.answers["ReleaseType"] = "Internal";
  EXPECT_TRUE(values_.isInternalBuild());
  for (const char* other : {"internal", "Internal ", "Beta", ""}) {
    device_.answers["ReleaseType"] = other;
    EXPECT_FALSE(ProcessValues(log_, device_, settings_, random_).isInternalBuild()) << other;
  }
  device_.answers.erase("ReleaseType");
  EXPECT_FALSE(ProcessValues(log_, device_, settings_, random_).isInternalBuild());
}

TEST_F(ProcessValuesTest, InternalBuildIsComputedOnce) {
  device_.answers["ReleaseType"] = "Internal";
  EXPECT_TRUE(values_.isInternalBuild());
  device_.answers["ReleaseType"] = "Beta";
  EXPECT_TRUE(values_.isInternalBuild());
  EXPECT_EQ(device_.queries, 1);
}

TEST_F(ProcessValuesTest, EnvironmentWithoutSettingFollowsTheBuild) {
  EXPECT_EQ(values_.currentEnvironmentType(), EnvironmentType::seed);
  EXPECT_EQ(log_.lines(), (std::vector<fake::FakeLog::Line>{
                              {LogLevel::information, "userDefaultsEnvironment: Environment type 3"}}));
  log_.clear();
  device_.answers["ReleaseType"] = "Internal";
  EXPECT_EQ(ProcessValues(log_, device_, settings_, random_).currentEnvironmentType(),
            EnvironmentType::orvaneInternal);
  EXPECT_EQ(log_.lines(), (std::vector<fake::FakeLog::Line>{
                              {LogLevel::information, "userDefaultsEnvironment: Environment type 2"}}));
}

TEST_F(ProcessValuesTest, StoredEnvironmentsZeroToFourAreTaken) {
  for (uint32_t type = 0; type <= 4; ++type) {
    log_.clear();
    set("environmentType", type);
    EXPECT_EQ(ProcessValues(log_, device_, settings_, random_).currentEnvironmentType(),
              static_cast<EnvironmentType>(type));
    EXPECT_EQ(
        log_.lines(),
        (std::vector<fake::FakeLog::Line>{
            {LogLevel::information, "userDefaultsEnvironment: Environment type " + std::to_string(type)}}));
  }
}

TEST_F(ProcessValuesTest, StoredEnvironmentOutOfRangeGivesTwo) {
  const std::vector<std::pair<Value, std::string>> rows = {
      {5, "5"},
      {-1, "4294967295"},
      {-2, "4294967294"},
      {-1000, "4294966296"},
      {-2.9, "4294967294"},
      {"-3", "4294967293"},
      {INT32_MIN, "2147483648"},
      {int64_t{INT32_MIN} - 1, "2147483648"},
      {INT64_MIN, "2147483648"},
      {int64_t{INT32_MAX} + 1, "2147483648"},
      {UINT32_MAX - 1, "4294967294"},
      {UINT32_MAX, "4294967295"},
      {int64_t{1} << 32, "4294967295"},
      {(int64_t{1} << 32) + 1, "4294967295"},  // not 1, which is an environment
      {INT64_MAX, "4294967295"},
      {UINT64_MAX - 1, "4294967295"},
      {UINT64_MAX, "4294967295"}};
  for (const auto& [stored, printed] : rows) {
    log_.clear();
    set("environmentType", stored);
    EXPECT_EQ(ProcessValues(log_, device_, settings_, random_).currentEnvironmentType(),
              EnvironmentType::orvaneInternal);
    EXPECT_EQ(log_.lines(),
              (std::vector<fake::FakeLog::Line>{
                  {LogLevel::warning,
                   "userDefaultsEnvironment: 'environmentType' of com.orvane.tarnel should be a number "
                   "from 0 to 4, not " +
                       stored.description()},
                  {LogLevel::error, "userDefaultsEnvironment: Invalid environment type " + printed},
                  {LogLevel::information, "userDefaultsEnvironment: Environment type 2"}}))
        << stored.description();
  }
}

TEST_F(ProcessValuesTest, StoredEnvironmentOfAnotherKind) {
  set("environmentType", "4");
  EXPECT_EQ(values_.currentEnvironmentType(), EnvironmentType::release);
  EXPECT_TRUE(
      log_.contains(LogLevel::warning,
                    "userDefaultsEnvironment: 'environmentType' of com.orvane.tarnel should be a number "
                    "from 0 to 4, not 4"));
  set("environmentType", Array{});
  EXPECT_EQ(ProcessValues(log_, device_, settings_, random_).currentEnvironmentType(), EnvironmentType::seed);
  set("environmentType", true);
  EXPECT_EQ(ProcessValues(log_, device_, settings_, random_).currentEnvironmentType(),
            EnvironmentType::development);
}

TEST_F(ProcessValuesTest, EnvironmentIsComputedOnce) {
  set("environmentType", 1);
  EXPECT_EQ(values_.currentEnvironmentType(), EnvironmentType::development);
  set("environmentType", 4);
  EXPECT_EQ(values_.currentEnvironmentType(), EnvironmentType::development);
  EXPECT_EQ(log_.lines().size(), 1U);
}

TEST_F(ProcessValuesTest, StorebagURLOverrideIsReadOnce) {
  set("tarnel_storebag_url", "https://bags.example/x");
  EXPECT_EQ(values_.storebagURLOverride(), "https://bags.example/x");
  set("tarnel_storebag_url", "https://other.example");
  EXPECT_EQ(values_.storebagURLOverride(), "https://bags.example/x");

  ProcessValues unset(log_, device_, settings_, random_);
  settings_.removeObject("com.orvane.tarnel", "tarnel_storebag_url");
  EXPECT_EQ(unset.storebagURLOverride(), std::nullopt);
  set("tarnel_storebag_url", "https://late.example");
  EXPECT_EQ(unset.storebagURLOverride(), std::nullopt);
}

TEST_F(ProcessValuesTest, StorebagURLOverrideMustBeText) {
  set("tarnel_storebag_url", 17);
  EXPECT_EQ(values_.storebagURLOverride(), std::nullopt);
  EXPECT_TRUE(
      log_.contains(LogLevel::warning,
                    "storebagServerURL: ignoring 'tarnel_storebag_url' of com.orvane.tarnel: expected a "
                    "text"));
}

TEST_F(ProcessValuesTest, ManyThreadsComputeOnce) {
  device_.answers["ReleaseType"] = "Internal";
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([this] {
      EXPECT_TRUE(values_.isInternalBuild());
      EXPECT_EQ(values_.currentEnvironmentType(), EnvironmentType::orvaneInternal);
      EXPECT_EQ(values_.storebagURLOverride(), std::nullopt);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(device_.queries, 1);
  EXPECT_EQ(log_.lines().size(), 1U);
}

TEST_F(ProcessValuesTest, TheProcessLifetimeIdentifierStays) {
  const std::string made = values_.processLifetimeIdentifier();
  EXPECT_EQ(made, "00000000-0000-0000-0000-000000000001");
  EXPECT_EQ(values_.processLifetimeIdentifier(), made);
  EXPECT_NE(ProcessValues(log_, device_, settings_, random_).processLifetimeIdentifier(), made);
}

TEST_F(ProcessValuesTest, NamesHaveIdentifiersOfTheirOwnInEachProcess) {
  const std::string made = values_.processLifetimeIdentifier("name");
  EXPECT_EQ(values_.processLifetimeIdentifier("name"), made);
  EXPECT_NE(values_.processLifetimeIdentifier("name2"), made);
  EXPECT_NE(values_.processLifetimeIdentifier(""), values_.processLifetimeIdentifier());
  EXPECT_NE(ProcessValues(log_, device_, settings_, random_).processLifetimeIdentifier("name"), made);
}

TEST_F(ProcessValuesTest, IdentifiersAreMadeOneAfterTheOther) {
  EXPECT_TRUE(values_.lockIdentifierCreation().owns_lock());
}

// Whoever sees one cannot tell it from one that was drawn.
TEST_F(ProcessValuesTest, IdentifiersOfNamesLookDrawn) {
  for (int i = 0; i < 100; ++i) {
    EXPECT_THAT(values_.processLifetimeIdentifier(std::to_string(i)),
                testing::MatchesRegex("[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}"));
  }
}

}  // namespace
}  // namespace tarnel

#include "util/identifiers.h"

#include <gtest/gtest.h>

#include <set>
#include <thread>
#include <vector>

#include "platform/fake/fake_world.h"

namespace tarnel {
namespace {

class IdentifiersTest : public testing::Test {
 protected:
  std::string identifier(const MaybeString& first, const MaybeString& second) {
    return getPersistentIdentifierForCustomClientIDSuffix(world_.dependencies, first, second);
  }
  MaybeString stored(const std::string& key) {
    const auto value = world_.settings.objectForKey("com.orvane.tarnel", key);
    return value && value->string() != nullptr ? MaybeString(*value->string()) : std::nullopt;
  }

  fake::FakeWorld world_;
};

TEST_F(IdentifiersTest, IsStoredUnderUuidAndBothParts) {
  const auto made = identifier("App", "Media");
  EXPECT_EQ(made, "00000000-0000-0000-0000-000000000001");
  EXPECT_EQ(stored("uuid:App:Media"), made);
}

TEST_F(IdentifiersTest, SamePartsGiveTheSameAcrossRestarts) {
  const auto made = identifier("App", "Media");
  EXPECT_EQ(identifier("App", "Media"), made);
  fake::FakeWorld restarted;
  restarted.settings.setObject("com.orvane.tarnel", "uuid:App:Media", made);
  EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(restarted.dependencies, "App", "Media"), made);
}

TEST_F(IdentifiersTest, SwappedPartsGiveAnother) {
  const auto made = identifier("App", "Media");
  EXPECT_NE(identifier("Media", "App"), made);
  EXPECT_TRUE(stored("uuid:Media:App"));
}

TEST_F(IdentifiersTest, MissingPartsAreEmpty) {
  const auto made = identifier(std::nullopt, std::nullopt);
  EXPECT_EQ(stored("uuid::"), made);
  EXPECT_EQ(identifier("", ""), made);
  const auto firstOnly = identifier("App", std::nullopt);
  EXPECT_EQ(stored("uuid:App:"), firstOnly);
  const auto secondOnly = identifier(std::nullopt, "Media");
  EXPECT_EQ(stored("uuid::Media"), secondOnly);
}

TEST_F(IdentifiersTest, EveryCallLogsKeyAndValue) {
  const auto made = identifier("App", "Media");
  const std::string line =
      "getPersistentIdentifierForCustomClientIDSuffix: The value for uuid:App:Media: " + made;
  EXPECT_EQ(world_.log.lines(), (std::vector<fake::FakeLog::Line>{{LogLevel::information, line}}));
  identifier("App", "Media");
  EXPECT_EQ(world_.log.count(LogLevel::information, line), 2U);
}

TEST_F(IdentifiersTest, StoreThatCannotBeReadGivesANewOneEveryTime) {
  const auto kept = identifier("App", "Media");
  world_.settings.broken = true;
  const auto first = identifier("App", "Media");
  const auto second = identifier("App", "Media");
  EXPECT_EQ((std::set<std::string>{kept, first, second}.size()), 3U);
  EXPECT_EQ(
      world_.log
          .startingWith("getPersistentIdentifierForCustomClientIDSuffix: the value for uuid:App:Media could "
                        "not be stored: ")
          .size(),
      2U);
  world_.settings.broken = false;
  EXPECT_EQ(identifier("App", "Media"), kept);
}

TEST_F(IdentifiersTest, ValueThatIsNoIdentifierIsReplaced) {
  for (const Value& value : {Value(17), Value("")}) {
    world_.log.clear();
    world_.settings.setObject("com.orvane.tarnel", "uuid:App:Media", value);
    const auto made = identifier("App", "Media");
    EXPECT_EQ(made.size(), 36U);
    EXPECT_EQ(stored("uuid:App:Media"), made);
    EXPECT_TRUE(world_.log.contains(LogLevel::warning,
                                    "getPersistentIdentifierForCustomClientIDSuffix: ignoring the setting "
                                    "'uuid:App:Media' of com.orvane.tarnel: expected a text; remove it"));
  }
}

TEST_F(IdentifiersTest, KeysThatAreTooLongAreNotStored) {
  const std::string longest(512 - std::string("uuid:").size() - std::string(":").size(), 'x');
  EXPECT_EQ(identifier(longest, std::nullopt), identifier(longest, std::nullopt));
  EXPECT_NE(identifier(longest + "x", std::nullopt), identifier(longest + "x", std::nullopt));
  EXPECT_EQ(stored("uuid:" + longest + "x:"), std::nullopt);
  EXPECT_TRUE(world_.log.contains(LogLevel::warning,
                                  "getPersistentIdentifierForCustomClientIDSuffix: a key of 513 bytes is not "
                                  "stored; names may have 512 bytes together"));
}

TEST_F(IdentifiersTest, ThreadsThatAskAtOnceGetTheSame) {
  std::vector<std::string> results(4);
  std::vector<std::thread> threads;
  for (auto& result : results) {
    threads.emplace_back([this, &result] { result = identifier("App", "Media"); });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ((std::set<std::string>(results.begin(), results.end()).size()), 1U);
}

TEST_F(IdentifiersTest, ProcessLifetimeIdentifierStays) {
  const std::string made = processLifetimeIdentifier(world_.random);
  EXPECT_EQ(made.size(), 36U);
  EXPECT_EQ(processLifetimeIdentifier(world_.random), made);
}

}  // namespace
}  // namespace tarnel

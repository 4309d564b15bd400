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

TEST_F(IdentifiersTest, ValueThatIsNoTextIsReplaced) {
  world_.settings.setObject("com.orvane.tarnel", "uuid:App:Media", Value(17));
  const auto made = identifier("App", "Media");
  EXPECT_EQ(made.size(), 36U);
  EXPECT_EQ(stored("uuid:App:Media"), made);
  EXPECT_TRUE(world_.log.contains(LogLevel::warning,
                                  "getPersistentIdentifierForCustomClientIDSuffix: ignoring the setting "
                                  "'uuid:App:Media' of com.orvane.tarnel: expected a text; remove it"));
}

TEST_F(IdentifiersTest, AnyTextThatIsStoredIsTheIdentifier) {
  for (const char* text : {"", "no UUID"}) {
    world_.settings.setObject("com.orvane.tarnel", "uuid:App:Media", text);
    EXPECT_EQ(identifier("App", "Media"), text);
    EXPECT_EQ(stored("uuid:App:Media"), text);
  }
  EXPECT_EQ(world_.log.lines().size(), 2U) << "without a warning";
}

TEST_F(IdentifiersTest, LongKeysAreStoredLikeOthers) {
  for (const size_t length : {500, 513, 5000, 65536}) {
    const std::string name(length, 'x');
    const auto made = identifier(name, "Media");
    EXPECT_EQ(stored("uuid:" + name + ":Media"), made);
    EXPECT_EQ(identifier(name, "Media"), made);
  }
}

// --- what may be stored in all ---

constexpr char kFull[] =
    "getPersistentIdentifierForCustomClientIDSuffix: the identifiers stored for clients would take more than "
    "262144 bytes; this one lasts until the daemon ends. Remove some that nobody needs, with: tarnelctl "
    "settings unset com.orvane.tarnel KEY";
constexpr size_t kBesidesName = 64 + 6;  // the entry, and "uuid:" with the second colon

class IdentifierRoomTest : public IdentifiersTest {
 protected:
  // A name whose identifier takes so much.
  static std::string nameOf(size_t bytes, char letter = 'x') {
    return std::string(bytes - kBesidesName, letter);
  }
  bool isStored(const std::string& name) { return stored("uuid:" + name + ":").has_value(); }
};

TEST_F(IdentifierRoomTest, TheLastByteIsUsedAndNoMore) {
  identifier(nameOf(262144 - 100), std::nullopt);
  identifier(nameOf(101, 'y'), std::nullopt);
  EXPECT_FALSE(isStored(nameOf(101, 'y')));
  EXPECT_EQ(world_.log.count(LogLevel::warning, kFull), 1U);
  identifier(nameOf(100), std::nullopt);
  EXPECT_TRUE(isStored(nameOf(100)));
  identifier(nameOf(100, 'z'), std::nullopt);
  EXPECT_FALSE(isStored(nameOf(100, 'z')));
  EXPECT_EQ(world_.log.count(LogLevel::warning, kFull), 2U);
}

TEST_F(IdentifierRoomTest, OneWithoutRoomLastsForTheProcessAndPushesNothingOut) {
  const auto first = identifier(nameOf(262144), std::nullopt);
  const auto second = identifier("App", "Media");
  const auto third = identifier("App", "Music");
  EXPECT_EQ(second.size(), 36U);
  EXPECT_NE(second, third);
  for (int i = 0; i < 1000; ++i) identifier("App" + std::to_string(i), "Media");
  EXPECT_EQ(identifier("App", "Media"), second);
  EXPECT_EQ(identifier("App", "Music"), third);
  EXPECT_EQ(identifier(nameOf(262144), std::nullopt), first);
  EXPECT_EQ(world_.settings.ownKeys("com.orvane.tarnel", "uuid:").size(), 1U);
}

TEST_F(IdentifierRoomTest, OneIsStoredOnceThereIsRoom) {
  identifier(nameOf(262144), std::nullopt);
  identifier("App", "Media");
  world_.settings.removeObject("com.orvane.tarnel", "uuid:" + nameOf(262144) + ":");
  const auto made = identifier("App", "Media");
  EXPECT_EQ(stored("uuid:App:Media"), made);
}

// One control character takes six in the file.
TEST_F(IdentifierRoomTest, WhatTheFileSpellsLongerCountsMore) {
  for (const char escaped : {'\x01', '\x1F', '\x7F', '"', '\\'}) {
    const std::string most((262144 - kBesidesName) / 6, escaped);
    identifier(most + escaped, std::nullopt);
    EXPECT_FALSE(isStored(most + escaped)) << int{escaped};
    identifier(most, std::nullopt);
    EXPECT_TRUE(isStored(most)) << int{escaped};
    world_.settings.removeObject("com.orvane.tarnel", "uuid:" + most + ":");
  }
}

TEST_F(IdentifierRoomTest, OtherSettingsDoNotCount) {
  world_.settings.setObject("com.orvane.tarnel", std::string(300000, 'x'), "text");
  world_.settings.setObject("com.example", "uuid:" + std::string(300000, 'x') + ":", "text");
  const auto made = identifier("App", "Media");
  EXPECT_EQ(stored("uuid:App:Media"), made);
}

// It has its place already.
TEST_F(IdentifierRoomTest, ReplacingWhatIsNoTextNeedsNoFurtherRoom) {
  world_.settings.setObject("com.orvane.tarnel", "uuid:" + nameOf(262144) + ":", Value(17));
  const auto made = identifier(nameOf(262144), std::nullopt);
  EXPECT_EQ(stored("uuid:" + nameOf(262144) + ":"), made);
}

// Both looked and found none; the second waits for the first, and then has its identifier too.
TEST_F(IdentifiersTest, WhoWaitedForAnotherGetsWhatThatOneMade) {
  std::string others;
  world_.settings.afterNextRead = [this, &others] { others = identifier("App", "Media"); };
  EXPECT_EQ(identifier("App", "Media"), "00000000-0000-0000-0000-000000000001");
  EXPECT_EQ(others, "00000000-0000-0000-0000-000000000001");
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

}  // namespace
}  // namespace tarnel

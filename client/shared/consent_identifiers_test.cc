#include "client/shared/consent_identifiers.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/fake/fake_random.h"
#include "platform/fake/fake_settings_store.h"

namespace tarnel {
namespace {

constexpr char kDomain[] = "com.orvane.tarnel";

class SwitchedConsent final : public Consent {
 public:
  bool isDiagnosticSubmissionAllowed() override { return allowed; }
  std::atomic<bool> allowed{false};
};

// A store that reads but does not forget.
class StubbornStore final : public SettingsStore {
 public:
  std::optional<Value> objectForKey(std::string_view domain, std::string_view key) override {
    return inner.objectForKey(domain, key);
  }
  MaybeError setObject(std::string_view domain, std::string_view key, const Value& value) override {
    return inner.setObject(domain, key, value);
  }
  MaybeError removeObject(std::string_view domain, std::string_view key) override {
    if (stubborn) return Error("test", 1, "no");
    return inner.removeObject(domain, key);
  }
  fake::FakeSettingsStore inner;
  bool stubborn = false;
};

class ConsentIdentifiersTest : public testing::Test {
 protected:
  StubbornStore settings_;
  SwitchedConsent consent_;
  fake::FakeRandom random_;
  ConsentIdentifiers identifiers_{settings_, consent_, random_};
};

TEST_F(ConsentIdentifiersTest, TheOverridingOneIsMadeOnceWhateverTheConsent) {
  const auto first = identifiers_.getPersistentIdentifierForDNU(0);
  ASSERT_TRUE(first);
  EXPECT_EQ(first->size(), 36U);
  consent_.allowed = true;
  EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(0), first);
  EXPECT_EQ(settings_.objectForKey(kDomain, "dnu:override"), Value(*first));
  ConsentIdentifiers afterRestart(settings_, consent_, random_);
  EXPECT_EQ(afterRestart.getPersistentIdentifierForDNU(0), first);
}

TEST_F(ConsentIdentifiersTest, TheRespectingOneIsAbsentWhileConsentIsWithheld) {
  EXPECT_FALSE(identifiers_.getPersistentIdentifierForDNU(1));
  EXPECT_FALSE(settings_.objectForKey(kDomain, "dnu:respect"));
}

TEST_F(ConsentIdentifiersTest, TheRespectingOneIsDroppedAndMadeAnew) {
  consent_.allowed = true;
  const auto first = identifiers_.getPersistentIdentifierForDNU(1);
  ASSERT_TRUE(first);
  EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(1), first);
  EXPECT_EQ(settings_.objectForKey(kDomain, "dnu:respect"), Value(*first));
  EXPECT_NE(identifiers_.getPersistentIdentifierForDNU(0), first);
  consent_.allowed = false;
  EXPECT_FALSE(identifiers_.getPersistentIdentifierForDNU(1));
  EXPECT_FALSE(settings_.objectForKey(kDomain, "dnu:respect"));
  consent_.allowed = true;
  const auto second = identifiers_.getPersistentIdentifierForDNU(1);
  ASSERT_TRUE(second);
  EXPECT_NE(second, first);
}

TEST_F(ConsentIdentifiersTest, WhatTheStoreCouldNotForgetDoesNotComeBack) {
  consent_.allowed = true;
  const auto first = identifiers_.getPersistentIdentifierForDNU(1);
  consent_.allowed = false;
  settings_.stubborn = true;
  EXPECT_FALSE(identifiers_.getPersistentIdentifierForDNU(1));
  consent_.allowed = true;
  EXPECT_NE(identifiers_.getPersistentIdentifierForDNU(1), first);
  settings_.stubborn = false;
  const auto second = identifiers_.getPersistentIdentifierForDNU(1);
  EXPECT_NE(second, first);
  EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(1), second);
}

TEST_F(ConsentIdentifiersTest, AStoreThatCannotBeReadGivesANewOneEveryTime) {
  settings_.inner.broken = true;
  const auto first = identifiers_.getPersistentIdentifierForDNU(0);
  const auto second = identifiers_.getPersistentIdentifierForDNU(0);
  ASSERT_TRUE(first && second);
  EXPECT_NE(first, second);
}

TEST_F(ConsentIdentifiersTest, AValueThatIsNoTextIsReplaced) {
  ASSERT_FALSE(settings_.setObject(kDomain, "dnu:override", Value(7)));
  const auto first = identifiers_.getPersistentIdentifierForDNU(0);
  EXPECT_EQ(settings_.objectForKey(kDomain, "dnu:override"), Value(*first));
}

TEST_F(ConsentIdentifiersTest, TwoFirstQuestionsGetOneAnswer) {
  std::vector<MaybeString> answers(4);
  std::vector<std::thread> threads;
  for (auto& answer : answers) {
    threads.emplace_back([this, &answer] { answer = identifiers_.getPersistentIdentifierForDNU(0); });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& answer : answers) EXPECT_EQ(answer, answers[0]);
}

}  // namespace
}  // namespace tarnel

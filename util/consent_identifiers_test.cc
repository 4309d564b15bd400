#include "util/consent_identifiers.h"

#include <gtest/gtest.h>

#include <atomic>
#include <set>
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

// A store that reads, and on demand neither forgets nor keeps.
class StubbornStore final : public SettingsStore {
 public:
  std::optional<Value> objectForKey(std::string_view domain, std::string_view key) override {
    return inner.objectForKey(domain, key);
  }
  MaybeError setObject(std::string_view domain, std::string_view key, const Value& value) override {
    ++changes;
    if (keepsNothingNew) return Error("test", 2, "no");
    return inner.setObject(domain, key, value);
  }
  MaybeError removeObject(std::string_view domain, std::string_view key) override {
    ++changes;
    if (forgetsNothing) return Error("test", 1, "no");
    return inner.removeObject(domain, key);
  }
  std::vector<std::string> ownKeys(std::string_view domain, std::string_view prefix) override {
    return inner.ownKeys(domain, prefix);
  }
  fake::FakeSettingsStore inner;
  bool forgetsNothing = false;
  bool keepsNothingNew = false;
  int changes = 0;
};

class ConsentIdentifiersTest : public testing::Test {
 protected:
  // The one that honours consent, after the user decided.
  std::string respecting(bool allowed) {
    consent_.allowed = allowed;
    return identifiers_.getPersistentIdentifierForDNU(1).value_or("none");
  }
  // As the tool does that writes decisions.
  MaybeError decide(bool allowed) {
    consent_.allowed = allowed;
    return ConsentIdentifiers(settings_, consent_, random_).consentChanged();
  }
  MaybeString stored(const char* key) {
    const auto value = settings_.objectForKey(kDomain, key);
    return value && value->string() != nullptr ? MaybeString(*value->string()) : std::nullopt;
  }

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

TEST_F(ConsentIdentifiersTest, TheRespectingOneIsStableUnderEitherDecision) {
  for (const bool allowed : {false, true}) {
    const auto first = respecting(allowed);
    EXPECT_EQ(first.size(), 36U);
    EXPECT_EQ(respecting(allowed), first);
    EXPECT_NE(identifiers_.getPersistentIdentifierForDNU(0), first);
    EXPECT_EQ(stored(allowed ? "dnu:respect" : "dnu:withheld"), first);
    EXPECT_EQ(stored(allowed ? "dnu:withheld" : "dnu:respect"), std::nullopt);
    ConsentIdentifiers afterRestart(settings_, consent_, random_);
    EXPECT_EQ(afterRestart.getPersistentIdentifierForDNU(1), first);
  }
}

TEST_F(ConsentIdentifiersTest, TheRespectingOneIsDrawnAnewWithEveryChange) {
  std::set<std::string> seen;
  for (const bool allowed : {true, false, true, false, false, true}) seen.insert(respecting(allowed));
  EXPECT_EQ(seen.size(), 5U);
}

// Nobody asks between two changes, as when the daemon does not run.
TEST_F(ConsentIdentifiersTest, AChangeThatNobodySawIsToldByWhoMakesIt) {
  for (const bool allowed : {true, false}) {
    const auto first = respecting(allowed);
    EXPECT_FALSE(decide(!allowed));
    EXPECT_FALSE(decide(allowed));
    EXPECT_NE(respecting(allowed), first) << allowed;
    EXPECT_NE(ConsentIdentifiers(settings_, consent_, random_).getPersistentIdentifierForDNU(1), first);
  }
}

TEST_F(ConsentIdentifiersTest, ADecisionThatIsRepeatedChangesNothing) {
  for (const bool allowed : {true, false}) {
    const auto first = respecting(allowed);
    EXPECT_FALSE(decide(allowed));
    EXPECT_EQ(respecting(allowed), first);
  }
}

TEST_F(ConsentIdentifiersTest, NothingIsWrittenAsLongAsTheDecisionHolds) {
  respecting(true);
  const int before = settings_.changes;
  respecting(true);
  EXPECT_EQ(settings_.changes, before);
}

TEST_F(ConsentIdentifiersTest, WhatTheStoreCouldNotForgetDoesNotComeBack) {
  for (const bool allowed : {true, false}) {
    const auto first = respecting(allowed);
    settings_.forgetsNothing = true;
    EXPECT_TRUE(decide(!allowed));
    const auto other = respecting(!allowed);
    EXPECT_NE(other, first);
    EXPECT_EQ(respecting(!allowed), other);
    settings_.keepsNothingNew = true;
    const auto second = respecting(allowed);
    EXPECT_NE(second, first);
    EXPECT_EQ(respecting(allowed), second) << "stable, though it cannot be stored";
    settings_.forgetsNothing = settings_.keepsNothingNew = false;
    EXPECT_EQ(respecting(allowed), second);
    EXPECT_EQ(respecting(allowed), second);
    EXPECT_EQ(stored(allowed ? "dnu:respect" : "dnu:withheld"), second);
    EXPECT_EQ(stored(allowed ? "dnu:withheld" : "dnu:respect"), std::nullopt);
  }
}

TEST_F(ConsentIdentifiersTest, WhatAnotherProcessDrewIsUsedAndForgottenToo) {
  respecting(true);
  settings_.setObject(kDomain, "dnu:withheld", "drawn elsewhere");
  EXPECT_EQ(respecting(false), "drawn elsewhere");
  respecting(true);
  EXPECT_EQ(stored("dnu:withheld"), std::nullopt);
}

TEST_F(ConsentIdentifiersTest, WhatCouldNotBeStoredIsForgottenToo) {
  settings_.keepsNothingNew = true;
  const auto first = respecting(true);
  const auto withheld = respecting(false);
  EXPECT_NE(respecting(true), first);
  EXPECT_NE(respecting(false), withheld);
}

TEST_F(ConsentIdentifiersTest, WithoutAStoreBothHoldForTheProcess) {
  settings_.inner.broken = true;
  const auto overriding = identifiers_.getPersistentIdentifierForDNU(0);
  ASSERT_TRUE(overriding);
  const auto respected = respecting(true);
  EXPECT_NE(respected, overriding);
  EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(0), overriding);
  EXPECT_EQ(respecting(true), respected);
  settings_.inner.broken = false;
  EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(0), overriding);
  EXPECT_EQ(stored("dnu:override"), overriding);
}

TEST_F(ConsentIdentifiersTest, AnyTextThatIsStoredIsTheIdentifier) {
  consent_.allowed = true;
  for (const char* text : {"", "no UUID"}) {
    for (const char* key : {"dnu:override", "dnu:respect"}) settings_.setObject(kDomain, key, text);
    EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(0), text);
    EXPECT_EQ(identifiers_.getPersistentIdentifierForDNU(1), text);
  }
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

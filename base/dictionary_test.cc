#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "base/value.h"

namespace tarnel {
namespace {

Dictionary numbered(size_t count) {
  Dictionary result;
  for (size_t i = 0; i < count; ++i) result.set("key" + std::to_string(i), i);
  return result;
}

std::vector<std::string> keysOf(const Dictionary& dictionary) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : dictionary) keys.push_back(key);
  return keys;
}

TEST(DictionaryTest, keepsTheOrderOfInsertionAndThePlaceOfAKey) {
  Dictionary dictionary = {{"b", 1}, {"a", 2}, {"b", 3}};
  dictionary.set("c", 4);
  dictionary.set("a", 5);
  EXPECT_EQ(keysOf(dictionary), (std::vector<std::string>{"b", "a", "c"}));
  EXPECT_EQ(*dictionary.find("b"), Value(3));
  EXPECT_EQ(*dictionary.find("a"), Value(5));
  EXPECT_EQ(dictionary.find("d"), nullptr);
}

TEST(DictionaryTest, isEmptyWhenNew) {
  const Dictionary none;
  EXPECT_TRUE(none.empty());
  EXPECT_EQ(none.begin(), none.end());
  EXPECT_EQ(none.find("x"), nullptr);
  EXPECT_EQ(none, (Dictionary{}));
  Dictionary reserved;
  reserved.reserve(4);
  EXPECT_EQ(none, reserved);
}

// The index appears at 65 entries; everything must hold on both sides of that edge.
TEST(DictionaryTest, findsReplacesAndRemovesAtAnySize) {
  for (const size_t count : {1, 63, 64, 65, 66, 100, 1000}) {
    Dictionary dictionary = numbered(count);
    ASSERT_EQ(dictionary.size(), count);
    for (size_t i = 0; i < count; ++i) {
      const Value* found = dictionary.find("key" + std::to_string(i));
      ASSERT_NE(found, nullptr) << i << " of " << count;
      EXPECT_EQ(*found, Value(i));
    }
    EXPECT_EQ(dictionary.find("key"), nullptr);
    dictionary.set("key0", "new");
    EXPECT_EQ(dictionary.size(), count);
    EXPECT_EQ(*dictionary.find("key0"), Value("new"));
    EXPECT_TRUE(dictionary.remove("key0"));
    EXPECT_FALSE(dictionary.remove("key0"));
    EXPECT_EQ(dictionary.size(), count - 1);
    for (size_t i = 1; i < count; ++i) {
      ASSERT_EQ(*dictionary.find("key" + std::to_string(i)), Value(i)) << count;
    }
    dictionary.set("key0", "back");
    EXPECT_EQ(keysOf(dictionary).back(), "key0");
  }
}

TEST(DictionaryTest, shrinksBelowTheIndexAndGrowsAgain) {
  Dictionary dictionary = numbered(70);
  for (size_t i = 0; i < 67; ++i) dictionary.remove("key" + std::to_string(i));
  EXPECT_EQ(*dictionary.find("key69"), Value(69));
  for (size_t i = 0; i < 67; ++i) dictionary.set("key" + std::to_string(i), "again");
  EXPECT_EQ(dictionary.size(), 70U);
  EXPECT_EQ(*dictionary.find("key67"), Value(67));
  EXPECT_EQ(*dictionary.find("key66"), Value("again"));
}

TEST(DictionaryTest, copiesShareUntilOneIsWritten) {
  const Dictionary original = numbered(40);
  Dictionary copy = original;
  EXPECT_EQ(copy.begin(), original.begin());
  copy.set("key1", "changed");
  EXPECT_NE(copy.begin(), original.begin());
  EXPECT_EQ(*original.find("key1"), Value(1));
  EXPECT_EQ(*copy.find("key1"), Value("changed"));
  copy = original;
  copy.remove("key2");
  EXPECT_TRUE(original.contains("key2"));
  copy = original;
  EXPECT_FALSE(copy.remove("absent"));
  EXPECT_EQ(copy.begin(), original.begin()) << "nothing was written, so nothing is copied";
}

TEST(DictionaryTest, copiesOnOtherThreadsMayBeWrittenAtOnce) {
  const Dictionary original = numbered(50);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([mine = original]() mutable {
      for (int i = 0; i < 200; ++i) {
        Dictionary copy = mine;
        copy.set("key1", i);
        mine.set("key2", i);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(original, numbered(50));
}

TEST(DictionaryTest, editsEveryEntryOnceAndDropsTheRefused) {
  Dictionary dictionary = numbered(40);
  const Dictionary before = dictionary;
  size_t visits = 0;
  dictionary.editEntries([&visits](const std::string&, Value& value) {
    ++visits;
    if (value.int64Value() % 2 == 1) return false;
    value = Value(value.int64Value() * 10);
    return true;
  });
  EXPECT_EQ(visits, 40U);
  EXPECT_EQ(dictionary.size(), 20U);
  EXPECT_EQ(dictionary.find("key1"), nullptr);
  EXPECT_EQ(*dictionary.find("key38"), Value(380));
  EXPECT_EQ(keysOf(dictionary)[1], "key2");
  EXPECT_EQ(before, numbered(40));
  dictionary.editEntries([](const std::string&, Value&) { return false; });
  EXPECT_TRUE(dictionary.empty());
  dictionary.set("key2", 2);
  EXPECT_EQ(dictionary.size(), 1U);
}

TEST(DictionaryTest, keepsTheIndexRightWhenAnEditDropsSomeOfMany) {
  Dictionary dictionary = numbered(100);
  dictionary.editEntries([](const std::string& key, Value&) { return key != "key0"; });
  EXPECT_EQ(dictionary.find("key0"), nullptr);
  for (size_t i = 1; i < 100; ++i) ASSERT_EQ(*dictionary.find("key" + std::to_string(i)), Value(i));
}

TEST(DictionaryTest, mergesTheOtherOverItself) {
  Dictionary dictionary = {{"a", 1}, {"b", 2}};
  dictionary.merge(Dictionary{{"b", 3}, {"c", 4}});
  EXPECT_EQ(dictionary, (Dictionary{{"a", 1}, {"b", 3}, {"c", 4}}));
  dictionary.merge(dictionary);
  EXPECT_EQ(dictionary.size(), 3U);
  dictionary.merge(Dictionary());
  EXPECT_EQ(dictionary.size(), 3U);
  Dictionary none;
  none.merge(dictionary);
  EXPECT_EQ(none.begin(), dictionary.begin()) << "taken as a whole";
}

TEST(DictionaryTest, isEqualWhateverTheOrder) {
  EXPECT_EQ((Dictionary{{"a", 1}, {"b", 2}}), (Dictionary{{"b", 2}, {"a", 1}}));
  EXPECT_FALSE((Dictionary{{"a", 1}}) == (Dictionary{{"a", 2}}));
  EXPECT_FALSE((Dictionary{{"a", 1}}) == (Dictionary{{"b", 1}}));
  EXPECT_FALSE((Dictionary{{"a", 1}}) == (Dictionary{{"a", 1}, {"b", 1}}));
}

TEST(DictionaryTest, lookupsByTypeGiveNothingForAnotherType) {
  const Dictionary dictionary = {
      {"text", "t"}, {"number", 1.5}, {"flag", true}, {"inner", Dictionary{{"x", 1}}}, {"list", Array{1}}};
  EXPECT_EQ(*findString(dictionary, "text"), "t");
  EXPECT_EQ(findString(dictionary, "number"), nullptr);
  EXPECT_EQ(findString(dictionary, "absent"), nullptr);
  EXPECT_EQ(findDictionary(dictionary, "inner")->size(), 1U);
  EXPECT_EQ(findDictionary(dictionary, "list"), nullptr);
  EXPECT_EQ(findArray(dictionary, "list")->size(), 1U);
  EXPECT_EQ(findArray(dictionary, "inner"), nullptr);
  EXPECT_EQ(*findNumber(dictionary, "flag"), Value(true));
  EXPECT_EQ(*findNumber(dictionary, "number"), Value(1.5));
  EXPECT_EQ(findNumber(dictionary, "text"), nullptr);
  EXPECT_EQ(findNumber(dictionary, "absent"), nullptr);
}

// Same length, same first, middle and last letter.
TEST(DictionaryTest, tellsKeysApartThatLookAlike) {
  Dictionary dictionary = {{"a1c2e", 1}};
  EXPECT_EQ(dictionary.find("a2c1e"), nullptr);
  dictionary.set("a2c1e", 2);
  EXPECT_EQ(dictionary.size(), 2U);
  EXPECT_TRUE(dictionary.remove("a1c2e"));
  EXPECT_EQ(dictionary.find("a1c2e"), nullptr);
  EXPECT_EQ(*dictionary.find("a2c1e"), Value(2));
  dictionary.set("a1c2e", 3);
  EXPECT_EQ(keysOf(dictionary), (std::vector<std::string>{"a2c1e", "a1c2e"}));
}

TEST(DictionaryTest, findsKeysOfEveryShapeAndLength) {
  Dictionary dictionary;
  std::vector<std::string> keys;
  for (size_t length = 0; length < 60; ++length) keys.emplace_back(length, static_cast<char>(0xC8 - length));
  for (const auto& key : keys) EXPECT_EQ(dictionary.find(key), nullptr);
  for (const auto& key : keys) dictionary.set(key, key.size());
  const Dictionary shared = dictionary;
  dictionary.editEntries([](const std::string& key, Value&) { return key.size() % 2 == 0; });
  for (const auto& key : keys) {
    EXPECT_EQ(dictionary.contains(key), key.size() % 2 == 0);
    EXPECT_EQ(*shared.find(key), Value(key.size()));
  }
}

TEST(DictionaryTest, aCopyWithRoomIsIndependentAndWhole) {
  for (const size_t count : {size_t{0}, size_t{3}, size_t{100}}) {
    const Dictionary original = numbered(count);
    Dictionary copy = original.copyWithRoomFor(10);
    EXPECT_EQ(copy, original);
    const auto* first = copy.begin();
    for (int i = 0; i < 10; ++i) copy.set("more" + std::to_string(i), i);
    EXPECT_EQ(copy.begin(), first);
    copy.set("key0", "changed");
    EXPECT_EQ(original.size(), count);
    EXPECT_EQ(original, numbered(count));
    EXPECT_EQ(*copy.find("more9"), Value(9));
  }
}

}  // namespace
}  // namespace tarnel

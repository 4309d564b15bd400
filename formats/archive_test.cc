#include "formats/archive.h"

#include <gtest/gtest.h>

#include <cmath>
#include <fstream>
#include <iterator>
#include <limits>
#include <string>

#include "formats/archive_format.h"
#include "formats/document.h"

namespace tarnel {
namespace {

// The document that an archive is, as any reader of CBOR sees it.
Value documentIn(const std::string& archive) {
  const auto document = parseDocument(archive);
  EXPECT_TRUE(static_cast<bool>(document));
  return document ? *document : Value();
}
Array objectsOf(const Value& root) {
  const auto archive = archiveObject(root);
  EXPECT_TRUE(static_cast<bool>(archive)) << archive.error().description();
  return *findArray(*documentIn(*archive).dictionary(), "objects");
}
// An archive that somebody else made.
std::string archiveOf(Array objects, Value root, Value version = 1) {
  return std::string(kArchiveMark) +
         writeBinaryDocument(Dictionary{
             {"version", std::move(version)}, {"root", std::move(root)}, {"objects", std::move(objects)}});
}
Value there(const Value& value) {
  const auto archive = archiveObject(value);
  EXPECT_TRUE(static_cast<bool>(archive)) << archive.error().description();
  const auto back = unarchiveObject(*archive);
  EXPECT_TRUE(static_cast<bool>(back)) << back.error().description();
  return back ? *back : Value("unreadable");
}
void expectProblem(const Result<Value>& result, int64_t code, const std::string& text) {
  ASSERT_FALSE(static_cast<bool>(result));
  EXPECT_EQ(result.error().domain(), kArchiveErrorDomain);
  EXPECT_EQ(result.error().code(), code);
  EXPECT_EQ(result.error().localizedDescription(), text);
}
void expectProblem(const Result<std::string>& result, int64_t code, const std::string& text) {
  ASSERT_FALSE(static_cast<bool>(result));
  EXPECT_EQ(result.error().code(), code);
  EXPECT_EQ(result.error().localizedDescription(), text);
}
Value nested(size_t depth) {
  Value value = "core";
  for (size_t i = 0; i < depth; ++i)
    value = i % 2 == 0 ? Value(Array{value}) : Value(Dictionary{{"k", value}});
  return value;
}
Dictionary dictionaryObject(Array keys, Array values) {
  return {{"keys", std::move(keys)}, {"values", std::move(values)}};
}

TEST(ArchiveTest, EveryKindOfValueComesBack) {
  const Array all{Value(),
                  true,
                  false,
                  0,
                  23,
                  24,
                  -1,
                  std::numeric_limits<int64_t>::min(),
                  std::numeric_limits<int64_t>::max(),
                  std::numeric_limits<uint64_t>::max(),
                  0.5,
                  -0.0,
                  std::numeric_limits<double>::infinity(),
                  Date{1700000000.25},
                  "",
                  "Grüße",
                  Data{},
                  Data{0, 255},
                  Array(),
                  Dictionary(),
                  Dictionary{{"", 1}, {"b", Array{1, 2}}}};
  const Value back = there(all);
  ASSERT_NE(back.array(), nullptr);
  ASSERT_EQ(back.array()->size(), all.size());
  for (size_t i = 0; i < all.size(); ++i) {
    EXPECT_EQ((*back.array())[i], all[i]) << i;
    EXPECT_EQ((*back.array())[i].type(), all[i].type()) << i;
  }
  EXPECT_TRUE(std::signbit(*(*back.array())[11].real()));
}

TEST(ArchiveTest, NotANumberComesBack) {
  EXPECT_TRUE(std::isnan(*there(std::nan("")).real()));
}

TEST(ArchiveTest, AnythingMayBeTheRoot) {
  EXPECT_EQ(there(7), Value(7));
  EXPECT_EQ(there("text"), Value("text"));
  EXPECT_EQ(there(Array()), Value(Array()));
  EXPECT_EQ(there(Dictionary{{"a", 1}}), Value(Dictionary{{"a", 1}}));
}

TEST(ArchiveTest, EqualObjectsStandOnce) {
  const Dictionary record{{"level", 3}, {"text", "level"}};
  EXPECT_EQ(objectsOf(Array{record, record, 3, "level"}),
            (Array{"level", 3, "text", dictionaryObject({0, 2}, {1, 0}), Array{3, 3, 1, 0}}));
}

TEST(ArchiveTest, EqualNumbersOfDifferentKindsAreDifferentObjects) {
  EXPECT_EQ(objectsOf(Array{1, 1.0, true, "1", Date{1}, 0.0, -0.0}).size(), 8U);
}

TEST(ArchiveTest, DictionariesAreEqualInAnyOrderOfTheirEntries) {
  EXPECT_EQ(objectsOf(Array{Dictionary{{"a", 1}, {"b", 2}}, Dictionary{{"b", 2}, {"a", 1}}}),
            (Array{"a", 1, "b", 2, dictionaryObject({0, 2}, {1, 3}), Array{4, 4}}));
}

TEST(ArchiveTest, DictionaryKeepsItsOrderWhenItsKeysAreNew) {
  const Value back = there(Dictionary{{"z", 1}, {"a", 2}, {"m", 3}});
  EXPECT_EQ(back.description(), R"({"z": 1, "a": 2, "m": 3})");
}

TEST(ArchiveTest, HeadNamesVersionAndRoot) {
  const auto archive = archiveObject(Array{"a"});
  EXPECT_TRUE(archive->starts_with("\xD9\xD9\xF7\xA3"));
  EXPECT_EQ(documentIn(*archive),
            Value(Dictionary{{"version", 1}, {"root", 1}, {"objects", Array{"a", Array{0}}}}));
}

TEST(ArchiveTest, EmptyArrayIsAnArchiveLikeAnyOther) {
  EXPECT_EQ(objectsOf(Array()), (Array{Array()}));
}

// --- what cannot be archived ---

TEST(ArchiveTest, TextThatIsNotUtf8Fails) {
  expectProblem(archiveObject(Array{"fine", "\xFF"}), kArchiveNotText,
                "text that is not UTF-8; give it as data");
  expectProblem(archiveObject(Dictionary{{"\xC0\x80", 1}}), kArchiveNotText,
                "a key that is not UTF-8; give it as data");
}

TEST(ArchiveTest, DeepNestingFails) {
  EXPECT_EQ(there(nested(32)), nested(32));
  expectProblem(archiveObject(nested(33)), kArchiveTooLarge,
                "more than 32 levels of nesting; archive less at once");
  expectProblem(archiveObject(nested(1000)), kArchiveTooLarge,
                "more than 32 levels of nesting; archive less at once");
}

TEST(ArchiveTest, TooManyValuesFail) {
  const Array three{1, 1, 1};
  EXPECT_TRUE(static_cast<bool>(archiveObject(three, {.values = 4})));
  expectProblem(archiveObject(three, {.values = 3}), kArchiveTooLarge,
                "more than 3 values; archive less at once");
  expectProblem(archiveObject(Dictionary{{"a", 1}}, {.values = 2}), kArchiveTooLarge,
                "more than 2 values; archive less at once");
}

TEST(ArchiveTest, TooManyBytesFail) {
  const auto archive = archiveObject("0123456789");
  EXPECT_TRUE(static_cast<bool>(archiveObject("0123456789", {.bytes = archive->size()})));
  expectProblem(archiveObject("0123456789", {.bytes = archive->size() - 1}), kArchiveTooLarge,
                "more than " + std::to_string(archive->size() - 1) + " bytes; archive less at once");
  const Value text(std::string(100, 'x'));  // as often as it occurs, as a reader counts it
  EXPECT_TRUE(static_cast<bool>(archiveObject(Array{text, text}, {.bytes = 200})));
  expectProblem(archiveObject(Array{text, text}, {.bytes = 199}), kArchiveTooLarge,
                "more than 199 bytes; archive less at once");
  const Value data(Data(100, 7));
  expectProblem(archiveObject(Array{data, data}, {.bytes = 199}), kArchiveTooLarge,
                "more than 199 bytes; archive less at once");
}

TEST(ArchiveTest, WhatIsWrittenCanBeReadUnderTheSameLimits) {
  Array dictionaries;
  for (int i = 0; i < 50; ++i) dictionaries.append(Dictionary{{"k" + std::to_string(i), i}});
  const ArchiveLimits limits{.depth = 2, .values = 151};
  const auto archive = archiveObject(dictionaries, limits);
  ASSERT_TRUE(static_cast<bool>(archive));
  const auto back = unarchiveObject(*archive, limits);
  ASSERT_TRUE(static_cast<bool>(back)) << back.error().description();
  EXPECT_EQ(*back, Value(dictionaries));
}

TEST(ArchiveTest, WhoStoresEqualObjectsOftenIsReadUnderTheSameLimits) {
  Array objects;
  Array all;
  for (int i = 0; i < 999; ++i) {
    objects.append(dictionaryObject({}, {}));
    all.append(i);
  }
  objects.append(all);
  const auto back = unarchiveObject(archiveOf(objects, 999), {.values = 1000});
  ASSERT_TRUE(static_cast<bool>(back)) << back.error().description();
  EXPECT_EQ(back->array()->size(), 999U);
}

// --- what cannot be read ---

TEST(ArchiveTest, ForeignBytesAreNoArchive) {
  for (const std::string& bytes : {std::string(), std::string("\xD9"), std::string("{\"version\": 1}"),
                                   writeBinaryDocument(Array{1}), archiveOf({1}, 0).substr(3)}) {
    expectProblem(unarchiveObject(bytes), kArchiveMalformed,
                  "this is no keyed archive, which begins with the bytes D9 D9 F7; give it unpacked");
  }
}

TEST(ArchiveTest, HeadNamesAVersionAndATable) {
  const auto headed = [](const Value& head) { return std::string(kArchiveMark) + writeBinaryDocument(head); };
  const std::string version = "the version is not 1; take a reader that knows it";
  expectProblem(unarchiveObject(headed(Array{1})), kArchiveMalformed, version);
  expectProblem(unarchiveObject(headed(Dictionary{{"root", 0}, {"objects", Array{1}}})), kArchiveMalformed,
                version);
  const std::string table = "there is no table of objects";
  expectProblem(unarchiveObject(headed(Dictionary{{"version", 1}, {"root", 0}})), kArchiveMalformed, table);
  expectProblem(unarchiveObject(headed(Dictionary{{"version", 1}, {"root", 0}, {"objects", "none"}})),
                kArchiveMalformed, table);
}

TEST(ArchiveTest, EveryPartOfAnArchiveIsRefusedWithoutCrashing) {
  const auto archive = archiveObject(Array{Dictionary{{"a", 1.5}}, "text", Data{1}, Date{2}});
  for (size_t length = 0; length < archive->size(); ++length) {
    EXPECT_FALSE(static_cast<bool>(unarchiveObject(std::string_view(*archive).substr(0, length)))) << length;
  }
  EXPECT_FALSE(static_cast<bool>(unarchiveObject(*archive + "x")));
}

TEST(ArchiveTest, OtherVersionIsRefused) {
  expectProblem(unarchiveObject(archiveOf({1}, 0, 2)), kArchiveMalformed,
                "the version is not 1; take a reader that knows it");
  expectProblem(unarchiveObject(archiveOf({1}, 0, "1")), kArchiveMalformed,
                "the version is not 1; take a reader that knows it");
  EXPECT_EQ(*unarchiveObject(archiveOf({5}, 0)), Value(5));
}

TEST(ArchiveTest, RootMustBeAPlaceInTheTable) {
  for (const Value& root : {Value(1), Value(-1), Value("0"), Value(), Value(0.0), Value(false)}) {
    expectProblem(unarchiveObject(archiveOf({7}, root)), kArchiveMalformed,
                  "the root is no place in the table");
  }
  expectProblem(unarchiveObject(archiveOf({}, 0)), kArchiveMalformed, "the root is no place in the table");
}

TEST(ArchiveTest, ReferencesMustPointBackwards) {
  const std::string problem = "object 1: a reference that is no earlier place in the table";
  for (const Value& place : {Value(1), Value(2), Value(-1), Value("0"), Value(), Value(true)}) {
    expectProblem(unarchiveObject(archiveOf({"a", Array{place}}, 0)), kArchiveMalformed, problem);
    expectProblem(unarchiveObject(archiveOf({"a", dictionaryObject({0}, {place})}, 0)), kArchiveMalformed,
                  problem);
    expectProblem(unarchiveObject(archiveOf({"a", dictionaryObject({place}, {0})}, 0)), kArchiveMalformed,
                  problem);
  }
}

TEST(ArchiveTest, ListsHoldPlacesAndNothingElse) {
  const std::string problem = "object 1: a reference that is no earlier place in the table";
  for (const Value& entry : {Value(Array{0}), Value(Dictionary()), Value(nested(20))}) {
    expectProblem(unarchiveObject(archiveOf({"a", Array{entry}}, 1)), kArchiveMalformed, problem);
    expectProblem(unarchiveObject(archiveOf({"a", dictionaryObject({0}, {entry})}, 1)), kArchiveMalformed,
                  problem);
  }
  const std::string deep = std::string(kArchiveMark) + std::string(1U << 20U, '\x81');
  EXPECT_EQ(unarchiveObject(deep).error().code(), kArchiveTooLarge);
}

TEST(ArchiveTest, DictionaryIsTwoListsOfEqualLength) {
  const std::string problem = "object 1: a dictionary is two lists of equal length, keys and values";
  const Array wrong{Dictionary(),
                    Dictionary{{"keys", Array{0}}},
                    Dictionary{{"values", Array{0}}},
                    Dictionary{{"keys", Array{0}}, {"other", Array{0}}},
                    Dictionary{{"other", Array{0}}, {"values", Array{0}}},
                    dictionaryObject({0}, {}),
                    Dictionary{{"keys", 0}, {"values", Array{0}}},
                    Dictionary{{"keys", Array{0}}, {"values", Array{0}}, {"more", 1}}};
  for (const auto& object : wrong) {
    expectProblem(unarchiveObject(archiveOf({"a", object}, 0)), kArchiveMalformed, problem);
  }
}

TEST(ArchiveTest, KeysAreTextAndOccurOnce) {
  expectProblem(unarchiveObject(archiveOf({1, dictionaryObject({0}, {0})}, 0)), kArchiveMalformed,
                "object 1: a key that is not text");
  expectProblem(unarchiveObject(archiveOf({"a", "a", dictionaryObject({0, 1}, {0, 0})}, 0)),
                kArchiveMalformed, "object 2: a key that occurs twice");
}

TEST(ArchiveTest, FewBytesThatComeToManyValuesAreRefused) {
  Array objects{"x"};
  for (int i = 0; i < 30; ++i) objects.append(Array{i, i});  // twice as many each time
  expectProblem(unarchiveObject(archiveOf(objects, 30)), kArchiveTooLarge,
                "object 18: it comes to more than 262144 values; archive less at once");
}

TEST(ArchiveTest, FewBytesThatComeToManyBytesAreRefused) {
  const Value text(std::string(1U << 20U, 'x'));
  const std::string problem = "it comes to more than 16777216 bytes; archive less at once";
  Array one;
  for (int i = 0; i < 17; ++i) one.append(0);
  expectProblem(unarchiveObject(archiveOf({text, one}, 1)), kArchiveTooLarge, "object 1: " + problem);
  Array many{text};  // each of them small enough
  for (int i = 0; i < 17; ++i) many.append(Array{0});
  expectProblem(unarchiveObject(archiveOf(many, 1)), kArchiveTooLarge, "object 17: " + problem);
  Array doubled{text};
  for (int i = 0; i < 5; ++i) doubled.append(Array{i, i});
  expectProblem(unarchiveObject(archiveOf(doubled, 5)), kArchiveTooLarge, "object 5: " + problem);
  expectProblem(unarchiveObject(archiveOf({text, dictionaryObject({0}, {0})}, 1), {.bytes = 3U << 19U}),
                kArchiveTooLarge, "object 1: it comes to more than 1572864 bytes; archive less at once");
}

TEST(ArchiveTest, TableHoldsNoMoreObjectsThanThereMayBeValues) {
  const Array three{"a", "b", Array{0, 1}};
  EXPECT_TRUE(static_cast<bool>(unarchiveObject(archiveOf(three, 2), {.values = 3})));
  // Nobody refers to the last one, yet it takes its room.
  const Array four{"a", "b", Array{0, 1}, "c"};
  expectProblem(unarchiveObject(archiveOf(four, 2), {.values = 3}), kArchiveTooLarge,
                "more than 3 objects; archive less at once");
}

TEST(ArchiveTest, DeepReferencesAreRefused) {
  Array objects{"x"};
  for (int i = 0; i < 33; ++i) objects.append(Array{i});
  EXPECT_TRUE(static_cast<bool>(unarchiveObject(archiveOf({"x", Array{0}}, 1), {.depth = 1})));
  expectProblem(unarchiveObject(archiveOf(objects, 0)), kArchiveTooLarge,
                "object 33: more than 32 levels of nesting; archive less at once");
}

TEST(ArchiveTest, SizeAndClaimsAreCheckedFirst) {
  const auto archive = archiveObject("text");
  EXPECT_EQ(unarchiveObject(*archive, {.bytes = 5}).error().code(), kArchiveTooLarge);
  const std::string claim = std::string(kArchiveMark) + "\xA1\x67objects\x9B\x00\x00\x00\x7F\xFF\xFF\xFF\xFF";
  EXPECT_EQ(unarchiveObject(claim).error().code(), kArchiveMalformed);
}

// --- the description for others ---

TEST(ArchiveTest, WorkedExampleOfTheDocumentIsWhatIsWritten) {
  std::ifstream file(TARNEL_KEYED_ARCHIVE_DOCUMENT);
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  const std::string fence = "```hex\n";
  const size_t start = text.find(fence);
  ASSERT_NE(start, std::string::npos);
  const std::string block =
      text.substr(start + fence.size(), text.find("```", start + fence.size()) - start - fence.size());
  // Each line: bytes in hexadecimal, then after a # what they are.
  std::string shown;
  std::string line;
  for (const char c : block) {
    if (c != '\n') {
      line += c;
      continue;
    }
    for (const char digit : line.substr(0, line.find('#'))) {
      if (digit != ' ') shown += digit;
    }
    line.clear();
  }
  const auto archive = archiveObject(Array{
      Dictionary{{"time", Date{1700000000.5}}, {"level", 3}, {"text", "no route"}},
      Dictionary{{"time", Date{1700000001.0}}, {"level", 3}, {"text", "no route"}},
  });
  const std::string hex = Value(Data(archive->begin(), archive->end())).description();
  EXPECT_EQ("<" + shown + ">", hex);
}

}  // namespace
}  // namespace tarnel

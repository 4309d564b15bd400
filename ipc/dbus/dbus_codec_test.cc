// What crosses the wire whole.
#include "ipc/dbus/dbus_codec.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "ipc/dbus/dbus_codec_test_fixture.h"

namespace tarnel::wire {
namespace {

using Names = std::vector<std::string>;

TEST_F(DbusCodecTest, EveryTypeOfValueSurvivesTheWire) {
  const Dictionary all{
      {"true", Value(true)},
      {"false", Value(false)},
      {"least", Value(std::numeric_limits<int64_t>::min())},
      {"most", Value(std::numeric_limits<int64_t>::max())},
      {"unsigned", Value(std::numeric_limits<uint64_t>::max())},
      {"real", Value(-0.125)},
      {"infinite", Value(std::numeric_limits<double>::infinity())},
      {"date", Value(Date{1767225600.25})},
      {"text", Value("gr\xC3\xBC\xC3\x9F \xF0\x9F\x93\x9E")},
      {"empty", Value("")},
      {"data", Value(Data{0, 255, 128})},
      {"noData", Value(Data{})},
      {"array", Value(Array{Value(1), Value("two"), Value(Array{Value(3.0)}), Value(Dictionary{})})},
      {"dictionary", Value(Dictionary{{"inner", Value(Dictionary{{"", Value(false)}})}})},
  };
  const auto read = roundTrip(all);
  EXPECT_EQ(read, all);
  // Equality of dictionaries ignores the order; the wire must keep it.
  ASSERT_EQ(read.size(), all.size());
  for (size_t i = 0; i < all.size(); ++i) EXPECT_EQ(read.begin()[i].first, all.begin()[i].first);
}

TEST_F(DbusCodecTest, NotANumberPasses) {
  const auto read = roundTrip({{"nan", Value(std::numeric_limits<double>::quiet_NaN())}});
  ASSERT_NE(read.find("nan"), nullptr);
  ASSERT_NE(read.find("nan")->real(), nullptr);
  EXPECT_TRUE(std::isnan(*read.find("nan")->real()));
}

TEST_F(DbusCodecTest, EmptyDictionaryAndArrayPass) {
  EXPECT_EQ(roundTrip({}), Dictionary());
  const auto message = send([](sd_bus_message* m) { return appendArray(m, {}); });
  const auto read = readArray(message.get());
  ASSERT_TRUE(read);
  EXPECT_TRUE(read->empty());
}

TEST_F(DbusCodecTest, NullValuesAreLeftOut) {
  EXPECT_EQ(roundTrip({{"a", Value()}, {"b", Value(1)}, {"c", Value(Array{Value(), Value(2)})}}),
            (Dictionary{{"b", Value(1)}, {"c", Value(Array{Value(2)})}}));
}

TEST_F(DbusCodecTest, ADictionaryOfManyEntriesPasses) {
  Dictionary many;
  for (int i = 0; i < 500; ++i) many.set("key" + std::to_string(i), Value(i));
  EXPECT_EQ(roundTrip(many), many);
}

TEST_F(DbusCodecTest, IntegersOfEveryWidthAreTaken) {
  EXPECT_EQ(valueOf("y", 200), Value(200));
  EXPECT_EQ(valueOf("n", -30000), Value(-30000));
  EXPECT_EQ(valueOf("q", 65535), Value(65535));
  EXPECT_EQ(valueOf("i", -2000000000), Value(-2000000000));
  EXPECT_EQ(valueOf("u", 4000000000U), Value(int64_t{4000000000}));
  EXPECT_EQ(valueOf("x", int64_t{-5}), Value(-5));
  EXPECT_EQ(valueOf("t", uint64_t{5}), Value(5));
}

TEST_F(DbusCodecTest, ObjectPathsAndSignaturesAreTexts) {
  EXPECT_EQ(valueOf("o", "/a/b"), Value("/a/b"));
  EXPECT_EQ(valueOf("g", "a{sv}"), Value("a{sv}"));
}

TEST_F(DbusCodecTest, ArraysOfOneTypeAreTaken) {
  EXPECT_EQ(valueOf("as", 2, "x", "y"), Value(Array{Value("x"), Value("y")}));
  EXPECT_EQ(valueOf("ai", 2, 1, -1), Value(Array{Value(1), Value(-1)}));
  EXPECT_EQ(valueOf("ab", 2, 1, 0), Value(Array{Value(true), Value(false)}));
  EXPECT_EQ(valueOf("ad", 1, 0.5), Value(Array{Value(0.5)}));
  EXPECT_EQ(valueOf("a(d)", 1, 7.0), Value(Array{Value(Date{7})}));
  EXPECT_EQ(valueOf("aas", 2, 1, "x", 0), Value(Array{Value(Array{Value("x")}), Value(Array{})}));
  EXPECT_EQ(valueOf("aa{sv}", 1, 1, "k", "u", 3U), Value(Array{Value(Dictionary{{"k", Value(3)}})}));
  EXPECT_EQ(valueOf("ay", 2, 1, 2), Value(Data{1, 2}));
}

TEST_F(DbusCodecTest, DictionariesOfOneTypeAreTaken) {
  EXPECT_EQ(valueOf("a{ss}", 2, "a", "1", "b", "2"), Value(Dictionary{{"a", Value("1")}, {"b", Value("2")}}));
  EXPECT_EQ(valueOf("a{si}", 1, "a", -1), Value(Dictionary{{"a", Value(-1)}}));
  EXPECT_EQ(valueOf("a{sa{sd}}", 1, "a", 1, "b", 0.5),
            Value(Dictionary{{"a", Value(Dictionary{{"b", Value(0.5)}})}}));
  EXPECT_EQ(valueOf("a{sas}", 1, "a", 1, "b"), Value(Dictionary{{"a", Value(Array{Value("b")})}}));
  EXPECT_EQ(valueOf("a{ss}", 0), Value(Dictionary{}));
}

TEST_F(DbusCodecTest, VariantsInsideVariantsAreUnwrapped) {
  EXPECT_EQ(valueOf("v", "v", "s", "x"), Value("x"));
}

TEST_F(DbusCodecTest, OfARepeatedKeyTheLastWins) {
  const auto message = sendRaw(
      [](sd_bus_message* m) { sd_bus_message_append(m, "a{sv}", 3, "k", "i", 1, "l", "i", 2, "k", "i", 3); });
  const auto read = readDictionary(message.get());
  ASSERT_TRUE(read);
  EXPECT_EQ(*read, (Dictionary{{"k", Value(3)}, {"l", Value(2)}}));
}

TEST_F(DbusCodecTest, WhatMayBeAbsentIsAnArrayOfAtMostOne) {
  const Dictionary one{{"k", Value(1)}};
  const Names names{"a", "b"};
  const auto message = send([&](sd_bus_message* m) -> MaybeError {
    for (const auto& error :
         {appendMaybeDictionary(m, one), appendMaybeDictionary(m, std::nullopt),
          appendMaybeArray(m, Array{Value(1)}), appendMaybeArray(m, std::nullopt), appendMaybeString(m, "s"),
          appendMaybeString(m, std::nullopt), appendMaybeNames(m, names), appendMaybeNames(m, std::nullopt),
          appendMaybeNames(m, Names{})}) {
      if (error) return error;
    }
    return std::nullopt;
  });
  sd_bus_message* m = message.get();
  EXPECT_STREQ(sd_bus_message_get_signature(m, 1), "aa{sv}aa{sv}aavaavasasaasaasaas");
  EXPECT_EQ(*readMaybeDictionary(m), one);
  EXPECT_EQ(*readMaybeDictionary(m), std::nullopt);
  EXPECT_EQ(*readMaybeArray(m), (Array{Value(1)}));
  EXPECT_EQ(*readMaybeArray(m), std::nullopt);
  EXPECT_EQ(*readMaybeString(m), "s");
  EXPECT_EQ(*readMaybeString(m), std::nullopt);
  EXPECT_EQ(*readMaybeNames(m), names);
  EXPECT_EQ(*readMaybeNames(m), std::nullopt);
  EXPECT_EQ(*readMaybeNames(m), Names{});
}

TEST_F(DbusCodecTest, WhatASendReturnedKeepsItsKind) {
  const Error error("domain", -7, "because");
  const auto message = send([&](sd_bus_message* m) -> MaybeError {
    for (const auto& failed :
         {appendMaybeSentObject(m, SentObject("text")), appendMaybeSentObject(m, SentObject(error)),
          appendMaybeSentObject(m, std::nullopt), appendMaybeError(m, error),
          appendMaybeError(m, std::nullopt)}) {
      if (failed) return failed;
    }
    return std::nullopt;
  });
  sd_bus_message* m = message.get();
  EXPECT_STREQ(sd_bus_message_get_signature(m, 1), "avavava(sxs)a(sxs)");
  EXPECT_EQ(*readMaybeSentObject(m), SentObject("text"));
  EXPECT_EQ(*readMaybeSentObject(m), SentObject(error));
  EXPECT_EQ(*readMaybeSentObject(m), std::nullopt);
  EXPECT_EQ(*readMaybeError(m), error);
  EXPECT_EQ(*readMaybeError(m), std::nullopt);
}

}  // namespace
}  // namespace tarnel::wire

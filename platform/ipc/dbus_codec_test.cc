#include "platform/ipc/dbus_codec.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "platform/ipc/bus_pair.h"
#include "platform/ipc/wire.h"

namespace tarnel::wire {
namespace {

using ::testing::HasSubstr;
using Names = std::vector<std::string>;

class DbusCodecTest : public ::testing::Test {
 protected:
  template <class Append>
  MessagePtr send(Append append) {
    auto message = buses_.newMessage();
    const MaybeError error = append(message.get());
    EXPECT_FALSE(error) << error->description();
    return buses_.crossed(message);
  }

  // A message written by hand, as another program's library would.
  template <class Build>
  MessagePtr sendRaw(Build build) {
    auto message = buses_.newMessage();
    build(message.get());
    return buses_.crossed(message);
  }

  Dictionary roundTrip(const Dictionary& dictionary) {
    const auto message = send([&](sd_bus_message* m) { return appendDictionary(m, dictionary); });
    auto read = readDictionary(message.get());
    EXPECT_TRUE(read) << read.error().description();
    return read ? std::move(*read) : Dictionary();
  }

  // The value that a hand-written variant is read as.
  template <class... Arguments>
  Value valueOf(const char* signature, Arguments... arguments) {
    const auto message = sendRaw([&](sd_bus_message* m) {
      ASSERT_GE(sd_bus_message_append(m, "a{sv}", 1, "k", signature, arguments...), 0);
    });
    const auto read = readDictionary(message.get());
    EXPECT_TRUE(read) << read.error().description();
    const auto* value = read ? read->find("k") : nullptr;
    return value == nullptr ? Value() : *value;
  }

  template <class... Arguments>
  Error refusalOf(const char* signature, Arguments... arguments) {
    const auto message =
        sendRaw([&](sd_bus_message* m) { ASSERT_GE(sd_bus_message_append(m, signature, arguments...), 0); });
    const auto read = readDictionary(message.get());
    EXPECT_FALSE(read);
    return read ? Error("", 0, "") : read.error();
  }

  BusPair buses_;
};

Dictionary nested(unsigned levels) {
  Dictionary inner{{"leaf", Value(1)}};
  for (unsigned i = 1; i < levels; ++i) inner = Dictionary{{"k", Value(inner)}};
  return inner;
}

Array nestedArray(unsigned levels) {
  Array inner{Value(1)};
  for (unsigned i = 1; i < levels; ++i) inner = Array{Value(inner)};
  return inner;
}

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

TEST_F(DbusCodecTest, NestsToTheLimitAndNoFurther) {
  EXPECT_EQ(roundTrip(nested(kMaxDepth)), nested(kMaxDepth));
  auto message = buses_.newMessage();
  const auto error = appendDictionary(message.get(), nested(kMaxDepth + 1));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kErrorTooDeep);
  EXPECT_THAT(error->localizedDescription(), HasSubstr("deeper than 32 levels"));

  const auto arrays = send([](sd_bus_message* m) { return appendArray(m, nestedArray(kMaxDepth)); });
  const auto read = readArray(arrays.get());
  ASSERT_TRUE(read);
  EXPECT_EQ(*read, nestedArray(kMaxDepth));
  message = buses_.newMessage();
  EXPECT_TRUE(appendArray(message.get(), nestedArray(kMaxDepth + 1)));
}

// Dictionaries nested by hand, since our own writer refuses what is too deep.
MessagePtr deepByHand(BusPair& buses, unsigned levels) {
  auto message = buses.newMessage();
  sd_bus_message* m = message.get();
  for (unsigned i = 0; i < levels; ++i) {
    EXPECT_TRUE(i == 0 || sd_bus_message_open_container(m, 'v', "a{sv}") >= 0);
    EXPECT_GE(sd_bus_message_open_container(m, 'a', "{sv}"), 0);
    EXPECT_GE(sd_bus_message_open_container(m, 'e', "sv"), 0);
    EXPECT_GE(sd_bus_message_append(m, "s", "k"), 0);
  }
  EXPECT_GE(sd_bus_message_append(m, "v", "i", 1), 0);
  for (unsigned i = 0; i < levels; ++i) {
    EXPECT_GE(sd_bus_message_close_container(m), 0);
    EXPECT_GE(sd_bus_message_close_container(m), 0);
    EXPECT_TRUE(i + 1 == levels || sd_bus_message_close_container(m) >= 0);
  }
  return buses.crossed(message);
}

TEST_F(DbusCodecTest, TooDeepOnTheWireIsRefusedByName) {
  EXPECT_TRUE(readDictionary(deepByHand(buses_, kMaxDepth).get()));
  const auto read = readDictionary(deepByHand(buses_, kMaxDepth + 1).get());
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error().domain(), kErrorTooDeep);
  EXPECT_THAT(read.error().localizedDescription(), HasSubstr("deeper than 32 levels"));
}

TEST_F(DbusCodecTest, VariantsInsideVariantsCountAsDepth) {
  const auto wrapped = [this](unsigned levels) {
    return sendRaw([levels](sd_bus_message* m) {
      sd_bus_message_open_container(m, 'a', "{sv}");
      sd_bus_message_open_container(m, 'e', "sv");
      sd_bus_message_append(m, "s", "k");
      for (unsigned i = 0; i + 1 < levels; ++i) sd_bus_message_open_container(m, 'v', "v");
      sd_bus_message_append(m, "v", "i", 1);
      for (unsigned i = 0; i + 1 < levels; ++i) sd_bus_message_close_container(m);
      sd_bus_message_close_container(m);
      sd_bus_message_close_container(m);
    });
  };
  EXPECT_TRUE(readDictionary(wrapped(kMaxDepth).get()));
  const auto read = readDictionary(wrapped(kMaxDepth + 1).get());
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error().domain(), kErrorTooDeep);
}

// Bytes in the place of a text; the library checks only what is appended in one go.
void appendBytes(sd_bus_message* m, std::string_view bytes) {
  char* room = nullptr;
  ASSERT_GE(sd_bus_message_append_string_space(m, bytes.size(), &room), 0);
  bytes.copy(room, bytes.size());
}

void openEntry(sd_bus_message* m, std::string_view key, const char* variant) {
  ASSERT_GE(sd_bus_message_open_container(m, 'a', "{sv}"), 0);
  ASSERT_GE(sd_bus_message_open_container(m, 'e', "sv"), 0);
  appendBytes(m, key);
  ASSERT_GE(sd_bus_message_open_container(m, 'v', variant), 0);
}

void closeContainers(sd_bus_message* m, int count) {
  for (int i = 0; i < count; ++i) ASSERT_GE(sd_bus_message_close_container(m), 0);
}

TEST_F(DbusCodecTest, TextThatIsNotUtf8IsRefusedWithItsPlace) {
  const auto inValue = readDictionary(sendRaw([](sd_bus_message* m) {
                                        openEntry(m, "outer", "a{sv}");
                                        openEntry(m, "inner", "s");
                                        appendBytes(m, "\xFF\xFE");
                                        closeContainers(m, 6);
                                      }).get());
  ASSERT_FALSE(inValue);
  EXPECT_EQ(inValue.error().domain(), kErrorInvalidArguments);
  EXPECT_THAT(inValue.error().localizedDescription(),
              HasSubstr("at key \"outer\", key \"inner\": the text is not UTF-8"));
}

TEST_F(DbusCodecTest, AKeyThatIsNotUtf8IsRefused) {
  for (const std::string_view key : {"\xC0\xAF", "\xED\xA0\x80", "\x80", "\xF4\x90\x80\x80"}) {
    const auto read = readDictionary(sendRaw([key](sd_bus_message* m) {
                                       openEntry(m, key, "i");
                                       sd_bus_message_append(m, "i", 1);
                                       closeContainers(m, 3);
                                     }).get());
    ASSERT_FALSE(read);
    EXPECT_EQ(read.error().domain(), kErrorInvalidArguments);
    EXPECT_THAT(read.error().localizedDescription(), HasSubstr("a key: the text is not UTF-8"));
  }
}

TEST_F(DbusCodecTest, TextsInTypedContainersAreCheckedToo) {
  const auto inArray = readDictionary(sendRaw([](sd_bus_message* m) {
                                        openEntry(m, "l", "as");
                                        sd_bus_message_open_container(m, 'a', "s");
                                        appendBytes(m, "fine");
                                        appendBytes(m, std::string_view("a\0b", 3));
                                        closeContainers(m, 4);
                                      }).get());
  ASSERT_FALSE(inArray);
  EXPECT_THAT(inArray.error().localizedDescription(), HasSubstr("at key \"l\", element 1: the text is not"));
  const auto inDictionary = readDictionary(sendRaw([](sd_bus_message* m) {
                                             openEntry(m, "l", "a{ss}");
                                             sd_bus_message_open_container(m, 'a', "{ss}");
                                             sd_bus_message_open_container(m, 'e', "ss");
                                             appendBytes(m, "k");
                                             appendBytes(m, "\x80");
                                             closeContainers(m, 5);
                                           }).get());
  ASSERT_FALSE(inDictionary);
  EXPECT_THAT(inDictionary.error().localizedDescription(), HasSubstr("at key \"l\", key \"k\": the text"));
}

TEST_F(DbusCodecTest, ALongKeyIsShortenedInErrorsAtACharacter) {
  const std::string key = std::string(63, 'a') + "\xC3\xBC" + std::string(5000, 'b');
  const auto read = readDictionary(sendRaw([&key](sd_bus_message* m) {
                                     openEntry(m, key, "s");
                                     appendBytes(m, "\xFF");
                                     closeContainers(m, 3);
                                   }).get());
  ASSERT_FALSE(read);
  EXPECT_LT(read.error().localizedDescription().size(), 200U);
  EXPECT_TRUE(isValidUtf8(read.error().localizedDescription()));
}

TEST_F(DbusCodecTest, TypesThatAreNoValuesAreRefused) {
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "(ii)", 1, 2).localizedDescription(),
              HasSubstr("structure (ii) is no value"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "h", 0).localizedDescription(), HasSubstr("type 'h' is no value"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "a{is}", 1, 1, "x").localizedDescription(),
              HasSubstr("keys of a dictionary are texts"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "ah", 1, 0).localizedDescription(),
              HasSubstr("type 'h' is no value"));
}

TEST_F(DbusCodecTest, AnotherTypeOfArgumentIsRefused) {
  EXPECT_EQ(refusalOf("s", "x").domain(), kErrorInvalidArguments);
  EXPECT_EQ(refusalOf("").domain(), kErrorInvalidArguments);
  EXPECT_EQ(refusalOf("a{ss}", 1, "k", "v").domain(), kErrorInvalidArguments);
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

TEST_F(DbusCodecTest, MoreThanOneElementIsRefused) {
  const auto texts = sendRaw([](sd_bus_message* m) { sd_bus_message_append(m, "as", 2, "a", "b"); });
  const auto text = readMaybeString(texts.get());
  ASSERT_FALSE(text);
  EXPECT_THAT(text.error().localizedDescription(), HasSubstr("at most one element"));
  const auto dictionaries = sendRaw([](sd_bus_message* m) { sd_bus_message_append(m, "aa{sv}", 2, 0, 0); });
  EXPECT_FALSE(readMaybeDictionary(dictionaries.get()));
  const auto objects =
      sendRaw([](sd_bus_message* m) { sd_bus_message_append(m, "av", 2, "s", "", "s", ""); });
  EXPECT_FALSE(readMaybeSentObject(objects.get()));
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

TEST_F(DbusCodecTest, ASentObjectOfAnotherTypeIsRefused) {
  const auto message = sendRaw([](sd_bus_message* m) { sd_bus_message_append(m, "av", 1, "i", 1); });
  const auto read = readMaybeSentObject(message.get());
  ASSERT_FALSE(read);
  EXPECT_THAT(read.error().localizedDescription(), HasSubstr("not i"));
}

TEST_F(DbusCodecTest, TextsThatTheOtherEndWouldRefuseAreNotSent) {
  const auto refusal = [this](const std::string& text) {
    auto message = buses_.newMessage();
    const auto error = appendDictionary(message.get(), {{"k", Value(Array{Value(text)})}});
    EXPECT_TRUE(error) << text;
    return error ? error->localizedDescription() : "";
  };
  EXPECT_EQ(refusal("\xFF"), "at key \"k\", element 0: the text is not UTF-8");
  EXPECT_THAT(refusal(std::string("a\0b", 3)), HasSubstr("NUL"));
  EXPECT_THAT(refusal("\xEF\xBF\xBF"), HasSubstr("no character"));
  EXPECT_THAT(refusal("\xEF\xB7\x90"), HasSubstr("no character"));
  EXPECT_THAT(refusal("\xF0\x9F\xBF\xBE"), HasSubstr("no character"));
  auto message = buses_.newMessage();
  const auto inKey = appendDictionary(message.get(), {{"\xFF", Value(1)}});
  ASSERT_TRUE(inKey);
  EXPECT_EQ(inKey->localizedDescription(), "at a key that is not UTF-8: the text is not UTF-8");
  message = buses_.newMessage();
  EXPECT_TRUE(appendMaybeError(message.get(), Error("d", 1, "\xFF")));
  // Neighbours of what is refused.
  const Dictionary fine{
      {"a", Value("\xEF\xBF\xBD")}, {"b", Value("\xEF\xB7\xB0")}, {"c", Value("\xEF\xB7\x8F")}};
  EXPECT_EQ(roundTrip(fine), fine);
}

}  // namespace
}  // namespace tarnel::wire

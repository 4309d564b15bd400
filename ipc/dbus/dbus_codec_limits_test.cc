// What is not sent, and what is not taken.
#include <gmock/gmock.h>

#include "ipc/dbus/dbus_codec_test_fixture.h"

namespace tarnel::wire {
namespace {

using ::testing::HasSubstr;

class DbusCodecLimitsTest : public DbusCodecTest {};

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

TEST_F(DbusCodecLimitsTest, NestsToTheLimitAndNoFurther) {
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

TEST_F(DbusCodecLimitsTest, TooDeepOnTheWireIsRefusedByName) {
  EXPECT_TRUE(readDictionary(deepByHand(buses_, kMaxDepth).get()));
  const auto read = readDictionary(deepByHand(buses_, kMaxDepth + 1).get());
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error().domain(), kErrorTooDeep);
  EXPECT_THAT(read.error().localizedDescription(), HasSubstr("deeper than 32 levels"));
}

TEST_F(DbusCodecLimitsTest, VariantsInsideVariantsCountAsDepth) {
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

TEST_F(DbusCodecLimitsTest, TextThatIsNotUtf8IsRefusedWithItsPlace) {
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

TEST_F(DbusCodecLimitsTest, AKeyThatIsNotUtf8IsRefused) {
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

TEST_F(DbusCodecLimitsTest, TextsInTypedContainersAreCheckedToo) {
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

TEST_F(DbusCodecLimitsTest, ALongKeyIsShortenedInErrorsAtACharacter) {
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

TEST_F(DbusCodecLimitsTest, TypesThatAreNoValuesAreRefused) {
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "(ii)", 1, 2).localizedDescription(),
              HasSubstr("structure (ii) is no value"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "h", 0).localizedDescription(), HasSubstr("type 'h' is no value"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "a{is}", 1, 1, "x").localizedDescription(),
              HasSubstr("keys of a dictionary are texts"));
  EXPECT_THAT(refusalOf("a{sv}", 1, "k", "ah", 1, 0).localizedDescription(),
              HasSubstr("type 'h' is no value"));
}

TEST_F(DbusCodecLimitsTest, AnotherTypeOfArgumentIsRefused) {
  EXPECT_EQ(refusalOf("s", "x").domain(), kErrorInvalidArguments);
  EXPECT_EQ(refusalOf("").domain(), kErrorInvalidArguments);
  EXPECT_EQ(refusalOf("a{ss}", 1, "k", "v").domain(), kErrorInvalidArguments);
}

TEST_F(DbusCodecLimitsTest, MoreThanOneElementIsRefused) {
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

TEST_F(DbusCodecLimitsTest, ASentObjectOfAnotherTypeIsRefused) {
  const auto message = sendRaw([](sd_bus_message* m) { sd_bus_message_append(m, "av", 1, "i", 1); });
  const auto read = readMaybeSentObject(message.get());
  ASSERT_FALSE(read);
  EXPECT_THAT(read.error().localizedDescription(), HasSubstr("not i"));
}

TEST_F(DbusCodecLimitsTest, TextsThatTheOtherEndWouldRefuseAreNotSent) {
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

#include <string>

#include <gtest/gtest.h>

#include "formats/cryptography.h"

namespace tarnel {
namespace {

Data dataOf(std::string_view text) {
  return {text.begin(), text.end()};
}

TEST(Base64Test, encodesWithPadding) {
  const struct {
    const char* plain;
    const char* encoded;
  } cases[] = {{"", ""},
               {"f", "Zg=="},
               {"fo", "Zm8="},
               {"foo", "Zm9v"},
               {"foob", "Zm9vYg=="},
               {"fooba", "Zm9vYmE="},
               {"foobar", "Zm9vYmFy"}};
  for (const auto& one : cases) {
    EXPECT_EQ(base64Encode(dataOf(one.plain)), one.encoded);
    EXPECT_EQ(base64Decode(one.encoded), dataOf(one.plain));
  }
  EXPECT_EQ(base64Encode(Data{0xFB, 0xFF, 0xBF}), "+/+/");
}

TEST(Base64Test, decodesEveryByte) {
  for (size_t length = 0; length < 520; ++length) {
    Data data;
    for (size_t i = 0; i < length; ++i) data.push_back(static_cast<uint8_t>(i * 7 + length));
    EXPECT_EQ(base64Decode(base64Encode(data)), data);
  }
}

TEST(Base64Test, ignoresCharactersOutsideTheAlphabet) {
  EXPECT_EQ(base64Decode(" Zm\r\n9v-_YmFy\t\x80*"), dataOf("foobar"));
  EXPECT_EQ(base64Decode("Zm8\n=\n"), dataOf("fo"));
  EXPECT_EQ(base64Decode("Zg=\n="), dataOf("f"));
  EXPECT_EQ(base64Decode("*-_ \n"), Data{});
  EXPECT_EQ(base64Decode(std::string_view("Zm\0"
                                          "9v",
                                          5)),
            dataOf("foo"));
}

TEST(Base64Test, endsAtThePadding) {
  EXPECT_EQ(base64Decode("Zg==Zg=="), dataOf("f"));
  EXPECT_EQ(base64Decode("Zm8=rest"), dataOf("fo"));
}

TEST(Base64Test, doesWithoutPadding) {
  EXPECT_EQ(base64Decode("Zg"), dataOf("f"));
  EXPECT_EQ(base64Decode("Zm9vYmE"), dataOf("fooba"));
}

TEST(Base64Test, refusesWhatCannotBeBase64) {
  for (const char* text : {"Z", "Zm9vY", "=", "Zm9v=", "Zg=", "Zg===", "Zm8==", "Z=", "Z===", "Zg=Zg=="}) {
    EXPECT_FALSE(base64Decode(text)) << text;
  }
}

}  // namespace
}  // namespace tarnel

#include "base/utf8.h"

#include <gtest/gtest.h>

#include <string>

#include "base/value.h"

namespace tarnel {
namespace {

TEST(Utf8, WhatIsWellFormed) {
  using namespace std::string_literals;
  const std::string valid[] = {"",
                               "plain",
                               "nul\0inside"s,
                               "\x7F",
                               "\xC2\x80",
                               "\xDF\xBF",
                               "\xE0\xA0\x80",
                               "\xED\x9F\xBF",
                               "\xEE\x80\x80",
                               "\xEF\xBF\xBF",
                               "\xF0\x90\x80\x80",
                               "\xF4\x8F\xBF\xBF",
                               "seven b\xC3\xA9 and eight more",
                               "12345678\xE2\x82\xAC"};
  for (const auto& text : valid) EXPECT_TRUE(isValidUtf8(text)) << text;
  const std::string invalid[] = {"\x80",
                                 "\xBF",
                                 "\xC0\x80",
                                 "\xC1\xBF",
                                 "\xC2",
                                 "\xC2\x41",
                                 "\xE0\x9F\xBF",
                                 "\xE1\x80",
                                 "\xE1\x80\x41",
                                 "\xED\xA0\x80",
                                 "\xED\xBF\xBF",
                                 "\xF0\x8F\xBF\xBF",
                                 "\xF0\x90\x80",
                                 "\xF4\x90\x80\x80",
                                 "\xF5\x80\x80\x80",
                                 "\xFE",
                                 "\xFF",
                                 "1234567\xC3",
                                 "12345678\xFFxxxxxxx",
                                 "\xE2\x28\xA1",
                                 "\xF0\x90\x28\xBC"};
  for (const auto& text : invalid)
    EXPECT_FALSE(isValidUtf8(text)) << description(Array{Data(text.begin(), text.end())});
  for (size_t place = 0; place < 24; ++place) {
    std::string text(24, 'a');
    text[place] = '\x90';
    EXPECT_FALSE(isValidUtf8(text)) << place;
  }
}

TEST(Utf8, LengthOfTheCharacterAtTheFront) {
  EXPECT_EQ(utf8CharacterLength("ab"), 1U);
  EXPECT_EQ(utf8CharacterLength("\xC3\xA9x"), 2U);
  EXPECT_EQ(utf8CharacterLength("\xE2\x82\xACx"), 3U);
  EXPECT_EQ(utf8CharacterLength("\xF0\x9D\x84\x9Ex"), 4U);
  EXPECT_EQ(utf8CharacterLength(""), 0U);
  EXPECT_EQ(utf8CharacterLength("\xA9x"), 0U) << "a continuation alone";
  EXPECT_EQ(utf8CharacterLength("\xE2\x82"), 0U) << "cut through";
}

TEST(Utf8, ACutNeverGoesThroughACharacter) {
  const std::string text =
      "a\xE2\x82\xAC"
      "b";
  EXPECT_EQ(wholeCharacters(text, 9), text);
  EXPECT_EQ(wholeCharacters(text, 5), text);
  EXPECT_EQ(wholeCharacters(text, 4), "a\xE2\x82\xAC");
  EXPECT_EQ(wholeCharacters(text, 3), "a");
  EXPECT_EQ(wholeCharacters(text, 2), "a");
  EXPECT_EQ(wholeCharacters(text, 1), "a");
  EXPECT_EQ(wholeCharacters(text, 0), "");
}

TEST(Utf8, WhatIsNoTextIsCutWithinThreeBytes) {
  const std::string noText(100, '\x90');
  EXPECT_GE(wholeCharacters(noText, 50).size(), 47U);
  EXPECT_LE(wholeCharacters(noText, 50).size(), 50U);
}

}  // namespace
}  // namespace tarnel

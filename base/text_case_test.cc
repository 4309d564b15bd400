#include "base/text_case.h"

#include <gtest/gtest.h>

namespace tarnel {
namespace {

std::string encoded(uint32_t code) {
  const auto tail = [code](unsigned shift) { return static_cast<char>(0x80U | (code >> shift & 0x3FU)); };
  if (code < 0x80) return {static_cast<char>(code)};
  if (code < 0x800) return {static_cast<char>(0xC0U | code >> 6U), tail(0)};
  if (code < 0x10000) return {static_cast<char>(0xE0U | code >> 12U), tail(6), tail(0)};
  return {static_cast<char>(0xF0U | code >> 18U), tail(12), tail(6), tail(0)};
}

TEST(TextCaseTest, TheTablesAreThere) {
  EXPECT_TRUE(foldsBeyondAscii()) << "this system has no locale C.UTF-8";
}

TEST(TextCaseTest, FoldsAscii) {
  EXPECT_EQ(foldCase("AbZ az09_@[`{"), "abz az09_@[`{");
  EXPECT_EQ(foldCase(""), "");
  EXPECT_EQ(foldCase(std::string("A\0B", 3)), std::string("a\0b", 3));
}

TEST(TextCaseTest, FoldsLettersOfEveryScriptThatHasCapitals) {
  EXPECT_EQ(foldCase("ÀÖØÞ×÷ßÿŸ"), "àöøþ×÷ßÿÿ");
  EXPECT_EQ(foldCase("ĀāĲĳĶķĹĺŇňŊŋŶŷŹźŽž"), "āāĳĳķķĺĺňňŋŋŷŷźźžž");
  EXPECT_EQ(foldCase("ƁƏȘȚǍ"), "ɓəșțǎ");
  EXPECT_EQ(foldCase("ṠẠỸ"), "ṡạỹ");
  EXPECT_EQ(foldCase("ΑΡΣΫΆΈΊΌΎΏ"), "αρσϋάέίόύώ");
  EXPECT_EQ(foldCase("ЀЏАЯабвҐӀԱ"), "ѐџаяабвґӏա");
  EXPECT_EQ(foldCase("ԱՖ"), "աֆ");
  EXPECT_EQ(foldCase("ᲐᲺ"), "აჺ");
  EXPECT_EQ(foldCase("ＡＺａ"), "ａｚａ");
  EXPECT_EQ(foldCase("\U00010400\U0001F600"), "\U00010428\U0001F600");
  EXPECT_EQ(foldCase("日本😀ĸŉ"), "日本😀ĸŉ");
}

// Small letters that share a capital are the same letter.
TEST(TextCaseTest, LettersWithTheSameCapitalAgree) {
  EXPECT_EQ(foldCase("ΟΔΟΣ"), foldCase("οδος"));
  EXPECT_EQ(foldCase("ς"), "σ");
  EXPECT_EQ(foldCase("ſ"), "s");
  EXPECT_EQ(foldCase("µ"), "μ") << "micro sign and mu";
  EXPECT_EQ(foldCase("ϐϑϕ"), "βθφ");
  EXPECT_EQ(foldCase("ǅ"), "ǆ");
  EXPECT_EQ(foldCase("ıİ"), "ii") << "with and without its dot";
}

TEST(TextCaseTest, FormsOfDifferentLengthAgree) {
  EXPECT_EQ(foldCase("\u212A"), "k") << "Kelvin sign";
  EXPECT_EQ(foldCase("\u212B"), "å") << "Angstrom sign";
  EXPECT_EQ(foldCase("\u2126"), "ω") << "Ohm sign";
  EXPECT_EQ(foldCase("ẞ"), "ß");
  EXPECT_EQ(foldCase("Ⱥ"), "ⱥ") << "three bytes for two";
  EXPECT_EQ(foldCase("xȺz"), "xⱥz");
}

// Of every character: folding twice is folding once.
TEST(TextCaseTest, WhatIsFoldedStaysAsItIs) {
  for (uint32_t code = 0; code <= 0x10FFFF; ++code) {
    if (code >= 0xD800 && code <= 0xDFFF) continue;
    const std::string folded = foldCase(encoded(code));
    ASSERT_EQ(foldCase(folded), folded) << std::hex << code;
  }
}

TEST(TextCaseTest, InTextThatIsNotUtf8OnlyAsciiIsFolded) {
  EXPECT_EQ(foldCase("A\xC3"), "a\xC3");
  EXPECT_EQ(foldCase(std::string("\xFF") + "B"), std::string("\xFF") + "b");
  EXPECT_EQ(foldCase("\xC3\x84\xC3"), "\xC3\x84\xC3") << "not even its sound characters";
  EXPECT_EQ(foldCase("X\xED\xA0\x80"), "x\xED\xA0\x80") << "a surrogate";
}

TEST(TextCaseTest, LowersCapitals) {
  EXPECT_EQ(lowerCase("AbZ az09_@[`{"), "abz az09_@[`{");
  EXPECT_EQ(lowerCase(""), "");
  EXPECT_EQ(lowerCase(std::string("A\0B", 3)), std::string("a\0b", 3));
  EXPECT_EQ(lowerCase("ÀÞŸΑΣЀЯԱᲐＡ\U00010400"), "àþÿασѐяաაａ\U00010428");
  EXPECT_EQ(lowerCase("\u212A\u212B\u2126ẞȺ"), "kåωßⱥ");
}

TEST(TextCaseTest, LoweringKeepsWhatIsSmall) {
  for (const char* small : {"ς", "ſ", "ı", "µ", "ϐϑϕ", "ſtraße ος", "日本😀ĸŉ"}) {
    EXPECT_EQ(lowerCase(small), small);
  }
}

TEST(TextCaseTest, InTextThatIsNotUtf8OnlyAsciiIsLowered) {
  EXPECT_EQ(lowerCase("A\xC3"), "a\xC3");
  EXPECT_EQ(lowerCase("\xC3\x84\xC3"), "\xC3\x84\xC3") << "not even its sound characters";
}

TEST(TextCaseTest, ComparesWithWhatIsFolded) {
  EXPECT_TRUE(equalsFolded("username", "UserName"));
  EXPECT_TRUE(equalsFolded("größe", "GRÖßE"));
  EXPECT_TRUE(equalsFolded("", ""));
  EXPECT_FALSE(equalsFolded("username", "UserNames"));
  EXPECT_FALSE(equalsFolded("usernames", "UserName"));
  EXPECT_FALSE(equalsFolded("username", "userNane"));
  EXPECT_FALSE(equalsFolded("größe", "GRÄßE"));
  EXPECT_FALSE(equalsFolded("a", ""));
}

TEST(TextCaseTest, ComparesFormsOfDifferentLength) {
  EXPECT_TRUE(equalsFolded("key", "\u212Aey"));
  EXPECT_TRUE(equalsFolded("break", "brea\u212A"));
  EXPECT_TRUE(equalsFolded(foldCase("Ⱥx"), "ⱥX"));
  EXPECT_TRUE(equalsFolded("ⱥx", "ȺX"));
  EXPECT_FALSE(equalsFolded("brea", "brea\u212A"));
  EXPECT_FALSE(equalsFolded("breakk", "brea\u212A"));
}

TEST(TextCaseTest, TellsAsciiWhereverTheOtherCharacterStands) {
  EXPECT_TRUE(isAscii(""));
  EXPECT_TRUE(isAscii(std::string(33, '\x7F')));
  for (size_t size = 1; size <= 20; ++size) {
    for (size_t at = 0; at < size; ++at) {
      std::string text(size, 'a');
      text[at] = '\x80';
      EXPECT_FALSE(isAscii(text)) << size << " " << at;
    }
  }
}

}  // namespace
}  // namespace tarnel

#include <gtest/gtest.h>

#include "backends/https/list_matching.h"
#include "backends/https/sender_names.h"
#include "base/text_format.h"

namespace tarnel {
namespace {

TEST(ListMatchingTest, AbsentOrEmptyListAnswersTheWhitelistArgument) {
  for (const auto& list : {MaybeTextList(), MaybeTextList(TextList{})}) {
    for (const auto& text : {MaybeString(), MaybeString("a")}) {
      EXPECT_TRUE(matchExactStringWithList(list, text, true));
      EXPECT_FALSE(matchExactStringWithList(list, text, false));
      EXPECT_TRUE(matchStringWithList(list, text, true));
      EXPECT_FALSE(matchStringWithList(list, text, false));
    }
  }
}

TEST(ListMatchingTest, AbsentStringAnswersTheOpposite) {
  const MaybeTextList list = TextList{"a"};
  EXPECT_FALSE(matchExactStringWithList(list, std::nullopt, true));
  EXPECT_TRUE(matchExactStringWithList(list, std::nullopt, false));
  EXPECT_FALSE(matchStringWithList(list, std::nullopt, true));
  EXPECT_TRUE(matchStringWithList(list, std::nullopt, false));
}

TEST(ListMatchingTest, ExactMatchTakesWholeStringsIgnoringCase) {
  const MaybeTextList list = TextList{"Alpha", "beta"};
  for (const bool whitelist : {true, false}) {
    EXPECT_TRUE(matchExactStringWithList(list, "ALPHA", whitelist));
    EXPECT_TRUE(matchExactStringWithList(list, "Beta", whitelist));
    EXPECT_FALSE(matchExactStringWithList(list, "alph", whitelist));
    EXPECT_FALSE(matchExactStringWithList(list, "alphabet", whitelist));
  }
  EXPECT_TRUE(matchExactStringWithList(TextList{""}, "", true));
  EXPECT_FALSE(matchExactStringWithList(TextList{""}, "a", true));
}

TEST(ListMatchingTest, LettersOfEveryScriptMatchIgnoringCase) {
  EXPECT_TRUE(matchExactStringWithList(TextList{"ΟΔΟΣ"}, "οδος", true));
  EXPECT_TRUE(matchExactStringWithList(TextList{"Ȁրև", "ԱԲ"}, "աբ", true));
  EXPECT_TRUE(matchExactStringWithList(TextList{"\u212Aey"}, "KEY", true));
  EXPECT_TRUE(matchStringWithList(TextList{"ＶＩＤＥＯ"}, "my-ｖｉｄｅｏ-call", true));
  EXPECT_TRUE(matchStringWithList(TextList{"ΟΣ"}, "δρομος 7", true));
  EXPECT_FALSE(matchExactStringWithList(TextList{"ΟΔΟΣ"}, "οδοσσ", true));
}

TEST(ListMatchingTest, PartialMatchFindsItemsAnywhereButNeverTheEmptyOne) {
  const MaybeTextList list = TextList{"Video", "x"};
  for (const bool whitelist : {true, false}) {
    EXPECT_TRUE(matchStringWithList(list, "my-VIDEO-call", whitelist));
    EXPECT_TRUE(matchStringWithList(list, "X", whitelist));
    EXPECT_FALSE(matchStringWithList(list, "vide", whitelist));
    EXPECT_FALSE(matchStringWithList(TextList{""}, "anything", whitelist));
    EXPECT_FALSE(matchStringWithList(TextList{""}, "", whitelist));
  }
}

TEST(ListMatchingTest, SplitsAtCommasWithoutTrimming) {
  EXPECT_EQ(splitAtCommas("A,B"), (TextList{"A", "B"}));
  EXPECT_EQ(splitAtCommas(" A ,, B,"), (TextList{" A ", "", " B", ""}));
  EXPECT_EQ(splitAtCommas(""), TextList{""});
}

TEST(SenderNamesTest, HoldsOneNamePerClientType) {
  EXPECT_EQ(senderName(0), "PX");
  EXPECT_EQ(senderName(1), "DW");
  EXPECT_EQ(senderName(2), "BOR");
  EXPECT_EQ(senderName(3), "HY");
  EXPECT_EQ(senderName(4), "MQ");
  EXPECT_EQ(senderName(5), "EJ");
  EXPECT_EQ(senderName(6), "ZU");
  EXPECT_EQ(senderName(7), "KA");
  EXPECT_EQ(senderName(8), "OW");
  EXPECT_EQ(senderName(9), "FE");
  EXPECT_EQ(senderName(10), "YL");
  EXPECT_EQ(senderName(11), "UB");
  EXPECT_EQ(senderName(12), "PLMA");
  EXPECT_EQ(senderName(13), "TOVAN");
  EXPECT_EQ(senderName(14), "VN-KRS");
  EXPECT_EQ(senderName(15), "VN-DULEX");
  EXPECT_EQ(senderName(16), "OSTRIK");
  EXPECT_EQ(senderName(17), "FRANDEL");
}

TEST(SenderNamesTest, IsEmptyForNumbersThatAreNoClientType) {
  for (const int32_t type : {-1, 18, 1000000, INT32_MIN, INT32_MAX}) EXPECT_EQ(senderName(type), "");
}

TEST(TextFormatTest, FormatsTextsOfAnyLength) {
  EXPECT_EQ(formatText("%s", ""), "");
  EXPECT_EQ(formatText("%d-%s", 5, "x"), "5-x");
  const std::string longText(100000, 'y');
  EXPECT_EQ(formatText("%s!", longText.c_str()), longText + "!");
}

}  // namespace
}  // namespace tarnel

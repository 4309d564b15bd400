#include "tools/receiving/text.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

namespace tarnel::lab {
namespace {

TEST(Text, NothingThatSteersATerminalIsPrinted) {
  EXPECT_EQ(printable("Zoë & Ravi ☕"), "Zoë & Ravi ☕");
  EXPECT_EQ(printable("\033[31mred\033[0m\r\n\t\x7f"), "?[31mred?[0m????");
  EXPECT_EQ(printable("\xc2\x9b"
                      "31m"),
            "?31m")
      << "C1 control characters";
  EXPECT_EQ(printable("a\xe2\x80\xae"
                      "b"),
            "a?b")
      << "reversed writing";
  EXPECT_EQ(printable("\xff\xfe ok"), "?? ok");
  EXPECT_EQ(printable(std::string("a\0b", 3)), "a?b");
}

TEST(Text, LongTextIsCutBetweenCharacters) {
  EXPECT_EQ(printable("abcdef", 6), "abcdef");
  EXPECT_EQ(printable("abcdefg", 6), "abcdef...");
  EXPECT_EQ(printable("aé", 2), "a...");
}

TEST(Text, NumbersForPeople) {
  EXPECT_EQ(grouped(0), "0");
  EXPECT_EQ(grouped(999), "999");
  EXPECT_EQ(grouped(1000), "1,000");
  EXPECT_EQ(grouped(1234567), "1,234,567");
  EXPECT_EQ(byteCount(999), "999 B");
  EXPECT_EQ(byteCount(1000), "1.0 kB");
  EXPECT_EQ(byteCount(999'949), "999.9 kB");
  EXPECT_EQ(byteCount(999'950), "1.0 MB");
  EXPECT_EQ(byteCount(16U << 20U), "16.8 MB");
}

TEST(Text, ClockTimeIsLocalWithMilliseconds) {
  ::setenv("TZ", "XYZ-2", 1);
  ::tzset();
  EXPECT_EQ(clockTime(1795176688.5), "14:11:28.500");
  ::unsetenv("TZ");
  ::tzset();
}

TEST(Text, HttpDates) {
  EXPECT_EQ(httpDate(784111777), "Sun, 06 Nov 1994 08:49:37 GMT");
  EXPECT_EQ(parseHttpDate("Sun, 06 Nov 1994 08:49:37 GMT"), 784111777);
  for (const char* bad : {"", "Sun", "Sun, 06 Nov 1994 08:49:37", "Sun, 06 Nov 1994 08:49:37 GMT ",
                          "Sun, 06 Xyz 1994 08:49:37 GMT", "Sun, 31 Feb 1994 08:49:37 GMT",
                          "Sunday, 06-Nov-94 08:49:37 GMT", "06 Nov 1994 08:49:37 GMT"}) {
    EXPECT_EQ(parseHttpDate(bad), std::nullopt) << bad;
  }
}

TEST(Text, NumbersAreDigitsOnly) {
  EXPECT_EQ(parseNumber("18446744073709551615"), UINT64_MAX);
  for (const char* bad : {"", "-1", "+1", " 1", "1 ", "1.5", "18446744073709551616", "x"}) {
    EXPECT_EQ(parseNumber(bad), std::nullopt) << bad;
  }
}

TEST(Text, LinesCountFromOne) {
  EXPECT_EQ(lineOfOffset("a\nb\nc", 0), 1U);
  EXPECT_EQ(lineOfOffset("a\nb\nc", 2), 2U);
  EXPECT_EQ(lineOfOffset("a\nb\nc", 400), 3U);
}

}  // namespace
}  // namespace tarnel::lab

#include "base/rfc3339.h"

#include <cmath>
#include <limits>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

TEST(Rfc3339Test, readsTimes) {
  const struct {
    const char* text;
    double seconds;
  } cases[] = {{"1970-01-01T00:00:00Z", 0},
               {"1970-01-01t00:00:01z", 1},
               {"2026-01-31T12:00:00+00:00", 1769860800},
               {"2026-01-31T12:00:00-00:00", 1769860800},
               {"2026-01-31T13:30:00+01:30", 1769860800},
               {"2026-01-31T04:00:00-08:00", 1769860800},
               {"2026-01-31T12:00:00.123456Z", 1769860800.123456},
               {"2026-01-31T12:00:00.5000000000000000000000Z", 1769860800.5},
               {"2024-02-29T00:00:00Z", 1709164800},
               {"2016-12-31T23:59:60Z", 1483228800},
               {"1969-12-31T23:59:59.9Z", -0.1},
               {"1969-12-31T23:59:58.75Z", -1.25},
               {"1969-12-31T23:59:58.0Z", -2},
               {"0000-01-01T00:00:00Z", -62167219200},
               {"9999-12-31T23:59:59Z", 253402300799}};
  for (const auto& one : cases) {
    const auto date = parseRfc3339(one.text);
    ASSERT_TRUE(date) << one.text;
    EXPECT_EQ(date->seconds, one.seconds) << one.text;
  }
}

TEST(Rfc3339Test, refusesEverythingElse) {
  for (const char* text : {"",
                           "2026-01-31",
                           "2026-01-31T12:00Z",
                           "2026-01-31T12:00:00",
                           "2026-01-31 12:00:00Z",
                           "2026-02-30T12:00:00Z",
                           "2025-02-29T12:00:00Z",
                           "2026-13-01T12:00:00Z",
                           "2026-00-01T12:00:00Z",
                           "2026-01-00T12:00:00Z",
                           "2026-01-31T24:00:00Z",
                           "2026-01-31T12:60:00Z",
                           "2026-01-31T12:00:61Z",
                           "2026-01-31T12:00:00.Z",
                           "2026-01-31T12:00:00,5Z",
                           "2026-01-31T12:00:00+24:00",
                           "2026-01-31T12:00:00+01:60",
                           "2026-01-31T12:00:00+0100",
                           "2026-01-31T12:00:00Z ",
                           " 2026-01-31T12:00:00Z",
                           "26-01-31T12:00:00Z",
                           "+026-01-31T12:00:00Z",
                           "2026-1-31T12:00:00Z",
                           "2026-01-31T12:00:0aZ",
                           "2026-01-31T12:00:00ZZ"}) {
    EXPECT_FALSE(parseRfc3339(text)) << text;
  }
  EXPECT_FALSE(parseRfc3339("2026-01-31T12:00:00." + std::string(1000, '0') + "Z"));
}

TEST(Rfc3339Test, writesWhatReadsBackAsTheSameDate) {
  for (const double seconds :
       {0.0, 0.5, 1769860800.123456, 1769860800.1234567, -0.1, -0.5, -1.0, -1.25, -62167219200.0,
        253402300799.0, 253402300799.99997, 1e-9, -1e-9, 5e-324, 1e10 / 3, -1e10 / 3}) {
    const auto text = rfc3339Text(Date{seconds});
    ASSERT_TRUE(text) << seconds;
    const auto back = parseRfc3339(*text);
    ASSERT_TRUE(back) << *text;
    EXPECT_EQ(back->seconds, seconds) << *text;
  }
  EXPECT_EQ(*rfc3339Text(Date{1769857200.25}), "2026-01-31T11:00:00.25Z");
  EXPECT_EQ(*rfc3339Text(Date{-0.1}), "1969-12-31T23:59:59.9Z");
  EXPECT_EQ(*rfc3339Text(Date{-62167219200.0}), "0000-01-01T00:00:00Z");
}

TEST(Rfc3339Test, doesNotWriteWhatNoCalendarHolds) {
  for (const double seconds : {253402300800.0, -62167219200.5, 1e300, -1e300, std::nan(""),
                               std::numeric_limits<double>::infinity()}) {
    EXPECT_FALSE(rfc3339Text(Date{seconds})) << seconds;
  }
}

}  // namespace
}  // namespace tarnel

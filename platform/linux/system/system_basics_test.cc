#include <algorithm>
#include <chrono>
#include <cmath>
#include <set>
#include <string>

#include <gtest/gtest.h>

#include "platform/linux/system/system_clock.h"
#include "platform/linux/system/system_random.h"

namespace tarnel {
namespace {

TEST(SystemClockTest, tellsTheTimeOfDay) {
  const auto before = std::chrono::system_clock::now().time_since_epoch();
  SystemClock clock;
  const TimeValue now = clock.timeOfDay();
  const auto after = std::chrono::system_clock::now().time_since_epoch();
  EXPECT_GE(now.microseconds, 0);
  EXPECT_LT(now.microseconds, 1000000);
  const auto told = std::chrono::seconds(now.seconds) + std::chrono::microseconds(now.microseconds);
  EXPECT_GE(told, std::chrono::floor<std::chrono::microseconds>(before));
  EXPECT_LE(told, after);
}

TEST(SystemRandomTest, drawsFortyEightBitsFromZeroToOne) {
  SystemRandom random;
  constexpr double kTwoTo48 = 281474976710656.0;
  double least = 1;
  double most = 0;
  bool usesLowestBit = false;
  for (int i = 0; i < 2000; ++i) {
    const double drawn = random.uniform();
    ASSERT_GE(drawn, 0);
    ASSERT_LT(drawn, 1);
    const double scaled = drawn * kTwoTo48;
    ASSERT_EQ(scaled, std::floor(scaled));
    usesLowestBit = usesLowestBit || std::fmod(scaled, 2) == 1;
    least = std::min(least, drawn);
    most = std::max(most, drawn);
  }
  EXPECT_TRUE(usesLowestBit);
  EXPECT_LT(least, 0.05);
  EXPECT_GT(most, 0.95);
}

TEST(SystemRandomTest, makesUuidsOfVersionFour) {
  SystemRandom random;
  std::set<std::string> seen;
  for (int i = 0; i < 200; ++i) {
    const UuidBytes uuid = random.uuid();
    EXPECT_EQ(uuid[6] >> 4U, 4);
    EXPECT_EQ(uuid[8] >> 6U, 2);
    seen.insert(uuidText(uuid));
  }
  EXPECT_EQ(seen.size(), 200U);
}

TEST(UuidTextTest, isCanonicalAndUpperCase) {
  EXPECT_EQ(uuidText({0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x46, 0x77, 0x88, 0x99, 0xaa, 0xbb, 0xcc, 0xdd,
                      0xee, 0xff}),
            "00112233-4455-4677-8899-AABBCCDDEEFF");
  EXPECT_EQ(uuidText({}), "00000000-0000-0000-0000-000000000000");
}

}  // namespace
}  // namespace tarnel

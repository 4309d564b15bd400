#include "base/percent_encoding.h"

#include <gtest/gtest.h>

#include <cstdio>

namespace tarnel {
namespace {

TEST(PercentEncodingTest, EveryByteHasItsForm) {
  const std::string kept =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._~!$&'()*+,;=:@/?";
  ASSERT_EQ(kept.size(), 26U + 26 + 10 + 19);
  for (int byte = 0; byte < 256; ++byte) {
    const std::string text(1, static_cast<char>(byte));
    char code[4];
    std::snprintf(code, sizeof code, "%%%02X", static_cast<unsigned>(byte));
    EXPECT_EQ(percentEncodedForQuery(text), kept.find(text) != std::string::npos ? text : code) << byte;
  }
}

TEST(PercentEncodingTest, TextsAreEncodedByteByByte) {
  EXPECT_EQ(percentEncodedForQuery(""), "");
  EXPECT_EQ(percentEncodedForQuery("Lumora AFRC log"), "Lumora%20AFRC%20log");
  EXPECT_EQ(percentEncodedForQuery("a b.log.gz"), "a%20b.log.gz");
  EXPECT_EQ(percentEncodedForQuery("a&b=c#d%20"), "a&b=c%23d%2520");
  EXPECT_EQ(percentEncodedForQuery("Zoë"), "Zo%C3%AB");
  EXPECT_EQ(percentEncodedForQuery(std::string("a\0b\xFF", 4)), "a%00b%FF");
}

}  // namespace
}  // namespace tarnel

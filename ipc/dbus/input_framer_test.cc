#include "ipc/dbus/input_framer.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ipc/server/ipc_test_support.h"

namespace tarnel {
namespace {

using ::testing::HasSubstr;

constexpr size_t kLimit = 4096;
const std::string kHandshake("\0AUTH EXTERNAL\r\nDATA\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n", 48);

TEST(InputFramerTest, MessagesAreCountedWhereverTheBytesAreCut) {
  const std::string all =
      kHandshake + rawCall("A") + rawCall("Bcd", std::string(100, 'x'), "s") + rawCall("E");
  for (size_t cut = 1; cut <= all.size(); ++cut) {
    InputFramer framer(kLimit);
    std::string held;
    size_t admitted = 0;
    for (size_t at = 0; at < all.size(); at += cut) {
      held += all.substr(at, cut);
      const auto step = framer.admit(held);
      ASSERT_TRUE(step) << framer.refusal();
      admitted += *step;
      held.erase(0, *step);
      EXPECT_LT(held.size(), 16U);
    }
    EXPECT_EQ(admitted, all.size());
    EXPECT_EQ(framer.completed(), 3U);
  }
}

TEST(InputFramerTest, OnlyALineOfItsOwnEndsTheAuthentication) {
  InputFramer framer(kLimit);
  // Neither of the two alone ends a line.
  const std::string lines =
      std::string("\0AUTH BEGIN\r\nXBEGIN\r\nBEGIN \r\nX\nBEGIN\r\nX\rBEGIN\r\n\r\r\nBEGIN\r\r\nBEGIN\n",
                  64) +
      std::string(1000, 'B');
  EXPECT_EQ(framer.admit(lines), lines.size());
  EXPECT_TRUE(framer.isAuthenticating());
  EXPECT_EQ(framer.admit("\r\nBEGIN\r\n"), 9U);
  EXPECT_EQ(framer.admit("x"), 0U);
  EXPECT_FALSE(framer.admit(std::string(16, 'x')));
}

TEST(InputFramerTest, TheFirstByteIsOfNoLine) {
  for (const char first : {'\0', 'x', '\r'}) {
    InputFramer framer(kLimit);
    EXPECT_EQ(framer.admit(first + std::string("BEGIN\r\n")), 8U);
    EXPECT_FALSE(framer.isAuthenticating());
  }
}

TEST(InputFramerTest, TheAuthenticationIsBounded) {
  for (const bool fits : {true, false}) {
    InputFramer framer(kLimit);
    const std::string lines(fits ? 4089 : 4090, 'x');
    EXPECT_EQ(framer.admit(lines.substr(0, 2000)), 2000U);
    EXPECT_EQ(framer.admit(lines.substr(2002) + "\r\n"), lines.size() - 2000);
    EXPECT_EQ(framer.admit("BEGIN\r\n").has_value(), fits);
    EXPECT_EQ(framer.refusal(), fits ? "" : "its authentication takes more than 4096 bytes");
  }
}

TEST(InputFramerTest, TheLimitItselfIsAllowedAndOneMoreIsNot) {
  const size_t empty = rawCall("A", "", "s").size();
  for (const bool fits : {true, false}) {
    InputFramer framer(kLimit);
    ASSERT_TRUE(framer.admit(kHandshake));
    const auto body = static_cast<uint32_t>(kLimit - empty + (fits ? 0 : 1));
    const auto admitted = framer.admit(rawCall("A", "", "s", body));
    EXPECT_EQ(admitted.has_value(), fits);
    EXPECT_EQ(framer.refusal(), fits ? "" : "a message of 4097 bytes exceeds the limit of 4096 bytes");
  }
}

TEST(InputFramerTest, TheLargestClaimDoesNotOverflow) {
  InputFramer framer(kLimit);
  ASSERT_TRUE(framer.admit(kHandshake));
  EXPECT_FALSE(framer.admit(std::string("l\1\0\1\xFF\xFF\xFF\xFF\1\0\0\0\xFF\xFF\xFF\xFF", 16)));
  EXPECT_THAT(framer.refusal(), HasSubstr("a message of 8589934607 bytes"));
}

TEST(InputFramerTest, BothByteOrdersAreRead) {
  InputFramer framer(kLimit);
  ASSERT_TRUE(framer.admit(kHandshake));
  EXPECT_EQ(framer.admit(std::string("B\1\0\1\0\0\0\2\0\0\0\1\0\0\0\1", 16) + std::string(10, 'x')), 26U);
  EXPECT_EQ(framer.completed(), 1U);
}

TEST(InputFramerTest, AByteThatBeginsNoMessageIsRefused) {
  InputFramer framer(kLimit);
  ASSERT_TRUE(framer.admit(kHandshake));
  EXPECT_FALSE(framer.admit("GET / HTTP/1.1\r\n\r\n"));
  EXPECT_THAT(framer.refusal(), HasSubstr("broke the protocol"));
}

}  // namespace
}  // namespace tarnel

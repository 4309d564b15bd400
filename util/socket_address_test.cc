#include "util/socket_address.h"

#include <gtest/gtest.h>

namespace tarnel {
namespace {

uint32_t addressOf(std::string_view text) {
  return socketAddress(text, 9).address;
}

TEST(SocketAddressTest, ReadsDottedText) {
  EXPECT_EQ(socketAddress("192.0.2.17", 8125), (Ipv4Address{0xC0000211, 8125}));
  EXPECT_EQ(addressOf("0.0.0.0"), 0U);
  EXPECT_EQ(addressOf("255.255.255.255"), 0xFFFFFFFFU);
}

TEST(SocketAddressTest, TakesTheClassicForms) {
  EXPECT_EQ(addressOf("127.1"), 0x7F000001U);
  EXPECT_EQ(addressOf("0x7f.0.0.01"), 0x7F000001U);
  EXPECT_EQ(addressOf("2130706433"), 0x7F000001U);
}

TEST(SocketAddressTest, UsesSixteenBytesAtMost) {
  EXPECT_EQ(addressOf("10.0.0.1        .not looked at"), 0x0A000001U);
  EXPECT_EQ(addressOf("100.100.100.100x"), 0xFFFFFFFFU);  // the sixteenth counts
  EXPECT_EQ(addressOf("000000000000010.1"), addressOf("000000000000010."));
}

TEST(SocketAddressTest, TextThatIsNoAddressIsTheBroadcastAddress) {
  for (const char* text : {"", "localhost", "server.example", "300.1.1.1", "1.2.3.4.5", "::1", "-1"}) {
    EXPECT_EQ(addressOf(text), 0xFFFFFFFFU) << text;
  }
}

TEST(SocketAddressTest, StopsAtAZeroByte) {
  EXPECT_EQ(addressOf(std::string_view("10.0.0.1\0.5", 11)), 0x0A000001U);
}

}  // namespace
}  // namespace tarnel

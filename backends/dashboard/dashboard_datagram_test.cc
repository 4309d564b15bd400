#include "backends/dashboard/dashboard_datagram.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <string>
#include <vector>

#include "backends/dashboard/udp_packet_to_send.h"
#include "backends/https/sender_names.h"

namespace tarnel {
namespace {

using Bytes = std::vector<uint8_t>;

DashboardHeader sampleHeader() {
  return {.selfVersionMajor = 3,
          .compType = 12,
          .timestamp = {0x1122334455, 999999},
          .sessionID = 0x01020304,
          .clientVersion = 0x0506,
          .method = Method{0x0708},
          .respCode = RespCode{0x090A},
          .udid = "0123456789abcdef0123456789abcdef01234567",
          .eventID = EventID{0x0B0C},
          .isReliable = true,
          .isServerFromProfile = true};
}
Bytes written(const DashboardHeader& header, const std::string& text = {}) {
  DashboardBuffer buffer;
  buffer.fill(0xCC);  // nothing is left of what was there
  const size_t length = writeDashboardDatagram(header, text, buffer);
  return {buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(length)};
}

TEST(DashboardDatagramTest, HeaderByteByByte) {
  Bytes expected{3,    12,   1,    249,    // version, component, constant, 4 ms units
                 0x22, 0x33, 0x44, 0x55,   // low 32 bits of the seconds
                 0xFE, 0xFD, 0xFC, 0xFB,   // session, complemented
                 0xFA, 0xF9,               // client version, inverted
                 0xFF, 0xBF,               // length 64, complemented
                 0x07, 0x08, 0x09, 0x0A};  // method, respCode
  const std::string udid = "0123456789abcdef0123456789abcdef01234567";
  expected.insert(expected.end(), udid.begin(), udid.end());
  expected.insert(expected.end(), {0x0B, 0x0C, 0x00, 0x01});  // event, flags
  EXPECT_EQ(written(sampleHeader()), expected);
}

TEST(DashboardDatagramTest, TextFollowsAndIsCounted) {
  const auto bytes = written(sampleHeader(), " a=1");
  ASSERT_EQ(bytes.size(), 68U);
  EXPECT_EQ(std::string(bytes.begin() + 64, bytes.end()), " a=1");
  EXPECT_EQ(bytes[14], 0xFF);
  EXPECT_EQ(bytes[15], 0xFF - 68);
}

TEST(DashboardDatagramTest, LongestDatagramHas1087Bytes) {
  const auto bytes = written(sampleHeader(), std::string(5000, 'x'));
  ASSERT_EQ(bytes.size(), 1087U);
  EXPECT_EQ(static_cast<uint16_t>(~(bytes[14] << 8U | bytes[15])), 1087);
}

TEST(DashboardDatagramTest, SubSecondPartIsInUnitsOfFourMilliseconds) {
  for (const auto& [microseconds, unit] : std::vector<std::pair<int32_t, int>>{
           {0, 0}, {3999, 0}, {4000, 1}, {250000, 62}, {500000, 125}, {995999, 248}, {996000, 249}}) {
    auto header = sampleHeader();
    header.timestamp.microseconds = microseconds;
    EXPECT_EQ(written(header)[3], unit) << microseconds;
  }
}

TEST(DashboardDatagramTest, FlagsSayReliableAndExplicitServer) {
  auto header = sampleHeader();
  for (const auto& [reliable, fromProfile, flags] : std::vector<std::tuple<bool, bool, int>>{
           {false, true, 0}, {true, true, 1}, {false, false, 2}, {true, false, 3}}) {
    header.isReliable = reliable;
    header.isServerFromProfile = fromProfile;
    EXPECT_EQ(written(header)[62], 0);
    EXPECT_EQ(written(header)[63], flags);
  }
}

TEST(DashboardDatagramTest, NarrowFieldsKeepTheLowByte) {
  auto header = sampleHeader();
  header.compType = 0x1234;
  EXPECT_EQ(written(header)[1], 0x34);
  header.compType = -1;
  EXPECT_EQ(written(header)[1], 0xFF);
}

TEST(DashboardDatagramTest, DeviceIdentifierIsFortyBytes) {
  auto header = sampleHeader();
  header.udid = "short";
  const auto bytes = written(header);
  EXPECT_EQ(std::string(bytes.begin() + 20, bytes.begin() + 25), "short");
  EXPECT_EQ(std::count(bytes.begin() + 25, bytes.begin() + 60, 0), 35);
  header.udid = "0123456789abcdef0123456789abcdef01234567and more";
  EXPECT_EQ(written(header), written(sampleHeader()));
  const std::string endless = "0123456789abcdef0123456789abcdef01234567" + std::string(1U << 16U, 'x');
  header.udid = endless;
  EXPECT_EQ(written(header), written(sampleHeader()));
  header.udid = "";
  EXPECT_EQ(written(header)[20], 0);
}

// --- text ---

TEST(DashboardTextTest, NoEntriesGiveNoText) {
  EXPECT_EQ(dashboardText({}), "");
}

TEST(DashboardTextTest, EveryEntryHasABlankBefore) {
  EXPECT_EQ(dashboardText({{"a", "xx"}}), " a=xx");
  EXPECT_EQ(dashboardText({{"a", "xx"}, {"b", "yyy"}}), " a=xx b=yyy");
}

TEST(DashboardTextTest, ShortestValuesComeFirstAndEqualOnesInTheirOrder) {
  const Dictionary payload{{"long", "12345"}, {"z", "22"}, {"three", 333},
                           {"a", 11},         {"one", 1},  {"m", "33"}};
  EXPECT_EQ(dashboardText(payload), " one=1 z=22 a=11 m=33 three=333 long=12345");
}

TEST(DashboardTextTest, OrderGoesByTheDescriptionBeforeItIsSanitized) {
  // Three and two characters that become two and four; nothing becomes "empty"; "null" has four.
  const Dictionary payload{{"n", Array{1}}, {"x", "\n\na"}, {"y", "=="}, {"e", ""}, {"five", "12345"}};
  EXPECT_EQ(dashboardText(payload), " e=empty y=\\=\\= x=a n=null five=12345");
}

TEST(DashboardTextTest, LengthCountsUtf16CodeUnits) {
  // Two and three bytes, one unit; four bytes, two units.
  EXPECT_EQ(dashboardText({{"two", "ab"}, {"one", "ü"}, {"also", "€"}}), " one=ü also=€ two=ab");
  EXPECT_EQ(dashboardText({{"three", "abc"}, {"two", "😀"}, {"also", "ab"}}), " two=😀 also=ab three=abc");
  EXPECT_EQ(dashboardText({{"two", "ab"}, {"also", "😀"}, {"one", "a"}}), " one=a two=ab also=😀");
}

TEST(DashboardTextTest, ManyEntriesOfEqualLengthKeepTheirOrder) {
  Dictionary payload;
  std::string expected;
  for (int i = 10; i < 90; ++i) {
    payload.set("k" + std::to_string(i), i);
    expected += " k" + std::to_string(i) + "=" + std::to_string(i);
  }
  EXPECT_EQ(dashboardText(payload), expected);
}

TEST(DashboardTextTest, KeysAreNotSanitized) {
  EXPECT_EQ(dashboardText({{"a=b\\\n", 1}}), " a=b\\\n=1");
}

TEST(DashboardTextTest, IsCutTo1023Bytes) {
  EXPECT_EQ(dashboardText({{"k", std::string(1020, 'x')}}), " k=" + std::string(1020, 'x'));
  EXPECT_EQ(dashboardText({{"k", std::string(1021, 'x')}}), " k=" + std::string(1020, 'x'));
  EXPECT_EQ(dashboardText({{"k", std::string(1U << 20U, 'x')}}).size(), 1023U);
}

TEST(DashboardTextTest, WhatComesAfterTheCutIsLeftOut) {
  const Dictionary payload{
      {"a", std::string(1017, 'x')}, {"b", std::string(2000, 'y')}, {"c", std::string(3000, 'z')}};
  EXPECT_EQ(dashboardText(payload), " a=" + std::string(1017, 'x') + " b=");
  // A full text stays as it is.
  EXPECT_EQ(dashboardText({{"a", std::string(1020, 'x')}, {"b", std::string(2000, 'y')}}),
            " a=" + std::string(1020, 'x'));
}

TEST(DashboardTextTest, CutNeverGoesThroughACharacter) {
  for (const std::string character : {"ü", "€", "😀"}) {
    for (const std::string key : {"k", "kk", "kkk", "kkkk"}) {  // the end falls on each of its bytes
      std::string value;
      while (value.size() < 2000) value += character;
      const size_t room = 1023 - key.size() - 2;
      const std::string text = dashboardText({{key, value}});
      EXPECT_EQ(text, " " + key + "=" + value.substr(0, room / character.size() * character.size()));
      // Nothing fills the gap.
      EXPECT_EQ(dashboardText({{key, value}, {"z", std::string(3000, 'z')}}), text);
    }
  }
  // Bytes that are no text at all are cut too.
  EXPECT_GE(dashboardText({{"k", std::string(2000, '\x80')}}).size(), 1020U);
}

TEST(DashboardTextTest, DescriptionsOfValues) {
  EXPECT_EQ(descriptionForObject("a text"), "a text");
  EXPECT_EQ(descriptionForObject(-17), "-17");
  EXPECT_EQ(descriptionForObject(UINT64_MAX), "18446744073709551615");
  EXPECT_EQ(descriptionForObject(0.25), "0.25");
  EXPECT_EQ(descriptionForObject(100000.0), "100000");
  EXPECT_EQ(descriptionForObject(true), "1");
  EXPECT_EQ(descriptionForObject(false), "0");
  for (const Value& other :
       {Value(), Value(Date{1}), Value(Data{1}), Value(Array{"a"}), Value(Dictionary{{"a", 1}})}) {
    EXPECT_EQ(descriptionForObject(other), "null");
  }
}

TEST(DashboardTextTest, Sanitizing) {
  EXPECT_EQ(sanitize("a=b\\c"), "a\\=b\\\\c");
  EXPECT_EQ(sanitize("\\="), "\\\\\\=");
  EXPECT_EQ(sanitize("one\ntwo\n\nthree\n"), "onetwothree");
  EXPECT_EQ(sanitize("a\nb=\n"), "ab\\=");
  EXPECT_EQ(sanitize(""), "empty");
  EXPECT_EQ(sanitize("\n\n"), "empty");
  EXPECT_EQ(sanitize(" "), " ");
  EXPECT_EQ(sanitize("\r\t"), "\r\t");  // only line feeds go
  EXPECT_EQ(sanitize("1.5"), "1.5");
}

// --- line for the log ---

TEST(DashboardLogLineTest, ShowsEveryFieldAsItWas) {
  auto header = sampleHeader();
  header.timestamp = {1700000000, 250000};
  EXPECT_EQ(
      writeLocalLog(written(header, " a=1 b=two")),
      "1700000000.248 0123456789abcdef0123456789abcdef01234567 127.0.0.1 PLMA  1286 16909060  2828  1800  "
      "2314  a=1 b=two");
}

TEST(DashboardLogLineTest, WithoutTextItEndsInOneBlank) {
  const DashboardHeader header{.timestamp = {5, 0}, .udid = "id"};
  EXPECT_EQ(writeLocalLog(written(header)), "5.000 id 127.0.0.1 PX     0     0     0     0     0 ");
}

TEST(DashboardLogLineTest, MillisecondsAreMultiplesOfFourWithThreeDigits) {
  auto header = sampleHeader();
  for (const auto& [microseconds, text] : std::vector<std::pair<int32_t, std::string>>{
           {0, ".000 "}, {4001, ".004 "}, {47999, ".044 "}, {999999, ".996 "}}) {
    header.timestamp = {1, microseconds};
    EXPECT_EQ(writeLocalLog(written(header)).substr(1, 5), text);
  }
}

TEST(DashboardLogLineTest, LargestNumbersAreNotTornApart) {
  const DashboardHeader header{.timestamp = {UINT32_MAX, 999999},
                               .sessionID = UINT32_MAX,
                               .clientVersion = UINT16_MAX,
                               .method = Method{UINT16_MAX},
                               .respCode = RespCode{UINT16_MAX},
                               .udid = "id",
                               .eventID = EventID{UINT16_MAX}};
  EXPECT_EQ(writeLocalLog(written(header)),
            "4294967295.996 id 127.0.0.1 PX 65535 4294967295 65535 65535 65535 ");
}

TEST(DashboardLogLineTest, NamesEverySender) {
  auto header = sampleHeader();
  for (int32_t type = 0; type <= 17; ++type) {
    header.compType = type;
    EXPECT_NE(writeLocalLog(written(header)).find(" 127.0.0.1 " + std::string(senderName(type)) + " "),
              std::string::npos)
        << type;
  }
}

TEST(DashboardLogLineTest, SenderWithoutANameIsADash) {
  auto header = sampleHeader();
  for (const int32_t type : {18, 255, -1}) {
    header.compType = type;
    EXPECT_NE(writeLocalLog(written(header)).find(" 127.0.0.1 -  1286"), std::string::npos) << type;
  }
}

TEST(DashboardLogLineTest, LongestLineIsWhole) {
  const DashboardHeader header{.compType = 15,
                               .timestamp = {UINT32_MAX, 999999},
                               .sessionID = UINT32_MAX,
                               .clientVersion = UINT16_MAX,
                               .udid = "0123456789abcdef0123456789abcdef01234567"};
  const std::string text(1023, 'x');
  const std::string line = writeLocalLog(written(header, text));
  EXPECT_TRUE(line.ends_with(" " + text));
}

TEST(DashboardLogLineTest, BufferHolds1152BytesWithTheirEnd) {
  auto datagram = written(sampleHeader());
  datagram.resize(64 + 5000, 'x');  // longer than any of ours
  const std::string line = writeLocalLog(datagram);
  EXPECT_EQ(line.size(), 1151U);
  EXPECT_EQ(line.back(), 'x');
}

TEST(DashboardLogLineTest, TextEndsAtAZeroByte) {
  EXPECT_TRUE(writeLocalLog(written(sampleHeader(), std::string(" a=1\0b", 6))).ends_with("  a=1"));
}

TEST(DashboardLogLineTest, PercentSignsAreText) {
  EXPECT_TRUE(writeLocalLog(written(sampleHeader(), " a=%s%n")).ends_with("  a=%s%n"));
}

// --- acknowledgements ---

TEST(DashboardAcknowledgementTest, NamesTheEventInBytes60And61) {
  Bytes datagram(62, 0xEE);
  datagram[60] = 0x12;
  datagram[61] = 0x34;
  EXPECT_EQ(acknowledgedEvent(datagram), EventID{0x1234});
  datagram.resize(1088, 0xFF);
  EXPECT_EQ(acknowledgedEvent(datagram), EventID{0x1234});
}

TEST(DashboardAcknowledgementTest, ShorterOnesNameNone) {
  for (size_t size = 0; size < 62; ++size) {
    EXPECT_EQ(acknowledgedEvent(Bytes(size, 0)), std::nullopt) << size;
  }
}

// --- packets ---

TEST(UDPPacketToSendTest, BeginsAtZeroWithACopyOfTheBytes) {
  Bytes bytes{1, 2, 3, 4};
  const auto packet = UDPPacketToSend::initWithBytes(bytes.data(), 3, EventID{7});
  bytes[0] = 9;
  EXPECT_EQ(packet->state(), UDPPacketToSend::State::notSent);
  EXPECT_EQ(static_cast<int>(packet->state()), 0);
  EXPECT_EQ(static_cast<int>(UDPPacketToSend::State::awaitsAcknowledgement), 1);
  EXPECT_EQ(packet->numberOfChecks(), 0);
  EXPECT_EQ(packet->numberOfRetransmits(), 0);
  EXPECT_EQ(packet->eventNumber(), EventID{7});
  EXPECT_EQ(*packet->data(), (Bytes{1, 2, 3}));
}

TEST(UDPPacketToSendTest, ReplacedDataLeavesEarlierReadersTheirs) {
  const Bytes bytes{1, 2, 3};
  const auto packet = UDPPacketToSend::initWithBytes(bytes.data(), bytes.size(), EventID{7});
  const auto before = packet->data();
  packet->setData(std::make_shared<const Bytes>(Bytes{4}));
  EXPECT_EQ(*before, bytes);
  EXPECT_EQ(*packet->data(), Bytes{4});
}

}  // namespace
}  // namespace tarnel

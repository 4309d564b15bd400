#include "tools/receiving/datagram_decoder.h"

#include <gmock/gmock.h>

#include <random>

#include "tools/receiving/test_datagram.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Pair;

std::vector<std::string> problemsOf(const Bytes& bytes) {
  Problems problems;
  readDatagram(bytes, problems);
  return problems.take();
}

std::vector<std::pair<std::string, std::string>> entriesOf(const std::string& text) {
  Problems problems;
  const auto datagram = readDatagram(sampleDatagram(text), problems);
  EXPECT_THAT(problems.take(), IsEmpty()) << text;
  return datagram ? datagram->entries : std::vector<std::pair<std::string, std::string>>();
}

TEST(DatagramDecoderTest, EveryFieldIsRead) {
  Problems problems;
  const auto datagram = readDatagram(sampleDatagram(" a=1 b=two"), problems);
  ASSERT_TRUE(datagram);
  EXPECT_THAT(problems.take(), IsEmpty());
  EXPECT_EQ(datagram->reportVersion, 3U);
  EXPECT_EQ(datagram->clientType, 12U);
  EXPECT_EQ(datagram->time, 1700000000.248);
  EXPECT_EQ(datagram->sessionID, 0x01020304U);
  EXPECT_EQ(datagram->clientVersion, 0x0506);
  EXPECT_EQ(datagram->method, 0x0708);
  EXPECT_EQ(datagram->status, 0x090A);
  EXPECT_EQ(datagram->device, "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(datagram->event, 0x0A0B);
  EXPECT_TRUE(datagram->isReliable);
  EXPECT_TRUE(datagram->isServerFromStorebag);
  EXPECT_EQ(datagram->text, " a=1 b=two");
  EXPECT_THAT(datagram->entries, ElementsAre(Pair("a", "1"), Pair("b", "two")));
}

TEST(DatagramDecoderTest, FlagsAndAShortDevice) {
  Bytes bytes = sampleDatagram("", false);
  bytes[63] = 2;
  bytes[23] = 0;  // the fourth character
  Problems problems;
  const auto datagram = readDatagram(bytes, problems);
  ASSERT_TRUE(datagram);
  EXPECT_FALSE(datagram->isReliable);
  EXPECT_FALSE(datagram->isServerFromStorebag);
  EXPECT_EQ(datagram->device, "012");
  EXPECT_THAT(datagram->entries, IsEmpty());
  EXPECT_THAT(problems.take(), IsEmpty());
}

TEST(DatagramDecoderTest, ValuesAreAsBeforeTheyWereEscaped) {
  EXPECT_THAT(entriesOf(" a=x\\=y\\\\z"), ElementsAre(Pair("a", "x=y\\z")));
  EXPECT_THAT(entriesOf(" a=\\\\\\= b=\\\\"), ElementsAre(Pair("a", "\\="), Pair("b", "\\")));
}

TEST(DatagramDecoderTest, BlanksInValuesAreKept) {
  EXPECT_THAT(entriesOf(" a=one two  b=  c=x "),
              ElementsAre(Pair("a", "one two "), Pair("b", " "), Pair("c", "x ")));
  EXPECT_THAT(entriesOf(" a=k v\\=w b=1"), ElementsAre(Pair("a", "k v=w"), Pair("b", "1")));
}

TEST(DatagramDecoderTest, ATextThatWasCutIsReadAsFarAsItGoes) {
  EXPECT_THAT(entriesOf(" a=1 longKey"), ElementsAre(Pair("a", "1 longKey")));
  EXPECT_THAT(entriesOf(" a=1 b="), ElementsAre(Pair("a", "1"), Pair("b", "")));
  EXPECT_THAT(entriesOf(" a=1\\"), ElementsAre(Pair("a", "1\\")));
  const std::string longest = " k=" + std::string(1020, 'x');
  EXPECT_THAT(entriesOf(longest), ElementsAre(Pair("k", std::string(1020, 'x'))));
}

TEST(DatagramDecoderTest, TextsThatHoldNoEntriesAreToldAndKept) {
  for (const std::string text : {"a=1", " ", " a", "x y=1"}) {
    Problems problems;
    const auto datagram = readDatagram(sampleDatagram(text), problems);
    ASSERT_TRUE(datagram) << text;
    EXPECT_EQ(datagram->text, text);
    EXPECT_THAT(datagram->entries, IsEmpty());
    EXPECT_THAT(problems.take(),
                ElementsAre("text: must consist of a blank, a key, = and a value for each entry"));
  }
  EXPECT_THAT(problemsOf(sampleDatagram(" a=1=2")), ElementsAre("text: an equal sign at byte 4 ends no key"));
  EXPECT_THAT(problemsOf(sampleDatagram(" a b=1")), ElementsAre("text: the first key has a blank in it"));
  EXPECT_THAT(problemsOf(sampleDatagram(" a=\xff")), ElementsAre("text: is not UTF-8"));
}

TEST(DatagramDecoderTest, WhatIsNoDatagramIsTold) {
  EXPECT_THAT(problemsOf({}), ElementsAre("no datagram: has 0 bytes; the header alone has 64"));
  Bytes bytes = sampleDatagram("");
  bytes.pop_back();
  EXPECT_THAT(problemsOf(bytes), ElementsAre("no datagram: has 63 bytes; the header alone has 64"));
  EXPECT_THAT(problemsOf(sampleDatagram(" k=" + std::string(1021, 'x'))),
              ElementsAre("no datagram: has more than 1,087 bytes"));
  bytes = sampleDatagram(" a=1");
  bytes[2] = 7;
  EXPECT_THAT(problemsOf(bytes), ElementsAre("no datagram: byte 2 must be 1, but is 7"));
  bytes = sampleDatagram(" a=1");
  bytes.pop_back();
  EXPECT_THAT(problemsOf(bytes), ElementsAre("no datagram: has 67 bytes, but names 68"));
}

TEST(DatagramDecoderTest, OddFieldsAreToldAndTheRestRead) {
  Bytes bytes = sampleDatagram(" a=1");
  bytes[3] = 250;
  bytes[62] = 1;
  bytes[20] = 0xFF;
  EXPECT_THAT(problemsOf(bytes), ElementsAre("byte 3: the part of the second must be below 250, but is 250",
                                             "bytes 62 and 63: flags that do not exist are set: 257",
                                             "device identifier: is not UTF-8"));
}

TEST(DatagramDecoderTest, NoBytesAreReadBeyondTheEnd) {
  Bytes bytes = sampleDatagram(" a=1 b=\\=");
  for (size_t size = 0; size <= bytes.size(); ++size) {
    const Bytes cut(bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(size));
    EXPECT_EQ(problemsOf(cut).empty(), size == bytes.size());
  }
}

TEST(DatagramDecoderTest, WhateverComesIsSurvived) {
  std::minstd_rand random(1);
  const std::string letters = " =\\ab";
  for (int round = 0; round < 20'000; ++round) {
    std::string text(random() % 40, ' ');
    for (char& letter : text) letter = letters[random() % letters.size()];
    Bytes bytes = sampleDatagram(text);
    if (round % 4 == 0) bytes[random() % bytes.size()] = static_cast<uint8_t>(random());
    Problems problems;
    const auto datagram = readDatagram(bytes, problems);
    size_t entryBytes = 0;
    if (datagram) {
      for (const auto& [key, value] : datagram->entries) entryBytes += key.size() + value.size() + 2;
      EXPECT_LE(entryBytes, datagram->text.size());
    }
  }
}

TEST(DatagramDecoderTest, TheAcknowledgementIsTheHeaderUpToTheEventNumber) {
  const Bytes bytes = sampleDatagram(" a=1");
  const Bytes acknowledgement = acknowledgementOf(bytes);
  EXPECT_EQ(acknowledgement, Bytes(bytes.begin(), bytes.begin() + 62));
  EXPECT_EQ(acknowledgement[60], 0x0A);
  EXPECT_EQ(acknowledgement[61], 0x0B);
  // Two labs that were made each other's server would go on for ever.
  EXPECT_THAT(problemsOf(acknowledgement), ElementsAre(HasSubstr("no datagram")));
}

}  // namespace
}  // namespace tarnel::lab

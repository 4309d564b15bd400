#include "tools/lab/receivers/datagram_receiver.h"

#include <gmock/gmock.h>

#include "formats/document.h"
#include "platform/fake/fake_clock.h"
#include "tools/receiving/test_datagram.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::SizeIs;

class DatagramReceiverTest : public ::testing::Test, public Notices {
 protected:
  void storebagServed(const ServedStorebag&) override {}
  void warning(const std::string& text) override { warnings_.push_back(text); }

  std::optional<Bytes> receive(const Bytes& bytes) {
    std::optional<Bytes> answer;
    receiver_.receive(bytes, bytes.size(), "127.0.0.1:5", [&answer](const Bytes& sent) { answer = sent; });
    return answer;
  }
  DatagramArrival last() const { return store_.lastDatagrams(1).at(0); }

  std::vector<std::string> warnings_;
  ArrivalStore store_{5000};
  DatagramFaults faults_;
  fake::FakeClock clock_;
  DatagramReceiver receiver_{store_, faults_, *this, clock_};
};

TEST_F(DatagramReceiverTest, ReliableOnesAreAcknowledgedEachTime) {
  const Bytes bytes = sampleDatagram(" a=1");
  for (uint64_t times = 1; times <= 3; ++times) {
    EXPECT_EQ(receive(bytes), acknowledgementOf(bytes));
    EXPECT_EQ(last().repetition, times);
    EXPECT_EQ(last().answer, DatagramAnswer::acknowledged);
  }
  EXPECT_EQ(last().sender, "127.0.0.1:5");
  EXPECT_EQ(last().arrived, 1700000000.0);
  EXPECT_EQ(store_.counts().datagrams, 3U);
  EXPECT_EQ(store_.counts().acknowledged, 3U);
}

TEST_F(DatagramReceiverTest, OthersAreStoredOnly) {
  EXPECT_FALSE(receive(sampleDatagram(" a=1", false)));
  EXPECT_EQ(last().answer, DatagramAnswer::nothing);
  EXPECT_EQ(last().content->text, " a=1");
}

TEST_F(DatagramReceiverTest, MalformedOnesAreStoredWithTheReason) {
  Bytes bytes = sampleDatagram("");
  bytes.resize(62);
  EXPECT_FALSE(receive(bytes));
  EXPECT_FALSE(last().content);
  EXPECT_EQ(last().bytes, bytes);
  EXPECT_THAT(last().problems, ElementsAre("no datagram: has 62 bytes; the header alone has 64"));
  EXPECT_EQ(store_.counts().datagramsWithProblems, 1U);
}

TEST_F(DatagramReceiverTest, SessionDeviceAndEventTellMessagesApart) {
  receive(sampleDatagram(" a=1"));
  for (const size_t offset : {size_t{8}, size_t{11}, size_t{20}, size_t{59}, size_t{60}, size_t{61}}) {
    Bytes other = sampleDatagram(" a=1");
    other[offset] ^= 1U;
    receive(other);
    EXPECT_EQ(last().repetition, 1U) << offset;
  }
  receive(sampleDatagram(" a=1", false));
  EXPECT_EQ(last().repetition, 2U);
}

TEST_F(DatagramReceiverTest, LosesOnPurposeWhatItIsTold) {
  faults_.set({.drop = 100});
  EXPECT_FALSE(receive(sampleDatagram(" a=1")));
  EXPECT_EQ(last().answer, DatagramAnswer::dropped);
  EXPECT_FALSE(receive(sampleDatagram(" a=1", false)));
  EXPECT_EQ(last().answer, DatagramAnswer::dropped);
  faults_.set({.dropAcknowledgements = 100});
  EXPECT_FALSE(receive(sampleDatagram(" a=1")));
  EXPECT_EQ(last().answer, DatagramAnswer::acknowledgementDropped);
  EXPECT_FALSE(receive(sampleDatagram(" a=1", false)));
  EXPECT_EQ(last().answer, DatagramAnswer::nothing) << "there was no acknowledgement to lose";
  EXPECT_EQ(store_.counts().dropped, 2U);
  EXPECT_EQ(store_.counts().acknowledgementsDropped, 1U);
  EXPECT_EQ(store_.counts().acknowledged, 0U);
}

TEST_F(DatagramReceiverTest, AFloodIsBoundedSecondBySecond) {
  for (int second = 0; second < 3; ++second) {
    for (uint64_t i = 0; i < DatagramReceiver::kMaxPerSecond; ++i) EXPECT_TRUE(receive(sampleDatagram("")));
    EXPECT_FALSE(receive(sampleDatagram("")));
    EXPECT_FALSE(receive(sampleDatagram("")));
    clock_.advance(1);
  }
  EXPECT_EQ(store_.counts().datagrams, 3 * DatagramReceiver::kMaxPerSecond);
  EXPECT_EQ(store_.counts().datagramsOverLimit, 6U);
  EXPECT_THAT(warnings_, ElementsAre("more than 2,000 datagrams came within a second; those beyond are lost"))
      << "told once as long as it goes on";
}

TEST_F(DatagramReceiverTest, WhatIsRememberedIsBounded) {
  for (size_t i = 0; i <= DatagramReceiver::kMaxRemembered; ++i) {
    if (i % 1000 == 0) clock_.advance(1);
    receive(sampleDatagram("", true, static_cast<uint16_t>(i)));
  }
  clock_.advance(1);
  receive(sampleDatagram("", true, 1));
  EXPECT_EQ(last().repetition, 2U);
  receive(sampleDatagram("", true, 0));
  EXPECT_EQ(last().repetition, 1U) << "the oldest was forgotten";
}

TEST_F(DatagramReceiverTest, Records) {
  receive(sampleDatagram(" a=1"));
  EXPECT_EQ(
      writeTextDocument(recordOfDatagram(last())),
      "{\"datagram\":1,\"arrived\":1700000000.0,\"sender\":\"127.0.0.1:5\",\"answered\":\"acknowledged\","
      "\"repetition\":1,\"size\":68,\"clientType\":12,\"time\":1700000000.248,\"sessionID\":16909060,"
      "\"clientVersion\":1286,\"method\":1800,\"status\":2314,"
      "\"device\":\"0123456789abcdef0123456789abcdef01234567\",\"event\":2571,\"reportVersion\":3,"
      "\"reliable\":true,\"serverFromStorebag\":true,\"text\":\" a=1\","
      "\"entries\":[{\"key\":\"a\",\"value\":\"1\"}],\"problems\":[]}");
  receive({1, 0xAB});
  EXPECT_EQ(writeTextDocument(recordOfDatagram(last())),
            "{\"datagram\":2,\"arrived\":1700000000.0,\"sender\":\"127.0.0.1:5\",\"answered\":\"nothing\","
            "\"repetition\":1,\"size\":2,\"bytes\":\"01ab\","
            "\"problems\":[\"no datagram: has 2 bytes; the header alone has 64\"]}");
}

}  // namespace
}  // namespace tarnel::lab

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <utility>

#include "backends/dashboard/dashboard_backend.h"
#include "backends/dashboard/dashboard_datagram.h"
#include "platform/fake/fake_world.h"
#include "platform/linux/queues/asio_work_queues.h"
#include "platform/linux/queues/udp_sockets.h"
#include "testing/lab_process.h"
#include "testing/waiting.h"
#include "tools/receiving/datagram_decoder.h"

// Dashboard datagrams: what the backend makes is what the lab reads, and what it delivers arrives there. The
// backend is driven directly, through its own send, because sessions make no datagrams.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::Ge;
using ::testing::IsEmpty;
using ::testing::Le;
using ::testing::Pair;
using ::testing::SizeIs;

constexpr char kDevice[] = "0123456789abcdef0123456789abcdef01234567";

DashboardHeader sampleHeader() {
  return {.selfVersionMajor = 3,
          .compType = 12,
          .timestamp = {1700000000, 251'999},
          .sessionID = 0x01020304,
          .clientVersion = 0x0506,
          .method = Method{0x0708},
          .respCode = RespCode{0x090A},
          .udid = kDevice,
          .eventID = EventID{0x0B0C},
          .isReliable = true};
}

// As the lab reads what the daemon makes of the payload.
lab::DashboardDatagram readBack(const DashboardHeader& header, const Dictionary& payload) {
  DashboardBuffer buffer;
  const size_t length = writeDashboardDatagram(header, dashboardText(payload), buffer);
  lab::Problems problems;
  const auto read = lab::readDatagram({buffer.data(), length}, problems);
  EXPECT_THAT(problems.take(), IsEmpty());
  EXPECT_TRUE(read);
  return read.value_or(lab::DashboardDatagram());
}

TEST(LabDatagramFormatTest, EveryHeaderFieldComesBack) {
  const auto read = readBack(sampleHeader(), {});
  EXPECT_EQ(read.reportVersion, 3U);
  EXPECT_EQ(read.clientType, 12U);
  EXPECT_EQ(read.time, 1700000000.248);
  EXPECT_EQ(read.sessionID, 0x01020304U);
  EXPECT_EQ(read.clientVersion, 0x0506);
  EXPECT_EQ(read.method, 0x0708);
  EXPECT_EQ(read.status, 0x090A);
  EXPECT_EQ(read.device, kDevice);
  EXPECT_EQ(read.event, 0x0B0C);
  EXPECT_TRUE(read.isReliable);
  EXPECT_FALSE(read.isServerFromStorebag);
  EXPECT_THAT(read.entries, IsEmpty());
}

TEST(LabDatagramFormatTest, FlagsLimitsAndAShortDeviceComeBack) {
  auto header = sampleHeader();
  header.isReliable = false;
  header.isServerFromProfile = true;
  header.udid = "id";
  header.sessionID = UINT32_MAX;
  header.clientVersion = UINT16_MAX;
  header.eventID = EventID{UINT16_MAX};
  header.timestamp = {UINT32_MAX, 999'999};
  const auto read = readBack(header, {});
  EXPECT_FALSE(read.isReliable);
  EXPECT_TRUE(read.isServerFromStorebag);
  EXPECT_EQ(read.device, "id");
  EXPECT_EQ(read.sessionID, UINT32_MAX);
  EXPECT_EQ(read.clientVersion, UINT16_MAX);
  EXPECT_EQ(read.event, UINT16_MAX);
  EXPECT_EQ(read.time, 4294967295.996);
}

TEST(LabDatagramFormatTest, ValuesComeBackUnescaped) {
  const Dictionary payload{{"number", -5},      {"real", 0.25},           {"flag", true},
                           {"text", "a=b\\c"},  {"blank", "one  two "},   {"empty", ""},
                           {"array", Array{1}}, {"lines", "x\ny"},        {"end", "\\"},
                           {"equal", "k v=w"},  {"u", "\u00fc\U0001F600"}};
  const auto read = readBack(sampleHeader(), payload);
  const std::map<std::string, std::string> entries(read.entries.begin(), read.entries.end());
  EXPECT_EQ(entries, (std::map<std::string, std::string>{{"number", "-5"},
                                                         {"real", "0.25"},
                                                         {"flag", "1"},
                                                         {"text", "a=b\\c"},
                                                         {"blank", "one  two "},
                                                         {"empty", "empty"},
                                                         {"array", "null"},
                                                         {"lines", "xy"},
                                                         {"end", "\\"},
                                                         {"equal", "k v=w"},
                                                         {"u", "\u00fc\U0001F600"}}));
  EXPECT_EQ(read.entries.front().first, "empty") << "the shortest value comes first";
}

TEST(LabDatagramFormatTest, TheLongestTextComesBack) {
  const auto read = readBack(sampleHeader(), {{"a", 1}, {"k", std::string(5000, 'x')}});
  EXPECT_THAT(read.entries, ElementsAre(Pair("a", "1"), Pair("k", std::string(1016, 'x'))));
}

class LabDatagramsTest : public ::testing::Test {
 protected:
  // A lab of their own: one that knew their sessions already would count repetitions.
  static void SetUpTestSuite() { ownLab() = std::make_unique<LabProcess>(); }
  static void TearDownTestSuite() { ownLab().reset(); }

  LabDatagramsTest() {
    world.workQueues.real = &queues;
    world.datagramSockets.real = &sockets;
    lab.reset();
  }

  // session: one of each test's own, because to the lab an event of the same session is a repetition.
  std::shared_ptr<DashboardBackend> make(uint32_t session, const Dictionary& more = {}) {
    Dictionary profile{{"ip", "127.0.0.1"}, {"port", lab.datagramPort()}};
    profile.merge(more);
    auto backend = DashboardBackend::initWithName(world.dependencies, "dashboard", profile, "Slate");
    EXPECT_NE(backend, nullptr);
    backend->setSessionID(session);
    backend->setCompType(12);
    backend->setClientVersion(0x0506);
    backend->setUdid(kDevice);
    backend->setSelfVersion("3.2");
    return backend;
  }
  static void send(DashboardBackend& backend, uint16_t event) {
    const Dictionary payload{{"number", event}, {"text", "a=b " + std::string(event, 'x')}};
    EXPECT_TRUE(
        backend.sendMessage(payload, TimeValue{1700000000, 250000}, Method{3}, RespCode{8}, EventID{event}));
  }
  // Ends once everything was acknowledged or given up.
  static void finish(std::shared_ptr<DashboardBackend> backend) {
    const std::weak_ptr<DashboardBackend> weak = backend;
    backend->cleanup();
    backend.reset();
    const Deadline deadline;
    while (!weak.expired() && !deadline.passed()) pause();
    EXPECT_TRUE(weak.expired()) << "not delivered in time";
  }
  // The lab's record of an arrival may come a moment later than its acknowledgement.
  std::vector<Dictionary> waitForDatagrams(size_t count) const {
    const Deadline deadline;
    while (lab.datagrams().size() < count && !deadline.passed()) pause();
    EXPECT_THAT(lab.datagrams(), SizeIs(Ge(count)));
    return lab.datagrams();
  }

  // What the lab did about each event, as often as it came.
  std::map<int64_t, std::multiset<std::string>> answersByEvent() const {
    std::map<int64_t, std::multiset<std::string>> answers;
    for (const Dictionary& arrival : lab.datagrams()) {
      auto& list = answers[numberIn(arrival, "event")];
      list.insert(textIn(arrival, "answered"));
      EXPECT_EQ(numberIn(arrival, "repetition"), static_cast<int64_t>(list.size()));
    }
    return answers;
  }
  static void pause() {
    std::mutex mutex;
    std::unique_lock lock(mutex);
    std::condition_variable().wait_for(lock, std::chrono::milliseconds(5));
  }

  static std::unique_ptr<LabProcess>& ownLab() {
    static std::unique_ptr<LabProcess> lab;
    return lab;
  }

  LabProcess& lab = *ownLab();
  fake::FakeWorld world;
  AsioWorkQueues queues{world.log};
  UdpSockets sockets;
};

TEST_F(LabDatagramsTest, AMessageArrivesDecodedAndIsAcknowledged) {
  auto backend = make(1001, {{"reliable", 50}});
  send(*backend, 7);
  finish(std::move(backend));
  const auto arrivals = waitForDatagrams(1);
  const Dictionary& arrival = arrivals.front();
  EXPECT_EQ(*findArray(arrival, "problems"), Array());
  EXPECT_EQ(textIn(arrival, "answered"), "acknowledged");
  EXPECT_EQ(numberIn(arrival, "clientType"), 12);
  EXPECT_EQ(numberIn(arrival, "sessionID"), 1001);
  EXPECT_EQ(numberIn(arrival, "clientVersion"), 0x0506);
  EXPECT_EQ(numberIn(arrival, "event"), 7);
  EXPECT_EQ(numberIn(arrival, "method"), 3);
  EXPECT_EQ(numberIn(arrival, "status"), 8);
  EXPECT_EQ(numberIn(arrival, "reportVersion"), 3);
  EXPECT_EQ(textIn(arrival, "device"), kDevice);
  EXPECT_EQ(findNumber(arrival, "time")->doubleValue(), 1700000000.248);
  EXPECT_EQ(*findArray(arrival, "entries"), (Array{Dictionary{{"key", "number"}, {"value", "7"}},
                                                   Dictionary{{"key", "text"}, {"value", "a=b xxxxxxx"}}}));
}

TEST_F(LabDatagramsTest, UnreliableMessagesAreNotAcknowledged) {
  auto backend = make(1002);
  for (uint16_t event = 1; event <= 5; ++event) send(*backend, event);
  finish(std::move(backend));
  for (const Dictionary& arrival : waitForDatagrams(5)) {
    EXPECT_EQ(textIn(arrival, "answered"), "nothing");
    EXPECT_EQ(numberIn(arrival, "repetition"), 1);
  }
}

TEST_F(LabDatagramsTest, EveryReliableMessageArrivesThroughALossyNetwork) {
  constexpr uint16_t kEvents = 40;
  lab.misbehave("for=datagrams&drop=30&drop-acknowledgements=30&seed=1");
  auto backend = make(1003, {{"reliable", 50}});
  for (uint16_t event = 1; event <= kEvents; ++event) send(*backend, event);
  finish(std::move(backend));
  // The last records may come a moment after the backend has given up.
  const auto isOver = [](const auto& entry) {
    return entry.second.count("acknowledged") > 0 || entry.second.size() == 5;
  };
  auto answers = answersByEvent();
  for (const Deadline deadline; !deadline.passed(); answers = answersByEvent()) {
    if (answers.size() == kEvents && std::all_of(answers.begin(), answers.end(), isOver)) break;
    pause();
  }
  ASSERT_THAT(answers, SizeIs(kEvents));
  size_t dropped = 0;
  size_t unanswered = 0;
  size_t sentOnce = 0;
  for (const auto& [event, list] : answers) {
    EXPECT_LT(list.count("dropped"), list.size()) << event << " never arrived";
    // The backend goes on until it is told, and gives up after the fifth time.
    EXPECT_THAT(list, SizeIs(Le(5U)));
    EXPECT_TRUE(isOver(std::pair(event, list))) << event;
    dropped += list.count("dropped");
    unanswered += list.count("acknowledgement dropped");
    sentOnce += list.size() == 1 ? 1 : 0;
  }
  EXPECT_GT(sentOnce, 0U) << "an acknowledgement ends the resending";
  EXPECT_GT(dropped, 0U);
  EXPECT_GT(unanswered, 0U);
}

TEST_F(LabDatagramsTest, WithoutAcknowledgementsEverythingComesFiveTimes) {
  lab.misbehave("for=datagrams&drop-acknowledgements=100");
  const Dictionary before = lab.status();
  auto backend = make(1004, {{"reliable", 5}});
  for (uint16_t event = 1; event <= 4; ++event) send(*backend, event);
  finish(std::move(backend));
  std::map<int64_t, int64_t> times;
  for (const Dictionary& arrival : waitForDatagrams(20)) {
    EXPECT_EQ(textIn(arrival, "answered"), "acknowledgement dropped");
    times[numberIn(arrival, "event")] = numberIn(arrival, "repetition");
  }
  EXPECT_THAT(times, ElementsAre(Pair(1, 5), Pair(2, 5), Pair(3, 5), Pair(4, 5)));
  const Dictionary after = lab.status();
  for (const auto& [key, more] : std::vector<std::pair<std::string, int64_t>>{
           {"datagrams", 20}, {"acknowledgementsDropped", 20}, {"acknowledged", 0}, {"dropped", 0}}) {
    EXPECT_EQ(numberIn(after, key), numberIn(before, key) + more) << key;
  }
}

}  // namespace
}  // namespace tarnel::test

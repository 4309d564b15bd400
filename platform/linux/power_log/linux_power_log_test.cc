#include "platform/linux/power_log/linux_power_log.h"

#include <gmock/gmock.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <cmath>
#include <limits>
#include <sstream>
#include <thread>

#include "platform/fake/fake_clock.h"
#include "platform/fake/fake_log.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;

class LinuxPowerLogTest : public testing::Test {
 protected:
  LinuxPowerLogTest() { clock.set({1700000000, 123456}); }

  LinuxPowerLog::Options journal() {
    return {.file = "", .send = [this](const iovec* parts, int count) {
              fields.clear();
              for (int index = 0; index < count; ++index) {
                fields.emplace_back(static_cast<const char*>(parts[index].iov_base), parts[index].iov_len);
              }
              return sendResult;
            }};
  }
  std::vector<PowerLogRecord> records(const std::string& name) const {
    std::vector<PowerLogRecord> found;
    std::istringstream lines(folder.read(name));
    for (std::string line; std::getline(lines, line);) {
      const auto record = powerLogRecord(line);
      EXPECT_TRUE(record) << line;
      if (record) found.push_back(*record);
    }
    return found;
  }

  const TemporaryFolder folder;
  const std::string file = folder.path("power.ndjson");
  fake::FakeClock clock;
  fake::FakeLog log;
  std::vector<std::string> fields;
  int sendResult = 0;
};

TEST_F(LinuxPowerLogTest, AnEventIsARecordOfTheJournalWithFieldsOfItsOwn) {
  LinuxPowerLog power(journal(), clock, log);
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"codec", "opus"}, {"method", 3}}, std::nullopt);
  EXPECT_THAT(fields, ElementsAre("MESSAGE=Power event Halvend-TRN of client 28",
                                  "MESSAGE_ID=6f9d1c1be52a4b0f9d6c41a7c0a9b2d4", "PRIORITY=6",
                                  "SYSLOG_IDENTIFIER=tarneld", "TARNEL_POWER_CLIENT=28",
                                  "TARNEL_POWER_EVENT=Halvend-TRN",
                                  "TARNEL_POWER_PAYLOAD={\"codec\":\"opus\",\"method\":3}"));
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(LinuxPowerLogTest, WhatIsTooLargeLeavesItsSize) {
  LinuxPowerLog power(journal(), clock, log);
  const std::string most(kMaxPowerLogPayload - std::string(R"({"a":""})").size(), 'x');
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", most}}, std::nullopt);
  EXPECT_EQ(fields.back(), "TARNEL_POWER_PAYLOAD={\"a\":\"" + most + "\"}");
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", most + "x"}}, std::nullopt);
  EXPECT_EQ(fields.back(), "TARNEL_POWER_DROPPED_BYTES=65537");
  LinuxPowerLog inFile({.file = file}, clock, log);
  inFile.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", most + "x"}}, std::nullopt);
  EXPECT_EQ(folder.read("power.ndjson"),
            "{\"time\":1700000000.123456,\"client\":28,\"event\":\"Halvend-TRN\",\"dropped_bytes\":65537}\n");
  EXPECT_EQ(records("power.ndjson").at(0).droppedBytes, 65537U);
  EXPECT_TRUE(records("power.ndjson").at(0).payload.isNull());
}

TEST_F(LinuxPowerLogTest, AJournalThatTakesNothingIsNamedOnceUntilItDoes) {
  LinuxPowerLog power(journal(), clock, log);
  sendResult = -EMSGSIZE;
  for (int i = 0; i < 3; ++i) power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", 1}}, std::nullopt);
  const std::string text =
      "logRegisteredEvent: the journal takes no records: Message too long; events of the power log are lost";
  EXPECT_EQ(log.lines(), (std::vector<fake::FakeLog::Line>{{LogLevel::error, text}}));
  sendResult = 0;
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", 1}}, std::nullopt);
  sendResult = -EMSGSIZE;
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_EQ(log.count(LogLevel::error, text), 2U);
}

TEST_F(LinuxPowerLogTest, WithoutAJournalAnEventIsALineThatReadsBack) {
  LinuxPowerLog power({.file = file}, clock, log);
  const Dictionary payload{{"data", Data{0, 255}},
                           {"date", Date{12}},
                           {"text", "a\nb\x1b[2J"},
                           {"nested", Array{1, Dictionary{{"x", true}}}},
                           {"nan", std::numeric_limits<double>::quiet_NaN()}};
  power.logRegisteredEvent(-5, "Other", payload, std::nullopt);
  clock.advance(1.5);
  power.logRegisteredEvent(28, "Halvend-TRN", Dictionary{{"a", 1}}, std::nullopt);
  const auto read = records("power.ndjson");
  ASSERT_EQ(read.size(), 2U);
  EXPECT_EQ(read[0].microseconds, 1700000000123456);
  EXPECT_EQ(read[0].client, -5);
  EXPECT_EQ(read[0].eventName, "Other");
  Dictionary expected = payload;
  expected.set("nan", Value());
  EXPECT_EQ(read[0].payload, Value(expected));
  EXPECT_EQ(read[1].microseconds, 1700000001623456);
  EXPECT_EQ(folder.read("power.ndjson").find('\x1b'), std::string::npos);
  struct stat status {};
  ASSERT_EQ(::stat(file.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(LinuxPowerLogTest, AFullFileTakesThePlaceOfTheOlderOne) {
  LinuxPowerLog power({.file = file, .maxFileBytes = 1000}, clock, log);
  for (int i = 0; i < 40; ++i) {
    power.logRegisteredEvent(i, "Halvend-TRN", Dictionary{{"a", std::string(50, 'x')}}, std::nullopt);
  }
  EXPECT_LE(folder.read("power.ndjson").size(), 1000U);
  EXPECT_LE(folder.read("power.ndjson.1").size(), 1000U);
  std::vector<int> clients;
  for (const char* name : {"power.ndjson.1", "power.ndjson"}) {
    for (const auto& record : records(name)) clients.push_back(record.client);
  }
  ASSERT_GT(clients.size(), 10U);
  EXPECT_EQ(clients.back(), 39);
  for (size_t i = 1; i < clients.size(); ++i)
    EXPECT_EQ(clients[i], clients[i - 1] + 1) << "none is missing between";
}

TEST_F(LinuxPowerLogTest, AFileIsFilledToItsLastByte) {
  const Dictionary event{{"a", 1}};
  LinuxPowerLog({.file = file}, clock, log).logRegisteredEvent(1, "E", event, std::nullopt);
  const size_t line = folder.read("power.ndjson").size();
  LinuxPowerLog power({.file = file, .maxFileBytes = 2 * line}, clock, log);
  power.logRegisteredEvent(2, "E", event, std::nullopt);
  EXPECT_EQ(records("power.ndjson").size(), 2U);
  power.logRegisteredEvent(3, "E", event, std::nullopt);
  EXPECT_EQ(records("power.ndjson").size(), 1U);
  EXPECT_EQ(records("power.ndjson.1").size(), 2U);
}

TEST_F(LinuxPowerLogTest, AnEmptyFileMakesNoRoomForALine) {
  LinuxPowerLog power({.file = file, .maxFileBytes = 10}, clock, log);
  power.logRegisteredEvent(1, "E", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_FALSE(std::filesystem::exists(olderPowerLogFile(file)));
}

TEST_F(LinuxPowerLogTest, ALineThatIsLargerThanTheFileMayBeStillFitsAlone) {
  LinuxPowerLog power({.file = file, .maxFileBytes = 10}, clock, log);
  for (int i = 0; i < 3; ++i) power.logRegisteredEvent(i, "E", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_EQ(records("power.ndjson").at(0).client, 2);
  EXPECT_EQ(records("power.ndjson.1").at(0).client, 1);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(LinuxPowerLogTest, AFileThatCannotBeWrittenIsNamed) {
  LinuxPowerLog missing({.file = folder.path("none/power.ndjson")}, clock, log);
  missing.logRegisteredEvent(28, "E", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_EQ(log.lines().at(0).text,
            "logRegisteredEvent: " + folder.path("none/power.ndjson") +
                ": cannot be opened: No such file or directory; events of the power log are lost");
  log.clear();
  folder.write("target", "mine\n");
  ASSERT_EQ(::symlink(folder.path("target").c_str(), file.c_str()), 0);
  LinuxPowerLog linked({.file = file}, clock, log);
  linked.logRegisteredEvent(28, "E", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_THAT(log.lines().at(0).text, StartsWith("logRegisteredEvent: " + file + ": cannot be opened: "));
  EXPECT_EQ(folder.read("target"), "mine\n");
  log.clear();
  LinuxPowerLog device({.file = "/dev/null"}, clock, log);
  device.logRegisteredEvent(28, "E", Dictionary{{"a", 1}}, std::nullopt);
  EXPECT_THAT(log.lines().at(0).text, StartsWith("logRegisteredEvent: /dev/null: is not a regular file"));
}

TEST_F(LinuxPowerLogTest, AFullDiskLeavesNoPartOfALine) {
  LinuxPowerLog power({.file = file}, clock, log);
  power.logRegisteredEvent(1, "E", Dictionary{{"a", 1}}, std::nullopt);
  const std::string before = folder.read("power.ndjson");
  const std::string outcome = runInChild([&power, &before]() -> std::string {
    ::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{.rlim_cur = before.size() + 10, .rlim_max = before.size() + 10};
    if (::setrlimit(RLIMIT_FSIZE, &limit) != 0) return "no limit";
    power.logRegisteredEvent(2, "E", Dictionary{{"a", 1}}, std::nullopt);
    return "tried";
  });
  EXPECT_EQ(outcome, "tried");
  EXPECT_EQ(folder.read("power.ndjson"), before);
}

TEST_F(LinuxPowerLogTest, LinesOfManyThreadsStayWhole) {
  LinuxPowerLog power({.file = file, .maxFileBytes = 20000}, clock, log);
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&power, thread] {
      for (int i = 0; i < 50; ++i) power.logRegisteredEvent(thread, "E", Dictionary{{"a", i}}, std::nullopt);
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(records("power.ndjson").size() + records("power.ndjson.1").size(), 200U);
}

TEST(PowerLogRecord, WhatIsNoRecordIsNone) {
  for (const char* line :
       {"", "{", "5", "{}", R"({"time":1,"client":28})", R"({"time":"1","client":1,"event":"E"})",
        R"({"time":1e300,"client":1,"event":"E"})", R"({"time":1,"client":1,"event":5})"}) {
    EXPECT_FALSE(powerLogRecord(line)) << line;
  }
  const auto bare = powerLogRecord(R"({"time":-1.5,"client":1,"event":"E"})");
  ASSERT_TRUE(bare);
  EXPECT_EQ(bare->microseconds, -1500000);
  EXPECT_TRUE(bare->payload.isNull());
}

TEST(PowerLogFile, AnInstanceOfOnesOwnAndOneWithoutAJournalHaveAFile) {
  const TemporaryFolder folder;
  const auto directories = [](bool isPrivate) {
    return Directories::fromEnvironment([isPrivate](const char* name) -> const char* {
      return isPrivate || std::string_view(name) == "LOGS_DIRECTORY" ? "/tmp/some/where" : nullptr;
    });
  };
  folder.write("socket", "");
  ASSERT_TRUE(directories(true).isPrivate());
  EXPECT_EQ(powerLogFile(directories(true), folder.path("socket")), "/tmp/some/where/power.ndjson");
  EXPECT_EQ(powerLogFile(directories(false), folder.path("socket")), "");
  EXPECT_EQ(powerLogFile(directories(false), folder.path("none")), "/tmp/some/where/power.ndjson");
}

}  // namespace
}  // namespace tarnel

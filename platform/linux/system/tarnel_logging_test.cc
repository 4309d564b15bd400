#include "platform/linux/system/tarnel_logging.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <sstream>
#include <thread>

namespace tarnel {
namespace {

using testing::ElementsAre;

class TarnelLoggingTest : public testing::Test {
 protected:
  TarnelLoggingTest() {
    EXPECT_EQ(::pipe2(ends_.data(), O_CLOEXEC), 0);
    // Reading must not wait for what was never written.
    ::fcntl(ends_[0], F_SETFL, O_NONBLOCK);
    environment_.standardError = ends_[1];
  }
  TarnelLoggingTest(const TarnelLoggingTest&) = delete;
  TarnelLoggingTest& operator=(const TarnelLoggingTest&) = delete;
  ~TarnelLoggingTest() override {
    ::close(ends_[0]);
    ::close(ends_[1]);
  }

  std::string written() const {
    std::string text;
    std::array<char, 4096> buffer{};
    for (;;) {
      const ssize_t count = ::read(ends_[0], buffer.data(), buffer.size());
      if (count <= 0) return text;
      text.append(buffer.data(), static_cast<size_t>(count));
    }
  }
  std::shared_ptr<TarnelLogging> start() {
    return TarnelLogging::startLogging("tarneld", "Daemon", environment_);
  }
  static std::string line(int level, const std::string& text) {
    return "<" + std::to_string(level) + ">tarneld[" + std::to_string(::getpid()) + "]: " + text + "\n";
  }

  std::array<int, 2> ends_{-1, -1};
  TarnelLogging::Environment environment_;
};

TEST_F(TarnelLoggingTest, LinesCarryTheirPriority) {
  const auto log = start();
  EXPECT_FALSE(log->writesToJournal());
  log->log(LogLevel::error, "main: sandbox_init() fails: %s\n", "why");
  log->log(LogLevel::warning, "w");
  log->log(LogLevel::information, "i %d", 5);
  EXPECT_EQ(written(), line(3, "main: sandbox_init() fails: why") + line(4, "w") + line(6, "i 5"));
}

TEST_F(TarnelLoggingTest, DebugTextsAreWrittenOnlyOnDemand) {
  const auto log = start();
  EXPECT_FALSE(log->enabled(LogLevel::debug));
  log->log(LogLevel::debug, "quiet");
  log->setConfiguredLevel(LogLevel::debug);
  log->log(LogLevel::debug, "loud");
  log->setConfiguredLevel(std::nullopt);
  log->log(LogLevel::debug, "quiet");
  EXPECT_EQ(written(), line(7, "loud"));
}

TEST_F(TarnelLoggingTest, TheEnvironmentsLevelWins) {
  environment_.level = "warning";
  const auto log = start();
  log->setConfiguredLevel(LogLevel::debug);
  log->log(LogLevel::information, "quiet");
  log->log(LogLevel::warning, "loud");
  EXPECT_EQ(written(), line(4, "loud"));
}

TEST_F(TarnelLoggingTest, AnUnknownLevelIsSaid) {
  environment_.level = "noisy";
  start();
  EXPECT_EQ(written(),
            line(4,
                 "startLogging: TARNEL_LOG_LEVEL must be \"error\", \"warning\", \"information\" or "
                 "\"debug\", not \"noisy\""));
}

TEST_F(TarnelLoggingTest, ATextCannotForgeALine) {
  const auto log = start();
  log->log(LogLevel::information, "client says %s", "x\n<3>tarneld[1]: forged\r\x1b[2J\x7f\t");
  EXPECT_EQ(written(), line(6, "client says x\\n<3>tarneld[1]: forged\\r\\x1b[2J\\x7f\\t"));
}

TEST_F(TarnelLoggingTest, AfterTheStopNothingIsWritten) {
  const auto log = start();
  log->stopLogging();
  log->log(LogLevel::error, "late");
  EXPECT_EQ(written(), "");
}

TEST_F(TarnelLoggingTest, TheJournalIsUsedWhenStandardErrorIsItsStream) {
  struct stat status {};
  ASSERT_EQ(::fstat(ends_[1], &status), 0);
  environment_.journalStream = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
  EXPECT_TRUE(start()->writesToJournal());
  environment_.journalStream = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino + 1);
  EXPECT_FALSE(start()->writesToJournal());
  environment_.journalStream = "nonsense";
  EXPECT_FALSE(start()->writesToJournal());
}

TEST_F(TarnelLoggingTest, AJournalRecordNamesProcessAndFacility) {
  EXPECT_THAT(start()->journalFields(LogLevel::error, "a\nb"),
              ElementsAre("MESSAGE=a\\nb", "PRIORITY=3", "SYSLOG_IDENTIFIER=tarneld", "SYSLOG_FACILITY=3",
                          "SYSLOG_PID=" + std::to_string(::getpid())));
  EXPECT_EQ(TarnelLogging::startLogging("x", "Unheard", environment_)->journalFields(LogLevel::debug, "")[3],
            "SYSLOG_FACILITY=1");
}

TEST_F(TarnelLoggingTest, AReaderThatDoesNotReadStallsNobodyAndIsToldWhatItMissed) {
  const auto log = start();
  const std::string text(4000, 'x');
  int lines = 0;
  // A pipe that is full takes nothing more; without the bound this would never end.
  ::fcntl(ends_[1], F_SETPIPE_SZ, 65536);
  for (; lines < 40; ++lines) log->log(LogLevel::information, "%s", text.c_str());
  written();
  log->log(LogLevel::information, "again");
  const std::string rest = written();
  EXPECT_NE(rest.find(" lines of this log were lost, because nobody read them\n"), std::string::npos);
  EXPECT_TRUE(rest.ends_with(line(6, "again")));
  log->log(LogLevel::information, "and again");
  EXPECT_EQ(written(), line(6, "and again"));
}

TEST_F(TarnelLoggingTest, ALineThatWasCutOffIsEndedBeforeTheNext) {
  const auto log = start();
  ::fcntl(ends_[1], F_SETPIPE_SZ, 4096);
  log->log(LogLevel::information, "%s", std::string(6000, 'x').c_str());
  EXPECT_EQ(written().back(), 'x');
  log->log(LogLevel::information, "next");
  EXPECT_TRUE(written().starts_with("\n<4>tarneld["));
}

TEST_F(TarnelLoggingTest, LinesOfManyThreadsStayWhole) {
  const auto log = start();
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&log] {
      for (int number = 0; number < 50; ++number) log->log(LogLevel::information, "0123456789");
    });
  }
  for (auto& thread : threads) thread.join();
  std::istringstream lines(written());
  std::string one;
  int count = 0;
  while (std::getline(lines, one)) {
    EXPECT_EQ(one + "\n", line(6, "0123456789"));
    ++count;
  }
  EXPECT_EQ(count, 200);
}

}  // namespace
}  // namespace tarnel

#include "base/log.h"

#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

class RecordingLog : public Log {
 public:
  std::vector<std::pair<LogLevel, std::string>> lines;

 protected:
  void write(LogLevel level, std::string_view text) override { lines.emplace_back(level, text); }
};

TEST(LogTest, formatsAndKeepsTheLevel) {
  RecordingLog log;
  TARNEL_LOG(log, warning, "routine: %s has %d%%", "it", 5);
  ASSERT_EQ(log.lines.size(), 1U);
  EXPECT_EQ(log.lines[0].first, LogLevel::warning);
  EXPECT_EQ(log.lines[0].second, "routine: it has 5%");
}

TEST(LogTest, writesTextsOfAnyLengthWhole) {
  for (const size_t length : {0, 1, 510, 511, 512, 513, 100000}) {
    RecordingLog log;
    const std::string text(length, 'x');
    log.log(LogLevel::error, "%s", text.c_str());
    ASSERT_EQ(log.lines.size(), 1U);
    EXPECT_EQ(log.lines[0].second, text);
  }
}

TEST(LogTest, writesEverythingUntilALevelIsSet) {
  RecordingLog log;
  EXPECT_TRUE(log.enabled(LogLevel::debug));
  log.setActiveLevel(LogLevel::warning);
  log.log(LogLevel::information, "dropped");
  log.log(LogLevel::warning, "written");
  log.log(LogLevel::error, "written too");
  EXPECT_EQ(log.lines.size(), 2U);
  EXPECT_FALSE(log.enabled(LogLevel::information));
}

TEST(LogTest, doesNotEvaluateWhatItWouldDrop) {
  RecordingLog log;
  log.setActiveLevel(LogLevel::error);
  int evaluated = 0;
  TARNEL_LOG(log, debug, "%d", ++evaluated);
  EXPECT_EQ(evaluated, 0);
  TARNEL_LOG(log, error, "%d", ++evaluated);
  EXPECT_EQ(evaluated, 1);
}

TEST(LogTest, printsMissingTextAsNull) {
  EXPECT_STREQ(printable(std::optional<std::string>()), "(null)");
  EXPECT_STREQ(printable(std::optional<std::string>("a")), "a");
  EXPECT_STREQ(printable(static_cast<const std::string*>(nullptr)), "(null)");
}

}  // namespace
}  // namespace tarnel

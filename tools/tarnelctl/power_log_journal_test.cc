#include "tools/tarnelctl/power_log_journal.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <functional>
#include <map>
#include <sstream>
#include <string_view>
#include <utility>
#include <vector>

namespace tarnel::ctl {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

using Entry = std::map<std::string, std::string>;

Entry entryOf(int client, const std::string& unit = "tarneld.service") {
  return {{"MESSAGE_ID", kPowerLogMessageID},
          {"_SYSTEMD_UNIT", unit},
          {"MESSAGE", "Halvend-TRN"},
          {kPowerLogClientField, std::to_string(client)},
          {kPowerLogEventField, "Halvend-TRN"},
          {kPowerLogPayloadField, "{\"a\":" + std::to_string(client) + "}"}};
}

// Stands where the system's would: on an entry, before the first or behind the last.
class FakeJournal final : public Journal {
 public:
  int addMatch(const std::string& match) override {
    const size_t equals = match.find('=');
    matches_[match.substr(0, equals)] = match.substr(equals + 1);
    return resultOf("addMatch " + match.substr(0, equals));
  }
  int seekHead() override {
    place_ = -1;
    return resultOf("seekHead");
  }
  int seekTail() override {
    place_ = static_cast<int64_t>(entries.size());
    return resultOf("seekTail");
  }
  int previousSkip(uint64_t count) override {
    int skipped = 0;
    for (int64_t i = place_ - 1; i >= 0 && static_cast<uint64_t>(skipped) < count; --i) {
      if (!isMet(i)) continue;
      place_ = i;
      ++skipped;
    }
    return resultOf("previousSkip", skipped);
  }
  int next() override {
    const int result = resultOf("next");
    for (int64_t i = place_ + 1; result == 0 && i < static_cast<int64_t>(entries.size()); ++i) {
      if (!isMet(i)) continue;
      place_ = i;
      return 1;
    }
    return result;
  }
  int wait() override { return onWait(); }

  std::optional<int64_t> microseconds() override {
    if (hasNoTimes) return std::nullopt;
    return 1700000000000000 + place_;
  }
  std::optional<std::string> field(const char* name) override {
    const Entry& entry = entries.at(static_cast<size_t>(place_));
    const auto found = entry.find(name);
    return found == entry.end() ? std::nullopt : std::optional(found->second);
  }

  std::vector<Entry> entries;
  std::function<int()> onWait = [] {
    ADD_FAILURE() << "waited without being asked to follow";
    return -EIO;
  };
  std::string failing;  // the operation that does
  int failure = -EIO;
  bool hasNoTimes = false;

 private:
  int resultOf(const std::string& operation, int result = 0) const {
    return operation == failing ? failure : result;
  }
  bool isMet(int64_t index) const {
    const Entry& entry = entries.at(static_cast<size_t>(index));
    return std::all_of(matches_.begin(), matches_.end(), [&entry](const auto& match) {
      const auto found = entry.find(match.first);
      return found != entry.end() && found->second == match.second;
    });
  }

  std::map<std::string, std::string> matches_;
  int64_t place_ = -1;
};

// Knows what was handed on, beside what was written.
class FlushedText final : public std::stringbuf {
 public:
  std::string flushed;

 protected:
  int sync() override {
    flushed = str();
    return 0;
  }
};

class PowerLogJournalTest : public testing::Test {
 protected:
  ExitStatus show() {
    const Terminal terminal{out_, err_};
    return showPowerLogOf(journal_, options_, terminal);
  }
  // The clients of the records that were printed.
  std::vector<int> shown() const { return clientsIn(text_.str()); }
  static std::vector<int> clientsIn(const std::string& text) {
    constexpr std::string_view kBefore = " client ";
    std::vector<int> clients;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
      const size_t found = line.find(kBefore);
      clients.push_back(found == std::string::npos ? -1 : std::stoi(line.substr(found + kBefore.size())));
    }
    return clients;
  }

  FakeJournal journal_;
  PowerLogOptions options_;
  FlushedText text_;
  std::ostream out_{&text_};
  std::ostringstream err_;
};

TEST_F(PowerLogJournalTest, ARecordIsShownWithTheTimeOfItsEntry) {
  journal_.entries = {entryOf(1), entryOf(28)};
  options_.lines = 1;
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(text_.str(), "2023-11-14 22:13:20.000001 +0000 client 28 Halvend-TRN {\"a\":28}\n");
  EXPECT_EQ(err_.str(), "");
}

TEST_F(PowerLogJournalTest, JsonIsOneLineForEachRecord) {
  journal_.entries = {entryOf(28)};
  options_.json = true;
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(text_.str(),
            "{\"time\":1700000000.0,\"client\":28,\"event\":\"Halvend-TRN\",\"payload\":{\"a\":28}}\n");
}

TEST_F(PowerLogJournalTest, AllAreShownUnlessTheLastAreAskedFor) {
  journal_.entries = {entryOf(1), entryOf(2), entryOf(3)};
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_THAT(shown(), ElementsAre(1, 2, 3));
}

struct LinesCase {
  unsigned lines;
  std::vector<int> shown;
};

class LinesTest : public PowerLogJournalTest, public testing::WithParamInterface<LinesCase> {};

// Entries of others between them do not count.
TEST_P(LinesTest, TheLastAreShown) {
  const Entry other{{"MESSAGE_ID", "8d45620c1a4348dbb17410da57c60c66"}, {"_SYSTEMD_UNIT", "other.service"}};
  journal_.entries = {other, entryOf(1), other, entryOf(2), entryOf(3), other, entryOf(4), other};
  options_.lines = GetParam().lines;
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(shown(), GetParam().shown);
  EXPECT_EQ(err_.str(), "");
}

INSTANTIATE_TEST_SUITE_P(FewerExactlyAndMoreThanThereAre, LinesTest,
                         testing::Values(LinesCase{0, {1, 2, 3, 4}}, LinesCase{1, {4}},
                                         LinesCase{3, {2, 3, 4}}, LinesCase{4, {1, 2, 3, 4}},
                                         LinesCase{5, {1, 2, 3, 4}}, LinesCase{UINT32_MAX, {1, 2, 3, 4}}),
                         [](const auto& test) { return std::to_string(test.param.lines); });

TEST_F(PowerLogJournalTest, AnEmptyJournalShowsNothing) {
  for (const unsigned lines : {0U, 1U}) {
    options_.lines = lines;
    EXPECT_EQ(show(), ExitStatus::ok);
  }
  EXPECT_EQ(text_.str(), "");
  EXPECT_EQ(err_.str(), "");
}

TEST_F(PowerLogJournalTest, OnlyRecordsOfTheUnitCount) {
  Entry unlike = entryOf(4);
  unlike["MESSAGE_ID"] = "8d45620c1a4348dbb17410da57c60c66";
  journal_.entries = {entryOf(1), entryOf(2, "session-1.scope"), entryOf(3, "mine.service"), unlike};
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_THAT(shown(), ElementsAre(1));
}

TEST_F(PowerLogJournalTest, TheUnitMayBeAnother) {
  journal_.entries = {entryOf(1), entryOf(2), entryOf(3, "mine.service")};
  options_.unit = "mine.service";
  options_.lines = 2;
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_THAT(shown(), ElementsAre(3));
}

TEST_F(PowerLogJournalTest, WithoutAUnitEverybodysRecordsCount) {
  Entry unlike = entryOf(4);
  unlike["MESSAGE_ID"] = "8d45620c1a4348dbb17410da57c60c66";
  journal_.entries = {entryOf(1), entryOf(2, "session-1.scope"), entryOf(3, "mine.service"), unlike};
  options_.unit.clear();
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_THAT(shown(), ElementsAre(1, 2, 3));
}

TEST_F(PowerLogJournalTest, EntriesThatAreNoRecordsAreNotShown) {
  Entry withoutClient = entryOf(2);
  withoutClient.erase(kPowerLogClientField);
  Entry withoutEvent = entryOf(3);
  withoutEvent.erase(kPowerLogEventField);
  Entry tooLarge = entryOf(4);
  tooLarge.erase(kPowerLogPayloadField);
  tooLarge[kPowerLogDroppedField] = "70000";
  journal_.entries = {withoutClient, withoutEvent, tooLarge};
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(
      text_.str(),
      "2023-11-14 22:13:20.000002 +0000 client 4 Halvend-TRN (70000 bytes, too large to be recorded)\n");
  EXPECT_EQ(err_.str(), "");
}

TEST_F(PowerLogJournalTest, AnEntryWithoutATimeIsNotShown) {
  journal_.entries = {entryOf(1)};
  journal_.hasNoTimes = true;
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(text_.str(), "");
}

TEST_F(PowerLogJournalTest, FollowingShowsWhatComesUntilNobodyReadsIt) {
  journal_.entries = {entryOf(1), entryOf(2)};
  options_.lines = 1;
  options_.follow = true;
  int waits = 0;
  journal_.onWait = [this, &waits] {
    switch (++waits) {
      case 1:
        EXPECT_THAT(clientsIn(text_.flushed), ElementsAre(2));
        journal_.entries.push_back(entryOf(9, "session-1.scope"));
        journal_.entries.push_back(entryOf(3));
        journal_.entries.push_back(entryOf(4));
        return 1;
      case 2:
        EXPECT_THAT(clientsIn(text_.flushed), ElementsAre(2, 3, 4));
        return 0;  // for nothing
      case 3:
        EXPECT_THAT(clientsIn(text_.flushed), ElementsAre(2, 3, 4));
        journal_.entries.push_back(entryOf(5));
        return 1;
      case 4:
        EXPECT_THAT(clientsIn(text_.flushed), ElementsAre(2, 3, 4, 5));
        out_.setstate(std::ios::badbit);
        return 1;
      default:
        return -EIO;
    }
  };
  EXPECT_EQ(show(), ExitStatus::ok);
  EXPECT_EQ(waits, 4);
  EXPECT_EQ(err_.str(), "");
}

TEST_F(PowerLogJournalTest, FollowingBeginsInAnEmptyJournalToo) {
  for (const unsigned lines : {0U, 2U}) {
    journal_.entries.clear();
    options_.lines = lines;
    options_.follow = true;
    bool isFirst = true;
    journal_.onWait = [this, &isFirst] {
      if (!std::exchange(isFirst, false)) return -EBADMSG;
      journal_.entries = {entryOf(1)};
      return 1;
    };
    text_.str("");
    err_.str("");
    EXPECT_EQ(show(), ExitStatus::failed);
    EXPECT_THAT(shown(), ElementsAre(1));
    EXPECT_EQ(err_.str(), "tarnelctl: the journal cannot be watched: Bad message\n");
  }
}

TEST_F(PowerLogJournalTest, WhatCannotBeReadIsSaidWithItsReason) {
  journal_.entries = {entryOf(1)};
  for (const auto& [operation, lines] : std::map<std::string, unsigned>{{"addMatch MESSAGE_ID", 0},
                                                                        {"addMatch _SYSTEMD_UNIT", 0},
                                                                        {"seekHead", 0},
                                                                        {"seekTail", 1},
                                                                        {"previousSkip", 1},
                                                                        {"next", 0}}) {
    journal_.failing = operation;
    options_.lines = lines;
    err_.str("");
    EXPECT_EQ(show(), ExitStatus::failed) << operation;
    EXPECT_EQ(err_.str(), "tarnelctl: the journal cannot be read: Input/output error\n") << operation;
  }
  EXPECT_EQ(text_.str(), "");
}

TEST_F(PowerLogJournalTest, WhoMayNotReadItIsToldWhoMay) {
  journal_.failing = "next";
  for (const int failure : {-EACCES, -EPERM}) {
    journal_.failure = failure;
    err_.str("");
    EXPECT_EQ(show(), ExitStatus::failed);
    EXPECT_THAT(err_.str(), HasSubstr("; run it as root or as a member of the group systemd-journal\n"));
  }
}

}  // namespace
}  // namespace tarnel::ctl

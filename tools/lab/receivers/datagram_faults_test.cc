#include "tools/lab/receivers/datagram_faults.h"

#include <gmock/gmock.h>

namespace tarnel::lab {
namespace {

std::string problem(const NameValues& query) {
  const auto shares = DatagramFaults::sharesFromQuery(query);
  return shares ? "" : shares.error().localizedDescription();
}

TEST(DatagramFaultsTest, SharesAreReadFromTheQuery) {
  const auto shares = DatagramFaults::sharesFromQuery(
      {{"for", "datagrams"}, {"drop", "30"}, {"drop-acknowledgements", "100"}, {"seed", "7"}});
  ASSERT_TRUE(shares);
  EXPECT_EQ(shares->drop, 30U);
  EXPECT_EQ(shares->dropAcknowledgements, 100U);
  EXPECT_EQ(shares->seed, 7U);
  EXPECT_EQ(problem({{"drop", "0"}}), "");
}

TEST(DatagramFaultsTest, WhatIsNotTakenIsNamed) {
  EXPECT_EQ(problem({{"drop", "101"}}), "drop=101: drop takes a percentage from 0 to 100");
  EXPECT_EQ(problem({{"drop-acknowledgements", "x"}}),
            "drop-acknowledgements=x: drop-acknowledgements takes a percentage from 0 to 100");
  EXPECT_EQ(problem({{"drop", "1"}, {"seed", "-1"}}), "seed=-1: seed takes a number");
  EXPECT_EQ(problem({{"status", "503"}}),
            "unknown parameter status; for=datagrams takes drop, drop-acknowledgements and seed");
  EXPECT_EQ(problem({{"for", "datagrams"}, {"seed", "1"}}),
            "say how much of the datagrams to lose, for example drop=30&drop-acknowledgements=30");
}

TEST(DatagramFaultsTest, SharesAreKeptAndAlike) {
  DatagramFaults faults;
  const auto count = [&faults](DatagramFate wanted) {
    int found = 0;
    for (int message = 0; message < 1000; ++message) {
      for (uint64_t repetition = 1; repetition <= 5; ++repetition) {
        if (faults.fateOf(std::to_string(message), repetition) == wanted) ++found;
      }
    }
    return found;
  };
  EXPECT_EQ(count(DatagramFate::deliver), 5000);
  faults.set({.drop = 30, .dropAcknowledgements = 50});
  EXPECT_NEAR(count(DatagramFate::drop), 1500, 150);
  EXPECT_NEAR(count(DatagramFate::dropAcknowledgement), 1750, 150);
  const int first = count(DatagramFate::drop);
  EXPECT_EQ(count(DatagramFate::drop), first);
  faults.set({.drop = 30, .seed = 2});
  EXPECT_NE(count(DatagramFate::drop), first);
  faults.set({.drop = 100, .dropAcknowledgements = 100});
  EXPECT_EQ(count(DatagramFate::drop), 5000);
  faults.set({.dropAcknowledgements = 100});
  EXPECT_EQ(count(DatagramFate::dropAcknowledgement), 5000);
  faults.clear();
  EXPECT_EQ(count(DatagramFate::deliver), 5000);
}

TEST(DatagramFaultsTest, DescriptionSaysWhatIsSet) {
  DatagramFaults faults;
  EXPECT_EQ(faults.description(), Array());
  faults.set({.drop = 30, .dropAcknowledgements = 5});
  EXPECT_EQ(faults.description(),
            (Array{Dictionary{{"for", "datagrams"},
                              {"what", "30 % dropped, 5 % of the acknowledgements dropped"},
                              {"left", "until cleared"}}}));
}

}  // namespace
}  // namespace tarnel::lab

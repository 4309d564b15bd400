#include "backends/https/event_filters.h"

#include <gtest/gtest.h>

#include "backends/tarnel_backend.h"
#include "platform/fake/fake_log.h"

namespace tarnel {
namespace {

class EventFiltersTest : public ::testing::Test {
 protected:
  void create(const Array& descriptions) {
    document = Dictionary{{"filters", descriptions}};
    ProfileReader reader(log, "httppost", "updateBackendState");
    filters.createFiltersFromArray(reader.section(document).findDictionaries("filters"));
  }
  Dictionary filtered(Dictionary event) const {
    filters.filterEvent(event);
    return event;
  }
  static Dictionary describe(const char* key, const char* action) {
    return {{"key", key}, {"action", action}};
  }

  fake::FakeLog log;
  Dictionary document;
  EventFilters filters;
  const std::string digestOfV = TarnelBackend::convertIntoSHA256("v");
};

TEST_F(EventFiltersTest, WithoutATableNothingChanges) {
  EXPECT_EQ(filtered({{"a", "v"}}), (Dictionary{{"a", "v"}}));
}

TEST_F(EventFiltersTest, RemovesAndDigests) {
  create({describe("gone", "remove"), describe("hashed", "sha256")});
  EXPECT_EQ(filtered({{"gone", "v"}, {"hashed", "v"}, {"stays", "v"}}),
            (Dictionary{{"hashed", digestOfV}, {"stays", "v"}}));
}

TEST_F(EventFiltersTest, OtherActionsLeaveTheField) {
  create({describe("a", "Remove"), describe("b", "SHA256"), describe("c", "keep"), Dictionary{{"key", "d"}},
          Dictionary{{"key", "e"}, {"action", 1}}});
  const Dictionary event{{"a", "v"}, {"b", "v"}, {"c", "v"}, {"d", "v"}, {"e", "v"}};
  EXPECT_EQ(filtered(event), event);
}

TEST_F(EventFiltersTest, NamesOfDifferentLengthMayBeTheSameIgnoringCase) {
  create({describe("kelvin", "remove"), describe("Ⱥ", "remove"), describe("ΣΟΦΟΣ", "remove")});
  EXPECT_EQ(filtered({{"\u212Aelvin", 1}, {"ⱥ", 2}, {"Ⱥ", 3}, {"σοφος", 4}, {"σοφοs", 5}}),
            (Dictionary{{"σοφοs", 5}}));
}

TEST_F(EventFiltersTest, NamesCompareIgnoringCase) {
  create({describe("UserName", "remove"), describe("STRASSE-Ä", "remove")});
  EXPECT_EQ(filtered({{"username", 1}, {"USERNAME", 2}, {"strasse-ä", 3}, {"usernam", 4}}),
            (Dictionary{{"usernam", 4}}));
}

TEST_F(EventFiltersTest, FirstMatchingRecordDecides) {
  create({Dictionary{{"method", 5}, {"key", "a"}, {"action", "remove"}}, describe("a", "sha256")});
  EXPECT_EQ(filtered({{"a", "v"}, {"_method", 5}}), (Dictionary{{"_method", 5}}));
  EXPECT_EQ(filtered({{"a", "v"}, {"_method", 6}}), (Dictionary{{"a", digestOfV}, {"_method", 6}}));
}

TEST_F(EventFiltersTest, KeepRecordShieldsAField) {
  create({Dictionary{{"method", 1}, {"key", "a"}, {"action", "keep"}}, describe("a", "remove")});
  EXPECT_EQ(filtered({{"a", "v"}, {"_method", 1}}), (Dictionary{{"a", "v"}, {"_method", 1}}));
  EXPECT_EQ(filtered({{"a", "v"}, {"_method", 2}}), (Dictionary{{"_method", 2}}));
}

TEST_F(EventFiltersTest, StatusMustFitToo) {
  create({Dictionary{{"method", 5}, {"status", 7}, {"key", "a"}, {"action", "remove"}}});
  const Dictionary otherStatus{{"a", "v"}, {"_method", 5}, {"_status", 8}};
  const Dictionary otherMethod{{"a", "v"}, {"_method", 4}, {"_status", 7}};
  EXPECT_EQ(filtered(otherStatus), otherStatus);
  EXPECT_EQ(filtered(otherMethod), otherMethod);
  EXPECT_FALSE(filtered({{"a", "v"}, {"_method", 5}, {"_status", 7}}).contains("a"));
}

TEST_F(EventFiltersTest, NegativeNumbersFitEveryEvent) {
  create({Dictionary{{"method", -2}, {"status", -9}, {"key", "a"}, {"action", "remove"}}});
  EXPECT_FALSE(filtered({{"a", "v"}, {"_method", 5}, {"_status", 7}}).contains("a"));
}

TEST_F(EventFiltersTest, AbsentMethodAndStatusOfAnEventCountAsZero) {
  create({Dictionary{{"method", 0}, {"status", 0}, {"key", "a"}, {"action", "remove"}},
          Dictionary{{"method", 1}, {"key", "b"}, {"action", "remove"}}});
  EXPECT_EQ(filtered({{"a", "v"}, {"b", "v"}}), (Dictionary{{"b", "v"}}));
}

// A number that is too large is the largest, and fits no event by its low bits.
TEST_F(EventFiltersTest, NumbersAreHeldToTheirBounds) {
  const int64_t tooLarge = (int64_t{1} << 32) + 5;
  create({Dictionary{{"method", tooLarge}, {"key", "a"}, {"action", "remove"}},
          Dictionary{{"status", tooLarge}, {"key", "b"}, {"action", "remove"}},
          Dictionary{{"method", 65536 + 5}, {"key", "c"}, {"action", "remove"}},
          Dictionary{{"method", UINT64_MAX}, {"status", 1e300}, {"key", "d"}, {"action", "remove"}},
          Dictionary{{"method", 5.9}, {"key", "e"}, {"action", "remove"}}});
  const Dictionary event{{"a", 1}, {"b", 1}, {"c", 1}, {"d", 1}, {"_method", 5}, {"_status", 5}};
  EXPECT_EQ(filtered(event), event);
  EXPECT_FALSE(filtered({{"e", 1}, {"_method", 5}}).contains("e"));
  // The same number still fits itself.
  EXPECT_FALSE(filtered({{"a", 1}, {"_method", tooLarge}}).contains("a"));
  EXPECT_TRUE(filtered({{"c", 1}, {"_method", tooLarge}}).contains("c"));
}

// Below 0 means every event, however far below.
TEST_F(EventFiltersTest, NegativeNumbersStayNegative) {
  create({Dictionary{{"method", -4294967291}, {"status", -1e300}, {"key", "a"}, {"action", "remove"}}});
  for (const int number : {0, 5, 6}) {
    EXPECT_FALSE(filtered({{"a", 1}, {"_method", number}, {"_status", number}}).contains("a")) << number;
  }
}

TEST_F(EventFiltersTest, ZeroIsANumberLikeAnyOther) {
  create({Dictionary{{"method", 0}, {"key", "a"}, {"action", "remove"}},
          Dictionary{{"status", 0}, {"key", "b"}, {"action", "remove"}}});
  const Dictionary other{{"a", "v"}, {"b", "v"}, {"_method", 5}, {"_status", 7}};
  EXPECT_EQ(filtered(other), other);
}

TEST_F(EventFiltersTest, MethodAndStatusAreThoseBeforeTheFilter) {
  create({describe("_method", "remove"), describe("_status", "sha256"),
          Dictionary{{"method", 5}, {"status", 7}, {"key", "z"}, {"action", "remove"}}});
  EXPECT_EQ(filtered({{"_method", 5}, {"_status", 7}, {"z", "v"}}),
            (Dictionary{{"_status", TarnelBackend::convertIntoSHA256("7")}}));
}

TEST_F(EventFiltersTest, DigestOfAValueThatIsNoTextCoversItsReadableText) {
  create({describe("n", "sha256"), describe("d", "sha256")});
  EXPECT_EQ(filtered({{"n", 12}, {"d", Dictionary{{"a", 1}}}}),
            (Dictionary{{"n", TarnelBackend::convertIntoSHA256("12")},
                        {"d", TarnelBackend::convertIntoSHA256("{\"a\": 1}")}}));
}

TEST_F(EventFiltersTest, EmptyListKeepsThePreviousTable) {
  create({describe("a", "remove")});
  create({});
  EXPECT_EQ(filtered({{"a", "v"}}), Dictionary());
}

TEST_F(EventFiltersTest, NewListReplacesTheTable) {
  create({describe("a", "remove")});
  create({describe("b", "remove")});
  EXPECT_EQ(filtered({{"a", "v"}, {"b", "v"}}), (Dictionary{{"a", "v"}}));
}

TEST_F(EventFiltersTest, WhatIsADigestIsNotDigestedAgain) {
  create({describe("hashed", "sha256"), describe("gone", "remove")});
  Dictionary event{{"Hashed", "v"}, {"gone", "v"}, {"stays", "v"}};
  auto trace = EventFilters::traceOf(event);
  EXPECT_TRUE(trace.digested.empty());
  filters.filterAgain(event, trace);
  const Dictionary once{{"Hashed", digestOfV}, {"stays", "v"}};
  EXPECT_EQ(event, once);
  EXPECT_EQ(trace.digested.count("Hashed"), 1U);
  EXPECT_EQ(trace.digested.size(), 1U);
  filters.filterAgain(event, trace);
  EXPECT_EQ(event, once);
}

TEST_F(EventFiltersTest, ALaterTableRemovesDigestsAndTakesWhatTheEarlierLeft) {
  create({describe("a", "sha256"), describe("b", "sha256")});
  Dictionary event{{"a", "v"}, {"b", "v"}, {"c", "v"}, {"d", "v"}};
  auto trace = EventFilters::traceOf(event);
  filters.filterAgain(event, trace);
  create(
      {describe("a", "remove"), describe("b", "sha256"), describe("c", "sha256"), describe("d", "remove")});
  filters.filterAgain(event, trace);
  EXPECT_EQ(event, (Dictionary{{"b", digestOfV}, {"c", digestOfV}}));
}

TEST_F(EventFiltersTest, ATraceKeepsTheNumbersThatAFilterTook) {
  create({describe("_method", "remove"), describe("_status", "sha256")});
  Dictionary event{{"a", "v"}, {"_method", 5}, {"_status", 7}};
  auto trace = EventFilters::traceOf(event);
  filters.filterAgain(event, trace);
  EXPECT_FALSE(event.contains("_method"));
  create({Dictionary{{"method", 5}, {"status", 7}, {"key", "a"}, {"action", "remove"}}});
  filters.filterAgain(event, trace);
  EXPECT_FALSE(event.contains("a"));
}

TEST_F(EventFiltersTest, RecordsWithoutAKeyFitNothing) {
  create({describe("a", "remove")});
  create({Dictionary{{"action", "remove"}}});
  EXPECT_EQ(filtered({{"a", "v"}, {"", "v"}}), (Dictionary{{"a", "v"}, {"", "v"}}));
}

TEST_F(EventFiltersTest, LongNamesAreToldApart) {
  const std::string first = std::string(100, 'x') + "1";
  const std::string second = std::string(100, 'x') + "2";
  create({describe(second.c_str(), "remove"), describe((first + "0").c_str(), "remove"),
          describe(std::string(63, 'y').c_str(), "remove")});
  EXPECT_EQ(filtered({{first, "v"}, {second, "v"}, {std::string(63, 'Y'), "v"}}), (Dictionary{{first, "v"}}));
}

TEST_F(EventFiltersTest, OrderHoldsAmongNamesOfDifferentLength) {
  create({describe("bb", "keep"), describe("a", "remove"), describe("bb", "remove"), describe("a", "keep")});
  EXPECT_EQ(filtered({{"a", "v"}, {"bb", "v"}}), (Dictionary{{"bb", "v"}}));
}

TEST_F(EventFiltersTest, WronglyTypedPartsCountAsAbsent) {
  create({Dictionary{{"method", "5"}, {"status", Array()}, {"key", "a"}, {"action", "remove"}},
          Dictionary{{"key", 7}, {"action", "remove"}}, 12});
  EXPECT_EQ(filtered({{"a", "v"}, {"_method", 6}, {"_status", 2}, {"7", "v"}}),
            (Dictionary{{"_method", 6}, {"_status", 2}, {"7", "v"}}));
  EXPECT_TRUE(
      log.contains(LogLevel::warning,
                   "HTTPSPostBackend(updateBackendState): httppost: filters[0].method is not a number "
                   "and counts as absent"));
  EXPECT_TRUE(
      log.contains(LogLevel::warning,
                   "HTTPSPostBackend(updateBackendState): httppost: filters[0].status is not a number "
                   "and counts as absent"));
  EXPECT_TRUE(log.contains(LogLevel::warning,
                           "HTTPSPostBackend(updateBackendState): httppost: filters[1].key is not a text and "
                           "counts as absent"));
  EXPECT_TRUE(
      log.contains(LogLevel::warning,
                   "HTTPSPostBackend(updateBackendState): httppost: filters[2] is not a dictionary and "
                   "counts as absent"));
  EXPECT_EQ(log.lines().size(), 4U);
}

TEST_F(EventFiltersTest, OneWarningPerKeyHoweverOftenItIsWrong) {
  Array descriptions;
  for (int i = 0; i < 1000; ++i) descriptions.append(Dictionary{{"key", i}});
  create(descriptions);
  EXPECT_EQ(log.lines().size(), 1U);
}

}  // namespace
}  // namespace tarnel

#include "platform/linux/device/linux_locale_information.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <thread>
#include <vector>

#include "platform/fake/fake_log.h"
#include "testing/linux_test_support.h"
#include "testing/zone_file_test_support.h"

namespace tarnel {
namespace {

LinuxLocaleInformation::Environment environment(const std::map<std::string, std::string>& variables) {
  return [variables](const char* name) -> const char* {
    const auto found = variables.find(name);
    return found == variables.end() ? nullptr : found->second.c_str();
  };
}

TEST(LinuxLocaleInformation, TheTerritoryIsTheCountry) {
  EXPECT_EQ(territoryOfLocale("de_DE.UTF-8"), "DE");
  EXPECT_EQ(territoryOfLocale("de_AT@euro"), "AT");
  EXPECT_EQ(territoryOfLocale("pt_BR"), "BR");
  for (const char* name :
       {"", "C", "POSIX", "C.UTF-8", "de", "eo.UTF-8", "es_419", "_DE", "de_de", "sr_RS_x"}) {
    EXPECT_FALSE(territoryOfLocale(name)) << name;
  }
}

TEST(LinuxLocaleInformation, TheFirstVariableThatIsSetDecides) {
  const auto country = [](const std::map<std::string, std::string>& variables) {
    fake::FakeLog log;
    return LinuxLocaleInformation(std::nullopt, environment(variables), log).countryCode();
  };
  EXPECT_EQ(country({{"LC_ALL", "en_US.UTF-8"}, {"LC_MEASUREMENT", "de_DE"}, {"LANG", "fr_FR"}}), "US");
  EXPECT_EQ(country({{"LC_ALL", ""}, {"LC_MEASUREMENT", "de_DE"}, {"LANG", "fr_FR"}}), "DE");
  EXPECT_EQ(country({{"LANG", "fr_FR"}}), "FR");
  EXPECT_FALSE(country({{"LC_ALL", "C"}, {"LANG", "fr_FR"}}));
  EXPECT_FALSE(country({}));
}

TEST(LinuxLocaleInformation, TheConfigurationComesFirst) {
  fake::FakeLog log;
  EXPECT_EQ(LinuxLocaleInformation("JP", environment({{"LC_ALL", "en_US"}}), log).countryCode(), "JP");
}

TEST(LinuxLocaleInformation, TheOffsetFollowsTheZoneOverTheYear) {
  const auto offset = [](const char* zone, int64_t time) {
    return runInChild([zone, time] {
      ::setenv("TZ", zone, 1);
      fake::FakeLog log;
      return std::to_string(
          LinuxLocaleInformation(std::nullopt, environment({{"TZ", zone}}), log).secondsFromGMT(time));
    });
  };
  constexpr char kSummerTime[] = "XST-1XDT,M3.5.0,M10.5.0/3";
  EXPECT_EQ(offset(kSummerTime, 1704067200), "3600");
  EXPECT_EQ(offset(kSummerTime, 1719792000), "7200");
  EXPECT_EQ(offset("NST3:30", 0), "-12600");
}

// The real class over a zone's file of the test's own, in a process of its own, whose zone it is.
class LocalZoneTest : public testing::Test {
 protected:
  LocalZoneTest() {
    folder_.write("east", zoneText(5 * 3600));
    folder_.write("west", zoneText(-3600));
    folder_.write("text", "Europe/Berlin\n");
    folder_.write("half", zoneText(-3600).substr(0, 50));
  }

  // As timedatectl does: at no instant without a link.
  void linkTo(const std::string& target) const {
    std::filesystem::create_symlink(target, folder_.path("new"));
    std::filesystem::rename(folder_.path("new"), file_);
  }
  void removeFile() const { std::filesystem::remove(file_); }
  size_t warnings() const { return log_.startingWith("LinuxLocaleInformation(secondsFromGMT): ").size(); }

  // The answers before and after each step, with a star behind those for which the file was read again.
  std::string answers(const std::vector<std::function<void()>>& steps,
                      const std::map<std::string, std::string>& variables = {}) {
    return runInChild([&] {
      linkTo("east");
      int loads = 0;
      LinuxLocaleInformation locale(std::nullopt, environment(variables), log_,
                                    {.file = file_, .load = [this, &loads] {
                                       loadZoneFrom(file_);
                                       ++loads;
                                     }});
      std::string said;
      const auto ask = [&] {
        loads = 0;
        said += std::to_string(locale.secondsFromGMT(1704067200));
        said += loads == 0 ? " " : "* ";
      };
      ask();
      for (const auto& step : steps) {
        step();
        ask();
      }
      return said + "with " + std::to_string(warnings()) + " warnings";
    });
  }

  TemporaryFolder folder_;
  const std::string file_ = folder_.path("localtime");
  fake::FakeLog log_;
};

TEST_F(LocalZoneTest, ALinkToAnotherZoneIsFollowed) {
  EXPECT_EQ(answers({[this] { linkTo("west"); }, [] {}, [this] { linkTo("east"); }}),
            "18000 -3600* -3600 18000* with 0 warnings");
}

TEST_F(LocalZoneTest, AFileInItsPlaceIsFollowed) {
  const auto put = [this](const char* zone) {
    return [this, zone] { std::filesystem::rename(folder_.path(zone), file_); };
  };
  EXPECT_EQ(answers({put("west"), put("east")}), "18000 -3600* 18000* with 0 warnings");
}

TEST_F(LocalZoneTest, ANewFileOfTheSameZoneIsFollowed) {
  EXPECT_EQ(answers({[this] { std::filesystem::rename(folder_.path("west"), folder_.path("east")); }}),
            "18000 -3600* with 0 warnings");
}

TEST_F(LocalZoneTest, NoFileMeansUTC) {
  EXPECT_EQ(answers({[this] { removeFile(); }, [] {}, [this] { linkTo("west"); }}),
            "18000 0* 0 -3600* with 0 warnings");
}

TEST_F(LocalZoneTest, WhatCannotBeUsedLeavesTheZoneOfBefore) {
  EXPECT_EQ(answers({[this] { linkTo("nowhere"); }, [this] { linkTo("text"); }, [this] { linkTo("."); },
                     [this] { linkTo("half"); }, [this] { linkTo("west"); }}),
            "18000 18000 18000 18000 18000 -3600* with 1 warnings");
}

TEST_F(LocalZoneTest, AnotherZoneThatCannotBeUsedIsToldAnew) {
  EXPECT_EQ(answers({[this] { linkTo("text"); }, [this] { linkTo("east"); }, [this] { linkTo("text"); }}),
            "18000 18000 18000 18000 with 2 warnings");
}

// As it is seen while it is copied to its place.
TEST_F(LocalZoneTest, AZoneCutShortAnywhereLeavesTheZoneOfBefore) {
  for (const auto& whole : {zoneText(-3600), longZoneText(-3600)}) {
    std::vector<std::function<void()>> steps;
    std::string expected = "18000 ";
    for (size_t size = 0; size < whole.size(); ++size) {
      steps.emplace_back([this, text = whole.substr(0, size)] {
        folder_.write("short", text);
        linkTo("short");
      });
      expected += "18000 ";
    }
    steps.emplace_back([this, &whole] { folder_.write("short", whole); });
    EXPECT_EQ(answers(steps), expected + "-3600* with 1 warnings");
  }
}

TEST_F(LocalZoneTest, AZoneOfTheSystemIsWhole) {
  const std::string file = "/usr/share/zoneinfo/Europe/Berlin";
  if (!std::filesystem::exists(file)) GTEST_SKIP() << file << " is not installed";
  EXPECT_EQ(answers({[this, &file] { linkTo(file); }}), "18000 3600* with 0 warnings");
}

// One more of what a header counts, and one byte too few for it.
TEST_F(LocalZoneTest, EveryCountOfAHeaderIsHeeded) {
  const size_t block = zoneText(0).size();
  const auto expectRefused = [this](std::string text, size_t count, size_t end, size_t bytesOfOne) {
    ++text[count + 3];
    text.insert(end, bytesOfOne - 1, '\0');
    EXPECT_EQ(answers({[this, &text] {
                folder_.write("short", text);
                linkTo("short");
              }}),
              "18000 18000 with 1 warnings")
        << count;
  };
  // Indicators of two kinds, leap seconds, transitions, kinds of local time, bytes of their names.
  size_t count = 20;
  for (const size_t bytesOfOne : {1, 1, 8, 5, 6, 1}) {
    expectRefused(zoneText(-3600), count, block, bytesOfOne);
    count += 4;
  }
  count = block + 20;
  for (const size_t bytesOfOne : {1, 1, 12, 9, 6, 1}) {
    expectRefused(longZoneText(-3600), count, 2 * block, bytesOfOne);
    count += 4;
  }
}

TEST_F(LocalZoneTest, AnotherMistakeAfterAUsableZoneIsToldAgain) {
  EXPECT_EQ(
      answers({[this] { linkTo("text"); }, [this] { linkTo("west"); }, [this] { linkTo("nowhere"); }, [] {}}),
      "18000 18000 -3600* -3600 -3600 with 2 warnings");
}

TEST_F(LocalZoneTest, TheWarningNamesFileAndRemedy) {
  linkTo("east");
  LinuxLocaleInformation locale(std::nullopt, environment({}), log_, {.file = file_, .load = [] {}});
  linkTo("text");
  locale.secondsFromGMT(0);
  EXPECT_TRUE(log_.contains(
      LogLevel::warning, "LinuxLocaleInformation(secondsFromGMT): the time zone has changed, but " + file_ +
                             ": is no time zone; the zone of before stays. Let the daemon read the file, "
                             "also in its sandbox's profile, or restart it"));
}

TEST_F(LocalZoneTest, AZoneInTheEnvironmentIsKept) {
  for (const char* zone : {"", ":/x", "XST-1"}) {
    EXPECT_EQ(answers({[this] { linkTo("west"); }, [this] { linkTo("text"); }}, {{"TZ", zone}}),
              "18000 18000 18000 with 0 warnings");
  }
}

TEST_F(LocalZoneTest, ThreadsSeeOneZoneOrTheOther) {
  EXPECT_EQ(runInChild([this] {
              linkTo("east");
              LinuxLocaleInformation locale(std::nullopt, environment({}), log_,
                                            {.file = file_, .load = [this] { loadZoneFrom(file_); }});
              linkTo("west");
              std::atomic<int> wrong{0};
              std::vector<std::thread> threads;
              for (int i = 0; i < 4; ++i) {
                threads.emplace_back([&] {
                  for (int round = 0; round < 100; ++round) {
                    if (locale.secondsFromGMT(1704067200) != -3600) ++wrong;
                  }
                });
              }
              for (auto& thread : threads) thread.join();
              return std::to_string(wrong);
            }),
            "0");
}

}  // namespace
}  // namespace tarnel

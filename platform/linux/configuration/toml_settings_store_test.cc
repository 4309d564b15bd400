#include "platform/linux/configuration/toml_settings_store.h"

#include <gmock/gmock.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cerrno>
#include <random>
#include <thread>

#include "formats/toml.h"
#include "platform/fake/fake_log.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

using testing::ElementsAre;
using testing::StartsWith;
using testing::UnorderedElementsAre;

constexpr char kDomain[] = "com.orvane.tarnel";
constexpr char kKey[] = "uuid:Foo:Bar";
constexpr char kOwn[] = "state/settings/com.orvane.tarnel.toml";
constexpr char kAdministrator[] = "etc/settings/com.orvane.tarnel.toml";

class TomlSettingsStoreTest : public testing::Test {
 protected:
  TomlSettingsStoreTest() {
    folder_.makeDirectory("etc");
    folder_.makeDirectory("state");
  }
  TomlSettingsStore open() { return TomlSettingsStore(folder_.path("etc"), folder_.path("state"), log_); }
  std::vector<std::string> logged() const {
    std::vector<std::string> texts;
    for (const auto& line : log_.lines()) texts.push_back(line.text);
    return texts;
  }

  TemporaryFolder folder_;
  fake::FakeLog log_;
};

TEST_F(TomlSettingsStoreTest, WhatWasStoredIsThereAfterARestart) {
  const Dictionary nested{{"a", 1}, {"b", Array{Value(true), Value("x")}}};
  const Dictionary all{{kKey, "4CE2A1F0-0000-4000-8000-000000000001"},
                       {"environmentType", "seed"},
                       {"forceEventLogging", true},
                       {"count", 42},
                       {"ratio", 0.5},
                       {"date", Date{1700000000}},
                       {"nested", nested}};
  {
    auto store = open();
    for (const auto& [key, value] : all) EXPECT_FALSE(store.setObject(kDomain, key, value)) << key;
  }
  auto store = open();
  for (const auto& [key, value] : all) EXPECT_EQ(store.objectForKey(kDomain, key), value) << key;
  EXPECT_FALSE(store.objectForKey(kDomain, "missing"));
  EXPECT_FALSE(store.objectForKey("com.orvane.timed", kKey));
  EXPECT_THAT(logged(), ElementsAre());
}

TEST_F(TomlSettingsStoreTest, OwnKeysAreListedByTheirBeginning) {
  folder_.write(kAdministrator, "\"uuid:admin:\" = \"X\"\n");
  auto store = open();
  EXPECT_THAT(store.ownKeys(kDomain, ""), ElementsAre());
  for (const char* key : {"uuid:a:", "uuid:b:c", "uuid", "xuuid:", "dnu:respect"}) {
    ASSERT_FALSE(store.setObject(kDomain, key, Value("X")));
  }
  EXPECT_THAT(store.ownKeys(kDomain, "uuid:"), UnorderedElementsAre("uuid:a:", "uuid:b:c"));
  EXPECT_EQ(store.ownKeys(kDomain, "").size(), 5U);
  EXPECT_THAT(store.ownKeys("com.orvane.timed", ""), ElementsAre());
  folder_.write("state/x.toml", "a = 1\n");
  EXPECT_THAT(store.ownKeys("../x", ""), ElementsAre()) << "no domain";
}

TEST_F(TomlSettingsStoreTest, RemovingFromNothingMakesNothing) {
  EXPECT_FALSE(open().removeObject(kDomain, kKey));
  EXPECT_FALSE(folder_.exists("state/settings"));
  EXPECT_TRUE(open().removeObject("../x", kKey)) << "no domain";
}

TEST_F(TomlSettingsStoreTest, TheFileIsTomlForItsOwnerAlone) {
  ASSERT_FALSE(open().setObject(kDomain, kKey, Value("X")));
  EXPECT_EQ(folder_.read(kOwn), "\"uuid:Foo:Bar\" = \"X\"\n");
  for (const auto& [name, mode] : {std::pair(kOwn, 0600U), std::pair("state/settings", 0700U)}) {
    struct stat status {};
    ASSERT_EQ(::stat(folder_.path(name).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, mode) << name;
  }
}

TEST_F(TomlSettingsStoreTest, TheAdministratorWins) {
  folder_.write(kAdministrator, "environmentType = \"carry\"\nonly = 1\n");
  auto store = open();
  ASSERT_FALSE(store.setObject(kDomain, "environmentType", Value("seed")));
  ASSERT_FALSE(store.setObject(kDomain, "mine", Value(2)));
  EXPECT_EQ(store.objectForKey(kDomain, "environmentType"), Value("carry"));
  EXPECT_EQ(store.entryForKey(kDomain, "environmentType")->layer, SettingsLayer::administrator);
  EXPECT_EQ(store.entryForKey(kDomain, "mine")->layer, SettingsLayer::own);
  const auto entries = store.entries(kDomain);
  ASSERT_TRUE(entries);
  std::vector<std::string> shown;
  for (const auto& entry : *entries) {
    shown.push_back(entry.key + (entry.layer == SettingsLayer::own ? " own" : " administrator"));
  }
  EXPECT_THAT(shown, ElementsAre("environmentType administrator", "mine own", "only administrator"));
  // Removing takes away the own value alone.
  ASSERT_FALSE(store.removeObject(kDomain, "environmentType"));
  EXPECT_EQ(store.objectForKey(kDomain, "environmentType"), Value("carry"));
  EXPECT_EQ(folder_.read(kOwn), "\"mine\" = 2\n");
}

TEST_F(TomlSettingsStoreTest, RemovingIsNoErrorWhenNothingIsThere) {
  auto store = open();
  EXPECT_FALSE(store.removeObject(kDomain, kKey));
  ASSERT_FALSE(store.setObject(kDomain, kKey, Value(1)));
  EXPECT_FALSE(store.removeObject(kDomain, kKey));
  EXPECT_FALSE(store.objectForKey(kDomain, kKey));
}

TEST_F(TomlSettingsStoreTest, ChangesOfOtherProcessesAreNoticed) {
  auto daemon = open();
  auto tool = open();
  EXPECT_FALSE(daemon.objectForKey(kDomain, "a"));
  ASSERT_FALSE(tool.setObject(kDomain, "a", Value(1)));
  EXPECT_EQ(daemon.objectForKey(kDomain, "a"), Value(1));
  ASSERT_FALSE(daemon.setObject(kDomain, "b", Value(2)));
  ASSERT_FALSE(tool.setObject(kDomain, "a", Value(3)));
  EXPECT_EQ(daemon.objectForKey(kDomain, "a"), Value(3));
  EXPECT_EQ(tool.objectForKey(kDomain, "b"), Value(2));
  folder_.write(kAdministrator, "a = 9\n");
  EXPECT_EQ(daemon.objectForKey(kDomain, "a"), Value(9));
  folder_.remove(kAdministrator);
  EXPECT_EQ(daemon.objectForKey(kDomain, "a"), Value(3));
}

TEST_F(TomlSettingsStoreTest, ADamagedOwnFileGivesNothingAndIsKept) {
  folder_.write(kOwn, "good = 1\n= broken\n");
  auto store = open();
  EXPECT_FALSE(store.objectForKey(kDomain, "good"));
  EXPECT_FALSE(store.objectForKey(kDomain, "good"));
  ASSERT_EQ(log_.lines().size(), 1U);
  EXPECT_EQ(log_.lines()[0].level, LogLevel::error);
  EXPECT_THAT(log_.lines()[0].text, StartsWith("TomlSettingsStore(read): " + folder_.path(kOwn) + ":2: "));
  EXPECT_TRUE(log_.lines()[0].text.ends_with("; it will be moved aside when the next value is stored"));
  const auto entries = store.entries(kDomain);
  ASSERT_FALSE(entries);
  EXPECT_THAT(entries.error().localizedDescription(), StartsWith(folder_.path(kOwn) + ":2: "));

  folder_.write("state/settings/com.orvane.tarnel.toml.damaged-1", "older\n");
  ASSERT_FALSE(store.setObject(kDomain, "new", Value(2)));
  EXPECT_EQ(folder_.read(std::string(kOwn) + ".damaged-1"), "older\n");
  EXPECT_EQ(folder_.read(std::string(kOwn) + ".damaged-2"), "good = 1\n= broken\n");
  EXPECT_EQ(store.objectForKey(kDomain, "new"), Value(2));
  EXPECT_TRUE(log_.contains(LogLevel::warning, "TomlSettingsStore(write): " + folder_.path(kOwn) +
                                                   " was damaged and is kept as " + folder_.path(kOwn) +
                                                   ".damaged-2"));
}

TEST_F(TomlSettingsStoreTest, ATimeWithoutADateCountsAsDamage) {
  folder_.write(kOwn, "at = 10:00:00\n");
  auto store = open();
  EXPECT_FALSE(store.objectForKey(kDomain, "at"));
  ASSERT_FALSE(store.setObject(kDomain, "new", Value(2)));
  EXPECT_TRUE(folder_.exists(std::string(kOwn) + ".damaged-1"));
}

TEST_F(TomlSettingsStoreTest, ADamagedFileOfTheAdministratorIsReportedOnceAndIgnored) {
  folder_.write(kAdministrator, "a = \n");
  auto store = open();
  ASSERT_FALSE(store.setObject(kDomain, "a", Value(1)));
  EXPECT_EQ(store.objectForKey(kDomain, "a"), Value(1));
  EXPECT_EQ(store.objectForKey(kDomain, "a"), Value(1));
  ASSERT_EQ(log_.lines().size(), 1U);
  EXPECT_THAT(log_.lines()[0].text,
              StartsWith("TomlSettingsStore(read): " + folder_.path(kAdministrator) + ":1: "));
  EXPECT_TRUE(log_.lines()[0].text.ends_with("; it is ignored until it is mended"));
  EXPECT_EQ(folder_.read(kAdministrator), "a = \n");
}

TEST_F(TomlSettingsStoreTest, AFileOfTheAdministratorThatOthersCanWriteIsIgnored) {
  folder_.write(kAdministrator, "a = 1\n");
  ASSERT_EQ(::chmod(folder_.path(kAdministrator).c_str(), 0666), 0);
  EXPECT_FALSE(open().objectForKey(kDomain, "a"));
  ASSERT_EQ(log_.lines().size(), 1U);
  EXPECT_NE(log_.lines()[0].text.find("chmod go-w"), std::string::npos);
}

TEST_F(TomlSettingsStoreTest, AFileThatCannotBeReadIsLeftAlone) {
  folder_.makeDirectory(kOwn);
  auto store = open();
  EXPECT_FALSE(store.objectForKey(kDomain, kKey));
  const auto error = store.setObject(kDomain, kKey, Value(1));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->localizedDescription(), folder_.path(kOwn) + ": is not a regular file");
  EXPECT_TRUE(std::filesystem::is_directory(folder_.path(kOwn)));
  EXPECT_EQ(
      logged(),
      (std::vector<std::string>{"TomlSettingsStore(read): " + folder_.path(kOwn) +
                                ": is not a regular file; nothing can be stored until that is mended"}));
}

TEST_F(TomlSettingsStoreTest, AFileBehindAClosedDirectoryIsNotTakenForNone) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs a directory that another user may not enter";
  folder_.write(kOwn, "a = 1\n");
  ::chmod(folder_.path().c_str(), 0755);
  ::chmod(folder_.path("state/settings").c_str(), 0700);
  const std::string said = runInChild([this] {
    if (::setresuid(65534, 65534, 65534) != 0) return std::string("no other user");
    auto store = open();
    if (store.objectForKey(kDomain, "a")) return std::string("it was read");
    return logged().empty() ? std::string("nothing was said") : logged().front();
  });
  EXPECT_EQ(said, "TomlSettingsStore(read): " + folder_.path(kOwn) +
                      ": cannot be opened: Permission denied; nothing can be stored until that is mended");
}

TEST_F(TomlSettingsStoreTest, WhatCannotBeStoredChangesNothing) {
  auto store = open();
  ASSERT_FALSE(store.setObject(kDomain, "a", Value(1)));
  for (const Value& value : {Value(), Value(Data{1}), Value("\xFF"), Value(UINT64_MAX)}) {
    const auto error = store.setObject(kDomain, "a", value);
    ASSERT_TRUE(error);
    EXPECT_NE(error->localizedDescription().find("\"a\" cannot be stored"), std::string::npos);
  }
  const auto large = store.setObject(kDomain, "b", Value(std::string(kMaxFileBytes, 'x')));
  ASSERT_TRUE(large);
  EXPECT_EQ(large->code(), EFBIG);
  EXPECT_EQ(store.objectForKey(kDomain, "a"), Value(1));
  EXPECT_FALSE(store.objectForKey(kDomain, "b"));
}

TEST_F(TomlSettingsStoreTest, ADomainIsNoPath) {
  auto store = open();
  for (const std::string& domain :
       {std::string("../x"), std::string("a/b"), std::string(), std::string(".hidden"), std::string("a b"),
        std::string(129, 'a'), std::string("a\0b", 3)}) {
    const auto error = store.setObject(domain, "k", Value(1));
    ASSERT_TRUE(error) << domain;
    EXPECT_EQ(error->domain(), kSettingsErrorDomain);
    EXPECT_FALSE(store.objectForKey(domain, "k"));
    EXPECT_FALSE(store.entries(domain));
  }
  EXPECT_FALSE(folder_.exists("x.toml"));
}

TEST_F(TomlSettingsStoreTest, DomainsOfBothLayersAreListed) {
  auto store = open();
  EXPECT_THAT(store.domains(), ElementsAre());
  folder_.write("etc/settings/com.orvane.timed.toml", "");
  folder_.write(kAdministrator, "");
  ASSERT_FALSE(store.setObject(kDomain, "a", Value(1)));
  ASSERT_FALSE(store.setObject("b", "a", Value(1)));
  EXPECT_THAT(store.domains(), ElementsAre("b", "com.orvane.tarnel", "com.orvane.timed"));
}

TEST_F(TomlSettingsStoreTest, NoWriteOfSeveralThreadsAndProcessesIsLost) {
  constexpr int kWrites = 20;
  std::vector<pid_t> children;
  for (int writer = 0; writer < 2; ++writer) {
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      auto store = open();
      for (int number = 0; number < kWrites; ++number) {
        if (store.setObject(kDomain, "p" + std::to_string(writer) + "." + std::to_string(number),
                            Value(number))) {
          ::_exit(1);
        }
      }
      ::_exit(0);
    }
    children.push_back(child);
  }
  auto store = open();
  std::vector<std::thread> threads;
  for (int writer = 0; writer < 2; ++writer) {
    threads.emplace_back([&store, writer] {
      for (int number = 0; number < kWrites; ++number) {
        EXPECT_FALSE(store.setObject(kDomain, "t" + std::to_string(writer) + "." + std::to_string(number),
                                     Value(number)));
        store.objectForKey(kDomain, "t0.0");
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (const pid_t child : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(store.entries(kDomain)->size(), 4U * kWrites);
}

// Writes without end, after it has stored the identifier once and said so.
[[noreturn]] void writeForEver(TomlSettingsStore& store, int ready) {
  const bool stored = store.objectForKey(kDomain, kKey) || !store.setObject(kDomain, kKey, Value("stable"));
  if (!stored || ::write(ready, "r", 1) != 1) ::_exit(1);
  for (int64_t number = 0;; ++number) {
    if (store.setObject(kDomain, "counter", Value(number))) ::_exit(1);
    if (store.setObject(kDomain, "filler", Value(std::string(static_cast<size_t>(number % 700) * 16, 'f'))))
      ::_exit(1);
  }
}

TEST_F(TomlSettingsStoreTest, AKillAtAnyInstantLeavesTheStoreWholeAndIdentifiersStable) {
  std::mt19937 random(20240607);
  std::uniform_int_distribution<long> delay(0, 4'000'000);
  for (int round = 0; round < 60; ++round) {
    std::array<int, 2> ends{-1, -1};
    ASSERT_EQ(::pipe(ends.data()), 0);
    const UniqueFd readEnd(ends[0]);
    UniqueFd writeEnd(ends[1]);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      auto store = open();
      writeForEver(store, writeEnd.get());
    }
    writeEnd.reset();
    char byte = 0;
    ASSERT_EQ(::read(readEnd.get(), &byte, 1), 1);
    // The instant is what is tested; nothing is waited for.
    const timespec wait{.tv_sec = 0, .tv_nsec = delay(random)};
    ::nanosleep(&wait, nullptr);
    ASSERT_EQ(::kill(child, SIGKILL), 0);
    ASSERT_EQ(::waitpid(child, nullptr, 0), child);

    ASSERT_TRUE(parseToml(folder_.read(kOwn))) << "round " << round;
    auto store = open();
    ASSERT_EQ(store.objectForKey(kDomain, kKey), Value("stable")) << "round " << round;
    ASSERT_FALSE(store.setObject(kDomain, "round", Value(round)));
  }
  EXPECT_THAT(logged(), ElementsAre());
}

}  // namespace
}  // namespace tarnel

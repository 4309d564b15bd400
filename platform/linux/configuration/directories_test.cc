#include "platform/linux/configuration/directories.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <map>

#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

Directories withEnvironment(const std::map<std::string, std::string>& variables) {
  return Directories::fromEnvironment([&variables](const char* name) -> const char* {
    const auto found = variables.find(name);
    return found == variables.end() ? nullptr : found->second.c_str();
  });
}

TEST(Directories, WithoutVariablesTheInstalledOnesHold) {
  const Directories directories = withEnvironment({});
  EXPECT_EQ(directories.runtime(), "/run/tarneld");
  EXPECT_EQ(directories.state(), "/var/lib/tarneld");
  EXPECT_EQ(directories.logs(), "/var/log/tarneld");
  EXPECT_EQ(directories.configuration(), "/etc/tarneld");
  EXPECT_EQ(directories.messageLogDirectory(), "/var/mobile/Library/Logs/Faultkeep/Retired");
  EXPECT_FALSE(directories.isPrivate());
  EXPECT_TRUE(directories.problems().empty());
}

TEST(Directories, WhatTheServiceManagerSetsForTheInstallationIsNotPrivate) {
  const Directories directories = withEnvironment({{"RUNTIME_DIRECTORY", "/run/tarneld"},
                                                   {"STATE_DIRECTORY", "/var/lib/tarneld"},
                                                   {"LOGS_DIRECTORY", "/var/log/tarneld"},
                                                   {"CONFIGURATION_DIRECTORY", "/etc/tarneld"}});
  EXPECT_FALSE(directories.isPrivate());
  EXPECT_EQ(directories.messageLogDirectory(), "/var/mobile/Library/Logs/Faultkeep/Retired");
}

TEST(Directories, AllFourElsewhereMakeAPrivateInstance) {
  const Directories directories = withEnvironment({{"RUNTIME_DIRECTORY", "/tmp/x/run"},
                                                   {"STATE_DIRECTORY", "/tmp/x/state:/tmp/x/more"},
                                                   {"LOGS_DIRECTORY", "/tmp/x/logs//"},
                                                   {"CONFIGURATION_DIRECTORY", "/tmp/x/etc"}});
  EXPECT_TRUE(directories.isPrivate());
  EXPECT_EQ(directories.state(), "/tmp/x/state");
  EXPECT_EQ(directories.logs(), "/tmp/x/logs");
  EXPECT_EQ(directories.messageLogDirectory(), "/tmp/x/logs/var/mobile/Library/Logs/Faultkeep/Retired");
}

TEST(Directories, ThreeElsewhereDoNot) {
  const Directories directories = withEnvironment({{"RUNTIME_DIRECTORY", "/tmp/x/run"},
                                                   {"STATE_DIRECTORY", "/tmp/x/state"},
                                                   {"LOGS_DIRECTORY", "/tmp/x/logs"}});
  EXPECT_FALSE(directories.isPrivate());
  EXPECT_EQ(directories.messageLogDirectory(), "/var/mobile/Library/Logs/Faultkeep/Retired");
}

TEST(Directories, ARelativePathIsNotUsedAndSaidSo) {
  const Directories directories = withEnvironment({{"STATE_DIRECTORY", "state"}, {"LOGS_DIRECTORY", ""}});
  EXPECT_EQ(directories.state(), "/var/lib/tarneld");
  ASSERT_EQ(directories.problems().size(), 1U);
  EXPECT_EQ(directories.problems()[0],
            "STATE_DIRECTORY is not used, because \"state\" does not begin with an absolute path; "
            "/var/lib/tarneld is "
            "used instead");
}

TEST(Directories, MissingOnesAreMadeForTheOwnerAlone) {
  const TemporaryFolder folder;
  const Directories directories = withEnvironment({{"RUNTIME_DIRECTORY", folder.path("a/run")},
                                                   {"STATE_DIRECTORY", folder.path("state")},
                                                   {"LOGS_DIRECTORY", folder.path("logs")},
                                                   {"CONFIGURATION_DIRECTORY", folder.path("etc")}});
  EXPECT_TRUE(directories.create().empty());
  EXPECT_TRUE(directories.create().empty());
  for (const char* name : {"a/run", "state", "logs", "etc", "logs/var/mobile/Library/Logs/Faultkeep"}) {
    struct stat status {};
    ASSERT_EQ(::stat(folder.path(name).c_str(), &status), 0) << name;
    EXPECT_EQ(status.st_mode & 0777U, 0700U) << name;
  }
  // The message log makes its own when it writes.
  EXPECT_FALSE(folder.exists("logs/var/mobile/Library/Logs/Faultkeep/Retired"));
}

TEST(Directories, WhatRootMakesBelowAUsersDirectoryIsThatUsers) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give directories away";
  const TemporaryFolder folder;
  folder.makeDirectory("state");
  ASSERT_EQ(::chown(folder.path("state").c_str(), 65534, 65533), 0);
  EXPECT_FALSE(makeDirectories(folder.path("state/a/b"), 0700));
  for (const char* name : {"state/a", "state/a/b"}) {
    struct stat status {};
    ASSERT_EQ(::stat(folder.path(name).c_str(), &status), 0) << name;
    EXPECT_EQ(status.st_uid, 65534U) << name;
    EXPECT_EQ(status.st_gid, 65533U) << name;
  }
}

TEST(Directories, WhatCannotBeWrittenIsNamedWithTheRemedy) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs a directory of another user";
  const TemporaryFolder folder;
  ::chmod(folder.path().c_str(), 0755);
  for (const char* name : {"run", "state", "logs", "etc", "logs/var/mobile/Library/Logs/Faultkeep"}) {
    folder.makeDirectory(name);
  }
  const std::string said = runInChild([&folder] {
    if (::setresuid(65534, 65534, 65534) != 0) return std::string("no other user");
    const Directories directories = withEnvironment({{"RUNTIME_DIRECTORY", folder.path("run")},
                                                     {"STATE_DIRECTORY", folder.path("state")},
                                                     {"LOGS_DIRECTORY", folder.path("logs")},
                                                     {"CONFIGURATION_DIRECTORY", folder.path("etc")}});
    std::string lines;
    for (const std::string& line : directories.create()) lines += line + "\n";
    return lines;
  });
  std::string expected;
  for (const char* name : {"run", "state", "logs"}) {
    expected += folder.path(name) +
                ": cannot be written by user 65534: Permission denied; change that with: " + "chown 65534 " +
                folder.path(name) + "\n";
  }
  EXPECT_EQ(said, expected);
}

TEST(Directories, WhatCannotBeMadeIsNamed) {
  const TemporaryFolder folder;
  folder.write("file", "");
  const auto error = makeDirectories(folder.path("file/below"), 0700);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->localizedDescription(), folder.path("file/below") + ": cannot be made: Not a directory");
  EXPECT_EQ(makeDirectories(folder.path("file"), 0700)->localizedDescription(),
            folder.path("file") + ": is no directory");
}

}  // namespace
}  // namespace tarnel

#include "base/file_access.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>

#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

TEST(FileAccess, ReadsAFileAndItsIdentity) {
  const TemporaryFolder folder;
  folder.write("a", "text\n");
  const auto contents = readFile(folder.path("a"));
  ASSERT_TRUE(contents);
  EXPECT_EQ(contents->text, "text\n");
  EXPECT_EQ(contents->identity, fileIdentity(folder.path("a")));
  EXPECT_FALSE(fileIdentity(folder.path("b")));
}

TEST(FileAccess, ReplacingChangesTheIdentityAndKeepsTheMode) {
  const TemporaryFolder folder;
  ASSERT_FALSE(replaceFile(folder.path("a"), "one", 0640));
  const auto before = fileIdentity(folder.path("a"));
  ASSERT_FALSE(replaceFile(folder.path("a"), "two", 0640));
  EXPECT_NE(before, fileIdentity(folder.path("a")));
  EXPECT_EQ(folder.read("a"), "two");
  struct stat status {};
  ASSERT_EQ(::stat(folder.path("a").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0640U);
  EXPECT_FALSE(folder.exists("a.new"));
}

TEST(FileAccess, AFailedReplacementLeavesTheOldFileAndNamesTheReason) {
  const TemporaryFolder folder;
  folder.makeDirectory("a");
  folder.write("a/inside", "kept");
  const auto error = replaceFile(folder.path("a"), "two", 0600);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->localizedDescription(), folder.path("a") + ": cannot be replaced: Is a directory");
  EXPECT_FALSE(folder.exists("a.new"));
  EXPECT_EQ(folder.read("a/inside"), "kept");
  const auto missing = replaceFile(folder.path("none/a"), "two", 0600);
  ASSERT_TRUE(missing);
  EXPECT_EQ(missing->code(), ENOENT);
}

TEST(FileAccess, WhatRootWritesBelongsToTheDirectorysOwner) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
  const TemporaryFolder folder;
  ASSERT_EQ(::chown(folder.path().c_str(), 4711, 4712), 0);
  ASSERT_FALSE(replaceFile(folder.path("a"), "text", 0600));
  ASSERT_TRUE(lockFile(folder.path("lock")));
  for (const char* name : {"a", "lock"}) {
    struct stat status {};
    ASSERT_EQ(::stat(folder.path(name).c_str(), &status), 0);
    EXPECT_EQ(status.st_uid, 4711U) << name;
    EXPECT_EQ(status.st_gid, 4712U) << name;
  }
}

TEST(FileAccess, WhatIsNoSmallRegularFileIsRefused) {
  const TemporaryFolder folder;
  folder.makeDirectory("directory");
  ASSERT_EQ(::mkfifo(folder.path("pipe").c_str(), 0600), 0);
  folder.write("large", std::string(101, 'x'));
  EXPECT_EQ(readFile(folder.path("directory")).error().localizedDescription(),
            folder.path("directory") + ": is not a regular file");
  EXPECT_EQ(readFile(folder.path("pipe")).error().code(), EINVAL);
  EXPECT_EQ(readFile(folder.path("large"), FileTrust::any, 100).error().localizedDescription(),
            folder.path("large") + ": is larger than 100 bytes");
  EXPECT_TRUE(readFile(folder.path("large"), FileTrust::any, 101));
  EXPECT_EQ(readFile(folder.path("none")).error().code(), ENOENT);
}

TEST(FileAccess, OnlyFilesThatNobodyElseCanWriteAreTrusted) {
  const TemporaryFolder folder;
  folder.write("etc/a", "text");
  const std::string path = folder.path("etc/a");
  EXPECT_TRUE(readFile(path, FileTrust::trusted));
  for (const unsigned mode : {0664U, 0646U}) {
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
    EXPECT_TRUE(readFile(path, FileTrust::any));
    const auto refused = readFile(path, FileTrust::trusted);
    ASSERT_FALSE(refused);
    EXPECT_EQ(refused.error().code(), EPERM);
    EXPECT_EQ(refused.error().localizedDescription(),
              path +
                  ": is not used, because it can be written by its group or by others; change that with: "
                  "chmod go-w " +
                  path);
  }
  ASSERT_EQ(::chmod(path.c_str(), 0644), 0);
  ASSERT_EQ(::chmod(folder.path("etc").c_str(), 0775), 0);
  EXPECT_EQ(readFile(path, FileTrust::trusted).error().localizedDescription(),
            path +
                ": is not used, because its directory can be written by its group or by others; change that "
                "with: chmod go-w " +
                folder.path("etc"));
}

TEST(FileAccess, ALinkIsTrustedOnlyWhenItsTargetsDirectoryIs) {
  const TemporaryFolder folder;
  folder.write("etc/other", "");
  folder.write("open/a", "text");
  ASSERT_EQ(::symlink(folder.path("open/a").c_str(), folder.path("etc/a").c_str()), 0);
  EXPECT_TRUE(readFile(folder.path("etc/a"), FileTrust::trusted));
  ASSERT_EQ(::chmod(folder.path("open").c_str(), 0777), 0);
  EXPECT_FALSE(readFile(folder.path("etc/a"), FileTrust::trusted));
}

TEST(FileAccess, AStrangersFileIsNotTrusted) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
  const TemporaryFolder folder;
  folder.write("etc/a", "text");
  const std::string path = folder.path("etc/a");
  ASSERT_EQ(::chown(path.c_str(), 12345, 0), 0);
  EXPECT_EQ(
      readFile(path, FileTrust::trusted).error().localizedDescription(),
      path +
          ": is not used, because it belongs to user 12345, who is neither root nor the user this runs as "
          "(0); change that with: chown root " +
          path);
}

TEST(FileAccess, FirstLinesComeWithoutBlanks) {
  const TemporaryFolder folder;
  folder.write("a", "  one \t\ntwo\n");
  folder.write("tree", std::string("model\0", 6));
  folder.write("blank", " \n");
  EXPECT_EQ(readFirstLine(folder.path("a")), "one");
  EXPECT_EQ(readFirstLine(folder.path("tree")), "model");
  EXPECT_FALSE(readFirstLine(folder.path("blank")));
  EXPECT_FALSE(readFirstLine(folder.path("none")));
}

TEST(FileAccess, EntriesAreSortedAndHiddenOnesLeftOut) {
  const TemporaryFolder folder;
  for (const char* name : {"d/20.toml", "d/10.toml", "d/.hidden.toml", "d/x.toml~", "d/.toml"})
    folder.write(name, "");
  EXPECT_EQ(sortedEntries(folder.path("d"), ".toml"), (std::vector<std::string>{"10.toml", "20.toml"}));
  EXPECT_TRUE(sortedEntries(folder.path("none"), ".toml").empty());
}

}  // namespace
}  // namespace tarnel

#include "platform/linux/system/linux_file_system.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>

#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

using testing::UnorderedElementsAre;

class LinuxFileSystemTest : public testing::Test {
 protected:
  TemporaryFolder folder_;
  LinuxFileSystem files_;
};

TEST_F(LinuxFileSystemTest, ListsADirectory) {
  folder_.write("d/a", "");
  folder_.write("d/.b", "");
  folder_.makeDirectory("d/c");
  const auto names = files_.contentsOfDirectory(folder_.path("d"));
  ASSERT_TRUE(names);
  EXPECT_THAT(*names, UnorderedElementsAre("a", ".b", "c"));
}

TEST_F(LinuxFileSystemTest, AMissingDirectoryHasACodeOfItsOwn) {
  const auto missing = files_.contentsOfDirectory(folder_.path("none"));
  ASSERT_FALSE(missing);
  EXPECT_EQ(missing.error().domain(), kFileErrorDomain);
  EXPECT_EQ(missing.error().code(), 260);
  folder_.write("file", "");
  const auto noDirectory = files_.contentsOfDirectory(folder_.path("file"));
  ASSERT_FALSE(noDirectory);
  EXPECT_EQ(noDirectory.error().code(), ENOTDIR);
  EXPECT_EQ(noDirectory.error().localizedDescription(),
            folder_.path("file") + ": cannot be listed: Not a directory");
}

TEST_F(LinuxFileSystemTest, DirectoriesAreMadeWithTheirParents) {
  EXPECT_FALSE(files_.createDirectory(folder_.path("a/b/c")));
  EXPECT_FALSE(files_.createDirectory(folder_.path("a/b/c")));
  EXPECT_TRUE(files_.fileExists(folder_.path("a/b/c")));
  folder_.write("file", "");
  EXPECT_EQ(files_.createDirectory(folder_.path("file/x"))->code(), ENOTDIR);
}

TEST_F(LinuxFileSystemTest, FilesAreMadeOnceAppendedToAndRemoved) {
  const std::string path = folder_.path("log");
  EXPECT_EQ(files_.appendToFile(path, "x")->code(), ENOENT);
  EXPECT_FALSE(files_.createFile(path));
  EXPECT_EQ(files_.createFile(path)->code(), EEXIST);
  EXPECT_EQ(folder_.read("log"), "");
  EXPECT_FALSE(files_.appendToFile(path, "one\n"));
  EXPECT_FALSE(files_.appendToFile(path, "two\n"));
  EXPECT_EQ(folder_.read("log"), "one\ntwo\n");
  EXPECT_FALSE(files_.removeFile(path));
  EXPECT_FALSE(files_.fileExists(path));
  EXPECT_EQ(files_.removeFile(path)->code(), ENOENT);
}

TEST_F(LinuxFileSystemTest, AFullDiskIsAnError) {
  EXPECT_EQ(files_.appendToFile("/dev/full", "x")->code(), EINVAL);  // no regular file
  folder_.write("limited", "");
  const std::string said = runInChild([this] {
    const rlimit limit{.rlim_cur = 4, .rlim_max = 4};
    ::signal(SIGXFSZ, SIG_IGN);
    ::setrlimit(RLIMIT_FSIZE, &limit);
    const auto error = files_.appendToFile(folder_.path("limited"), "too long");
    return error ? std::to_string(error->code()) : std::string("written");
  });
  EXPECT_EQ(said, std::to_string(EFBIG));
}

TEST_F(LinuxFileSystemTest, AFileGrowsToItsLimitOnly) {
  LinuxFileSystem files(10);
  folder_.write("log", "");
  EXPECT_FALSE(files.appendToFile(folder_.path("log"), "123456"));
  EXPECT_FALSE(files.appendToFile(folder_.path("log"), "7890"));
  const auto error = files.appendToFile(folder_.path("log"), "x");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), EFBIG);
  EXPECT_EQ(error->localizedDescription(), folder_.path("log") + ": would grow beyond 10 bytes");
  EXPECT_EQ(folder_.read("log"), "1234567890");
}

TEST_F(LinuxFileSystemTest, NoLinkAndNoPipeIsWrittenTo) {
  folder_.write("target", "");
  ASSERT_EQ(::symlink(folder_.path("target").c_str(), folder_.path("link").c_str()), 0);
  EXPECT_EQ(files_.appendToFile(folder_.path("link"), "x")->code(), ELOOP);
  ASSERT_EQ(::mkfifo(folder_.path("pipe").c_str(), 0600), 0);
  EXPECT_TRUE(files_.appendToFile(folder_.path("pipe"), "x"));
}

TEST_F(LinuxFileSystemTest, TheCreationDateIsNotTheDateOfChange) {
  const auto now = [] {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  };
  const double before = now();
  folder_.write("file", "text");
  const timespec old[2] = {{.tv_sec = 1000000000, .tv_nsec = 0}, {.tv_sec = 1000000000, .tv_nsec = 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, folder_.path("file").c_str(), old, 0), 0);
  const auto date = files_.creationDate(folder_.path("file"));
  struct statx status {};
  ASSERT_EQ(::statx(AT_FDCWD, folder_.path("file").c_str(), 0, STATX_BTIME, &status), 0);
  ASSERT_EQ(date.has_value(), (status.stx_mask & STATX_BTIME) != 0);
  if (date) {
    EXPECT_GE(date->seconds, before - 1);
    EXPECT_LE(date->seconds, now() + 1);
  }
  EXPECT_FALSE(files_.creationDate(folder_.path("none")));
}

// The kernel's own files know no birth.
TEST_F(LinuxFileSystemTest, WithoutATimeOfBirthThereIsNoCreationDate) {
  constexpr char kFile[] = "/proc/self/status";
  struct statx status {};
  ASSERT_EQ(::statx(AT_FDCWD, kFile, 0, STATX_BTIME | STATX_MTIME, &status), 0);
  if ((status.stx_mask & STATX_BTIME) != 0) GTEST_SKIP() << "needs a file system without times of birth";
  ASSERT_NE(status.stx_mask & STATX_MTIME, 0U);
  EXPECT_FALSE(files_.creationDate(kFile));
}

}  // namespace
}  // namespace tarnel

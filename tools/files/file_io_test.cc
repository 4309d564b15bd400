#include "tools/files/file_io.h"

#include <gmock/gmock.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>

namespace tarnel {
namespace {

using ::testing::HasSubstr;

class FileIo : public ::testing::Test {
 protected:
  FileIo() { std::filesystem::create_directories(directory_); }
  ~FileIo() override { std::filesystem::remove_all(directory_); }

  const std::string directory_ = ::testing::TempDir() + "tarnel_file_io_" +
                                 ::testing::UnitTest::GetInstance()->current_test_info()->name();
};

TEST_F(FileIo, WritesWithTheGivenModeAndReadsBack) {
  const std::string path = directory_ + "/file";
  ASSERT_FALSE(writeFile(path, "old", 0644));
  ASSERT_FALSE(writeFile(path, std::string("new\0bytes", 9), 0600));
  EXPECT_EQ(*readFile(path, 100), std::string("new\0bytes", 9));
  struct stat status {};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0600U);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory_), {}), 1)
      << "no temporary file stays";
}

TEST_F(FileIo, RefusesWhatIsTooLargeMissingOrNoRegularFile) {
  const std::string path = directory_ + "/file";
  ASSERT_FALSE(writeFile(path, "12345", 0644));
  EXPECT_TRUE(readFile(path, 5));
  EXPECT_THAT(readFile(path, 4).error().localizedDescription(), HasSubstr("larger than 4 bytes"));
  EXPECT_EQ(readFile(directory_ + "/none", 4).error().code(), ENOENT);
  EXPECT_THAT(readFile(directory_, 4).error().localizedDescription(), HasSubstr("not a regular file"));
  ASSERT_EQ(::mkfifo((directory_ + "/pipe").c_str(), 0600), 0);
  EXPECT_THAT(readFile(directory_ + "/pipe", 4).error().localizedDescription(),
              HasSubstr("not a regular file"));
}

TEST_F(FileIo, MakesDirectoriesWithTheirParents) {
  EXPECT_FALSE(makeDirectory(directory_ + "/a/b/c", 0755));
  EXPECT_FALSE(makeDirectory(directory_ + "/a/b/c", 0755));
  EXPECT_TRUE(pathExists(directory_ + "/a/b/c"));
  ASSERT_FALSE(writeFile(directory_ + "/file", "", 0644));
  const MaybeError error = makeDirectory(directory_ + "/file/below", 0755);
  ASSERT_TRUE(error);
  EXPECT_THAT(error->localizedDescription(), HasSubstr(directory_ + "/file"));
  EXPECT_TRUE(makeDirectory(directory_ + "/file", 0755));
}

TEST_F(FileIo, AFailedWriteKeepsTheOldFileAndNamesThePath) {
  const MaybeError error = writeFile(directory_ + "/none/file", "x", 0644);
  ASSERT_TRUE(error);
  EXPECT_THAT(error->localizedDescription(), HasSubstr(directory_ + "/none/file: No such file or directory"));
}

}  // namespace
}  // namespace tarnel

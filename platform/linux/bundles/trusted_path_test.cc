#include "platform/linux/bundles/trusted_path.h"

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "platform/file_system.h"
#include "platform/linux/bundles/trusted_folder_test_support.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

using testing::HasSubstr;

class TrustedPathTest : public testing::Test {
 protected:
  TrustedPathTest() {
    folder.makeDirectory("a/b");
    std::ofstream(file) << "x";
    ::chmod(file.c_str(), 0644);
  }
  // "trusted", or the code and the reason without what begins it.
  std::string outcome(const std::string& path) const {
    const auto error = checkTrustedPath(path);
    if (!error) return "trusted";
    EXPECT_EQ(error->domain(), kFileErrorDomain);
    const std::string begin = path + ": is not used, because ";
    const std::string& text = error->localizedDescription();
    return std::to_string(error->code()) + " " + (text.starts_with(begin) ? text.substr(begin.size()) : text);
  }
  const TrustedFolder folder;
  const std::string file = folder.path("a/b/file");
  const std::string refused = std::to_string(EPERM) + " ";
};

TEST_F(TrustedPathTest, WhatOnlyItsOwnersCanWriteIsTrusted) {
  EXPECT_EQ(outcome(file), "trusted");
  ::chmod(folder.path("a").c_str(), 0500);
  ::chmod(file.c_str(), 0400);
  EXPECT_EQ(outcome(file), "trusted");
}

TEST_F(TrustedPathTest, SpecialBitsAloneChangeNothing) {
  for (const mode_t mode : {01755, 02755, 04755, 06711}) {
    ::chmod(folder.path("a").c_str(), mode);
    ::chmod(file.c_str(), mode);
    EXPECT_EQ(outcome(file), "trusted") << std::oct << mode;
  }
}

// Whoever made the link, the file is the same: its owner and mode say who can write to it.
TEST_F(TrustedPathTest, AHardLinkIsTheFileItself) {
  folder.makeDirectory("elsewhere");
  ::chmod(folder.path("elsewhere").c_str(), 0777);
  ASSERT_EQ(::link(file.c_str(), folder.path("elsewhere/file").c_str()), 0);
  EXPECT_EQ(outcome(file), "trusted");
  EXPECT_THAT(outcome(folder.path("elsewhere/file")), HasSubstr("can be written by its group or by others"));
  ::chmod(folder.path("elsewhere/file").c_str(), 0666);
  EXPECT_EQ(outcome(file),
            refused + "it can be written by its group or by others; change that with: chmod go-w " + file);
}

TEST_F(TrustedPathTest, WhatOthersCanWriteIsRefusedAtEveryStep) {
  for (const std::string name : {"", "a", "a/b"}) {
    const std::string directory = name.empty() ? folder.path() : folder.path(name);
    for (const mode_t mode : {0775, 0757, 01777, 01757, 02770, 02775}) {
      ::chmod(directory.c_str(), mode);
      EXPECT_EQ(outcome(file),
                refused + "its directory " + directory +
                    " can be written by its group or by others; change that with: chmod go-w " + directory);
    }
    ::chmod(directory.c_str(), 0755);
  }
  for (const mode_t mode : {0664, 0646}) {
    ::chmod(file.c_str(), mode);
    EXPECT_EQ(outcome(file),
              refused + "it can be written by its group or by others; change that with: chmod go-w " + file);
  }
}

TEST_F(TrustedPathTest, TheRootCountsAsWell) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can have another root";
  const auto inside = [this](mode_t mode) {
    return runInChild([this, mode]() -> std::string {
      if (::chroot(folder.path().c_str()) != 0 || ::chmod("/", mode) != 0) return "no other root";
      return outcome("/a/b/file");
    });
  };
  EXPECT_EQ(inside(0755), "trusted");
  EXPECT_EQ(inside(0757), refused +
                              "its directory / can be written by its group or by others; change that with: "
                              "chmod go-w /");
}

TEST_F(TrustedPathTest, WhatBelongsToOthersIsRefusedAtEveryStep) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
  for (const std::string& part : {folder.path("a"), folder.path("a/b"), file}) {
    ASSERT_EQ(::chown(part.c_str(), 4711, 0), 0);
    EXPECT_THAT(outcome(file),
                HasSubstr("belongs to user 4711, who is neither root nor the user this runs as"));
    EXPECT_THAT(outcome(file), HasSubstr("chown root " + part));
    ASSERT_EQ(::chown(part.c_str(), 0, 0), 0);
  }
  EXPECT_EQ(outcome(file), "trusted");
}

TEST_F(TrustedPathTest, ADirectoryForTemporaryFilesIsNoPlace) {
  const TemporaryFolder temporary;
  struct stat status {};
  ASSERT_EQ(::stat(std::filesystem::temp_directory_path().c_str(), &status), 0);
  if ((status.st_mode & S_IWOTH) == 0) GTEST_SKIP() << "here only its owner can write to it";
  temporary.write("file", "x");
  EXPECT_THAT(outcome(temporary.path("file")), HasSubstr("can be written by its group or by others"));
}

TEST_F(TrustedPathTest, NoPartMayBeASymbolicLink) {
  ASSERT_EQ(::symlink("b", folder.path("a/link").c_str()), 0);
  ASSERT_EQ(::symlink("file", folder.path("a/b/filelink").c_str()), 0);
  ASSERT_EQ(::symlink("nowhere", folder.path("a/dangling").c_str()), 0);
  EXPECT_EQ(outcome(folder.path("a/link/file")),
            refused + folder.path("a/link") + " is a symbolic link; put what it leads to in its place");
  EXPECT_EQ(outcome(folder.path("a/b/filelink")),
            refused + folder.path("a/b/filelink") + " is a symbolic link; put what it leads to in its place");
  EXPECT_THAT(outcome(folder.path("a/dangling")), HasSubstr("is a symbolic link"));
}

TEST_F(TrustedPathTest, PathsThatLeadRoundAboutAreRefused) {
  for (const char* part : {"/./", "/../b/", "//"}) {
    const std::string path = folder.path("a/b") + part + "file";
    EXPECT_EQ(outcome(path), std::to_string(EINVAL) +
                                 " the path has a part that is empty, \".\" or \"..\"; write it without");
  }
  EXPECT_EQ(outcome("a/b/file"), std::to_string(EINVAL) + " the path is not absolute");
  EXPECT_EQ(outcome(""), std::to_string(EINVAL) + " the path is not absolute");
}

TEST_F(TrustedPathTest, WhatIsMissingOrNoFileIsSaid) {
  EXPECT_THAT(outcome(folder.path("a/c/file")), testing::StartsWith(std::to_string(ENOENT) + " "));
  EXPECT_THAT(outcome(file + "/file"), testing::StartsWith(std::to_string(ENOTDIR) + " "));
  EXPECT_EQ(outcome(folder.path("a/b")), std::to_string(EINVAL) + " it is not a regular file");
  ASSERT_EQ(::mkfifo(folder.path("a/pipe").c_str(), 0600), 0);
  EXPECT_EQ(outcome(folder.path("a/pipe")), std::to_string(EINVAL) + " it is not a regular file");
}

}  // namespace
}  // namespace tarnel

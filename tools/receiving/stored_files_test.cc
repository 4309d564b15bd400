#include "tools/receiving/stored_files.h"

#include <gmock/gmock.h>
#include <sys/stat.h>

#include <filesystem>
#include <set>

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

constexpr double kNow = 1795184701.5;  // 2026-11-20 14:25:01 UTC

class Warnings final : public Notices {
 public:
  void storebagServed(const ServedStorebag&) override {}
  void warning(const std::string& text) override { texts.push_back(text); }
  std::vector<std::string> texts;
};

class StoredFilesTest : public ::testing::Test {
 protected:
  StoredFilesTest() {
    std::filesystem::remove_all(folder_);
    std::filesystem::create_directories(folder_);
  }
  ~StoredFilesTest() override { std::filesystem::remove_all(folder_); }

  StoredFiles opened(StoredFiles::Bounds bounds = {}) {
    StoredFiles files(folder_, warnings_, bounds);
    EXPECT_FALSE(files.open());
    return files;
  }
  static std::string put(StoredFiles& files, const std::string& name, const std::string& text,
                         const std::string& description = "{}") {
    Result<IncomingFile> file = files.create(kNow, name);
    EXPECT_TRUE(file) << file.error().localizedDescription();
    EXPECT_FALSE(file->write(text));
    const MaybeError error = files.keep(*file, description);
    EXPECT_FALSE(error) << error->localizedDescription();
    return file->name();
  }
  std::set<std::string> names() const {
    std::set<std::string> found;
    for (const auto& item : std::filesystem::directory_iterator(folder_)) {
      found.insert(item.path().filename().string());
    }
    return found;
  }
  void write(const std::string& name, const std::string& text) const {
    ASSERT_FALSE(writeFile(folder_ + "/" + name, text, 0600));
  }

  const std::string folder_ = ::testing::TempDir() + "tarnel_stored_" +
                              ::testing::UnitTest::GetInstance()->current_test_info()->name();
  Warnings warnings_;
};

TEST_F(StoredFilesTest, FileAndDescriptionLieBesideEachOtherForTheirOwnerAlone) {
  StoredFiles files = opened();
  EXPECT_EQ(put(files, "a b.log", "text", "{\"a\": 1}"), "20261120-142501-0001-a_b.log");
  EXPECT_THAT(names(), ElementsAre("20261120-142501-0001-a_b.log", "20261120-142501-0001-a_b.log.json"));
  EXPECT_EQ(*readFile(folder_ + "/20261120-142501-0001-a_b.log", 100), "text");
  EXPECT_EQ(*readFile(descriptionOf(folder_ + "/20261120-142501-0001-a_b.log"), 100), "{\"a\": 1}");
  for (const std::string& name : names()) {
    struct stat status {};
    ASSERT_EQ(::stat((folder_ + "/" + name).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U) << name;
  }
}

TEST_F(StoredFilesTest, NoNameLeavesTheFolder) {
  StoredFiles files = opened();
  const std::vector<std::string> hostile = {"/etc/passwd",          "../../x",   "..", ".", "", "a/b",
                                            std::string("a\0b", 3), "\033[2J\n", "ü"};
  for (const std::string& name : hostile) {
    put(files, name, "text", "");
  }
  EXPECT_THAT(names(), SizeIs(9));
  for (const std::string& name : names()) EXPECT_TRUE(isStoredName(name)) << name;
  EXPECT_EQ(safeFileName("../../x"), ".._.._x");
  EXPECT_EQ(safeFileName(""), "file");
  EXPECT_EQ(safeFileName(std::string("a\0b", 3)), "a_b");
  EXPECT_EQ(safeFileName(std::string(5000, 'x') + ".log"), std::string(96, 'x') + ".log");
}

TEST_F(StoredFilesTest, NothingIsEverOverwritten) {
  for (int run = 0; run < 3; ++run) {
    StoredFiles files = opened();
    for (int i = 0; i < 3; ++i) put(files, "x", std::to_string(run));
  }
  EXPECT_THAT(names(), SizeIs(18));
  StoredFiles files = opened();
  // Somebody was faster.
  Result<IncomingFile> file = files.create(kNow, "y");
  write(file->name(), "mine");
  EXPECT_THAT(files.keep(*file, "{}")->localizedDescription(), HasSubstr("File exists"));
  EXPECT_EQ(*readFile(folder_ + "/" + file->name(), 100), "mine");
  EXPECT_FALSE(pathExists(descriptionOf(file->path()))) << "it would describe what is not ours";
}

TEST_F(StoredFilesTest, WhatIsNotKeptIsGone) {
  {
    StoredFiles files = opened();
    Result<IncomingFile> file = files.create(kNow, "x");
    EXPECT_FALSE(file->write("half"));
    EXPECT_THAT(names(), ElementsAre("incoming-20261120-142501-0001-x"));
  }
  EXPECT_THAT(names(), IsEmpty());
  // Left by a run that was killed.
  write("incoming-20261120-142501-0001-x", "half");
  write("incoming-mine", "not ours");
  opened();
  EXPECT_THAT(names(), ElementsAre("incoming-mine"));
}

TEST_F(StoredFilesTest, TheOldestMakeRoom) {
  StoredFiles files = opened({.files = 3, .bytes = 1000});
  for (int i = 0; i < 5; ++i) put(files, std::to_string(i), "text");
  EXPECT_THAT(names(), SizeIs(6));
  EXPECT_THAT(warnings_.texts, SizeIs(2));
  EXPECT_EQ(warnings_.texts[0],
            "removed " + folder_ + "/20261120-142501-0001-0 to make room for newer files");
  put(files, "large", std::string(1500, 'x'));
  EXPECT_THAT(names(), ElementsAre("20261120-142501-0006-large", "20261120-142501-0006-large.json"))
      << "the newest stays even when it alone is too much";
}

TEST_F(StoredFilesTest, FilesOfEarlierRunsCountAndOthersAreLeftAlone) {
  write("20261119-000000-0001-old", "1");
  write("20261119-000000-0001-old.json", "2");
  write("20261119-000000-0002-old", "3");
  write("notes.txt", std::string(5000, 'x'));
  write("20261119-note", "x");
  StoredFiles files = opened({.files = 2, .bytes = 1000});
  EXPECT_THAT(warnings_.texts, IsEmpty());
  EXPECT_EQ(put(files, "new", "text", ""), "20261120-142501-0003-new");
  EXPECT_THAT(names(), ElementsAre("20261119-000000-0002-old", "20261119-note", "20261120-142501-0003-new",
                                   "notes.txt"));
}

TEST_F(StoredFilesTest, AFolderThatIsGoneIsNamed) {
  StoredFiles files = opened();
  std::filesystem::remove_all(folder_);
  EXPECT_THAT(files.create(kNow, "x").error().localizedDescription(),
              HasSubstr("cannot write " + folder_ + "/20261120-142501-0001-x: No such file or directory"));
  EXPECT_THAT(StoredFiles(folder_, warnings_, {}).open()->localizedDescription(),
              HasSubstr("cannot read " + folder_));
}

TEST(StoredNameTest, OnlyNamesOfOurOwnFormAreTaken) {
  for (const std::string good : {"20261120-142501-0001-x", "20261120-142501-12345-a.json"}) {
    EXPECT_TRUE(isStoredName(good)) << good;
  }
  for (const std::string bad :
       {"", "x", "20261120-142501-0001-", "20261120-142501-001-x", "20261120-142501-0001x",
        "2026112a-142501-0001-x", "20261120_142501-0001-x", "20261120-142501-0001-x/y",
        "20261120-142501-0001-../x", "20261120-142501-00010"}) {
    EXPECT_FALSE(isStoredName(bad)) << bad;
  }
}

}  // namespace
}  // namespace tarnel::lab

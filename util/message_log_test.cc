#include "util/message_log.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

#include "platform/fake/fake_world.h"

namespace tarnel {
namespace {

constexpr double kNow = 1700000000;  // 2023-11-14 22:13:20 UTC
const std::string kDirectory = "/log/Retired";
const std::string kNewFile = kDirectory + "/tarneld_1700000000_messageLog.diag";
const std::string kNowText = "2023-11-14 22:13:20 +0000";

// Everything that the inner file system does.
class OtherFiles : public FileSystem {
 public:
  explicit OtherFiles(FileSystem& inner) : inner_(inner) {}
  Result<std::vector<std::string>> contentsOfDirectory(const std::string& path) override {
    return inner_.contentsOfDirectory(path);
  }
  MaybeError createDirectory(const std::string& path) override { return inner_.createDirectory(path); }
  std::optional<Date> creationDate(const std::string& path) override { return inner_.creationDate(path); }
  bool fileExists(const std::string& path) override { return inner_.fileExists(path); }
  MaybeError createFile(const std::string& path) override { return inner_.createFile(path); }
  MaybeError appendToFile(const std::string& path, std::string_view text) override {
    return inner_.appendToFile(path, text);
  }
  MaybeError removeFile(const std::string& path) override { return inner_.removeFile(path); }

 private:
  FileSystem& inner_;
};

class UndeletableFiles final : public OtherFiles {
 public:
  using OtherFiles::OtherFiles;
  MaybeError removeFile(const std::string& /*path*/) override {
    return Error(kFileErrorDomain, EACCES, "not permitted");
  }
};

class UndatedFiles final : public OtherFiles {
 public:
  using OtherFiles::OtherFiles;
  std::optional<Date> creationDate(const std::string& /*path*/) override { return std::nullopt; }
};

class MessageLogTest : public testing::Test {
 protected:
  void SetUp() override { world_.files.directories.insert(kDirectory); }
  std::string addFile(const std::string& name, std::optional<double> age, const std::string& text = "") {
    const std::string path = kDirectory + "/" + name;
    world_.files.files[path] = {text, age ? std::optional(Date{kNow - *age}) : std::nullopt};
    return path;
  }
  bool exists(const std::string& path) { return world_.files.fileExists(path); }
  std::string textOf(const std::string& path) { return world_.files.files.at(path).text; }
  size_t fileCount() { return world_.files.files.size(); }
  bool logged(LogLevel level, const std::string& text) { return world_.log.contains(level, text); }
  bool loggedDeletion(const std::string& path, const std::string& date) {
    return logged(LogLevel::information,
                  "writeToLogFile: Deleted expired tarneld log file " + path + " (" + date + ")");
  }
  void write() { writeToLogFile(world_.dependencies, "%s", "message"); }

  fake::FakeWorld world_;
};

TEST_F(MessageLogTest, EmptyDirectoryGivesAFileNamedAfterTheTime) {
  writeToLogFile(world_.dependencies, "[%s -> sendMessage] %d", "httppost", 7);
  EXPECT_EQ(fileCount(), 1U);
  EXPECT_EQ(textOf(kNewFile), "(" + kNowText + ") [httppost -> sendMessage] 7\n");
  EXPECT_EQ(world_.log.lines(),
            (std::vector<fake::FakeLog::Line>{
                {LogLevel::information,
                 "writeToLogFile: Created new tarneld log file " + kNewFile + " (" + kNowText + ")"},
                {LogLevel::information, "writeToLogFile: Saved log message to " + kNewFile}}));
}

TEST_F(MessageLogTest, LaterMessagesAreAppended) {
  write();
  world_.clock.advance(61.5);
  writeToLogFile(world_.dependencies, "second");
  EXPECT_EQ(fileCount(), 1U);
  EXPECT_EQ(textOf(kNewFile), "(" + kNowText + ") message\n(2023-11-14 22:14:21 +0000) second\n");
}

TEST_F(MessageLogTest, LongMessagesAreKeptWhole) {
  const std::string text(300000, 'x');
  writeToLogFile(world_.dependencies, "<%s>", text.c_str());
  EXPECT_EQ(textOf(kNewFile), "(" + kNowText + ") <" + text + ">\n");
}

TEST_F(MessageLogTest, EmptyMessageStillGetsItsLine) {
  writeToLogFile(world_.dependencies, "%s", "");
  EXPECT_EQ(textOf(kNewFile), "(" + kNowText + ") \n");
}

TEST_F(MessageLogTest, NameHoldsTheSecondsAsASigned32BitNumber) {
  world_.clock.set({int64_t{1} << 31, 0});
  write();
  EXPECT_TRUE(exists(kDirectory + "/tarneld_-2147483648_messageLog.diag"));
}

TEST_F(MessageLogTest, MissingDirectoryIsCreated) {
  world_.files.directories.clear();
  write();
  EXPECT_TRUE(
      logged(LogLevel::information, "writeToLogFile: Creating tarneld log directory at /log/Retired"));
  EXPECT_TRUE(world_.files.directories.contains(kDirectory));
  EXPECT_TRUE(exists(kNewFile));
}

TEST_F(MessageLogTest, AnyOtherListingErrorCountsAsAnEmptyDirectory) {
  const auto old = addFile("tarneld_1_messageLog.diag", 100);
  world_.files.listingError = Error(kFileErrorDomain, EACCES, "not permitted");
  write();
  EXPECT_TRUE(logged(LogLevel::error, "writeToLogFile: Error reading from log directory: " +
                                          world_.files.listingError->description()));
  EXPECT_TRUE(exists(kNewFile));
  EXPECT_TRUE(exists(old));
  EXPECT_TRUE(world_.log.startingWith("writeToLogFile: Creating").empty());
}

TEST_F(MessageLogTest, FileOlderThanADayIsDeletedAndANewOneStarted) {
  const auto old = addFile("tarneld_1_messageLog.diag", 86401, "old\n");
  write();
  EXPECT_FALSE(exists(old));
  EXPECT_TRUE(loggedDeletion(old, "2023-11-13 22:13:19 +0000"));
  EXPECT_TRUE(exists(kNewFile));
}

TEST_F(MessageLogTest, FileOfADayOrLessIsAppendedTo) {
  for (const double age : {86399.0, 86400.0, -5.0}) {
    world_.files.files.clear();
    const auto path = addFile("tarneld_1_messageLog.diag", age, "old\n");
    write();
    EXPECT_EQ(fileCount(), 1U) << age;
    EXPECT_EQ(textOf(path), "old\n(" + kNowText + ") message\n") << age;
  }
}

TEST_F(MessageLogTest, NewerOfTwoFreshFilesIsKept) {
  // Listed by name: once the newer comes last, once first.
  for (const bool newerLast : {true, false}) {
    world_.files.files.clear();
    world_.log.clear();
    const auto older = addFile(newerLast ? "tarneld_1_messageLog.diag" : "tarneld_2_messageLog.diag", 200);
    const auto newer = addFile(newerLast ? "tarneld_2_messageLog.diag" : "tarneld_1_messageLog.diag", 100);
    write();
    EXPECT_FALSE(exists(older));
    EXPECT_TRUE(loggedDeletion(older, "2023-11-14 22:10:00 +0000"));
    EXPECT_EQ(textOf(newer), "(" + kNowText + ") message\n");
    EXPECT_EQ(fileCount(), 1U);
  }
}

TEST_F(MessageLogTest, OfTwoFilesOfOneDateTheFirstListedStays) {
  const auto first = addFile("tarneld_1_messageLog.diag", 100);
  const auto second = addFile("tarneld_2_messageLog.diag", 100);
  write();
  EXPECT_TRUE(exists(first));
  EXPECT_FALSE(exists(second));
}

// --- files whose making the file system does not know ---

TEST_F(MessageLogTest, TheNameTellsTheDateThatTheFileSystemDoesNotKnow) {
  for (const int64_t age : {86399, 86400, 0, -5}) {
    world_.files.files.clear();
    const auto name = "tarneld_" + std::to_string(1700000000 - age) + "_messageLog.diag";
    const auto path = addFile(name, std::nullopt, "old\n");
    write();
    EXPECT_EQ(textOf(path), "old\n(" + kNowText + ") message\n") << age;
    EXPECT_EQ(fileCount(), 1U) << age;
  }
  world_.files.files.clear();
  const auto old = addFile("tarneld_1699913599_messageLog.diag", std::nullopt, "old\n");
  write();
  EXPECT_FALSE(exists(old));
  EXPECT_TRUE(loggedDeletion(old, "2023-11-13 22:13:19 +0000"));
  EXPECT_TRUE(exists(kNewFile));
}

// Each message changes the file, and with it the time of its last change.
TEST_F(MessageLogTest, AFileThatIsWrittenAllTheTimeExpiresToo) {
  write();
  world_.files.files.at(kNewFile).creationDate.reset();
  for (int hour = 0; hour < 24; ++hour) {
    world_.clock.advance(3600);
    write();
  }
  EXPECT_EQ(fileCount(), 1U);
  world_.clock.advance(1);
  write();
  EXPECT_FALSE(exists(kNewFile));
  EXPECT_EQ(fileCount(), 1U);
}

TEST_F(MessageLogTest, TheFileSystemKnowsBetterThanTheName) {
  const auto young = addFile("tarneld_1_messageLog.diag", 60);
  write();
  EXPECT_TRUE(exists(young));
}

TEST_F(MessageLogTest, ANewFileWhoseMakingIsNotKnownHasTheDateOfItsName) {
  UndatedFiles files(world_.files);
  writeToLogFile(world_.withFiles(files), "message");
  EXPECT_TRUE(logged(LogLevel::information,
                     "writeToLogFile: Created new tarneld log file " + kNewFile + " (" + kNowText + ")"));
}

// The name has the low 32 bits alone.
TEST_F(MessageLogTest, ANameOfLaterThanTheYear2038StillTellsTheDate) {
  constexpr int64_t kLater = (int64_t{1} << 31) + 1000;
  world_.clock.set({kLater, 0});
  const auto before = addFile("tarneld_2147483000_messageLog.diag", std::nullopt);
  const auto after = addFile("tarneld_-2147483000_messageLog.diag", std::nullopt);
  const auto old = addFile("tarneld_2147397000_messageLog.diag", std::nullopt);
  write();
  EXPECT_FALSE(exists(old));
  EXPECT_TRUE(loggedDeletion(old, description(Date{2147397000})));
  EXPECT_FALSE(exists(before)) << "the older one";
  EXPECT_EQ(textOf(after), "(" + description(Date{kLater}) + ") message\n");
}

TEST_F(MessageLogTest, ANameThatIsNoNumberOf32BitsHasNoDate) {
  for (const char* middle : {"", "x", "1x", "x1", " 1", "1 ", "+1", "1.5", "--1", "2147483648", "-2147483649",
                             "99999999999999999999"}) {
    world_.files.files.clear();
    const auto path = addFile("tarneld_" + std::string(middle) + "_messageLog.diag", std::nullopt);
    write();
    EXPECT_EQ(textOf(path), "(" + kNowText + ") message\n") << middle;
  }
}

TEST_F(MessageLogTest, KeptFileWithoutADateIsReplacedButNotDeleted) {
  const auto undated = addFile("tarneld_x_messageLog.diag", std::nullopt);
  const auto dated = addFile("tarneld_y_messageLog.diag", 100);
  write();
  EXPECT_EQ(textOf(undated), "");
  EXPECT_EQ(textOf(dated), "(" + kNowText + ") message\n");
}

TEST_F(MessageLogTest, FileWithoutADateLosesAgainstADatedOne) {
  const auto dated = addFile("tarneld_x_messageLog.diag", 100);
  const auto undated = addFile("tarneld_y_messageLog.diag", std::nullopt);
  write();
  EXPECT_TRUE(exists(dated));
  EXPECT_FALSE(exists(undated));
  EXPECT_TRUE(loggedDeletion(undated, "(null)"));
}

TEST_F(MessageLogTest, OnlyFileWithoutADateIsAppendedTo) {
  const auto undated = addFile("tarneld_x_messageLog.diag", std::nullopt);
  write();
  EXPECT_EQ(textOf(undated), "(" + kNowText + ") message\n");
}

TEST_F(MessageLogTest, NamesOfThreePartsCountAndOthersAreLeftAlone) {
  const auto counted = addFile("tarneld_x_messageLog.diag", 90000);
  const auto emptyMiddle = addFile("tarneld__messageLog.diag", 90000);
  const std::vector<std::string> others = {addFile("tarneld_1_2_messageLog.diag", 90000),
                                           addFile("tarneld_messageLog.diag", 90000),
                                           addFile("Tarneld_1_messageLog.diag", 90000),
                                           addFile("tarneld_1_messageLog.diag.old", 90000),
                                           addFile("xtarneld_1_messageLog.diag", 90000),
                                           addFile("tarneld_1_messageLog.diag_", 90000),
                                           addFile("tarneld_1700000000-messageLog.diag", 90000),
                                           addFile("tarneld", 90000),
                                           addFile("_tarneld_messageLog.diag", 90000)};
  write();
  EXPECT_FALSE(exists(counted));
  EXPECT_FALSE(exists(emptyMiddle));
  for (const auto& other : others) EXPECT_TRUE(exists(other)) << other;
}

TEST_F(MessageLogTest, FileThatCannotBeCreatedLosesTheMessage) {
  world_.files.createError = Error(kFileErrorDomain, ENOSPC, "no space");
  write();
  EXPECT_EQ(world_.log.lines(),
            (std::vector<fake::FakeLog::Line>{
                {LogLevel::error, "writeToLogFile: Failed to create new tarneld log file " + kNewFile}}));
}

// Another call may have made it in between: it exists, which is what counts.
TEST_F(MessageLogTest, FileThatExistsAlreadyIsUsed) {
  addFile("tarneld_1700000000_messageLog.diag", 0, "other\n");
  world_.files.listingError = Error(kFileErrorDomain, EACCES, "not permitted");
  write();
  EXPECT_EQ(textOf(kNewFile), "other\n(" + kNowText + ") message\n");
}

TEST_F(MessageLogTest, WriteFailureDeletesTheFile) {
  const auto path = addFile("tarneld_1_messageLog.diag", 60, "old\n");
  world_.files.appendError = Error(kFileErrorDomain, ENOSPC, "no space");
  write();
  EXPECT_FALSE(exists(path));
  EXPECT_TRUE(loggedDeletion(path, "2023-11-14 22:12:20 +0000"));
  EXPECT_TRUE(logged(LogLevel::warning, "writeToLogFile: Failed to write to tarneld log file " + path + " (" +
                                            world_.files.appendError->description() + ")"));
  EXPECT_TRUE(world_.log.startingWith("writeToLogFile: Saved").empty());
}

TEST_F(MessageLogTest, FileThatCannotBeDeletedIsReportedAndTheMessageStillWritten) {
  UndeletableFiles files(world_.files);
  const Dependencies dependencies = world_.withFiles(files);
  const auto old = addFile("tarneld_1_messageLog.diag", 90000);
  writeToLogFile(dependencies, "message");
  EXPECT_TRUE(exists(old));
  EXPECT_EQ(world_.log.startingWith("writeToLogFile: Failed to delete tarneld log file " + old).size(), 1U);
  EXPECT_TRUE(world_.log.startingWith("writeToLogFile: Deleted").empty());
  EXPECT_EQ(textOf(kNewFile), "(" + kNowText + ") message\n");
}

}  // namespace
}  // namespace tarnel

#include "tools/tarnelctl/commands/upload_command.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>

namespace tarnel::ctl {
namespace {

Result<Array> read(const std::string& text, size_t most = 1000) {
  std::istringstream input(text);
  return readLogRecords(input, most);
}

TEST(LogRecordsTest, AnArrayOrOneRecordALine) {
  const Array records{Dictionary{{"a", 1}}, "text", 3};
  EXPECT_EQ(*read("[{\"a\": 1}, \"text\", 3]"), records);
  EXPECT_EQ(*read("\n [{\"a\": 1},\n \"text\", 3]\n"), records);
  EXPECT_EQ(*read("{\"a\": 1}\n\"text\"\n\n3"), records);
  EXPECT_EQ(*read("{\"a\": 1}\r\n\"text\"\r\n3\r\n"), records);
  EXPECT_EQ(*read("[1]\n[2]\n"), (Array{Array{1}, Array{2}}));
  EXPECT_EQ(*read(""), Array());
  EXPECT_EQ(*read(" \n\n"), Array());
  EXPECT_EQ(*read("[]"), Array());
}

TEST(LogRecordsTest, WhatIsWrongIsNamedWithItsLine) {
  EXPECT_TRUE(read("1\n\n{\"a\"\n").error().localizedDescription().starts_with("line 3: "));
  EXPECT_TRUE(read("[1\n[2]\n").error().localizedDescription().starts_with("line 1: "));
  EXPECT_FALSE(read("[1, 2"));
  EXPECT_EQ(read("[1, null]").error().localizedDescription(), "record 2 is null, which is no record");
  EXPECT_EQ(read("\nnull\n").error().localizedDescription(), "record 1 is null, which is no record");
}

TEST(SessionOptionsTest, TheLibraryWaitsAtLeastAsLongAsTheTool) {
  EXPECT_EQ(sessionOptions({.timeout = std::chrono::minutes(10)}).replyTimeout, std::chrono::minutes(10));
  EXPECT_EQ(sessionOptions({.timeout = std::chrono::seconds(1)}).replyTimeout,
            client::Options().replyTimeout);
  EXPECT_EQ(sessionOptions({.socketPath = "/s"}).socketPath, "/s");
}

class UnreadableFileTest : public ::testing::Test {
 protected:
  std::string refusal(const std::string& path) {
    err_.str("");
    EXPECT_EQ(uploadLogRecords({.socketPath = "/nonexistent"}, path, {out_, err_}), ExitStatus::failed);
    return err_.str();
  }
  std::ostringstream out_;
  std::ostringstream err_;
};

TEST_F(UnreadableFileTest, TheReasonIsSaid) {
  EXPECT_EQ(refusal("/nonexistent"), "tarnelctl: /nonexistent cannot be read: No such file or directory\n");
  EXPECT_EQ(refusal("/"), "tarnelctl: / cannot be read: Is a directory\n");
}

TEST_F(UnreadableFileTest, WhatCannotBeUploadedIsToldBeforeTheDaemonIsAsked) {
  const SendOptions options{.socketPath = "/nonexistent"};
  EXPECT_EQ(uploadFile(options, "/nonexistent", {out_, err_}), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: /nonexistent cannot be read: No such file or directory\n");
  err_.str("");
  const std::string path = ::testing::TempDir() + "/tarnelctl-empty-upload";
  std::ofstream(path).close();
  EXPECT_EQ(uploadFile(options, path, {out_, err_}), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: " + path + " is empty: only files that hold something are uploaded\n");
  std::filesystem::remove(path);
  EXPECT_EQ(out_.str(), "");
}

TEST_F(UnreadableFileTest, NullsThatGetLostAreCounted) {
  const auto told = [this](const char* text) {
    const std::string path = ::testing::TempDir() + "/tarnelctl-nulls";
    std::ofstream(path) << text;
    err_.str("");
    uploadLogRecords({.socketPath = "/nonexistent"}, path, {out_, err_});
    std::filesystem::remove(path);
    return err_.str();
  };
  EXPECT_THAT(told(R"([{"a": null}])"),
              ::testing::StartsWith("tarnelctl: 1 null in the records is left out: there is no such value in "
                                    "a call\n"));
  EXPECT_THAT(told(R"([{"a": [1, null, {"b": null}]}])"),
              ::testing::StartsWith("tarnelctl: 2 nulls in the records are left out"));
  EXPECT_THAT(told(R"([{"a": "null"}])"), ::testing::Not(::testing::HasSubstr("left out")));
}

TEST_F(UnreadableFileTest, AReadThatFailsIsNoEndOfTheFile) {
  class Broken final : public std::streambuf {
    int_type underflow() override { throw std::ios_base::failure("broken"); }
  };
  Broken broken;
  std::istream input(&broken);
  EXPECT_EQ(readLogRecords(input).error().localizedDescription(), "it cannot be read");
}

TEST(LogRecordsTest, TheSizeIsBounded) {
  EXPECT_TRUE(read("[123456]", 8));
  EXPECT_EQ(read("[1234567]", 8).error().localizedDescription(),
            "these are more than 8 bytes: send less at once");
}

}  // namespace
}  // namespace tarnel::ctl

#include "tools/tarnelctl/upload_command.h"

#include <gtest/gtest.h>

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
}

TEST(LogRecordsTest, TheSizeIsBounded) {
  EXPECT_TRUE(read("[123456]", 8));
  EXPECT_EQ(read("[1234567]", 8).error().localizedDescription(),
            "these are more than 8 bytes: send less at once");
}

}  // namespace
}  // namespace tarnel::ctl

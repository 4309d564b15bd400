#include "tools/tarnelctl/recording.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

namespace tarnel::ctl {
namespace {

constexpr char kSession[] = R"({"session":"a","sessionInfo":{"sessionID":1,"clientType":8}})";

Result<Recording> readText(const std::string& text) {
  std::istringstream input(text);
  return readRecording(input);
}

std::string refusalOf(const std::string& line) {
  const auto recording = readText(std::string(kSession) + "\n" + line + "\n");
  return recording ? "accepted" : recording.error().localizedDescription();
}

TEST(RecordingTest, ReadsSessionsMessagesAndOperations) {
  const auto recording =
      readText(std::string(kSession) + "\n\n" +
               R"({"session":"a","at":0.5,"category":5,"type":20,"payload":{"k":1},"flag":3})"
               "\n" +
               R"({"session":"a","at":0.5,"category":5,"type":20})"
               "\n" +
               R"({"session":"a","at":1,"op":"flush"})"
               "\n" +
               R"({"session":"a","at":2,"op":"finish"})"
               "\n" +
               R"({"session":"a","at":3,"op":"close"})"
               "\n");
  ASSERT_TRUE(recording) << recording.error().localizedDescription();
  ASSERT_EQ(recording->sessions.size(), 1U);
  EXPECT_EQ(recording->sessions[0].sessionInfo.find("clientType")->int32Value(), 8);
  EXPECT_FALSE(recording->sessions[0].userInfo);
  ASSERT_EQ(recording->steps.size(), 5U);
  EXPECT_EQ(recording->steps[0].category, 5);
  EXPECT_EQ(recording->steps[0].type, 20);
  EXPECT_EQ(recording->steps[0].flag, 3U);
  EXPECT_EQ(recording->steps[0].payload, MaybeDictionary(Dictionary{{"k", 1}}));
  EXPECT_EQ(recording->steps[1].flag, 0U);
  EXPECT_FALSE(recording->steps[1].payload);
  EXPECT_EQ(recording->steps[2].kind, RecordedStep::Kind::flush);
  EXPECT_EQ(recording->steps[3].kind, RecordedStep::Kind::finish);
  EXPECT_EQ(recording->steps[4].kind, RecordedStep::Kind::close);
}

TEST(RecordingTest, NamesLineAndFault) {
  EXPECT_EQ(refusalOf("[]"), "line 2: is no JSON object");
  EXPECT_EQ(refusalOf("{}"),
            "line 2: \"session\" is missing: it names the session that the record belongs to");
  EXPECT_EQ(refusalOf(kSession), "line 2: session \"a\" was described before");
  EXPECT_EQ(refusalOf(R"({"session":"b","at":1,"op":"flush"})"),
            "line 2: session \"b\" is not described: its \"sessionInfo\" record must come first");
  EXPECT_EQ(refusalOf(R"({"session":"a","at":1,"op":"stop"})"),
            "line 2: \"op\" must be \"flush\", \"finish\" or \"close\"");
  EXPECT_EQ(refusalOf(R"({"session":"a","at":1})"),
            "line 2: is neither a message (\"category\" and \"type\") nor an operation (\"op\")");
  EXPECT_EQ(refusalOf(R"({"session":"a","at":1,"category":65536,"type":1})"),
            "line 2: \"category\" must be an integer from 0 to 65535");
  EXPECT_EQ(refusalOf(R"({"session":"a","at":1,"category":1,"type":1,"flag":4})"),
            "line 2: \"flag\" must be an integer from 0 to 3");
  EXPECT_EQ(refusalOf(R"({"session":"a","at":1,"category":1,"type":1,"payload":3})"),
            "line 2: \"payload\" must be an object");
  EXPECT_EQ(refusalOf(R"({"session":"a","category":1,"type":1})"),
            "line 2: \"at\" must be the seconds since the recording's start, and no less than in the record "
            "before");
  EXPECT_TRUE(refusalOf("{").starts_with("line 2: "));
}

TEST(RecordingTest, TimeNeverGoesBack) {
  const auto recording = readText(std::string(kSession) + "\n" +
                                  R"({"session":"a","at":2,"op":"flush"})"
                                  "\n" +
                                  R"({"session":"a","at":1,"op":"flush"})"
                                  "\n");
  ASSERT_FALSE(recording);
  EXPECT_TRUE(recording.error().localizedDescription().starts_with("line 3: "));
}

TEST(RecordingTest, RefusesAnEmptyOne) {
  EXPECT_EQ(readText("").error().localizedDescription(),
            "the recording describes no session: examples/call-recording.ndjson shows what one looks like");
}

TEST(RecordingTest, IsBounded) {
  std::istringstream input(std::string(kSession) + "\n");
  const auto recording = readRecording(input, 20);
  ASSERT_FALSE(recording);
  EXPECT_EQ(recording.error().localizedDescription(), "line 1: the recording is larger than 20 bytes");
}

TEST(RecordingTest, ALineWithoutEndIsNotReadToItsEnd) {
  std::istringstream input(std::string(1000, 'x'));
  const auto recording = readRecording(input, 100);
  ASSERT_FALSE(recording);
  EXPECT_EQ(recording.error().localizedDescription(), "line 1: the recording is larger than 100 bytes");
  EXPECT_LE(input.tellg(), 102);
}

TEST(RecordingTest, AFolderIsNoRecording) {
  std::ifstream folder("/");
  const auto recording = readRecording(folder);
  ASSERT_FALSE(recording);
  EXPECT_EQ(recording.error().localizedDescription(), "cannot be read: is it a file?");
}

}  // namespace
}  // namespace tarnel::ctl

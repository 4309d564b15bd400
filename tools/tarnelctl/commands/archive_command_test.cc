#include "tools/tarnelctl/commands/archive_command.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <limits>
#include <sstream>

#include "base/unique_fd.h"
#include "formats/document.h"
#include "tools/tarnelctl/readable_value.h"

namespace tarnel::ctl {
namespace {

using testing::EndsWith;
using testing::HasSubstr;

Value records() {
  return Array{Dictionary{{"time", Date{1700000000.5}}, {"level", 3}, {"text", "no \"route\"\n"}},
               Dictionary{{"body", Data{0, 255}}, {"more", Array{1, Array{}, Dictionary{{"a", Value()}}}}}};
}

class ArchiveCommandTest : public testing::Test {
 protected:
  ArchiveCommandTest() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tarnelctl-archive.XXXXXX").string();
    home_ = mkdtemp(pattern.data());
  }
  ~ArchiveCommandTest() override { std::filesystem::remove_all(home_); }

  std::string file(const std::string& bytes) const {
    const std::string path = home_ + "/log.archive";
    std::ofstream(path, std::ios::binary) << bytes;
    return path;
  }
  static std::string archive(const Value& value) { return *archiveObject(value); }
  ExitStatus show(const std::string& path, bool json = false, const ArchiveLimits& limits = {}) {
    out_.str("");
    err_.str("");
    return showArchive({path, json}, -1, terminal_, limits);
  }
  ExitStatus showInput(const std::string& path) {
    out_.str("");
    err_.str("");
    const UniqueFd input(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    return showArchive({.file = "-"}, input.get(), terminal_, {.bytes = 4096});
  }
  void expectRefusal(const std::string& bytes, const std::string& reason) {
    const std::string path = file(bytes);
    EXPECT_EQ(show(path), ExitStatus::failed);
    EXPECT_EQ(err_.str(), "tarnelctl: " + path + ": " + reason + "\n");
    EXPECT_EQ(out_.str(), "");
  }

  std::string home_;
  std::ostringstream out_;
  std::ostringstream err_;
  Terminal terminal_{out_, err_};
};

TEST_F(ArchiveCommandTest, RecordsAreReadable) {
  ASSERT_EQ(show(file(archive(records()))), ExitStatus::ok);
  EXPECT_EQ(out_.str(),
            "- time: 2023-11-14T22:13:20.5Z\n"
            "  level: 3\n"
            "  text: \"no \\\"route\\\"\\n\"\n"
            "- body: <2 bytes: 00ff>\n"
            "  more:\n"
            "    - 1\n"
            "    - []\n"
            "    - a: null\n");
  EXPECT_EQ(err_.str(), "");
}

TEST_F(ArchiveCommandTest, JsonIsTheTextFormAndReadsBack) {
  ASSERT_EQ(show(file(archive(records())), true), ExitStatus::ok);
  EXPECT_THAT(out_.str(), HasSubstr(R"("$date": "2023-11-14T22:13:20.5Z")"));
  EXPECT_THAT(out_.str(), HasSubstr(R"("$data": "AP8=")"));
  EXPECT_THAT(out_.str(), EndsWith("]\n"));
  const auto back = parseDocument(out_.str());
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, records());
}

TEST_F(ArchiveCommandTest, StandardInputIsReadToItsEnd) {
  EXPECT_EQ(showInput(file(archive("text"))), ExitStatus::ok);
  EXPECT_EQ(out_.str(), "\"text\"\n");
  EXPECT_EQ(showInput(file(std::string(4097, 'x'))), ExitStatus::failed);
  EXPECT_EQ(
      err_.str(),
      "tarnelctl: cannot read standard input: it is larger than 4096 bytes, and no archive of a log data "
      "upload is: check that it is one\n");
  EXPECT_EQ(showInput(home_), ExitStatus::failed);
  EXPECT_EQ(
      err_.str(),
      "tarnelctl: cannot read standard input: Is a directory: give an archive's file, or - for standard "
      "input\n");
}

TEST_F(ArchiveCommandTest, WhatCannotBeReadIsNamedWithTheRemedy) {
  EXPECT_EQ(show(home_ + "/none"), ExitStatus::failed);
  EXPECT_EQ(err_.str(),
            "tarnelctl: cannot read " + home_ + "/none: No such file or directory: check the path\n");
  EXPECT_EQ(show(home_), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: cannot read " + home_ +
                            ": it is not a regular file: give an archive's file, or - for standard input\n");
  ASSERT_EQ(::mkfifo((home_ + "/pipe").c_str(), 0600), 0);
  EXPECT_EQ(show(home_ + "/pipe"), ExitStatus::failed);  // and does not wait for somebody to write into it
  const std::string path = file(archive(1));
  EXPECT_EQ(show(path, false, {.bytes = 8}), ExitStatus::failed);
  EXPECT_THAT(err_.str(), HasSubstr("it is larger than 8 bytes, and no archive of a log data upload is"));
  if (::geteuid() != 0) {  // root may read everything
    ASSERT_EQ(::chmod(path.c_str(), 0), 0);
    EXPECT_EQ(show(path), ExitStatus::failed);
    EXPECT_THAT(err_.str(), EndsWith("Permission denied: run it as a user who may read it\n"));
  }
}

TEST_F(ArchiveCommandTest, WhatIsNoArchiveIsRefused) {
  expectRefusal("", "it is empty: give the body of a log data upload, as it was received");
  const std::string no =
      "this is no keyed archive, which begins with the bytes D9 D9 F7: give the body of a log data upload, "
      "as it was received";
  expectRefusal("{}", no);
  expectRefusal("\x1f\x8b\x08", no);
  expectRefusal("\xD9\xD9", no);
}

TEST_F(ArchiveCommandTest, EveryTruncationIsSaidToBeDamage) {
  const std::string whole = archive(records());
  for (size_t length = 3; length < whole.size(); ++length) {
    EXPECT_EQ(show(file(whole.substr(0, length))), ExitStatus::failed) << length;
    EXPECT_THAT(err_.str(), HasSubstr("the archive is incomplete, damaged or of another version ("))
        << length;
    EXPECT_THAT(err_.str(), EndsWith("): fetch it anew if it was cut short\n")) << length;
  }
  EXPECT_EQ(show(file(whole + "x")), ExitStatus::failed);
  EXPECT_THAT(err_.str(), HasSubstr("bytes after the document"));
}

TEST_F(ArchiveCommandTest, AnArchiveThatComesToTooMuchIsRefused) {
  Value value = Array{1, 2};
  for (int i = 0; i < 10; ++i) value = Array{value, value};
  EXPECT_EQ(show(file(archive(value)), false, {.values = 100}), ExitStatus::failed);
  EXPECT_THAT(err_.str(), HasSubstr(": it is more than a log data upload may hold: "));
  EXPECT_THAT(err_.str(), HasSubstr("more than 100 values"));
}

TEST(ReadableTextTest, ScalarsAreTold) {
  EXPECT_EQ(readableText(Value()), "null\n");
  EXPECT_EQ(readableText(true), "true\n");
  EXPECT_EQ(readableText(-5), "-5\n");
  EXPECT_EQ(readableText(UINT64_MAX), "18446744073709551615\n");
  EXPECT_EQ(readableText(0.5), "0.5\n");
  EXPECT_EQ(readableText(-std::numeric_limits<double>::infinity()), "-inf\n");
  EXPECT_EQ(readableText(std::nan("")), "nan\n");
  EXPECT_EQ(readableText(Date{1e12}), "date 1000000000000 s after 1970\n");
  EXPECT_EQ(readableText(Data{}), "<0 bytes>\n");
  EXPECT_EQ(readableText(Data{7}), "<1 byte: 07>\n");
  EXPECT_EQ(readableText(Dictionary{}), "{}\n");
}

TEST(ReadableTextTest, LongDataIsCut) {
  std::string hex;
  for (int i = 0; i < 64; ++i) hex += "ab";
  EXPECT_EQ(readableText(Data(64, 0xab)), "<64 bytes: " + hex + ">\n");
  EXPECT_EQ(readableText(Data(65, 0xab)), "<65 bytes: " + hex + "...>\n");
}

TEST(ReadableTextTest, ListsInListsShareALine) {
  EXPECT_EQ(readableText(Array{Array{1, 2}, Dictionary{{"a", Dictionary{{"b", 1}, {"c", 2}}}, {"d", 3}}}),
            "- - 1\n"
            "  - 2\n"
            "- a:\n"
            "    b: 1\n"
            "    c: 2\n"
            "  d: 3\n");
}

TEST(ReadableTextTest, NothingSteersATerminal) {
  EXPECT_EQ(readableText("\x1b[31m\t\r\x7f\u009b \u202e\u2066\u200f\u2028 Ä€😀\u00a0"),
            "\"\\u001b[31m\\t\\u000d\\u007f\\u009b \\u202e\\u2066\\u200f\\u2028 Ä€😀\u00a0\"\n");
  EXPECT_EQ(readableText(Dictionary{{"a\x1b", 1}, {"", 2}, {"- x", 3}, {"-", 4}, {"ok_1.2-b$", 5}}),
            "\"a\\u001b\": 1\n\"\": 2\n\"- x\": 3\n\"-\": 4\nok_1.2-b$: 5\n");
}

}  // namespace
}  // namespace tarnel::ctl

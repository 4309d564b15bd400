#include <gtest/gtest.h>

#include <array>
#include <cstdio>
#include <limits>
#include <string>

#include "formats/archive.h"
#include "formats/document.h"
#include "testing/linux_test_support.h"

// The example of a reader in another language, which knows the archive's description and nothing else.

namespace tarnel {
namespace {

struct Finished {
  int status;  // exit status
  std::string output;
};

class ArchiveExampleTest : public ::testing::Test {
 protected:
  Finished read(const std::string& archive) const {
    folder_.write("archive", archive);
    const std::string command = "'" TARNEL_READ_ARCHIVE_EXAMPLE "' '" + folder_.path("archive") + "' 2>&1";
    FILE* const pipe = ::popen(command.c_str(), "r");
    Finished finished{-1, {}};
    std::array<char, 4096> piece{};
    while (const size_t size = std::fread(piece.data(), 1, piece.size(), pipe)) {
      finished.output.append(piece.data(), size);
    }
    const int end = ::pclose(pipe);
    if (WIFEXITED(end)) finished.status = WEXITSTATUS(end);
    return finished;
  }
  std::string problem(const std::string& text) const {
    return "read-archive: " + folder_.path("archive") + ": " + text + "\n";
  }

 private:
  TemporaryFolder folder_;
};

TEST_F(ArchiveExampleTest, ReadsWhatIsWritten) {
  const Dictionary record{{"level", 3}, {"text", "no route"}, {"", Array{}}, {"nested", Dictionary{}}};
  const Array records{record,
                      record,
                      Value(),
                      true,
                      false,
                      0,
                      -1,
                      23,
                      24,
                      255,
                      256,
                      65536,
                      INT64_MIN,
                      INT64_MAX,
                      UINT64_MAX,
                      0.5,
                      -1e300,
                      "",
                      "Grüße 😀 \"\n",
                      Data{},
                      Data{0, 1, 255},
                      Array{Array{record}, Dictionary{{"a", Array{1, 2}}}}};
  const auto archive = archiveObject(records);
  ASSERT_TRUE(static_cast<bool>(archive));
  const auto finished = read(*archive);
  EXPECT_EQ(finished.status, 0);
  const auto document = parseDocument(finished.output);
  ASSERT_TRUE(static_cast<bool>(document)) << finished.output;
  EXPECT_EQ(*document, Value(records));
}

TEST_F(ArchiveExampleTest, KeepsKindsApart) {
  const auto archive = archiveObject(
      Array{1, 1.0, true, Date{1700000000.5}, Date{1}, std::numeric_limits<double>::infinity()});
  EXPECT_EQ(read(*archive).output, "[1, 1.0, true, {\"$date\": 1700000000.5}, {\"$date\": 1.0}, \"inf\"]\n");
}

TEST_F(ArchiveExampleTest, PrintsNothingThatATerminalObeys) {
  const auto archive = archiveObject(Array{"\x1b]0;\x07\x7f\u009b2J\u00a0"});
  EXPECT_EQ(read(*archive).output, "[\"\\u001b]0;\\u0007\\u007f\\u009b2J\u00a0\"]\n");
}

TEST_F(ArchiveExampleTest, SaysWhatIsWrong) {
  EXPECT_EQ(read("[1]").output, problem("it does not begin with the bytes D9 D9 F7"));
  const auto archive = archiveObject(Array{"text"});
  EXPECT_EQ(read(archive->substr(0, archive->size() - 3)).output, problem("it ends too early"));
  EXPECT_EQ(read(*archive + "x").output, problem("bytes after its end"));
  std::string forward = *archive;
  forward.back() = 1;  // the list's own place
  const auto refused = read(forward);
  EXPECT_EQ(refused.output, problem("1 is no place among the first 1 objects"));
  EXPECT_EQ(refused.status, 1);
}

}  // namespace
}  // namespace tarnel

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "formats/archive.h"
#include "formats/document.h"
#include "testing/child_process.h"
#include "testing/programs.h"

// `tarnelctl archive`, which needs no daemon.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;

FinishedProcess run(std::vector<std::string> arguments, std::string_view input = {}) {
  ProcessOptions options;
  options.program = kTarnelctl;
  options.arguments = std::move(arguments);
  options.arguments.insert(options.arguments.begin(), "archive");
  return runProcess(options, input);
}

Value records() {
  return Array{Dictionary{{"time", Date{1700000000.5}}, {"text", "a\x1b[2J"}},
               Dictionary{{"body", Data{1, 2, 3}}, {"ok", true}}};
}

TEST(TarnelctlArchiveTest, AFileAndStandardInputAreShown) {
  const TestFolder folder;
  const std::string archive = *archiveObject(records());
  folder.write("log.archive", archive);
  const auto shown = run({"show", folder.path("log.archive")});
  EXPECT_EQ(shown.end.status, 0) << shown.errors;
  EXPECT_EQ(
      shown.output,
      "- time: 2023-11-14T22:13:20.5Z\n  text: \"a\\u001b[2J\"\n- body: <3 bytes: 010203>\n  ok: true\n");
  EXPECT_EQ(shown.errors, "");
  const auto json = run({"show", "--json", "-"}, archive);
  EXPECT_EQ(json.end.status, 0) << json.errors;
  const auto document = parseDocument(json.output);
  ASSERT_TRUE(document) << json.output;
  EXPECT_EQ(*document, records());
}

TEST(TarnelctlArchiveTest, MistakesAreNamedAndEndWithTheirStatus) {
  const TestFolder folder;
  const std::string archive = *archiveObject(records());
  folder.write("log.archive", archive.substr(0, archive.size() - 1));
  const auto truncated = run({"show", folder.path("log.archive")});
  EXPECT_EQ(truncated.end.status, 1);
  EXPECT_THAT(truncated.errors, HasSubstr("the archive is incomplete, damaged or of another version ("));
  const auto other = run({"show", "-"}, "[]");
  EXPECT_EQ(other.end.status, 1);
  EXPECT_THAT(other.errors, HasSubstr("tarnelctl: standard input: this is no keyed archive"));
  const auto directory = run({"show", folder.path()});
  EXPECT_EQ(directory.end.status, 1);
  EXPECT_THAT(directory.errors, HasSubstr("it is not a regular file"));
  EXPECT_EQ(run({"show"}).end.status, 2);
  EXPECT_EQ(run({"shwo"}).end.status, 2);
  EXPECT_EQ(run({}).end.status, 2);
  EXPECT_THAT(run({"show", "--help"}).output, HasSubstr("at most 16 MiB"));
}

}  // namespace
}  // namespace tarnel::test

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>
#include <string>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"

// The first programs of docs/client-library.md do what it says, against the lab and the storebag of the demo.

namespace tarnel::test {
namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using ::testing::UnorderedElementsAre;

struct Example {
  const char* language;
  const char* program;
};

class ExamplesTest : public ::testing::TestWithParam<Example> {
 protected:
  void SetUp() override {
    lab.reset();
    lab.serveFile("brevan", std::string(kSourceDirectory) + "/examples/storebags/brevan.json");
    lab.connect(instance);
    instance.setConsent(true);
  }

  FinishedProcess hello() const {
    ProcessOptions options;
    options.program = GetParam().program;
    options.environment = {"TARNEL_SOCKET=" + instance.socketPath()};
    return runProcess(options);
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

INSTANTIATE_TEST_SUITE_P(Languages, ExamplesTest,
                         ::testing::Values(Example{"C", HELLO_C}, Example{"Cpp", HELLO_CPP}),
                         [](const auto& info) { return info.param.language; });

// What an example prints where all goes well, but for the message itself.
constexpr char kBeforeMessage[] = "configured, live backend: httppost\nsent, the daemon posts: {\n  ";
constexpr char kAfterMessage[] = "\n}\nfinished\n";

TEST(ExamplesDocumentTest, ShowsTheirOutput) {
  std::istringstream output(std::string(kBeforeMessage) + "..." + kAfterMessage);
  std::string shown;
  for (std::string line; std::getline(output, line);) shown += "    " + line + "\n";
  EXPECT_THAT(readWholeFile(std::string(kSourceDirectory) + "/docs/client-library.md"), HasSubstr(shown));
}

TEST_P(ExamplesTest, TheMessageArrivesAndEachStepIsTold) {
  ASSERT_TRUE(instance.start());
  const auto run = hello();
  EXPECT_EQ(run.end.status, 0) << run.errors;
  EXPECT_THAT(run.errors, IsEmpty());
  EXPECT_THAT(run.output,
              AllOf(StartsWith(kBeforeMessage), HasSubstr("\"greeting\""), EndsWith(kAfterMessage)));

  const auto arrivals = lab.waitForEvents(4);
  EXPECT_THAT(kindsOf(arrivals), UnorderedElementsAre("0/0", "7/3", "0/2", "0/1"));
  for (const auto& arrival : arrivals) {
    if (kindOf(arrival) != "7/3") continue;
    const auto& event = eventOf(arrival);
    EXPECT_EQ(textIn(event, "greeting"), "hello");
    ASSERT_TRUE(event.contains("rtt"));
    EXPECT_EQ(event.find("rtt")->doubleValue(), 12.5);
    EXPECT_EQ(textIn(event, "userName"), "9d017e2681b7f31725e1c0fbe2612e89079c22806b02cf7a894b500dd5a219c1");
    EXPECT_EQ(textIn(event, "clientName"), "Meetwell");
    EXPECT_EQ(textIn(event, "serviceName"), "video-call");
  }
  for (const auto& post : lab.posts()) {
    EXPECT_EQ(*findArray(post, "problems"), Array()) << description(post);
  }
}

TEST_P(ExamplesTest, WithoutConsentItSaysHowTheUserAgrees) {
  instance.setConsent(false);
  ASSERT_TRUE(instance.start());
  const auto run = hello();
  EXPECT_EQ(run.end.status, 1);
  EXPECT_THAT(run.errors, StartsWith("hello: configuring: no backend reports: let the user agree "
                                     "(tarnelctl consent on), or "));
  EXPECT_THAT(run.output, IsEmpty());
  instance.stop();
  EXPECT_THAT(lab.posts(), IsEmpty());
}

TEST_P(ExamplesTest, WithoutAStorebagItSaysWhereToLook) {
  lab.withdraw("brevan");
  ASSERT_TRUE(instance.start());
  const auto run = hello();
  EXPECT_EQ(run.end.status, 1);
  EXPECT_THAT(run.errors, AllOf(StartsWith("hello: configuring: there is no storebag for client type 8: "),
                                HasSubstr("tarnel_storebag_url")));
  EXPECT_THAT(run.output, IsEmpty());
}

TEST_P(ExamplesTest, WithoutADaemonItSaysThatNoneListens) {
  const auto run = hello();
  EXPECT_EQ(run.end.status, 1);
  EXPECT_THAT(run.errors, AllOf(StartsWith("hello: "), HasSubstr("no daemon is listening at " +
                                                                 instance.socketPath() + ": start ")));
  EXPECT_THAT(run.output, IsEmpty());
}

}  // namespace
}  // namespace tarnel::test

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "formats/document.h"
#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// The command-line tool against the daemon.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

class TarnelctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    const Dictionary entry = clientEntry(lab.eventsURL(), lab.realtimeURL());
    lab.serve("brevan", storebag("1", {{"httppost", profile({entry})}}));
  }

  FinishedProcess run(std::vector<std::string> arguments, std::string_view input = {}) const {
    ProcessOptions options;
    options.program = kTarnelctl;
    options.arguments = std::move(arguments);
    options.environment = instance.environment();
    return runProcess(options, input);
  }
  static std::vector<std::string> message(std::vector<std::string> more = {}) {
    std::vector<std::string> all{"--client-type",  "8",          "--client-name", "Meetwell",
                                 "--service-name", "video-call", "--category",    "5",
                                 "--type",         "6"};
    std::move(more.begin(), more.end(), std::back_inserter(all));
    return all;
  }
  FinishedProcess send(std::vector<std::string> more = {}) const {
    auto arguments = message(std::move(more));
    arguments.insert(arguments.begin(), "send");
    return run(std::move(arguments));
  }
  static Dictionary documentIn(const std::string& text) {
    const auto document = parseDocument(text);
    EXPECT_TRUE(document && document->dictionary() != nullptr) << text;
    return document && document->dictionary() != nullptr ? *document->dictionary() : Dictionary();
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(TarnelctlTest, SendShowsEachStepAndArrives) {
  ASSERT_TRUE(instance.start());
  const auto sent = send({"--flag", "1", "codec=opus", "loss=0.5", "id:string=007", "ok=true"});
  EXPECT_EQ(sent.end.status, 0) << sent.errors;
  EXPECT_THAT(sent.output, StartsWith("start: httppost\nmessage: "));
  const auto arrivals = lab.waitForEvents(4);
  for (const auto& arrival : arrivals) {
    if (kindOf(arrival) != "5/6") continue;
    EXPECT_EQ(textIn(arrival, "path"), "/v1/realtime");
    EXPECT_EQ(textIn(eventOf(arrival), "codec"), "opus");
    EXPECT_EQ(eventOf(arrival).find("loss")->doubleValue(), 0.5);
    EXPECT_EQ(textIn(eventOf(arrival), "id"), "007");
    EXPECT_EQ(*eventOf(arrival).find("ok"), Value(true));
  }
}

TEST_F(TarnelctlTest, SendAnswersInJson) {
  ASSERT_TRUE(instance.start());
  const auto sent = send({"--json", "--batch", "--flush", "key=value"});
  EXPECT_EQ(sent.end.status, 0) << sent.errors;
  const auto answer = documentIn(sent.output);
  ASSERT_NE(findDictionary(answer, "start"), nullptr);
  EXPECT_EQ(*findArray(*findDictionary(answer, "start"), "backends"), Array{"httppost"});
  EXPECT_NE(findDictionary(answer, "message"), nullptr);
  ASSERT_NE(findDictionary(answer, "flush"), nullptr);
  EXPECT_THAT(textIn(*findDictionary(answer, "flush"), "text"), HasSubstr("\"key\""));
  // What a backend answers is told, and counts as a failure.
  const auto empty = send({"--json", "--flush"});
  EXPECT_EQ(empty.end.status, 1);
  EXPECT_EQ(textIn(*findDictionary(documentIn(empty.output), "flush"), "error"), "Nothing to flush");
}

TEST_F(TarnelctlTest, SendWithoutAStorebagFails) {
  lab.withdraw("moldaro");
  ASSERT_TRUE(instance.start());
  const auto sent = run({"send", "--client-type", "9", "--category", "1", "--type", "2"});
  EXPECT_EQ(sent.end.status, 1);
  EXPECT_THAT(sent.errors, HasSubstr("no storebag is available for client type 9"));
  const auto nameless = run({"send", "--client-type", "3", "--category", "1", "--type", "2"});
  EXPECT_EQ(nameless.end.status, 1);
  EXPECT_THAT(nameless.errors, HasSubstr("client type 3 has no storebag"));
}

TEST_F(TarnelctlTest, SingleSendsOneMessage) {
  ASSERT_TRUE(instance.start());
  auto arguments = message({"k=v"});
  arguments.insert(arguments.begin(), "single");
  const auto sent = run(arguments);
  EXPECT_EQ(sent.end.status, 0) << sent.errors;
  EXPECT_EQ(sent.output, "single: finished\n");
  EXPECT_EQ(textIn(eventOf(lab.waitForEvents(1)[0]), "k"), "v");
}

TEST_F(TarnelctlTest, SingleWithoutAStorebagFailsAndSaysWhereToLook) {
  lab.withdraw("moldaro");
  ASSERT_TRUE(instance.start());
  const auto sent = run({"single", "--client-type", "9", "--category", "1", "--type", "2"});
  EXPECT_EQ(sent.end.status, 1);
  EXPECT_EQ(sent.output, "single: storebag not available\n");
  EXPECT_THAT(sent.errors, HasSubstr("no storebag is available for client type 9: see the daemon's log"));
}

TEST_F(TarnelctlTest, ExitStatusSaysWhetherADaemonServesUs) {
  const auto none = send();
  EXPECT_EQ(none.end.status, 3);
  EXPECT_THAT(none.errors,
              HasSubstr("no daemon is listening at " + instance.socketPath() + ": start the daemon"));
  instance.setEntitlements("# nobody\n");
  ASSERT_TRUE(instance.start());
  const auto refused = send();
  EXPECT_EQ(refused.end.status, 3);
  EXPECT_THAT(refused.errors, HasSubstr("lacks the entitlement com.orvane.private.tarneld"));
  EXPECT_THAT(refused.output, IsEmpty());
  instance.waitForLog("does not have required tarnel entitlement. Closing connection...");
  EXPECT_EQ(run({"send", "--category", "1"}).end.status, 2);
  EXPECT_EQ(run({"sned"}).end.status, 2);
  EXPECT_EQ(send({"key"}).end.status, 2);
  EXPECT_EQ(run({"--help"}).end.status, 0);
}

TEST_F(TarnelctlTest, ARecordedCallArrivesCompleteEventByEvent) {
  const std::string examples = std::string(kSourceDirectory) + "/examples";
  const std::string recording = examples + "/call-recording.ndjson";
  lab.serveFile("brevan", examples + "/storebags/brevan.json");
  lab.serveFile("moldaro", examples + "/storebags/moldaro.json");
  ASSERT_TRUE(instance.start());
  const auto replayed = run({"replay", "--fast", "--json", recording});
  ASSERT_EQ(replayed.end.status, 0) << replayed.errors;
  const auto summary = parseDocument(replayed.output);
  ASSERT_TRUE(summary && summary->array() != nullptr) << replayed.output;
  size_t expected = 0;
  for (const Value& session : *summary->array()) {
    const auto& fields = *session.dictionary();
    EXPECT_EQ(numberIn(fields, "sent"), numberIn(fields, "answered")) << replayed.output;
    EXPECT_EQ(numberIn(fields, "failed"), 0);
    EXPECT_EQ(numberIn(fields, "refused"), 0);
    EXPECT_EQ(textIn(fields, "backends"), "httppost");
    expected += 2;  // a start and a stop message of each session
  }
  const std::string text = readWholeFile(recording);
  expected += countOf("\"category\":", text) + countOf("\"op\":\"finish\"", text);
  EXPECT_EQ(lab.waitForEvents(expected).size(), expected);

  instance.folder().write("events.ndjson", lab.eventLines());
  ProcessOptions check;
  check.program = "/usr/bin/env";
  check.arguments = {"python3", std::string(kSourceDirectory) + "/scripts/check-arrivals", recording,
                     instance.folder().path("events.ndjson"), lab.storebagFolder()};
  const auto checked = runProcess(check);
  EXPECT_EQ(checked.end.status, 0) << checked.output << checked.errors;
  EXPECT_THAT(checked.output, HasSubstr("every event that was sent arrived as it should"));
}

TEST_F(TarnelctlTest, ReplayReadsStandardInputAndNamesItsMistakes) {
  ASSERT_TRUE(instance.start());
  const std::string recording =
      R"({"session":"a","sessionInfo":{"sessionID":1,"clientType":8,"requireUserInfo":true},)"
      R"("userInfo":{"clientName":"Meetwell","serviceName":"video-call"}})"
      "\n"
      R"({"session":"a","at":0.0,"category":3,"type":4,"payload":{"x":1}})"
      "\n";
  const auto replayed = run({"replay", "--fast", "-"}, recording);
  EXPECT_EQ(replayed.end.status, 0) << replayed.errors;
  EXPECT_THAT(replayed.output,
              HasSubstr("a (httppost): 1 sent, 1 answered, 0 refused by a backend, 0 failed"));
  lab.waitForEvents(3);
  const auto broken = run({"replay", "--fast", "-"}, recording + "{\"session\":\"b\",\"category\":1}\n");
  EXPECT_EQ(broken.end.status, 1);
  EXPECT_THAT(broken.errors, HasSubstr("line 3"));
}

TEST_F(TarnelctlTest, LogShowsWhatWasSent) {
  ASSERT_TRUE(instance.start());
  const auto before = run({"log"});
  EXPECT_EQ(before.end.status, 1);
  EXPECT_THAT(before.errors, HasSubstr("no message log in "));
  ASSERT_EQ(send({"mark=found"}).end.status, 0);
  const auto shown = run({"log"});
  EXPECT_EQ(shown.end.status, 0) << shown.errors;
  EXPECT_THAT(shown.output, HasSubstr("[httppost -> sendMessageWithDictionary] "));
  EXPECT_THAT(shown.output, HasSubstr("\"found\""));
  EXPECT_THAT(run({"log", "--path"}).output, HasSubstr("_messageLog.diag\n"));
  EXPECT_EQ(countOf("\n", run({"log", "-n", "2"}).output), 2U);
}

TEST_F(TarnelctlTest, ConsentAndSettingsTakeEffectOnARunningDaemon) {
  ASSERT_TRUE(instance.start());
  // Also as root: what it makes there must stay the daemon's.
  EXPECT_EQ(run({"consent", "off"}).end.status, 0);
  EXPECT_THAT(run({"consent", "status"}).output, HasSubstr("off"));
  EXPECT_THAT(send().output, HasSubstr("start: no live backend"));
  EXPECT_EQ(run({"consent", "on"}).end.status, 0);
  EXPECT_THAT(send().output, HasSubstr("start: httppost"));
  lab.waitForEvents(4);
  EXPECT_EQ(run({"settings", "set", "com.orvane.tarnel", "httpsPostURL", lab.url() + "/moved"}).end.status,
            0);
  EXPECT_THAT(run({"settings", "get", "com.orvane.tarnel", "httpsPostURL"}).output, HasSubstr("/moved"));
  lab.reset();
  ASSERT_EQ(send().end.status, 0);
  for (const auto& arrival : lab.waitForEvents(4)) EXPECT_EQ(textIn(arrival, "path"), "/moved");
  EXPECT_EQ(run({"settings", "unset", "com.orvane.tarnel", "httpsPostURL"}).end.status, 0);
}

}  // namespace
}  // namespace tarnel::test

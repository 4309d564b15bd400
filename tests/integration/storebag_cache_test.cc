#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// When the daemon asks for a storebag, and what it makes of the answers.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class StorebagCacheTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    serve("1");
    ASSERT_TRUE(instance.start());
    requests_ = lab.storebagRequests();
  }

  void serve(const std::string& version, int64_t refreshCycle = 3600) const {
    const Dictionary entry = clientEntry(lab.eventsURL(), lab.realtimeURL());
    lab.serve("brevan",
              with(storebag(version, {{"httppost", profile({entry})}}), "refresh_cycle", refreshCycle));
  }
  // Since the start of the test.
  int64_t requests() const { return lab.storebagRequests() - requests_; }
  // The version under which a session runs, by its stop message.
  std::string versionOfASession() {
    const size_t before = lab.events().size();
    { TestSession session(instance, {}); }
    const auto arrivals = lab.waitForEvents(before + 2);
    for (auto arrival = arrivals.rbegin(); arrival != arrivals.rend(); ++arrival) {
      if (kindOf(*arrival) == "0/1") return textIn(eventOf(*arrival), "StorebagVersion");
    }
    return "no stop message";
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;

 private:
  int64_t requests_ = 0;
};

TEST_F(StorebagCacheTest, OneRequestServesTheSessionsOfADay) {
  EXPECT_EQ(versionOfASession(), "1");
  serve("2");
  EXPECT_EQ(versionOfASession(), "1");
  EXPECT_EQ(requests(), 1);
  instance.waitForLog("storebagForSession: Cached storebag found for client type 8");
}

TEST_F(StorebagCacheTest, ClientTypesOfOneNameShareOneRequest) {
  const Dictionary entry = clientEntry(lab.eventsURL(), lab.realtimeURL());
  lab.serve("calvisto", storebag("3", {{"httppost", profile({entry})}}));
  for (const int clientType : {7, 11, 13}) {
    EXPECT_THAT(TestSession(instance, {.clientType = clientType}).backends(), ElementsAre("httppost"));
  }
  EXPECT_EQ(requests(), 1);
  lab.withdraw("calvisto");
}

TEST_F(StorebagCacheTest, AnExpiredOneIsAskedForConditionallyAndKeptWhenUnchanged) {
  serve("1", 0);
  EXPECT_EQ(versionOfASession(), "1");
  const size_t before = instance.logSize();
  EXPECT_EQ(versionOfASession(), "1");
  EXPECT_EQ(requests(), 2);
  instance.waitForLog("fetchStorebagWithName: Adding 'Last-Modified: ", before);
  instance.waitForLog("storebag content has not changed. using its cached version", before);
  EXPECT_THAT(lab.process().output(), HasSubstr("\"status\":304"));
  // What was not modified is kept for as long as that answer says, which is the lab's minute.
  instance.waitForLog("fetchAndCacheStorebag: Storebag max age: 60 seconds", before);
  EXPECT_EQ(versionOfASession(), "1");
  EXPECT_EQ(requests(), 2);
}

TEST_F(StorebagCacheTest, AnExpiredOneGivesWayToANewer) {
  serve("1", 0);
  EXPECT_EQ(versionOfASession(), "1");
  serve("2", 0);
  EXPECT_EQ(versionOfASession(), "2");
  EXPECT_EQ(requests(), 2);
}

TEST_F(StorebagCacheTest, AFailureKeepsTheOldDataAndIsNotRepeatedFor900Seconds) {
  serve("1", 0);
  EXPECT_EQ(versionOfASession(), "1");
  lab.misbehave("break-signature=1&for=storebags");
  const size_t before = instance.logSize();
  EXPECT_EQ(versionOfASession(), "1");
  instance.waitForLog("fetchStorebagWithName: Signature can not be verified, 0x", before);
  instance.waitForLog("fetchAndCacheStorebag: Unable to fetch storebag for client type 8", before);
  EXPECT_EQ(requests(), 2);
  serve("2", 0);
  EXPECT_EQ(versionOfASession(), "1");
  EXPECT_EQ(requests(), 2);
  instance.waitForLog(
      "storebagForSession: Not fetching storebag for client type 8 - must wait 900 seconds between attempts",
      before);
}

TEST_F(StorebagCacheTest, WithoutAnyStorebagTheClientIsToldAndServedAllTheSame) {
  lab.withdraw("moldaro");
  TestSession session(instance, {.clientType = 9});
  ASSERT_TRUE(session.started.ok()) << session.started.status.message;
  EXPECT_FALSE(session.started.names);
  const auto reply = session.send(1, 2);
  EXPECT_TRUE(reply.ok());
  EXPECT_FALSE(reply.error);
  instance.waitForLog("sendMessageWithDictionary: No backends available to send message");
  const auto flushed = session.session.flushAndWait(kDeadline);
  ASSERT_TRUE(flushed.error);
  EXPECT_EQ(flushed.error->description, "No backends available to send message");
  EXPECT_EQ(flushed.error->code, -1);
  EXPECT_EQ(session.session.fetchDisplayURLAndWait(kDeadline).text, "URL not available");
  const auto single = session.session.sendSingleMessageAndWait(
      sessionInfo({.clientType = 9}), userInfo("Meetwell", "video-call"), 1, 2, {}, kDeadline);
  EXPECT_EQ(single.text, "storebag not available");
  EXPECT_EQ(requests(), 1);
}

TEST_F(StorebagCacheTest, AClientTypeWithoutANameIsAnErrorForThatClientAlone) {
  for (const int clientType : {0, 3, 18, -1}) {
    TestSession nameless(instance, {.clientType = clientType});
    EXPECT_FALSE(nameless.started.ok()) << clientType;
    EXPECT_THAT(nameless.started.status.message, HasSubstr("has no storebag"));
    // Locks are released, and the session goes on without backends.
    EXPECT_TRUE(nameless.send(1, 2).ok());
    EXPECT_THAT(TestSession(instance, {}).backends(), ElementsAre("httppost"));
  }
  instance.expectAlive();
  EXPECT_EQ(requests(), 1) << "nothing is asked for";
}

TEST_F(StorebagCacheTest, OneClientTypeGoesOnWithTheBuiltInDocumentWhenNoServerAnswers) {
  instance.stop();
  // Nobody listens there.
  instance.setSetting("tarnel_storebag_url", "https://127.0.0.1:1/storebags");
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.clientType = 7});
  ASSERT_TRUE(session.started.ok()) << session.started.status.message;
  instance.waitForLog(
      "fetchStorebagWithName: Error resolving with lookup server "
      "https://127.0.0.1:1/storebags/calvisto?version=");
  instance.waitForLog("fetchStorebagWithName: Loading default storebag 'calvisto'");
  instance.waitForLog("fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.");
  instance.waitForLog("fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=3600");
  // A configuration, though none of whose backends this build makes.
  EXPECT_TRUE(!session.started.names || session.started.names->empty() ||
              *session.started.names == std::vector<std::string>{"dravik"});
  EXPECT_TRUE(session.send(1, 2).ok());
  TestSession other(instance, {.clientType = 8});
  EXPECT_TRUE(other.started.ok());
  EXPECT_FALSE(other.started.names);
}

TEST_F(StorebagCacheTest, TheEnvironmentChoosesTheSection) {
  const Dictionary entry = clientEntry(lab.eventsURL(), lab.realtimeURL());
  Dictionary inner{{"version", "7"}};
  inner.set("seed", Dictionary{{"httppost", profile({entry})}});
  inner.set("release", Dictionary{{"httppost2", profile({entry})}});
  inner.set("development", Dictionary());
  lab.serve("moldaro", inner);
  EXPECT_THAT(TestSession(instance, {.clientType = 9}).backends(), ElementsAre("httppost"));
  const auto backendsIn = [this](int environment) {
    instance.stop();
    instance.setSetting("environmentType", environment);
    instance.start();
    TestSession session(instance, {.clientType = 9});
    EXPECT_TRUE(session.started.ok());
    return session.started.names;
  };
  EXPECT_THAT(*backendsIn(4), ElementsAre("httppost2"));
  EXPECT_FALSE(backendsIn(1).has_value() && !backendsIn(1)->empty());
  EXPECT_FALSE(backendsIn(0)) << "the lookup always fails";
  EXPECT_FALSE(backendsIn(9)) << "an invalid one counts as 2, whose section is missing";
  instance.waitForLog("userDefaultsEnvironment: Invalid environment type 9");
}

}  // namespace
}  // namespace tarnel::test

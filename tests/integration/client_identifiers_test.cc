#include <gtest/gtest.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Under which identifiers events arrive, and how long each lasts.

namespace tarnel::test {
namespace {

class ClientIdentifiersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
  }

  Dictionary entry() const { return clientEntry(lab.eventsURL(), lab.realtimeURL()); }
  // One backend with one entry, under the name that client type 8 has.
  void serveEntry(const Dictionary& clientEntry) const {
    lab.serve("brevan", storebag("1.0-test", {{"httppost", profile({clientEntry})}}));
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(ClientIdentifiersTest, TheConsentingIdentifierIsDrawnAnewWithEveryChangeOfConsent) {
  serveEntry(entry());
  lab.serve("moldaro", storebag("1", {{"httppost", profile({with(entry(), "override_dnu", 1)})}}));
  ASSERT_TRUE(instance.start());
  // Of one session: its client identifiers, by sender.
  const auto identifiers = [&] {
    std::map<std::string, std::set<std::string>> seen;
    for (const auto& arrival : lab.events()) {
      seen[textIn(eventOf(arrival), "_sender")].insert(textIn(arrival, "clientId"));
    }
    return seen;
  };
  const auto runSessions = [&](size_t events) {
    { TestSession honours(instance, {.clientType = 8}); }
    { TestSession overrides(instance, {.clientType = 9}); }
    lab.waitForEvents(events);
  };
  runSessions(4);  // start and stop of both
  auto first = identifiers();
  ASSERT_EQ(first["OW"].size(), 1U);
  ASSERT_EQ(first["FE"].size(), 1U);
  EXPECT_NE(first["OW"], first["FE"]);

  runSessions(8);
  EXPECT_EQ(identifiers(), first) << "identifiers are stable while consent lasts";

  instance.setConsent(false);
  runSessions(10);
  EXPECT_EQ(identifiers()["FE"], first["FE"]) << "the overriding identifier does not follow consent";
  EXPECT_EQ(instance.folder().read("state/settings/com.orvane.tarnel.toml").find("dnu:respect"),
            std::string::npos)
      << "the consenting identifier is forgotten";

  instance.setConsent(true);
  lab.reset();
  runSessions(4);
  const auto last = identifiers();
  EXPECT_EQ(last.at("FE"), first["FE"]);
  EXPECT_NE(last.at("OW"), first["OW"]);
  EXPECT_EQ(last.at("OW").size(), 1U);

  instance.stop();
  ASSERT_TRUE(instance.start());
  lab.reset();
  runSessions(4);
  EXPECT_EQ(identifiers(), last) << "both outlive the daemon";
}

// An event that is about no user is posted without consent, and under an identifier that joins nothing.
TEST_F(ClientIdentifiersTest, EventsAboutNoUserHaveAnIdentifierUnderEitherDecision) {
  serveEntry(entry());
  ASSERT_TRUE(instance.start());
  std::vector<std::string> identifiers;
  for (const bool allowed : {false, true, false}) {
    instance.setConsent(allowed);
    lab.reset();
    for (int i = 0; i < 2; ++i) TestSession(instance, {.requireUserInfo = false});
    std::set<std::string> seen;
    for (const auto& arrival : lab.waitForEvents(4)) seen.insert(textIn(arrival, "clientId"));
    ASSERT_EQ(seen.size(), 1U) << allowed;
    identifiers.push_back(*seen.begin());
    EXPECT_EQ(identifiers.back().size(), 36U);
  }
  EXPECT_EQ(std::set<std::string>(identifiers.begin(), identifiers.end()).size(), 3U);
}

TEST_F(ClientIdentifiersTest, ACustomClientIdentifierIsOneForEachClient) {
  serveEntry(with(without(without(entry(), "client"), "service"), "custom_clientId", 1));
  ASSERT_TRUE(instance.start());
  for (const char* name : {"One", "Two", "ONE"}) TestSession(instance, {.client = name});
  std::map<std::string, std::set<std::string>> seen;
  for (const auto& arrival : lab.waitForEvents(6)) {
    seen[textIn(eventOf(arrival), "clientName")].insert(textIn(arrival, "clientId"));
  }
  ASSERT_EQ(seen["One"].size(), 1U);
  ASSERT_EQ(seen["Two"].size(), 1U);
  EXPECT_NE(seen["One"], seen["Two"]);
}

TEST_F(ClientIdentifiersTest, ACustomClientIdentifierOfALongNameLastsLikeOthers) {
  serveEntry(with(without(without(entry(), "client"), "service"), "custom_clientId", 1));
  std::set<std::string> seen;
  const std::string name = "\"\x01\\" + std::string(3000, 'n');
  for (int start = 0; start < 2; ++start) {
    ASSERT_TRUE(instance.start());
    lab.reset();
    for (int i = 0; i < 2; ++i) TestSession(instance, {.client = name});
    for (const auto& arrival : lab.waitForEvents(4)) seen.insert(textIn(arrival, "clientId"));
    instance.stop();
  }
  EXPECT_EQ(seen.size(), 1U);
}

}  // namespace
}  // namespace tarnel::test

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <condition_variable>
#include <map>
#include <mutex>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Sessions of several clients that report for one activity.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

constexpr int kTop = 5;         // sends as "EJ"
constexpr int kChild = 8;       // "OW"
constexpr int kGrandchild = 9;  // "FE"

// What reached an aggregating client.
class Aggregate {
 public:
  client::Options options(const PrivateInstance& instance) {
    auto options = optionsFor(instance);
    options.onAggregatedMessage = [this](client::DictionaryView info, double timestamp, uint16_t category,
                                         uint16_t type, client::DictionaryView payload) {
      const std::lock_guard lock(mutex_);
      EXPECT_GT(timestamp, 1.6e9);
      seen_.push_back(std::to_string(info.find("sessionID").toInt64()) + ": " + std::to_string(category) +
                      "/" + std::to_string(type) + " " + std::string(payload.find("text").toString()) + " " +
                      std::string(payload.find("clientName").toString()));
      changed_.notify_all();
    };
    options.onAggregationEnd = [this] {
      const std::lock_guard lock(mutex_);
      ++ends_;
      changed_.notify_all();
    };
    return options;
  }
  bool waitForEnd() {
    return wait([this] { return ends_ > 0; });
  }
  bool waitFor(const std::string& text) {
    return wait([this, &text] { return std::find(seen_.begin(), seen_.end(), text) != seen_.end(); });
  }
  std::vector<std::string> seen() {
    const std::lock_guard lock(mutex_);
    return seen_;
  }
  int ends() {
    const std::lock_guard lock(mutex_);
    return ends_;
  }

 private:
  template <class Condition>
  bool wait(Condition holds) {
    std::unique_lock lock(mutex_);
    return changed_.wait_until(lock, Deadline().end(), holds);
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> seen_;
  int ends_ = 0;
};

class HierarchyTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    serve(kTop, 0);
    serve(kChild, 1);
    serve(kGrandchild, 2);
  }

  Dictionary entry(int level) const {
    return with(clientEntry(lab.eventsURL(), lab.realtimeURL()), "hierarchy", level);
  }
  void serve(int clientType, int level) const {
    lab.serve(nameOf(clientType), storebag("1", {{"httppost", profile({entry(level)})}}));
  }
  static const char* nameOf(int clientType) {
    return clientType == kTop ? "plexor" : clientType == kChild ? "brevan" : "moldaro";
  }
  // The session identifiers that arrived, by kind of event.
  std::map<std::string, std::string> identifiersOf(size_t events) const {
    std::map<std::string, std::string> identifiers;
    for (const auto& arrival : lab.waitForEvents(events)) {
      identifiers[kindOf(arrival)] = textIn(eventOf(arrival), "_sessionID");
    }
    return identifiers;
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(HierarchyTest, IdentifiersOfChildrenBeginWithTheirParents) {
  ASSERT_TRUE(instance.start());
  TestSession top(instance, {.clientType = kTop});
  TestSession child(instance, {.clientType = kChild});
  // Names are compared without regard to case.
  TestSession grandchild(instance, {.clientType = kGrandchild, .client = "MEETWELL"});
  ASSERT_TRUE(top.send(1, 11).ok());
  ASSERT_TRUE(child.send(2, 12).ok());
  ASSERT_TRUE(grandchild.send(3, 13).ok());
  auto ids = identifiersOf(6);
  EXPECT_EQ(ids["1/11"].size(), 24U);
  ASSERT_EQ(ids["2/12"].size(), 49U) << ids["2/12"];
  EXPECT_EQ(ids["2/12"].substr(0, 25), ids["1/11"] + ".");
  ASSERT_EQ(ids["3/13"].size(), 74U);
  EXPECT_EQ(ids["3/13"].substr(0, 50), ids["2/12"] + ".");
}

TEST_F(HierarchyTest, AChildThatComesFirstIsRelabelledWhenItsParentComes) {
  ASSERT_TRUE(instance.start());
  TestSession child(instance, {.clientType = kChild, .batch = true});
  instance.waitForLog("(backend httppost) with hierarchy 1 is missing its parent");
  ASSERT_TRUE(child.send(2, 12).ok());
  TestSession top(instance, {.clientType = kTop});
  ASSERT_TRUE(top.send(1, 11).ok());
  ASSERT_FALSE(child.session.flushAndWait(kDeadline).error);
  auto ids = identifiersOf(4);
  EXPECT_EQ(ids["2/12"].size(), 49U) << "an event that was batched before carries the combined identifier";
  EXPECT_EQ(ids["2/12"].substr(0, 25), ids["1/11"] + ".");
}

TEST_F(HierarchyTest, AGapLeavesTheGrandchildAlone) {
  ASSERT_TRUE(instance.start());
  TestSession top(instance, {.clientType = kTop});
  TestSession grandchild(instance, {.clientType = kGrandchild});
  ASSERT_TRUE(grandchild.send(3, 13).ok());
  EXPECT_EQ(identifiersOf(3)["3/13"].size(), 24U);
  instance.waitForLog(
      "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete "
      "parentSessionID is '(null)'");
}

TEST_F(HierarchyTest, ChildrenTakeTheirParentsState) {
  auto off = entry(0);
  off.set("sampling_threshold", 0);
  off.set("override_sampling", 0);
  lab.serve(nameOf(kTop), storebag("1", {{"httppost", profile({off})}}));
  lab.serve(nameOf(kChild),
            storebag("1", {{"httppost", profile({entry(1)})}, {"httppost2", profile({entry(1)})}}));
  ASSERT_TRUE(instance.start());
  TestSession alone(instance, {.clientType = kChild, .service = "video-call-elsewhere"});
  EXPECT_THAT(alone.backends(), UnorderedElementsAre("httppost", "httppost2"));
  TestSession top(instance, {.clientType = kTop});
  EXPECT_THAT(top.backends(), IsEmpty());
  TestSession child(instance, {.clientType = kChild});
  EXPECT_THAT(child.backends(), IsEmpty())
      << "one is off with the parent's, the other has none at the parent";
}

TEST_F(HierarchyTest, NewUserInfoMovesASessionToOtherParents) {
  ASSERT_TRUE(instance.start());
  TestSession top(instance, {.clientType = kTop});
  TestSession other(instance, {.clientType = kTop, .service = "video-call-2"});
  TestSession child(instance, {.clientType = kChild});
  ASSERT_TRUE(top.send(1, 11).ok());
  ASSERT_TRUE(other.send(1, 21).ok());
  ASSERT_TRUE(child.send(2, 12).ok());
  const size_t before = instance.logSize();
  // The same names: nothing is synced, but what else is in it goes into events.
  auto richer = userInfo("Meetwell", "video-call");
  richer.set("room", "blue");
  EXPECT_THAT(*child.session.fetchStatesAndWait(richer, kDeadline).names, ElementsAre("httppost"));
  ASSERT_TRUE(child.send(2, 13).ok());
  EXPECT_EQ(instance.countInLog("receivedUserInfo: Received new user info", before), 0U);
  EXPECT_THAT(*child.session.fetchStatesAndWait(userInfo("Meetwell", "video-call-2"), kDeadline).names,
              ElementsAre("httppost"));
  EXPECT_EQ(instance.countInLog("receivedUserInfo: Received new user info for session 7", before), 1U);
  ASSERT_TRUE(child.send(2, 14).ok());
  auto ids = identifiersOf(8);
  EXPECT_EQ(ids["2/12"].substr(0, 25), ids["1/11"] + ".");
  EXPECT_EQ(ids["2/13"], ids["2/12"]);
  EXPECT_EQ(ids["2/14"], ids["1/21"] + ids["2/12"].substr(24));
  for (const auto& arrival : lab.events()) {
    EXPECT_EQ(textIn(eventOf(arrival), "room"), kindOf(arrival) == "2/13" ? "blue" : "");
  }
}

TEST_F(HierarchyTest, TheTopMostAggregatorGetsWhatItsDescendantsSend) {
  ASSERT_TRUE(instance.start());
  Aggregate ofTop;
  Aggregate ofChild;
  TestSession child(ofChild.options(instance), {.clientType = kChild, .sessionID = 22});
  ASSERT_TRUE(child.send(2, 12, client::Dictionary().set("text", "alone")).ok());
  EXPECT_TRUE(ofChild.waitFor("22: 2/12 alone Meetwell"));
  EXPECT_EQ(ofChild.ends(), 0);

  TestSession top(ofTop.options(instance), {.clientType = kTop, .sessionID = 11});
  EXPECT_TRUE(ofChild.waitForEnd()) << "the ancestor aggregates for it now";
  TestSession grandchild(instance, {.clientType = kGrandchild, .sessionID = 33});
  ASSERT_TRUE(child.send(2, 13, client::Dictionary().set("text", "b")).ok());
  ASSERT_TRUE(grandchild.send(3, 13, client::Dictionary().set("text", "c")).ok());
  ASSERT_TRUE(grandchild.send(3, 14).ok());
  ASSERT_TRUE(top.send(1, 11, client::Dictionary().set("text", "d")).ok());
  EXPECT_TRUE(ofTop.waitFor("22: 2/13 b Meetwell"));
  EXPECT_TRUE(ofTop.waitFor("33: 3/13 c Meetwell"));
  EXPECT_TRUE(ofTop.waitFor("33: 3/14  ")) << "without payload nothing is merged";
  EXPECT_TRUE(ofTop.waitFor("11: 1/11 d Meetwell"));
  // Its backends get them all the same; its own client hears nothing any more.
  for (const auto& line : ofChild.seen()) EXPECT_EQ(line.find("2/13"), std::string::npos) << line;
  EXPECT_EQ(ofChild.ends(), 1);
  EXPECT_EQ(ofTop.ends(), 0);
  lab.waitForEvents(8);
}

TEST_F(HierarchyTest, AParentThatGoesLeavesItsChildrenReporting) {
  ASSERT_TRUE(instance.start());
  TestSession child(instance, {.clientType = kChild});
  {
    Aggregate aggregate;
    TestSession top(aggregate.options(instance), {.clientType = kTop});
    ASSERT_TRUE(child.send(2, 12, client::Dictionary().set("text", "heard")).ok());
    EXPECT_TRUE(aggregate.waitFor("7: 2/12 heard Meetwell"));
  }
  instance.waitForLog("dealloc: TarneldSession dealloc: 7");
  ASSERT_TRUE(child.send(2, 13).ok());
  EXPECT_TRUE(lab.waitUntil([](const std::vector<Dictionary>& arrivals) {
    const auto kinds = kindsOf(arrivals);
    return std::find(kinds.begin(), kinds.end(), "2/13") != kinds.end();
  }));
}

}  // namespace
}  // namespace tarnel::test

#include "platform/linux/identity/entitlement_rules.h"

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

constexpr char kEntitlement[] = "com.orvane.private.tarneld";

class FakeProcess final : public PeerProcess {
 public:
  std::optional<std::string> executable() const override { return program; }
  std::optional<std::string> unit() const override { return service; }
  bool isAlive() const override { return alive; }

  std::optional<std::string> program;
  std::optional<std::string> service;
  bool alive = true;
};

class EntitlementRulesTest : public testing::Test {
 protected:
  std::unique_ptr<EntitlementRules> load(const std::string& text) {
    folder_.write("entitlements.d/10.toml", text);
    problems_.clear();
    return EntitlementRules::load(folder_.path(), problems_);
  }
  // Whether one grant with these conditions lets the peer in.
  bool grants(const std::string& conditions, const PeerCredentials& peer) {
    const auto rules = load("[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\n" + conditions);
    EXPECT_THAT(texts(), IsEmpty());
    return rules->holds(peer, kEntitlement);
  }
  // What is said about a grant that is refused.
  std::string refusal(const std::string& grant) {
    const auto rules = load(grant);
    EXPECT_THAT(rules->rules(), IsEmpty());
    EXPECT_EQ(problems_.size(), 1U);
    return problems_.empty() ? "" : problems_[0].text;
  }
  std::vector<std::string> texts() const {
    std::vector<std::string> result;
    for (const auto& problem : problems_) result.push_back(problem.text);
    return result;
  }
  std::string file() const { return folder_.path("entitlements.d/10.toml"); }
  PeerCredentials peer(uint32_t uid, uint32_t gid) const {
    return PeerCredentials{.pid = 42, .uid = uid, .gid = gid, .process = process_};
  }

  TemporaryFolder folder_;
  std::vector<ConfigurationProblem> problems_;
  std::shared_ptr<FakeProcess> process_ = std::make_shared<FakeProcess>();
};

TEST_F(EntitlementRulesTest, WithoutRulesNobodyHoldsAnything) {
  EXPECT_FALSE(EntitlementRules::load(folder_.path("none"), problems_)->holds(peer(0, 0), kEntitlement));
  EXPECT_THAT(texts(), ElementsAre(folder_.path("none/entitlements.d") +
                                   ": holds no grant, so no client is let in; write one (see "
                                   "tarneld.conf(5)) and start the daemon anew"));
}

TEST_F(EntitlementRulesTest, AGrantIsForItsEntitlementAlone) {
  const auto rules = load("[[grant]]\nentitlement = \"other\"\nuser = 7\n");
  EXPECT_TRUE(rules->holds(peer(7, 8), "other"));
  EXPECT_FALSE(rules->holds(peer(7, 8), kEntitlement));
  EXPECT_FALSE(rules->holds(peer(7, 8), ""));
}

TEST_F(EntitlementRulesTest, GroupAndUserAreTheEffectiveOnes) {
  EXPECT_TRUE(grants("group = 50\n", peer(7, 50)));
  EXPECT_FALSE(grants("group = 50\n", peer(50, 7)));
  EXPECT_TRUE(grants("user = 7\n", peer(7, 50)));
  EXPECT_FALSE(grants("user = 7\n", peer(50, 7)));
}

TEST_F(EntitlementRulesTest, NamesAreLookedUpWhenTheRulesLoad) {
  EXPECT_TRUE(grants("group = \"root\"\n", peer(7, 0)));
  EXPECT_TRUE(grants("user = \"root\"\n", peer(0, 7)));
  EXPECT_FALSE(grants("user = \"root\"\n", peer(7, 0)));
}

TEST_F(EntitlementRulesTest, AllConditionsMustHold) {
  const std::string conditions =
      "group = 50\nuser = 7\nunit = \"app.service\"\nexecutable = \"/usr/bin/app\"\n";
  process_->program = "/usr/bin/app";
  process_->service = "app.service";
  EXPECT_TRUE(grants(conditions, peer(7, 50)));
  EXPECT_FALSE(grants(conditions, peer(8, 50)));
  EXPECT_FALSE(grants(conditions, peer(7, 51)));
  process_->program = "/usr/bin/other";
  EXPECT_FALSE(grants(conditions, peer(7, 50)));
  process_->program = "/usr/bin/app";
  process_->service = "other.service";
  EXPECT_FALSE(grants(conditions, peer(7, 50)));
}

TEST_F(EntitlementRulesTest, AProcessThatIsGoneOrUnknownMeetsNoConditionOnIt) {
  const std::string conditions = "user = 7\nexecutable = \"/usr/bin/app\"\n";
  EXPECT_FALSE(grants(conditions, peer(7, 50)));
  process_ = nullptr;
  EXPECT_FALSE(grants(conditions, peer(7, 50)));
  EXPECT_FALSE(grants("unit = \"app.service\"\n", peer(7, 50)));
}

TEST_F(EntitlementRulesTest, AUnitAloneIsEnough) {
  process_->service = "app.service";
  EXPECT_TRUE(grants("unit = \"app.service\"\n", peer(7, 50)));
}

TEST_F(EntitlementRulesTest, ALookupReplacesTheOwnEyesWhileThePeerLives) {
  const auto rules = load(
      "[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\nuser = 7\nexecutable = \"/usr/bin/app\"\n");
  EXPECT_TRUE(rules->needsExecutable());
  rules->setExecutableLookup([](int32_t pid) -> std::optional<std::string> {
    return pid == 42 ? std::optional<std::string>("/usr/bin/app") : std::nullopt;
  });
  EXPECT_TRUE(rules->holds(peer(7, 50), kEntitlement));
  process_->alive = false;
  EXPECT_FALSE(rules->holds(peer(7, 50), kEntitlement));
  EXPECT_FALSE(load("[[grant]]\nentitlement = \"e\"\nuser = 7\n")->needsExecutable());
}

TEST_F(EntitlementRulesTest, UnknownCredentialsHoldNothing) {
  EXPECT_FALSE(grants("user = 0\n", PeerCredentials()));
  EXPECT_EQ(refusal("[[grant]]\nentitlement = \"e\"\nuser = 4294967295\n"),
            file() + ":3: user is no valid number; this grant is not used");
}

TEST_F(EntitlementRulesTest, AGrantThatCannotBeUsedIsNamedWithItsLine) {
  const struct {
    const char* grant;
    const char* said;
  } cases[] = {
      {"[[grant]]\nentitlement = \"e\"\nexecutable = \"/usr/bin/app\"\n",
       ":1: executable alone proves nothing, because a user can make another program look like it; add "
       "group, user or "
       "unit"},
      {"[[grant]]\nentitlement = \"e\"\n", ":1: the grant names nobody; add group, user or unit"},
      {"[[grant]]\nuser = 1\n", ":1: the grant has no entitlement = \"...\""},
      {"[[grant]]\nentitlement = \"\"\nuser = 1\n", ":2: entitlement must be a text that is not empty"},
      {"[[grant]]\nentitlement = \"e\"\nuser = -1\n", ":3: user is no valid number"},
      {"[[grant]]\nentitlement = \"e\"\ngroup = \"root\\u0000x\"\n", ":3: group must hold no zero character"},
      {"[[grant]]\nentitlement = \"e\\u0000\"\ngroup = 0\n", ":2: entitlement must hold no zero character"},
      {"[[grant]]\nentitlement = \"e\"\ngroup = \"no such group\"\n",
       ":3: there is no group \"no such group\" on this system; create it and restart the daemon"},
      {"[[grant]]\nentitlement = \"e\"\nuser = 1\nexecutabel = \"/x\"\n", ":4: unknown key executabel"},
      {"[[grant]]\nentitlement = \"e\"\nunit = \"app\"\n", ":3: unit must end in .service or .scope"},
      {"[[grant]]\nentitlement = \"e\"\nuser = 1\nexecutable = \"app\"\n",
       ":4: executable must be an absolute path"},
      {"grant = [1]\n", ":1: a grant must be a section that begins with [[grant]]"},
  };
  for (const auto& one : cases) {
    EXPECT_EQ(refusal(one.grant), file() + one.said + "; this grant is not used");
    EXPECT_EQ(problems_[0].level, LogLevel::error);
  }
}

TEST_F(EntitlementRulesTest, TheOtherGrantsStand) {
  folder_.write("entitlements.d/20.toml", "[[grant]]\nentitlement = \"b\"\nuser = 2\n");
  const auto rules = load("[[grant]]\nentitlement = \"a\"\n[[grant]]\nentitlement = \"a\"\nuser = 1\n");
  EXPECT_EQ(problems_.size(), 1U);
  EXPECT_TRUE(rules->holds(peer(1, 9), "a"));
  EXPECT_TRUE(rules->holds(peer(2, 9), "b"));
}

TEST_F(EntitlementRulesTest, OtherKeysAndShapesAreReported) {
  load("grants = 1\n");
  EXPECT_THAT(texts(),
              ElementsAre(file() + ":1: unknown key grants; it is ignored, tarneld.conf(5) lists the keys"));
  load("grant = 1\n");
  EXPECT_THAT(texts(),
              ElementsAre(file() + ":1: grant must be a list of sections that begin with [[grant]]; the "
                                   "default stays"));
}

TEST_F(EntitlementRulesTest, AFileThatOthersCanWriteGrantsNothing) {
  folder_.write("entitlements.d/10.toml", "[[grant]]\nentitlement = \"e\"\nuser = 1\n");
  ASSERT_EQ(::chmod(file().c_str(), 0664), 0);
  EXPECT_FALSE(EntitlementRules::load(folder_.path(), problems_)->holds(peer(1, 1), "e"));
  EXPECT_THAT(texts(), ElementsAre(file() +
                                   ": is not used, because it can be written by its group or by others; "
                                   "change that with: chmod go-w " +
                                   file()));
}

}  // namespace
}  // namespace tarnel

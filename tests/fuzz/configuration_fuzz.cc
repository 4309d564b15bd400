// The administrator's files with any text. The input's first line begins with
//   'c'  the rest is tarneld.toml and, behind a line "---", a file of tarneld.d
//   'e'  the rest is a file of entitlements.d

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "formats/toml.h"
#include "platform/linux/configuration/configuration.h"
#include "platform/linux/identity/entitlement_rules.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/scratch_folder.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {
    "syntax error",     "nothing wrong",       "unknown key",         "bad value",   "every field",
    "later file wins",  "earlier value stays", "upload fitted",       "grant",       "grant refused",
    "group by name",    "user by number",      "unit and executable", "peer let in", "peer kept out",
    "no list of grants"};

namespace {

const ScratchFolder& folder() {
  static const ScratchFolder made;
  return made;
}

int64_t linesOf(std::string_view text) {
  return std::count(text.begin(), text.end(), '\n') + 1;
}

// Every problem names a file and a line of it.
void checkProblems(const std::vector<ConfigurationProblem>& problems, const std::string& path,
                   std::string_view text) {
  for (const auto& problem : problems) {
    if (!problem.text.starts_with(path + ":")) continue;
    const auto line = Value(problem.text.substr(path.size() + 1)).int64Value();
    require(line >= 1 && line <= linesOf(text), "a problem names its line");
    if (problem.text.find(": unknown key ") != std::string::npos) reached("unknown key");
    if (problem.text.find(" must be ") != std::string::npos) reached("bad value");
  }
}

// --- tarneld.toml ---

bool isWithin(uint64_t value, uint64_t least, uint64_t most) {
  return value >= least && value <= most;
}

void checkRanges(const Configuration& made) {
  constexpr uint64_t kMillion = 1'000'000;
  constexpr uint64_t kTebi = uint64_t{1} << 40U;
  require(isWithin(made.limits.connections, 1, kMillion), "connections");
  require(isWithin(made.limits.connectionsPerUser, 1, kMillion), "connections per user");
  require(isWithin(static_cast<uint64_t>(made.limits.idleExit.count()), 0, 86400), "idle exit");
  require(isWithin(static_cast<uint64_t>(made.http.connectTimeout.count()), 1, 3600), "time to connect");
  require(isWithin(static_cast<uint64_t>(made.http.noProgress.count()), 1, 3600), "time without progress");
  require(isWithin(made.http.maxAnswerBytes, 1024, kTebi), "bytes of an answer");
  require(isWithin(made.http.maxQueuedBytes, 1024, kTebi), "queued bytes");
  require(isWithin(made.http.connectionsPerHost, 1, kMillion), "connections to a host");
  require(isWithin(made.http.connections, 1, kMillion), "connections to servers");
  require(made.limits.maxUploadBytes <= made.http.maxQueuedBytes / 2, "an upload fits beside others");
  const auto isCapital = [](char letter) { return letter >= 'A' && letter <= 'Z'; };
  const auto& country = made.country;
  require(!country || (country->size() == 2 && std::all_of(country->begin(), country->end(), isCapital)),
          "a country has two letters");
  const auto& root = made.bundleRoot;
  require(root.empty() || (root.front() == '/' && root.back() != '/'),
          "the bundles' root is absolute or nothing");
  require((root + "/").find("/../") == std::string::npos && root.find('\0') == std::string::npos,
          "and leads nowhere else");
}

// Of one key: who decides it.
template <class T>
void checkField(const TomlNode& later, const char* section, const char* key, const T& both, const T& first,
                const T& second) {
  const auto* table = later.find(section);
  if (table == nullptr || table->find(key) == nullptr) {
    require(both == first, "a key that the later file does not have stays as it was");
    if (!(first == second)) reached("earlier value stays");
  } else {
    require(both == first || both == second, "a key has the value of one of the files");
    if (!(first == second) && both == second) reached("later file wins");
  }
}

void checkFields(const TomlNode& later, const Configuration& both, const Configuration& first,
                 const Configuration& second) {
  checkField(later, "log", "level", both.logLevel, first.logLevel, second.logLevel);
  checkField(later, "locale", "country", both.country, first.country, second.country);
  checkField(later, "bundles", "root", both.bundleRoot, first.bundleRoot, second.bundleRoot);
  const auto limits = [&](const char* key, auto member) {
    checkField(later, "limits", key, both.limits.*member, first.limits.*member, second.limits.*member);
  };
  limits("idle_exit_seconds", &Configuration::Limits::idleExit);
  limits("connections", &Configuration::Limits::connections);
  limits("connections_per_user", &Configuration::Limits::connectionsPerUser);
  const auto http = [&](const char* key, auto member) {
    checkField(later, "http", key, both.http.*member, first.http.*member, second.http.*member);
  };
  http("connect_timeout_seconds", &Configuration::Http::connectTimeout);
  http("no_progress_seconds", &Configuration::Http::noProgress);
  http("max_answer_bytes", &Configuration::Http::maxAnswerBytes);
  http("max_queued_bytes", &Configuration::Http::maxQueuedBytes);
  http("connections_per_host", &Configuration::Http::connectionsPerHost);
  http("connections", &Configuration::Http::connections);
  const Configuration untouched;
  if (both.logLevel && both.country && !both.bundleRoot.empty() && both.problems.empty() &&
      both.http.connections != untouched.http.connections && both.limits.idleExit.count() != 0) {
    reached("every field");
  }
}

Configuration loadWith(std::optional<std::string_view> main, std::optional<std::string_view> dropIn) {
  folder().clear();
  if (main) folder().write("tarneld.toml", *main);
  if (dropIn) folder().write("tarneld.d/any.toml", *dropIn);
  return loadConfiguration(folder().path());
}

void checkConfiguration(std::string_view text) {
  constexpr std::string_view kBetween = "\n---\n";
  const auto split = std::min(text.find(kBetween), text.size());
  const auto main = text.substr(0, split);
  const auto dropIn = text.substr(std::min(split + kBetween.size(), text.size()));
  const auto first = loadWith(main, std::nullopt);
  const auto second = loadWith(std::nullopt, dropIn);
  const auto both = loadWith(main, dropIn);
  checkRanges(both);
  checkProblems(both.problems, folder().path() + "/tarneld.toml", main);
  checkProblems(both.problems, folder().path() + "/tarneld.d/any.toml", dropIn);
  if (both.problems.empty()) reached("nothing wrong");
  const auto fitted = [](const ConfigurationProblem& problem) {
    return problem.text.find("limits.max_upload_bytes is ") != std::string::npos;
  };
  if (std::any_of(both.problems.begin(), both.problems.end(), fitted)) reached("upload fitted");
  const auto later = parseToml(dropIn);
  if (!parseToml(main)) {
    require(first.limits == Configuration::Limits() && first.http == Configuration::Http(),
            "nothing of a broken file is used");
    require(first.problems.size() == 1, "and that is said once");
    reached("syntax error");
  }
  checkFields(later ? *later : TomlNode{.kind = TomlNode::Kind::table}, both, first, second);
}

// --- entitlements.d ---

template <class Look>
std::optional<uint32_t> numberOf(const TomlNode* node, Look look) {
  if (node == nullptr) return std::nullopt;
  if (const auto* number = node->scalar.integer()) {
    if (*number < 0 || *number >= UINT32_MAX) return std::nullopt;
    return static_cast<uint32_t>(*number);
  }
  const auto* name = node->scalar.string();
  return name == nullptr ? std::nullopt : look(name->c_str());
}

std::optional<uint32_t> groupNamed(const char* name) {
  const auto* entry = ::getgrnam(name);
  if (entry == nullptr) return std::nullopt;
  reached("group by name");
  return entry->gr_gid;
}

std::optional<uint32_t> userNamed(const char* name) {
  const auto* entry = ::getpwnam(name);
  return entry == nullptr ? std::nullopt : std::optional<uint32_t>(entry->pw_uid);
}

std::optional<std::string> textOf(const TomlNode* node) {
  const auto* text = node == nullptr ? nullptr : node->scalar.string();
  return text == nullptr ? std::nullopt : std::optional(*text);
}

// What the grant says, in other words than the code's; nothing when it must not be used.
std::optional<EntitlementRule> ruleOf(const TomlNode& grant) {
  static const std::set<std::string_view> kKeys{"entitlement", "group", "user", "unit", "executable"};
  for (const auto& [key, node] : grant.entries) {
    if (!kKeys.contains(key) || textOf(&node).value_or("").find('\0') != std::string::npos)
      return std::nullopt;
  }
  EntitlementRule rule{.entitlement = textOf(grant.find("entitlement")).value_or(""),
                       .group = numberOf(grant.find("group"), groupNamed),
                       .user = numberOf(grant.find("user"), userNamed),
                       .unit = textOf(grant.find("unit")),
                       .executable = textOf(grant.find("executable"))};
  const auto isLost = [&grant](const char* key, bool taken) { return grant.find(key) != nullptr && !taken; };
  if (rule.entitlement.empty() || isLost("group", rule.group.has_value()) ||
      isLost("user", rule.user.has_value()) || isLost("unit", rule.unit.has_value()) ||
      isLost("executable", rule.executable.has_value())) {
    return std::nullopt;
  }
  if (rule.unit && !rule.unit->ends_with(".service") && !rule.unit->ends_with(".scope")) return std::nullopt;
  if (rule.executable && !rule.executable->starts_with('/')) return std::nullopt;
  if (!rule.group && !rule.user && !rule.unit) return std::nullopt;
  return rule;
}

bool isSame(const EntitlementRule& a, const EntitlementRule& b) {
  return a.entitlement == b.entitlement && a.group == b.group && a.user == b.user && a.unit == b.unit &&
         a.executable == b.executable;
}

class KnownProcess final : public PeerProcess {
 public:
  explicit KnownProcess(const EntitlementRule& rule) : rule_(rule) {}
  std::optional<std::string> executable() const override { return rule_.executable.value_or("/usr/bin/any"); }
  std::optional<std::string> unit() const override { return rule_.unit.value_or("any.scope"); }
  bool isAlive() const override { return true; }

 private:
  const EntitlementRule rule_;
};

// A peer that the rule is about is let in; one that differs in a condition is not, by this rule alone.
void checkPeers(const EntitlementRule& rule) {
  EntitlementRules alone({rule});
  const PeerCredentials peer{.pid = 1,
                             .uid = rule.user.value_or(12),
                             .gid = rule.group.value_or(34),
                             .process = std::make_shared<KnownProcess>(rule)};
  require(alone.holds(peer, rule.entitlement), "a peer that fits holds the entitlement");
  require(!alone.holds(peer, rule.entitlement + "x"), "and no other");
  reached("peer let in");
  const auto requireOut = [&](const PeerCredentials& other) {
    require(!alone.holds(other, rule.entitlement), "all conditions must hold");
    reached("peer kept out");
  };
  auto other = peer;
  other.uid ^= 1U;
  if (rule.user) requireOut(other);
  other = peer;
  other.gid ^= 1U;
  if (rule.group) requireOut(other);
  other = peer;
  auto elsewhere = rule;
  if (rule.unit) elsewhere.unit = "x" + *rule.unit;
  if (rule.executable) elsewhere.executable = *rule.executable + "x";
  other.process = std::make_shared<KnownProcess>(elsewhere);
  if (rule.unit || rule.executable) requireOut(other);
  other.process = nullptr;
  if (rule.unit || rule.executable) requireOut(other);
  require(!alone.holds(PeerCredentials(), rule.entitlement), "nobody is let in unknown");
}

std::vector<EntitlementRule> expectedRules(const TomlNode& document) {
  std::vector<EntitlementRule> rules;
  const auto* grants = document.find("grant");
  if (grants == nullptr) return rules;
  if (grants->kind != TomlNode::Kind::array) reached("no list of grants");
  for (const auto& grant : grants->elements) {
    auto rule = grant.kind == TomlNode::Kind::table ? ruleOf(grant) : std::nullopt;
    reached(rule ? "grant" : "grant refused");
    if (!rule) continue;
    if (rule->user && grant.find("user")->scalar.integer() != nullptr) reached("user by number");
    if (rule->unit && rule->executable) reached("unit and executable");
    rules.push_back(*std::move(rule));
  }
  return rules;
}

void checkEntitlements(std::string_view text) {
  folder().clear();
  folder().write("entitlements.d/any.toml", text);
  std::vector<ConfigurationProblem> problems;
  const auto rules = EntitlementRules::load(folder().path(), problems);
  const auto path = folder().path() + "/entitlements.d/any.toml";
  for (const auto& problem : problems)
    require(problem.text.starts_with(path + ":"), "a problem names the file");
  checkProblems(problems, path, text);
  const auto document = parseToml(text);
  if (!document) {
    require(rules->rules().empty() && problems.size() == 1, "a broken file grants nothing, and that is said");
    return;
  }
  const auto expected = expectedRules(*document);
  require(std::equal(rules->rules().begin(), rules->rules().end(), expected.begin(), expected.end(), isSame),
          "what is granted is what is written");
  if (const auto* grants = document->find("grant")) {
    const bool isComplete =
        grants->kind == TomlNode::Kind::array && grants->elements.size() == expected.size();
    require(isComplete || !problems.empty(), "what is not granted is named");
  }
  for (size_t i = 0; i < expected.size() && i < 8; ++i) checkPeers(expected[i]);
}

}  // namespace

void runOne(std::span<const uint8_t> input) {
  InputReader reader(input);
  const auto kind = reader.line();
  if (kind.starts_with('c')) checkConfiguration(reader.rest());
  if (kind.starts_with('e')) checkEntitlements(reader.rest());
}

}  // namespace tarnel::fuzz

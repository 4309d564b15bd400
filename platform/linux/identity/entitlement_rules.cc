#include "platform/linux/identity/entitlement_rules.h"

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "base/file_access.h"
#include "platform/linux/configuration/toml_file.h"

namespace tarnel {

namespace {

// Entries of groups with many members are long; beyond this the name service is not believed.
constexpr size_t kMaxNameServiceBytes = 1U << 20U;

template <class Entry, class Lookup>
bool lookUp(const std::string& name, Entry& entry, std::vector<char>& buffer, Lookup lookup) {
  for (buffer.resize(4096); buffer.size() <= kMaxNameServiceBytes; buffer.resize(buffer.size() * 2)) {
    Entry* found = nullptr;
    const int failure = lookup(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
    if (failure == ERANGE) continue;
    return failure == 0 && found != nullptr;
  }
  return false;
}

std::optional<uint32_t> groupNumber(const std::string& name) {
  group entry{};
  std::vector<char> buffer;
  if (!lookUp(name, entry, buffer, ::getgrnam_r)) return std::nullopt;
  return entry.gr_gid;
}

std::optional<uint32_t> userNumber(const std::string& name) {
  passwd entry{};
  std::vector<char> buffer;
  if (!lookUp(name, entry, buffer, ::getpwnam_r)) return std::nullopt;
  return entry.pw_uid;
}

// Reads one grant; collects what is wrong with it.
class GrantReader {
 public:
  GrantReader(const std::string& path, std::vector<ConfigurationProblem>& problems)
      : path_(path), problems_(problems) {}

  std::optional<EntitlementRule> read(const TomlNode& grant) {
    if (grant.kind != TomlNode::Kind::table) {
      refuse(grant, "a grant must be a section that begins with [[grant]]");
      return std::nullopt;
    }
    for (const auto& [key, node] : grant.entries) readKey(key, node);
    if (good_ && rule_.entitlement.empty()) refuse(grant, "the grant has no entitlement = \"...\"");
    if (good_ && !rule_.group && !rule_.user && !rule_.unit) refuseConditions(grant);
    return good_ ? std::optional(std::move(rule_)) : std::nullopt;
  }

 private:
  void refuse(const TomlNode& node, const std::string& reason) {
    problems_.push_back({LogLevel::error, atLine(path_, node.line, reason + "; this grant is not used")});
    good_ = false;
  }

  void refuseConditions(const TomlNode& grant) {
    refuse(grant, rule_.executable
                      ? "executable alone proves nothing, because a user can make another program "
                        "look like it; add group, user or unit"
                      : "the grant names nobody; add group, user or unit");
  }

  void readKey(const std::string& key, const TomlNode& node) {
    if (key == "entitlement") {
      if (const auto* text = textOf(key, node)) rule_.entitlement = *text;
    } else if (key == "group") {
      rule_.group = numberOf(key, node, groupNumber);
    } else if (key == "user") {
      rule_.user = numberOf(key, node, userNumber);
    } else if (key == "unit") {
      readUnit(node);
    } else if (key == "executable") {
      readExecutable(node);
    } else {
      // A condition that nobody checks would make the grant wider than it was meant.
      refuse(node, "unknown key " + key);
    }
  }

  const std::string* textOf(const std::string& key, const TomlNode& node) {
    const std::string* text = node.scalar.string();
    if (text == nullptr || text->empty()) {
      refuse(node, key + " must be a text that is not empty");
      return nullptr;
    }
    // The system would take what stands before it for the whole name.
    if (text->find('\0') != std::string::npos) {
      refuse(node, key + " must hold no zero character");
      return nullptr;
    }
    return text;
  }

  void readUnit(const TomlNode& node) {
    const std::string* unit = textOf("unit", node);
    if (unit == nullptr) return;
    if (!unit->ends_with(".service") && !unit->ends_with(".scope")) {
      refuse(node, "unit must end in .service or .scope");
    }
    rule_.unit = *unit;
  }

  void readExecutable(const TomlNode& node) {
    const std::string* executable = textOf("executable", node);
    if (executable == nullptr) return;
    if (executable->front() != '/') refuse(node, "executable must be an absolute path");
    rule_.executable = *executable;
  }

  // A name, or the number itself.
  template <class Lookup>
  std::optional<uint32_t> numberOf(const std::string& key, const TomlNode& node, Lookup lookup) {
    if (const int64_t* number = node.scalar.integer()) {
      // The highest number means "nobody" to the kernel.
      if (*number >= 0 && *number < PeerCredentials::kNoId) return static_cast<uint32_t>(*number);
      refuse(node, key + " is no valid number");
      return std::nullopt;
    }
    const std::string* name = textOf(key, node);
    if (name == nullptr) return std::nullopt;
    const auto number = lookup(*name);
    if (!number || *number == PeerCredentials::kNoId) {
      refuse(node,
             "there is no " + key + " \"" + *name + "\" on this system; create it and restart the daemon");
      return std::nullopt;
    }
    return number;
  }

  const std::string& path_;
  std::vector<ConfigurationProblem>& problems_;
  EntitlementRule rule_;
  bool good_ = true;
};

void loadFile(const std::string& path, std::vector<EntitlementRule>& rules,
              std::vector<ConfigurationProblem>& problems) {
  const auto document = readTomlFile(path, problems);
  if (!document) return;
  for (const auto& [key, node] : document->entries) {
    if (key != "grant") {
      problems.push_back(unknownKey(path, node, key));
    } else if (node.kind != TomlNode::Kind::array) {
      problems.push_back(badValue(path, node, key, "a list of sections that begin with [[grant]]"));
    } else {
      for (const TomlNode& grant : node.elements) {
        if (auto rule = GrantReader(path, problems).read(grant)) rules.push_back(*std::move(rule));
      }
    }
  }
}

}  // namespace

std::unique_ptr<EntitlementRules> EntitlementRules::load(const std::string& configurationDirectory,
                                                         std::vector<ConfigurationProblem>& problems) {
  std::vector<EntitlementRule> rules;
  const std::string directory = configurationDirectory + "/entitlements.d";
  const std::vector<std::string> names = sortedEntries(directory, ".toml");
  if (names.empty()) {
    problems.push_back({LogLevel::warning, directory +
                                               ": holds no grant, so no client is let in; write one (see "
                                               "tarneld.conf(5)) and start the daemon anew"});
  }
  for (const std::string& name : names) {
    loadFile(directory + "/" + name, rules, problems);
  }
  return std::make_unique<EntitlementRules>(std::move(rules));
}

bool EntitlementRules::holds(const PeerCredentials& peer, std::string_view entitlement) {
  return std::any_of(rules_.begin(), rules_.end(), [this, &peer, entitlement](const EntitlementRule& rule) {
    return rule.entitlement == entitlement && matches(rule, peer);
  });
}

bool EntitlementRules::needsExecutable() const {
  return std::any_of(rules_.begin(), rules_.end(),
                     [](const EntitlementRule& rule) { return rule.executable.has_value(); });
}

std::optional<std::string> EntitlementRules::executableOf(const PeerCredentials& peer) const {
  if (peer.process == nullptr) return std::nullopt;
  if (!executableLookup_) return peer.process->executable();
  auto path = executableLookup_(peer.pid);
  return peer.process->isAlive() ? std::move(path) : std::nullopt;
}

bool EntitlementRules::matches(const EntitlementRule& rule, const PeerCredentials& peer) const {
  if (rule.group && *rule.group != peer.gid) return false;
  if (rule.user && *rule.user != peer.uid) return false;
  // Asked only when all else holds: it costs a look into /proc.
  if (rule.unit && (peer.process == nullptr || peer.process->unit() != rule.unit)) return false;
  if (rule.executable && executableOf(peer) != rule.executable) return false;
  return rule.group || rule.user || rule.unit;
}

}  // namespace tarnel

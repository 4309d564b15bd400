#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "ipc/entitlements.h"
#include "platform/linux/configuration/configuration.h"

namespace tarnel {

// One [[grant]] of a file in entitlements.d/. All conditions that are given must hold.
struct EntitlementRule {
  std::string entitlement;
  std::optional<uint32_t> group;  // the peer's effective group
  std::optional<uint32_t> user;   // the peer's effective user
  std::optional<std::string> unit;
  std::optional<std::string> executable;
};

// Entitlements granted by the administrator's rules. Without a rule nobody holds anything.
//
// A group that only a set-group-id program has is the one proof of which program connected. An executable's
// path can be forged by its user and therefore only narrows a group, a user or a unit: a rule that has
// nothing else is refused.
//
// Threads: any; immutable once set up.
class EntitlementRules final : public Entitlements {
 public:
  explicit EntitlementRules(std::vector<EntitlementRule> rules) : rules_(std::move(rules)) {}

  // Reads entitlements.d/*.toml of the configuration directory. Names of groups and users are looked up now,
  // because a confined process may not be able to. A rule that cannot be used is left out, and a problem
  // names it; the others stand.
  static std::unique_ptr<EntitlementRules> load(const std::string& configurationDirectory,
                                                std::vector<ConfigurationProblem>& problems);

  bool holds(const PeerCredentials& peer, std::string_view entitlement) override;

  // How to look at a process's executable when this process may not itself (see ProcessWitness): gives the
  // path for a process id, or nothing. Set before the first question.
  using ExecutableLookup = std::function<std::optional<std::string>(int32_t pid)>;
  void setExecutableLookup(ExecutableLookup lookup) { executableLookup_ = std::move(lookup); }
  // True when a rule asks for an executable, which a confined process cannot see without a lookup.
  bool needsExecutable() const;

  const std::vector<EntitlementRule>& rules() const noexcept { return rules_; }

 private:
  bool matches(const EntitlementRule& rule, const PeerCredentials& peer) const;
  std::optional<std::string> executableOf(const PeerCredentials& peer) const;

  std::vector<EntitlementRule> rules_;
  ExecutableLookup executableLookup_;
};

}  // namespace tarnel

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/entitlements.h"
#include "platform/linux/configuration.h"

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
// Threads: any; immutable.
class EntitlementRules final : public Entitlements {
 public:
  explicit EntitlementRules(std::vector<EntitlementRule> rules) : rules_(std::move(rules)) {}

  // Reads entitlements.d/*.toml of the configuration directory. Names of groups and users are looked up now,
  // because a confined process may not be able to. A rule that cannot be used is left out, and a problem
  // names it; the others stand.
  static std::unique_ptr<EntitlementRules> load(const std::string& configurationDirectory,
                                                std::vector<ConfigurationProblem>& problems);

  bool holds(const PeerCredentials& peer, std::string_view entitlement) override;

  const std::vector<EntitlementRule>& rules() const noexcept { return rules_; }

 private:
  std::vector<EntitlementRule> rules_;
};

}  // namespace tarnel

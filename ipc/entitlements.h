#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// What the kernel says about a peer's process beyond its credentials. Threads: any.
//
// Both facts hold for the process that connected, as long as it lives; they say where its code was loaded
// from and who started it, and are no proof of which program holds the socket now.
class PeerProcess {
 public:
  PeerProcess() = default;
  PeerProcess(const PeerProcess&) = delete;
  PeerProcess& operator=(const PeerProcess&) = delete;
  virtual ~PeerProcess() = default;

  // Absolute path of the running program; nothing when the process is gone, its file was deleted, or this
  // process may not look at it, which holds for every process that confined itself.
  virtual std::optional<std::string> executable() const = 0;
  // Name of the systemd unit that runs it ("app.service"); nothing when there is none, or as above.
  virtual std::optional<std::string> unit() const = 0;
  // Whether it still lives: then nobody else has had its number since it connected.
  virtual bool isAlive() const = 0;
};

// A peer as it was when it connected. Every field comes from the kernel.
struct PeerCredentials {
  // Before anything is known: no process, and ids that no rule can name.
  static constexpr uint32_t kNoId = UINT32_MAX;

  int32_t pid = 0;                             // 0: unknown, or in another pid namespace
  uint32_t uid = kNoId;                        // effective user
  uint32_t gid = kNoId;                        // effective group
  std::shared_ptr<const PeerProcess> process;  // null: nothing more can be known
};

// Who may do what. Threads: any.
class Entitlements {
 public:
  Entitlements() = default;
  Entitlements(const Entitlements&) = delete;
  Entitlements& operator=(const Entitlements&) = delete;
  virtual ~Entitlements() = default;

  // Whether the peer holds the boolean entitlement of that name; false when nothing grants it.
  virtual bool holds(const PeerCredentials& peer, std::string_view entitlement) = 0;
};

}  // namespace tarnel

#pragma once

// Numbers of the kernel's interface that older headers lack.

namespace tarnel::kernel {

inline constexpr int kSoPeerPidFd = 77;  // SO_PEERPIDFD, Linux 6.5

// Landlock, by ABI version; see landlock(7).
inline constexpr unsigned long long kLandlockAccessFsRefer = 1ULL << 13U;     // ABI 2
inline constexpr unsigned long long kLandlockAccessFsTruncate = 1ULL << 14U;  // ABI 3
inline constexpr unsigned long long kLandlockAccessFsIoctlDev = 1ULL << 15U;  // ABI 5
inline constexpr unsigned long long kLandlockAccessNetBindTcp = 1ULL << 0U;   // ABI 4
inline constexpr unsigned long long kLandlockAccessNetConnectTcp = 1ULL << 1U;
inline constexpr unsigned long long kLandlockScopeAbstractUnixSocket = 1ULL << 0U;  // ABI 6
inline constexpr unsigned long long kLandlockScopeSignal = 1ULL << 1U;
inline constexpr unsigned kLandlockRuleNetPort = 2;

// struct landlock_ruleset_attr as of ABI 6. The kernel takes the leading part that its ABI knows.
struct LandlockRulesetAttr {
  unsigned long long handled_access_fs;
  unsigned long long handled_access_net;
  unsigned long long scoped;
};

// struct landlock_net_port_attr.
struct LandlockNetPortAttr {
  unsigned long long allowed_access;
  unsigned long long port;
};

}  // namespace tarnel::kernel

#include "platform/linux/sandbox/landlock.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <utility>

#include "base/file_access.h"
#include "base/kernel_constants.h"

namespace tarnel {

namespace {

using Rights = unsigned long long;

constexpr Rights kReadFile = LANDLOCK_ACCESS_FS_READ_FILE;
constexpr Rights kReadDirectory = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr Rights kWriteFile = LANDLOCK_ACCESS_FS_WRITE_FILE | kernel::kLandlockAccessFsTruncate;
constexpr Rights kWriteDirectory = kWriteFile | LANDLOCK_ACCESS_FS_REMOVE_FILE |
                                   LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_MAKE_DIR |
                                   LANDLOCK_ACCESS_FS_MAKE_REG | LANDLOCK_ACCESS_FS_MAKE_SOCK;
// Never granted, but asked for, so that they are denied.
constexpr Rights kForbidden = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_MAKE_CHAR |
                              LANDLOCK_ACCESS_FS_MAKE_BLOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO |
                              LANDLOCK_ACCESS_FS_MAKE_SYM | kernel::kLandlockAccessFsRefer |
                              kernel::kLandlockAccessFsIoctlDev;

int supportedAbi() {
  return static_cast<int>(
      ::syscall(SYS_landlock_create_ruleset, nullptr, size_t{0}, LANDLOCK_CREATE_RULESET_VERSION));
}

Rights knownFileRights(int abi) {
  Rights rights = kReadDirectory | kWriteDirectory | kForbidden;
  if (abi < 2) rights &= ~kernel::kLandlockAccessFsRefer;
  if (abi < 3) rights &= ~kernel::kLandlockAccessFsTruncate;
  if (abi < 5) rights &= ~kernel::kLandlockAccessFsIoctlDev;
  return rights;
}

kernel::LandlockRulesetAttr attributesFor(const SandboxProfile& profile, int abi) {
  kernel::LandlockRulesetAttr attributes{
      .handled_access_fs = knownFileRights(abi), .handled_access_net = 0, .scoped = 0};
  if (abi >= 4) {
    attributes.handled_access_net = kernel::kLandlockAccessNetBindTcp;
    if (profile.connectTcp) attributes.handled_access_net |= kernel::kLandlockAccessNetConnectTcp;
  }
  if (abi >= 6) {
    attributes.scoped = kernel::kLandlockScopeAbstractUnixSocket | kernel::kLandlockScopeSignal;
  }
  return attributes;
}

// The structure's part that the kernel knows.
size_t attributeSize(int abi) {
  if (abi < 4) return offsetof(kernel::LandlockRulesetAttr, handled_access_net);
  if (abi < 6) return offsetof(kernel::LandlockRulesetAttr, scoped);
  return sizeof(kernel::LandlockRulesetAttr);
}

MaybeError allowPath(const UniqueFd& ruleset, const std::string& path, bool writable, Rights known) {
  const UniqueFd fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (!fd) {
    if (errno == ENOENT || errno == ENOTDIR) return std::nullopt;
    return systemError(path, "cannot be opened for a sandbox rule");
  }
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return systemError(path, "cannot be examined");
  Rights rights = S_ISDIR(status.st_mode) ? kReadDirectory : kReadFile;
  if (writable) rights |= S_ISDIR(status.st_mode) ? kWriteDirectory : kWriteFile;
  landlock_path_beneath_attr attributes{};
  attributes.allowed_access = rights & known;
  attributes.parent_fd = fd.get();
  if (::syscall(SYS_landlock_add_rule, ruleset.get(), LANDLOCK_RULE_PATH_BENEATH, &attributes, 0U) != 0) {
    return systemError(path, "cannot be made a sandbox rule");
  }
  return std::nullopt;
}

MaybeError allowPort(const UniqueFd& ruleset, uint16_t port, Rights rights) {
  const kernel::LandlockNetPortAttr attributes{.allowed_access = rights, .port = port};
  if (::syscall(SYS_landlock_add_rule, ruleset.get(), kernel::kLandlockRuleNetPort, &attributes, 0U) != 0) {
    return systemError("port " + std::to_string(port), "cannot be made a sandbox rule");
  }
  return std::nullopt;
}

MaybeError addRules(const UniqueFd& ruleset, const SandboxProfile& profile, int abi) {
  const Rights known = knownFileRights(abi);
  for (const std::string& path : profile.read) {
    if (auto error = allowPath(ruleset, path, false, known)) return error;
  }
  for (const std::string& path : profile.readWrite) {
    if (auto error = allowPath(ruleset, path, true, known)) return error;
  }
  if (abi < 4) return std::nullopt;
  for (const uint16_t port : profile.bindTcp) {
    if (auto error = allowPort(ruleset, port, kernel::kLandlockAccessNetBindTcp)) return error;
  }
  if (!profile.connectTcp) return std::nullopt;
  for (const uint16_t port : *profile.connectTcp) {
    if (auto error = allowPort(ruleset, port, kernel::kLandlockAccessNetConnectTcp)) return error;
  }
  return std::nullopt;
}

}  // namespace

Result<Landlock> Landlock::prepare(const SandboxProfile& profile) {
  const int abi = supportedAbi();
  if (abi < 1) {
    return systemError(
        "Landlock",
        "the kernel does not offer it; use Linux 5.13 or later and name landlock in the kernel "
        "parameter lsm=");
  }
  const kernel::LandlockRulesetAttr attributes = attributesFor(profile, abi);
  UniqueFd ruleset(
      static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attributes, attributeSize(abi), 0U)));
  if (!ruleset) return systemError("Landlock", "a ruleset cannot be made");
  if (auto error = addRules(ruleset, profile, abi)) return *error;
  return Landlock(std::move(ruleset));
}

std::optional<std::string> Landlock::restrictSelf() const {
  if (::syscall(SYS_landlock_restrict_self, ruleset_.get(), 0U) == 0) return std::nullopt;
  return systemError("Landlock", "the rules cannot be entered").localizedDescription();
}

}  // namespace tarnel

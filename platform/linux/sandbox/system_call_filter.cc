#include "platform/linux/sandbox/system_call_filter.h"

#include <sched.h>
#include <seccomp.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <system_error>
#include <utility>

namespace tarnel {

namespace {

constexpr uint32_t kDeny = SCMP_ACT_ERRNO(EPERM);

// By name, so that calls an architecture or the library does not know are skipped.
constexpr std::array kAlwaysDenied{
    "execve",
    "execveat",
    "fork",
    "vfork",
    "process_vm_readv",
    "process_vm_writev",
    "pidfd_getfd",
    "kcmp",
    "process_madvise",
    "mount",
    "umount2",
    "pivot_root",
    "chroot",
    "move_mount",
    "open_tree",
    "fsopen",
    "fsconfig",
    "fsmount",
    "fspick",
    "mount_setattr",
    "unshare",
    "setns",
    "bpf",
    "perf_event_open",
    "userfaultfd",
    "io_uring_setup",
    "io_uring_enter",
    "io_uring_register",
    "keyctl",
    "add_key",
    "request_key",
    "init_module",
    "finit_module",
    "delete_module",
    "kexec_load",
    "kexec_file_load",
    "reboot",
    "swapon",
    "swapoff",
    "acct",
    "quotactl",
    "quotactl_fd",
    "syslog",
    "vhangup",
    "settimeofday",
    "clock_settime",
    "clock_settime64",
    "adjtimex",
    "clock_adjtime",
    "sethostname",
    "setdomainname",
    "ioperm",
    "iopl",
    "modify_ldt",
    "lookup_dcookie",
    "open_by_handle_at",
    "name_to_handle_at",
    "mknod",
    "mknodat",
    "fanotify_init",
};

// The leak checker traces its own process from a helper that it clones.
#if defined(__SANITIZE_ADDRESS__)
constexpr bool kMayTraceItself = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
constexpr bool kMayTraceItself = true;
#else
constexpr bool kMayTraceItself = false;
#endif
#else
constexpr bool kMayTraceItself = false;
#endif

class FilterBuilder {
 public:
  explicit FilterBuilder(scmp_filter_ctx context) : context_(context) {}

  void deny(const char* name) { denyNumber(seccomp_syscall_resolve_name(name)); }

  // False when there is no call of that name.
  bool denyKnown(const std::string& name) {
    const int number = seccomp_syscall_resolve_name(name.c_str());
    if (number == __NR_SCMP_ERROR) return false;
    denyNumber(number);
    return true;
  }

  void denyNewProcesses() {
    if (kMayTraceItself) return;
    denyNumber(SCMP_SYS(ptrace));
    // Whatever shares no thread group is a process of its own.
    note(seccomp_rule_add(context_, kDeny, SCMP_SYS(clone), 1,
                          SCMP_A0(SCMP_CMP_MASKED_EQ, static_cast<scmp_datum_t>(CLONE_THREAD), 0)));
    // Its flags lie in memory, where a filter cannot look; callers then use clone.
    note(seccomp_rule_add(context_, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(clone3), 0));
  }

  void limitFamilies(const std::vector<int>& allowed) {
    const int highest = allowed.empty() ? -1 : *std::max_element(allowed.begin(), allowed.end());
    for (const int call : {SCMP_SYS(socket), SCMP_SYS(socketpair)}) {
      for (int family = 0; family < highest; ++family) {
        if (std::find(allowed.begin(), allowed.end(), family) == allowed.end()) {
          refuseFamily(call, SCMP_A0_64(SCMP_CMP_EQ, static_cast<scmp_datum_t>(family)));
        }
      }
      refuseFamily(call, SCMP_A0_64(SCMP_CMP_GE, static_cast<scmp_datum_t>(highest + 1)));
    }
    // Of netlink, name resolution needs the routing family (0) alone.
    note(seccomp_rule_add(context_, kDeny, SCMP_SYS(socket), 2,
                          SCMP_A0_64(SCMP_CMP_EQ, static_cast<scmp_datum_t>(AF_NETLINK)),
                          SCMP_A2_64(SCMP_CMP_NE, static_cast<scmp_datum_t>(0))));
  }

  // Typing into the terminal that the process was started from.
  void denyTerminalInput() {
    note(seccomp_rule_add(context_, kDeny, SCMP_SYS(ioctl), 1,
                          SCMP_A1(SCMP_CMP_MASKED_EQ, static_cast<scmp_datum_t>(0xFFFFFFFF),
                                  static_cast<scmp_datum_t>(TIOCSTI))));
  }

  int failure() const { return failure_; }

 private:
  void denyNumber(int number) {
    if (number < 0) return;  // not of this architecture
    note(seccomp_rule_add(context_, kDeny, number, 0));
  }
  void refuseFamily(int call, const scmp_arg_cmp& comparison) {
    note(seccomp_rule_add_array(context_, SCMP_ACT_ERRNO(EAFNOSUPPORT), call, 1, &comparison));
  }
  void note(int result) {
    if (result < 0 && result != -EEXIST && failure_ == 0) failure_ = -result;
  }

  scmp_filter_ctx context_;
  int failure_ = 0;
};

Error filterError(const std::string& action, int code) {
  return Error("TarnelSandboxErrorDomain", code,
               "seccomp: " + action + ": " + std::error_code(code, std::generic_category()).message());
}

}  // namespace

Result<SystemCallFilter> SystemCallFilter::prepare(const SandboxProfile& profile) {
  std::shared_ptr<void> context(seccomp_init(SCMP_ACT_ALLOW), [](void* filter) {
    if (filter != nullptr) seccomp_release(filter);
  });
  if (context == nullptr) return filterError("a filter cannot be made", ENOMEM);
  FilterBuilder builder(context.get());
  for (const char* name : kAlwaysDenied) builder.deny(name);
  builder.denyNewProcesses();
  builder.limitFamilies(profile.families);
  builder.denyTerminalInput();
  for (const std::string& name : profile.deniedCalls) {
    if (!builder.denyKnown(name)) {
      return filterError("the profile's calls.deny names \"" + name + "\", which is no system call", EINVAL);
    }
  }
  if (builder.failure() != 0) return filterError("a rule cannot be made", builder.failure());
  return SystemCallFilter(std::move(context));
}

std::optional<std::string> SystemCallFilter::load() const {
  const int result = seccomp_load(context_.get());
  if (result == 0) return std::nullopt;
  return filterError("the filter cannot be entered; use a kernel with CONFIG_SECCOMP_FILTER", -result)
      .localizedDescription();
}

}  // namespace tarnel

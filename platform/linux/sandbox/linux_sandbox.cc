#include "platform/linux/sandbox/linux_sandbox.h"

#include <dirent.h>
#include <fcntl.h>
#include <netdb.h>
#include <pwd.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <ctime>
#include <memory>
#include <utility>
#include <vector>

#include "base/file_access.h"
#include "platform/linux/sandbox/landlock.h"
#include "platform/linux/sandbox/system_call_filter.h"

namespace tarnel {

namespace {

// ThreadSanitizer keeps a thread of its own.
#if defined(__SANITIZE_THREAD__)
constexpr int kRuntimeThreads = 1;
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
constexpr int kRuntimeThreads = 1;
#else
constexpr int kRuntimeThreads = 0;
#endif
#else
constexpr int kRuntimeThreads = 0;
#endif

int countThreads() {
  const std::unique_ptr<DIR, int (*)(DIR*)> tasks(::opendir("/proc/self/task"), &::closedir);
  if (tasks == nullptr) return -1;
  int count = 0;
  while (const dirent* entry = ::readdir(tasks.get())) {
    if (entry->d_name[0] != '.') ++count;
  }
  return count;
}

std::optional<std::string> checkThreads() {
  const int count = countThreads();
  if (count < 0) return "the threads of this process cannot be counted; mount /proc";
  if (count > 1 + kRuntimeThreads) {
    return "the process already has " + std::to_string(count) +
           " threads, and those would stay unconfined; enter the sandbox before starting any";
  }
  return std::nullopt;
}

bool isProfileName(std::string_view name) {
  return !name.empty() && name.front() != '.' && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

}  // namespace

LinuxSandbox::LinuxSandbox(std::string configurationDirectory, SandboxVariables variables)
    : configurationDirectory_(std::move(configurationDirectory)), variables_(std::move(variables)) {}

std::optional<std::string> LinuxSandbox::enter(std::string_view profileName) {
  if (!isProfileName(profileName))
    return "\"" + std::string(profileName) + "\" is no name of a sandbox profile";
  const std::string path = configurationDirectory_ + "/sandbox.d/" + std::string(profileName) + ".profile";
  const auto profile = readSandboxProfile(path, variables_);
  if (!profile) return profile.error().localizedDescription();
  const auto rules = Landlock::prepare(*profile);
  if (!rules) return rules.error().localizedDescription();
  const auto filter = SystemCallFilter::prepare(*profile);
  if (!filter) return path + ": " + filter.error().localizedDescription();

  if (auto failure = checkThreads()) return failure;
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1UL, 0UL, 0UL, 0UL) != 0) {
    return systemError("no_new_privs", "cannot be set").localizedDescription();
  }
  if (auto failure = rules->restrictSelf()) return failure;
  if (auto failure = filter->load()) return failure;
  return probe();
}

std::optional<std::string> LinuxSandbox::probe() const {
  constexpr char kRemedy[] =
      "; the sandbox is not effective, check the profile and the kernel's configuration";
  // The root may be listed by everybody, so only the sandbox can forbid it.
  if (UniqueFd(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC))) {
    return std::string("probe: the root directory can still be listed") + kRemedy;
  }
  const std::string outside = configurationDirectory_ + "/.sandbox-probe";
  if (UniqueFd(::open(outside.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600))) {
    ::unlink(outside.c_str());
    return "probe: " + outside + " can still be created" + kRemedy;
  }
  // Unfiltered, an empty name is not found.
  std::array<char*, 1> none{nullptr};
  if (::execve("", none.data(), none.data()) == 0 || errno != EPERM) {
    return std::string("probe: programs can still be started") + kRemedy;
  }
  return std::nullopt;
}

SandboxVariables sandboxVariables(const Directories& directories, const std::string& bundleFolder,
                                  const std::string& bundleRoot) {
  const std::string& messages = directories.messageLogDirectory();
  return {{"RUNTIME", directories.runtime()},
          {"STATE", directories.state()},
          {"LOGS", directories.logs()},
          {"CONFIGURATION", directories.configuration()},
          {"MESSAGE_LOGS", messages.substr(0, messages.rfind('/'))},
          {"BUNDLE", bundleFolder},
          {"BUNDLE_ROOT", bundleRoot}};
}

void preloadLazyFacilities() {
  ::tzset();
  const time_t now = ::time(nullptr);
  std::tm local{};
  ::localtime_r(&now, &local);

  std::vector<char> buffer(65536);
  passwd entry{};
  passwd* found = nullptr;
  ::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found);

  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* addresses = nullptr;
  if (::getaddrinfo("localhost", "https", &hints, &addresses) == 0) ::freeaddrinfo(addresses);
}

}  // namespace tarnel

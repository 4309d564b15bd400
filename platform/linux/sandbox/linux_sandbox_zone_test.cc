// The local time zone of a confined process.

#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "platform/fake/fake_log.h"
#include "platform/linux/device/linux_locale_information.h"
#include "platform/linux/sandbox/linux_sandbox_test_fixture.h"
#include "testing/zone_file_test_support.h"

namespace tarnel {
namespace {

// A process beside this one that acts whenever it is told to, and is not confined with it.
class Helper {
 public:
  explicit Helper(const std::vector<std::function<void()>>& acts) {
    if (::socketpair(AF_UNIX, SOCK_STREAM, 0, ends_.data()) != 0 || ::fork() != 0) return;
    char byte = 0;
    for (const auto& act : acts) {
      if (::read(ends_[1], &byte, 1) != 1) break;
      act();
      if (::write(ends_[1], &byte, 1) != 1) break;
    }
    ::_exit(0);
  }
  // Returns when the next act is done.
  void act() const {
    char byte = 0;
    if (::write(ends_[0], &byte, 1) != 1 || ::read(ends_[0], &byte, 1) != 1) ::_exit(1);
  }

 private:
  std::array<int, 2> ends_{};
};

// With a folder of the test's own in the place of /etc, whose localtime leads to one zone after the other.
TEST_F(LinuxSandboxTest, AnotherLocalTimeZoneIsFollowed) {
  folder_.write("system/zones/east", zoneText(5 * 3600));
  folder_.write("system/zones/west", zoneText(-3600));
  folder_.write("outside/south", zoneText(7200));
  const auto linkTo = [this](const std::string& target) {
    std::filesystem::create_symlink(target, path("system/new"));
    std::filesystem::rename(path("system/new"), path("system/localtime"));
  };
  const std::string said = runInChild([&]() -> std::string {
    const bool isRoot = ::geteuid() == 0;
    if (::unshare(CLONE_NEWNS | (isRoot ? 0 : CLONE_NEWUSER)) != 0) return "no namespace";
    if (::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return "no namespace";
    if (::mount(path("system").c_str(), "/etc", nullptr, MS_BIND, nullptr) != 0) return "no namespace";
    ::unsetenv("TZ");
    linkTo("zones/east");
    fake::FakeLog log;
    LinuxLocaleInformation locale(
        std::nullopt, [](const char*) { return nullptr; }, log);
    const Helper helper(
        {[&] { linkTo("/etc/zones/west"); }, [&] { linkTo(path("outside/south")); },
         [&] { std::filesystem::rename(path("system/zones/east"), path("system/localtime")); }});
    if (auto failure = sandbox().enter(kName)) return "not confined: " + *failure;
    std::string offsets = std::to_string(locale.secondsFromGMT(1700000000));
    for (int act = 0; act < 3; ++act) {
      helper.act();
      offsets += " " + std::to_string(locale.secondsFromGMT(1700000000));
    }
    for (const auto& line : log.lines()) offsets += "\n" + line.text;
    return offsets;
  });
  if (said == "no namespace") GTEST_SKIP() << "needs a mount namespace";
  EXPECT_EQ(
      said,
      "18000 -3600 -3600 18000\n"
      "LinuxLocaleInformation(secondsFromGMT): the time zone has changed, but /etc/localtime: cannot be "
      "opened: Permission denied; the zone of before stays. Let the daemon read the file, also in its "
      "sandbox's profile, or restart it");
}

}  // namespace
}  // namespace tarnel

#include "platform/linux/sandbox/linux_sandbox.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <thread>

#include "base/file_access.h"
#include "platform/linux/sandbox/linux_sandbox_test_fixture.h"

namespace tarnel {
namespace {

std::string outcome(int result) {
  return result >= 0 ? "done" : strerrorname_np(errno);
}

TEST_F(LinuxSandboxTest, TheShippedProfileConfines) {
  EXPECT_EQ(enterInChild(), "confined");
}

TEST_F(LinuxSandboxTest, NothingOutsideIsWrittenOrRead) {
  EXPECT_EQ(
      confined([this] { return outcome(::open(path("outside/new").c_str(), O_WRONLY | O_CREAT, 0600)); }),
      "EACCES");
  EXPECT_EQ(confined([this] { return outcome(::open(path("outside/file").c_str(), O_RDONLY)); }), "EACCES");
  EXPECT_EQ(confined([this] { return outcome(::unlink(path("outside/file").c_str())); }), "EACCES");
  EXPECT_EQ(confined([this] { return outcome(::truncate(path("outside/file").c_str(), 0)); }), "EACCES");
  EXPECT_EQ(confined([this] {
              return outcome(::rename(path("outside/file").c_str(), path("state/file").c_str()));
            }),
            "EACCES");
  EXPECT_EQ(confined([this] { return outcome(::open(path("etc/new").c_str(), O_WRONLY | O_CREAT, 0600)); }),
            "EACCES");
  EXPECT_EQ(folder_.read("outside/file"), "secret");
}

TEST_F(LinuxSandboxTest, TheInstancesDirectoriesServeTheirPurpose) {
  EXPECT_EQ(confined([this] {
              if (auto error = replaceFile(path("state/settings.toml"), "a = 1\n", 0600))
                return error->description();
              if (auto error = replaceFile(path("logs/messages.log"), "line\n", 0600))
                return error->description();
              if (::mkdir(path("logs/deep").c_str(), 0700) != 0) return outcome(-1);
              return readFirstLine(path("bundle/version")).value_or("none") +
                     (readFile(profilePath()) ? " and the profile" : "");
            }),
            "8.2 and the profile");
}

TEST_F(LinuxSandboxTest, TheServicesSocketCanBeBound) {
  EXPECT_EQ(confined([this] {
              const UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
              sockaddr_un address{};
              address.sun_family = AF_UNIX;
              const std::string name = path("run/com.orvane.tarneld");
              name.copy(&address.sun_path[0], sizeof(address.sun_path) - 1);
              if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0)
                return outcome(-1);
              if (::listen(fd.get(), 1) != 0) return outcome(-1);
              return outcome(::unlink(name.c_str()));
            }),
            "done");
}

TEST_F(LinuxSandboxTest, NoProgramAndNoProcessIsStarted) {
  EXPECT_EQ(confined([] { return outcome(::execl("/bin/true", "true", nullptr)); }), "EPERM");
#if !defined(__SANITIZE_ADDRESS__)
  EXPECT_EQ(confined([] {
              const pid_t pid = ::fork();
              if (pid == 0) ::_exit(0);
              return outcome(pid);
            }),
            "EPERM");
#endif
}

TEST_F(LinuxSandboxTest, ThreadsCanBeStarted) {
  EXPECT_EQ(confined([] {
              std::string text = "not run";
              std::thread([&text] { text = "run"; }).join();
              return text;
            }),
            "run");
}

TEST_F(LinuxSandboxTest, OtherSocketFamiliesAreRefused) {
  for (const int family : {AF_PACKET, AF_VSOCK, AF_ALG, AF_BLUETOOTH, AF_APPLETALK, 3, 200}) {
    EXPECT_EQ(confined([family] { return outcome(::socket(family, SOCK_STREAM, 0)); }), "EAFNOSUPPORT")
        << family;
  }
  EXPECT_EQ(confined([] { return outcome(::socket(AF_NETLINK, SOCK_RAW, 9)); }), "EPERM");
  for (const int family : {AF_UNIX, AF_INET, AF_INET6}) {
    EXPECT_EQ(confined([family] { return outcome(::socket(family, SOCK_DGRAM, 0)); }), "done") << family;
  }
}

// A TCP listener of the test on loopback.
class LoopbackServer {
 public:
  LoopbackServer() : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof(address);
    EXPECT_EQ(::bind(fd_.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
    EXPECT_EQ(::listen(fd_.get(), 8), 0);
    EXPECT_EQ(::getsockname(fd_.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    port_ = ntohs(address.sin_port);
  }
  uint16_t port() const { return port_; }

 private:
  UniqueFd fd_;
  uint16_t port_ = 0;
};

std::string connectTo(uint16_t port) {
  addrinfo hints{};
  hints.ai_family = AF_INET;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* addresses = nullptr;
  if (::getaddrinfo("localhost", std::to_string(port).c_str(), &hints, &addresses) != 0) return "no name";
  const UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const int result = ::connect(fd.get(), addresses->ai_addr, addresses->ai_addrlen);
  const std::string text = outcome(result);
  ::freeaddrinfo(addresses);
  return text;
}

TEST_F(LinuxSandboxTest, ServersCanBeResolvedAndReached) {
  const LoopbackServer server;
  EXPECT_EQ(confined([&server] { return connectTo(server.port()); }), "done");
}

TEST_F(LinuxSandboxTest, NoTcpPortIsListenedOn) {
  EXPECT_EQ(confined([] {
              const UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
              sockaddr_in address{};
              address.sin_family = AF_INET;
              address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
              return outcome(::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)));
            }),
            "EACCES");
}

TEST_F(LinuxSandboxTest, PortsCanBeLimited) {
  const LoopbackServer allowed;
  const LoopbackServer other;
  writeProfile(
      "[files]\nread = [\"/etc\", \"/usr\", \"/lib\", \"/proc\"]\n[network]\nfamilies = [\"unix\", \"inet\", "
      "\"netlink\"]\n"
      "connect_tcp = [" +
      std::to_string(allowed.port()) + "]\n");
  EXPECT_EQ(confined([&allowed] { return connectTo(allowed.port()); }), "done");
  EXPECT_EQ(confined([&other] { return connectTo(other.port()); }), "EACCES");
}

TEST_F(LinuxSandboxTest, FurtherCallsCanBeDenied) {
  writeProfile(shipped_.substr(0, shipped_.find("[calls]")) + "[calls]\ndeny = [\"getpriority\"]\n");
  EXPECT_EQ(confined([] {
              errno = 0;
              ::getpriority(PRIO_PROCESS, 0);
              return std::string(strerrorname_np(errno));
            }),
            "EPERM");
  writeProfile("[calls]\ndeny = [\"no_such_call\"]\n");
  EXPECT_EQ(enterInChild(), profilePath() +
                                ": seccomp: the profile's calls.deny names \"no_such_call\", which is no "
                                "system call: Invalid argument");
}

TEST_F(LinuxSandboxTest, PrivilegesCannotBeGained) {
  EXPECT_EQ(confined([] { return std::to_string(::prctl(PR_GET_NO_NEW_PRIVS, 0UL, 0UL, 0UL, 0UL)); }), "1");
}

TEST_F(LinuxSandboxTest, ThePeersUnitCanStillBeRead) {
  const std::string cgroup = "/proc/" + std::to_string(::getpid()) + "/cgroup";
  EXPECT_EQ(confined([&cgroup] { return std::string(readFile(cgroup) ? "read" : "unreadable"); }), "read");
}

TEST_F(LinuxSandboxTest, LocalTimeStaysKnown) {
  EXPECT_EQ(confined([] {
              const time_t time = 1700000000;
              std::tm local{};
              return std::string(::localtime_r(&time, &local) != nullptr ? "known" : "unknown");
            }),
            "known");
}

TEST_F(LinuxSandboxTest, AMissingProfileIsNamedWithItsRemedy) {
  folder_.remove("etc/sandbox.d/com.orvane.tarneld.profile");
  EXPECT_EQ(enterInChild(),
            profilePath() +
                ": there is no such sandbox profile; copy the one that was installed with the daemon "
                "(see tarneld.conf(5)) to this place");
}

TEST_F(LinuxSandboxTest, AProfileThatOthersCanWriteIsRefused) {
  ASSERT_EQ(::chmod(profilePath().c_str(), 0666), 0);
  EXPECT_EQ(enterInChild(), profilePath() +
                                ": is not used, because it can be written by its group or by others; "
                                "change that with: chmod go-w " +
                                profilePath());
  ASSERT_EQ(::chmod(profilePath().c_str(), 0644), 0);
  ASSERT_EQ(::chmod(path("etc/sandbox.d").c_str(), 0777), 0);
  EXPECT_EQ(enterInChild(), profilePath() +
                                ": is not used, because its directory can be written by its group or by "
                                "others; change that with: chmod go-w " +
                                path("etc/sandbox.d"));
}

TEST_F(LinuxSandboxTest, AProfileOfAStrangerIsRefused) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
  ASSERT_EQ(::chown(profilePath().c_str(), 12345, 0), 0);
  EXPECT_EQ(enterInChild(), profilePath() +
                                ": is not used, because it belongs to user 12345, who is neither root nor "
                                "the user this runs as (0); change that with: chown root " +
                                profilePath());
}

TEST_F(LinuxSandboxTest, EveryMistakeOfAProfileIsRefusedWithItsLine) {
  const std::string at = profilePath() + ":2: ";
  const struct {
    const char* text;
    const char* reason;
  } cases[] = {
      {"\n[files]\nread = [\"relative\"]\n", "\"relative\" is no absolute path"},
      {"[files]\nread = \"/usr\"\n", "files.read must be a list in brackets"},
      {"[files]\nread = [\"/\"]\n", "\"/\" opens the whole file system"},
      {"[files]\nread = [\"///\"]\n", "\"///\" opens the whole file system"},
      {"[files]\nread = [\"/.\"]\n", "\"/.\" must have no \".\" and no \"..\" between slashes"},
      {"[files]\nread = [\"/usr/..\"]\n", "\"/usr/..\" must have no \".\" and no \"..\" between slashes"},
      {"[files]\nread = [\"${STATE}/../x\"]\n",
       "\"${STATE}/../x\" must have no \".\" and no \"..\" between slashes"},
      {"[files]\nread = [\"/\\u0000usr\"]\n", "a path must hold no zero character"},
      {"[files]\nread = [7]\n", "a path must be a text"},
      {"[files]\n[netwrk]\n", "unknown key netwrk"},
      {"[files]\nwrite = []\n", "unknown key files.write"},
      {"\nother = 1\n", "unknown key other"},
      {"[network]\nfamilies = [\"packet\"]\n",
       "network.families may hold \"unix\", \"inet\", \"inet6\" and \"netlink\""},
      {"[network]\nconnect_tcp = [65536]\n", "a port must be an integer from 0 to 65535"},
      {"[network]\nbind_tcp = [\"443\"]\n", "a port must be an integer from 0 to 65535"},
      {"[calls]\ndeny = [1]\n", "calls.deny must hold names of system calls"},
      {"[files]\nread = [\"${HOME}/x\"]\n",
       "unknown variable at the start of \"${HOME}/x\", known are ${BUNDLE}, ${BUNDLE_ROOT}, "
       "${CONFIGURATION}, ${LOGS}, ${MESSAGE_LOGS}, ${RUNTIME}, ${STATE}"},
  };
  for (const auto& one : cases) {
    writeProfile(one.text);
    const std::string line = one.text[0] == '\n' && one.text[1] == '[' ? profilePath() + ":3: " : at;
    EXPECT_EQ(enterInChild(), line + one.reason + "; correct the profile") << one.text;
  }
  writeProfile("[files]\nread = [\n");
  EXPECT_TRUE(enterInChild().starts_with(profilePath() + ":"));
}

TEST_F(LinuxSandboxTest, AProfileThatWouldNotConfineIsNoticed) {
  writeProfile(shipped_.substr(0, shipped_.find("read_write = [")) + "read_write = [\"${CONFIGURATION}\"]\n");
  EXPECT_EQ(enterInChild(),
            "probe: " + path("etc/.sandbox-probe") +
                " can still be created; the sandbox is not effective, check the profile and the "
                "kernel's configuration");
  EXPECT_FALSE(fileIdentity(path("etc/.sandbox-probe")));
}

TEST_F(LinuxSandboxTest, AProcessWithThreadsIsRefused) {
  const std::string said = runInChild([this] {
    int ends[2];
    if (::pipe(ends) != 0) return outcome(-1);
    std::thread waiting([&ends] {
      char byte = 0;
      while (::read(ends[0], &byte, 1) < 0) {
      }
    });
    auto text = sandbox().enter(kName).value_or("confined");
    ::close(ends[1]);
    waiting.join();
    return text;
  });
  EXPECT_EQ(said.find("the process already has "), 0U) << said;
  EXPECT_NE(said.find("enter the sandbox before starting any"), std::string::npos);
}

TEST_F(LinuxSandboxTest, AProfileNameIsNoPath) {
  for (const char* name : {"", "../x", "a/b", ".hidden"}) {
    EXPECT_EQ(enterInChild(name), "\"" + std::string(name) + "\" is no name of a sandbox profile");
  }
}

}  // namespace
}  // namespace tarnel

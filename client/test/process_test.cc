#include <gtest/gtest.h>
#include <sys/auxv.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "client/src/c_support.h"
#include "client/src/options.h"
#include "client/test/test_daemon.h"
#include "tarnel/tarnel.h"

// Sessions in processes that fork and end.

namespace tarnel::client {
namespace {

using namespace std::chrono_literals;

constexpr auto kLong = 30s;

#if defined(__SANITIZE_THREAD__)
constexpr bool kChildMayStartThreads = false;  // ThreadSanitizer's rule
#else
constexpr bool kChildMayStartThreads = true;
#endif

// Result of a program that was to be privileged and is not.
constexpr int kNotPrivileged = 77;

// Runs `body` in a forked child; its result, or 100 plus the signal that ended it.
int inChild(const std::function<int()>& body) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::alarm(30);
    ::_exit(body());
  }
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 100 + WTERMSIG(status);
}

// Runs this test program again with the given mode, see main() below.
int asProgram(const std::string& mode, const std::string& path) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::alarm(30);
    ::execl("/proc/self/exe", "process_test", mode.c_str(), path.c_str(), nullptr);
    ::_exit(99);
  }
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 100 + WTERMSIG(status);
}

// Runs a copy of this test program that is set-group-id to a group other than the process's own; nothing
// where that cannot be made or the system does not honour it.
std::optional<int> asPrivilegedProgram(const std::string& mode, const std::string& copy) {
  gid_t group = ::getegid() + 1;  // root may take any
  if (::geteuid() != 0) {
    std::vector<gid_t> groups(static_cast<size_t>(std::max(::getgroups(0, nullptr), 0)));
    if (::getgroups(static_cast<int>(groups.size()), groups.data()) < 0) return std::nullopt;
    std::erase(groups, ::getegid());
    if (groups.empty()) return std::nullopt;
    group = groups.front();
  }
  std::filesystem::copy_file("/proc/self/exe", copy);
  if (::chown(copy.c_str(), static_cast<uid_t>(-1), group) != 0) return std::nullopt;
  if (::chmod(copy.c_str(), 02755) != 0) return std::nullopt;
  const pid_t child = ::fork();
  if (child == 0) {
    ::execl(copy.c_str(), "process_test", mode.c_str(), "", nullptr);
    ::_exit(99);
  }
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  const int result = WIFEXITED(status) ? WEXITSTATUS(status) : 100 + WTERMSIG(status);
  return result == kNotPrivileged ? std::nullopt : std::optional(result);
}

class ProcessTest : public ::testing::Test {
 protected:
  Options options() const {
    Options options;
    options.socketPath = path_;
    return options;
  }

  test::ScratchFolder folder_;
  const std::string path_ = folder_.file("socket");
};

TEST_F(ProcessTest, AForkedChildHasNoneOfTheFilesThatAreUploaded) {
  test::TestDaemon daemon(path_);
  daemon.isSilent = true;
  auto session = std::make_unique<Session>(options());
  const std::string file = folder_.file("upload.log");
  std::ofstream(file) << "text";
  ASSERT_TRUE(session->uploadFile(file));
  daemon.waitFor(1);
  const auto timesOpen = [&file] {
    int count = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code ignored;
      if (std::filesystem::read_symlink(entry.path(), ignored) == file) ++count;
    }
    return count;
  };
  // The stand-in, in this same process, lets go of the message with its copy.
  while (timesOpen() > 1) std::this_thread::yield();
  EXPECT_EQ(timesOpen(), 1);
  EXPECT_EQ(inChild([&] {
              if (session->uploadFile(file).code != TARNEL_ERROR_FORKED) return 2;
              session.reset();
              return timesOpen();
            }),
            0);
  EXPECT_EQ(timesOpen(), 1);
}

TEST_F(ProcessTest, InAForkedChildTheSessionIsInert) {
  test::TestDaemon daemon(path_);
  bool wasCalled = false;
  auto session = std::make_unique<Session>(options());
  ASSERT_TRUE(session->startConfigAndWait(kLong).ok());
  const int result = inChild([&session, &wasCalled] {
    if (session->sendMessage(9, 9, {}, Flag::normal, [&wasCalled](const Reply&) { wasCalled = true; }).code !=
        TARNEL_ERROR_FORKED) {
      return 1;
    }
    if (session->flushAndWait(1s).status.code != TARNEL_ERROR_FORKED) return 2;
    if (session->reconnect().code != TARNEL_ERROR_FORKED) return 3;
    if (session->drain(1s).code != TARNEL_ERROR_FORKED) return 4;
    if (session->state() != State::closed) return 5;
    session.reset();
    return wasCalled ? 6 : 0;
  });
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(session->sendMessageAndWait(1, 1, {}, Flag::normal, kLong).ok());
  EXPECT_EQ(daemon.received().size(), 2U);
}

TEST_F(ProcessTest, AForkWhileThreadsSendDoesNotHang) {
  test::TestDaemon daemon(path_);
  Session session(options());
  std::atomic<bool> ends{false};
  std::thread sender([&session, &ends] {
    while (!ends) {
      if (!session.sendMessage(1, 1)) std::this_thread::yield();
    }
  });
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(inChild([&session] { return session.sendMessage(1, 1).code == TARNEL_ERROR_FORKED ? 0 : 1; }),
              0);
  }
  ends = true;
  sender.join();
}

TEST_F(ProcessTest, AChildCanMakeItsOwnSession) {
  if (!kChildMayStartThreads) GTEST_SKIP();
  test::TestDaemon daemon(path_);
  Session session(options());
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  EXPECT_EQ(inChild([this] {
              Session own(options());
              return own.startConfigAndWait(kLong).ok() ? 0 : 1;
            }),
            0);
}

TEST_F(ProcessTest, TheChildDoesNotKeepTheConnectionOfItsParentOpen) {
  test::TestDaemon daemon(path_);
  int hold[2];
  ASSERT_EQ(::pipe(hold), 0);
  auto session = std::make_unique<Session>(options());
  ASSERT_TRUE(session->startConfigAndWait(kLong).ok());
  const pid_t child = ::fork();
  if (child == 0) {
    ::close(hold[1]);
    char byte = 0;
    ::_exit(::read(hold[0], &byte, 1) == 0 ? 0 : 1);
  }
  ::close(hold[0]);
  session.reset();
  // The daemon sees the end while the child lives on.
  const auto deadline = std::chrono::steady_clock::now() + kLong;
  while (daemon.connectionCount() != 0 && std::chrono::steady_clock::now() < deadline) daemon.nudge();
  EXPECT_EQ(daemon.connectionCount(), 0U);
  ::close(hold[1]);
  int status = 0;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
}

TEST_F(ProcessTest, AProgramThatEndsWithoutDestroyingItsSessionStillSends) {
  test::TestDaemon daemon(path_);
  EXPECT_EQ(asProgram("leak", path_), 7);
  EXPECT_EQ(daemon.received().size(), 500U);
}

TEST_F(ProcessTest, AStaticSessionEndsWell) {
  test::TestDaemon daemon(path_);
  EXPECT_EQ(asProgram("static", path_), 7);
  EXPECT_EQ(daemon.received().size(), 500U);
}

TEST_F(ProcessTest, NoCallbackIsBegunOnceTheProcessEnds) {
  test::TestDaemon daemon(path_);
  daemon.isSilent = true;
  EXPECT_EQ(asProgram("callbacks", path_), 7);
}

TEST_F(ProcessTest, ExitInsideACallbackDoesNotHang) {
  test::TestDaemon daemon(path_);
  EXPECT_EQ(asProgram("exit-in-callback", path_), 7);
}

TEST_F(ProcessTest, ACallbackThatNeverReturnsDoesNotHoldUpTheEnd) {
  test::TestDaemon daemon(path_);
  EXPECT_EQ(asProgram("stuck-callback", path_), 7);
}

TEST_F(ProcessTest, AProgramEndsAtOnceWhenThereIsNoDaemon) {
  EXPECT_EQ(asProgram("leak", path_), 7);
}

TEST_F(ProcessTest, TheThreadTakesNoSignals) {
  EXPECT_EQ(asProgram("signal", path_), 7);
}

// Who starts such a program must not say where its reports go.
TEST_F(ProcessTest, ASetGroupIdProgramDoesNotTakeItsSocketFromTheEnvironment) {
  ASSERT_EQ(::setenv("TARNEL_SOCKET", "/elsewhere", 1), 0);
  const auto result = asPrivilegedProgram("socket", folder_.file("copy"));
  ::unsetenv("TARNEL_SOCKET");
  if (!result) GTEST_SKIP() << "no set-group-id program can be made here";
  EXPECT_EQ(*result, 7);
}

// The programs that the tests above run: each ends with code 7.

Session* leaked = nullptr;

Options programOptions(const char* path) {
  Options options;
  options.socketPath = path;
  options.linger = 10s;
  return options;
}

int sendFive(Session& session) {
  for (uint16_t i = 0; i < 500; ++i) {
    if (!session.sendMessage(1, i, Dictionary().set("i", i), Flag::normal)) break;
  }
  return 7;
}

int callbacksProgram(const char* path) {
  auto options = programOptions(path);
  options.linger = 50ms;
  leaked = std::make_unique<Session>(std::move(options)).release();
  std::atexit([] {});
  for (int i = 0; i < 20; ++i) {
    const auto sent = leaked->flush([](const Reply&) { ::_exit(3); });
    if (!sent) return 4;
  }
  return 7;
}

int exitInCallbackProgram(const char* path) {
  leaked = std::make_unique<Session>(programOptions(path)).release();
  const auto sent = leaked->startConfig([](const Reply&) { std::exit(7); });
  if (!sent) return 4;
  std::promise<void>().get_future().wait();
  return 5;
}

int stuckCallbackProgram(const char* path) {
  auto options = programOptions(path);
  options.linger = 0ms;
  leaked = std::make_unique<Session>(std::move(options)).release();
  static std::promise<void> isInside;
  const auto sent = leaked->startConfig([](const Reply&) {
    isInside.set_value();
    std::promise<void>().get_future().wait();
  });
  if (!sent) return 4;
  isInside.get_future().wait();
  return 7;
}

int signalProgram(const char* path) {
  // Blocked in this thread, so that only another could take it, and die of it.
  Session session(programOptions(path));
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGUSR1);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  ::kill(::getpid(), SIGUSR1);
  int taken = 0;
  sigwait(&set, &taken);
  return taken == SIGUSR1 ? 7 : 1;
}

int socketProgram() {
  if (::getauxval(AT_SECURE) == 0) return kNotPrivileged;
  return core::resolveSocketPath("") == "/run/tarneld/com.orvane.tarneld" ? 7 : 1;
}

int runProgram(const std::string& mode, const char* path) {
  if (mode == "leak") {
    leaked = std::make_unique<Session>(programOptions(path)).release();
    return sendFive(*leaked);
  }
  if (mode == "static") {
    static Session session(programOptions(path));
    return sendFive(session);
  }
  if (mode == "socket") return socketProgram();
  if (mode == "callbacks") return callbacksProgram(path);
  if (mode == "exit-in-callback") return exitInCallbackProgram(path);
  if (mode == "stuck-callback") return stuckCallbackProgram(path);
  return signalProgram(path);
}

}  // namespace
}  // namespace tarnel::client

int main(int argc, char** argv) {
  if (argc == 3 && argv[1][0] != '-') return tarnel::client::runProgram(argv[1], argv[2]);
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}

#include "ipc/server/listening_socket.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cstdlib>
#include <fstream>

#include "ipc/server/ipc_test_support.h"

namespace tarnel {
namespace {

using ::testing::HasSubstr;

TEST(ListeningSocketTest, EveryUserMayConnect) {
  const TemporaryFolder folder;
  const auto made = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(made) << made.error().description();
  struct stat file {};
  ASSERT_EQ(stat(folder.socket().c_str(), &file), 0);
  EXPECT_TRUE(S_ISSOCK(file.st_mode));
  EXPECT_EQ(file.st_mode & 0777U, 0666U);
  EXPECT_TRUE(connectTo(folder.socket()));
}

TEST(ListeningSocketTest, TheFileGoesWithTheSocket) {
  const TemporaryFolder folder;
  { EXPECT_TRUE(ListeningSocket::make(folder.socket())); }
  EXPECT_FALSE(std::filesystem::exists(folder.socket()));
}

TEST(ListeningSocketTest, ASuccessorsFileStays) {
  const TemporaryFolder folder;
  auto first = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(first);
  std::filesystem::remove(folder.socket());
  const auto second = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(second);
  { const ListeningSocket gone = *std::move(first); }
  EXPECT_TRUE(std::filesystem::exists(folder.socket()));
}

TEST(ListeningSocketTest, TheSocketOfADeadDaemonIsReplaced) {
  const TemporaryFolder folder;
  const pid_t child = fork();
  if (child == 0) {
    auto made = ListeningSocket::make(folder.socket());
    _exit(made ? 0 : 1);  // as killed: nothing is cleaned up
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_EQ(status, 0);
  ASSERT_TRUE(std::filesystem::exists(folder.socket()));
  EXPECT_TRUE(ListeningSocket::make(folder.socket()));
}

TEST(ListeningSocketTest, ALivingDaemonIsNotDisplaced) {
  const TemporaryFolder folder;
  const auto first = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(first);
  const auto second = ListeningSocket::make(folder.socket());
  ASSERT_FALSE(second);
  EXPECT_THAT(second.error().localizedDescription(),
              HasSubstr("another daemon is listening at " + folder.socket()));
  EXPECT_TRUE(connectTo(folder.socket()));
}

TEST(ListeningSocketTest, AFileThatIsNoSocketIsKept) {
  const TemporaryFolder folder;
  std::ofstream(folder.socket()) << "precious";
  const auto made = ListeningSocket::make(folder.socket());
  ASSERT_FALSE(made);
  EXPECT_THAT(made.error().localizedDescription(), HasSubstr("is not a socket"));
  EXPECT_TRUE(std::filesystem::is_regular_file(folder.socket()));
}

TEST(ListeningSocketTest, APathThatIsTooLongIsRefused) {
  const TemporaryFolder folder;
  const std::string path = folder.path() + '/' + std::string(120, 'x');
  const auto made = ListeningSocket::make(path);
  ASSERT_FALSE(made);
  EXPECT_THAT(made.error().localizedDescription(), HasSubstr("of 1 to 107"));
  EXPECT_FALSE(ListeningSocket::make(""));
}

TEST(ListeningSocketTest, AMissingDirectoryIsNamed) {
  const auto made = ListeningSocket::make("/nonexistent/directory/socket");
  ASSERT_FALSE(made);
  EXPECT_THAT(made.error().localizedDescription(),
              HasSubstr("cannot open the runtime directory /nonexistent/directory/"));
}

// In a child, as the service manager would start it: descriptors from 3 on, and variables that tell of them.
template <class Body>
int asActivated(const std::vector<int>& descriptors, const char* names, Body body) {
  const pid_t child = fork();
  if (child != 0) {
    int status = 0;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  std::vector<int> high;
  for (const int fd : descriptors) high.push_back(fcntl(fd, F_DUPFD, 100));
  for (size_t i = 0; i < high.size(); ++i) dup2(high[i], static_cast<int>(3 + i));
  setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
  setenv("LISTEN_FDS", std::to_string(descriptors.size()).c_str(), 1);
  setenv("LISTEN_FDNAMES", names, 1);
  _exit(body());
}

TEST(ListeningSocketTest, TheServiceManagersSocketIsTakenByName) {
  const TemporaryFolder folder;
  const auto other = ListeningSocket::make(folder.path() + "/other");
  const auto ours = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(other && ours);
  const UniqueFd datagrams(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  const auto chosen = [] {
    const auto taken = ListeningSocket::fromServiceManager(wire::kServiceName);
    return taken.get();
  };
  EXPECT_EQ(asActivated({other->get(), ours->get()}, "other:com.orvane.tarneld", chosen), 4);
  EXPECT_EQ(asActivated({datagrams.get(), other->get(), ours->get()}, "a:b:c", chosen), 4);
  EXPECT_EQ(asActivated({datagrams.get()}, "com.orvane.tarneld", [&chosen] { return chosen() < 0 ? 77 : 1; }),
            77);
}

TEST(ListeningSocketTest, TheServiceManagersSocketIsServed) {
  const TemporaryFolder folder;
  const auto ours = ListeningSocket::make(folder.socket());
  ASSERT_TRUE(ours);
  const auto serve = [&folder] {
    Service service;
    service.start();
    BusClient client(folder.socket());
    const bool isAnswered = client.call("StartConfig", "") != nullptr;
    // No socket of its own.
    const bool isOnlyOne = !std::filesystem::exists(service.path());
    service.stop();
    return isAnswered && isOnlyOne && std::filesystem::exists(folder.socket()) ? 77 : 1;
  };
  EXPECT_EQ(asActivated({ours->get()}, wire::kServiceName, serve), 77);
}

}  // namespace
}  // namespace tarnel

// A client for the tests of identity; a copy of it is made set-group-id. What became of its attempt goes to
// standard output: "accepted", "refused" or what stood in the way.
//
//   identity_probe call SOCKET                   calls the daemon
//   identity_probe hold SOCKET                   calls it, then keeps the connection until its input ends
//   identity_probe exec SOCKET PROGRAM           connects, leaves the connection to a child, and becomes
//   PROGRAM identity_probe steal SOCKET PROGRAM          starts PROGRAM hold, and tries to take its
//   connection

#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "testing/raw_bus_client.h"

namespace {

using tarnel::test::RawBusClient;

const char* resultOf(const RawBusClient& client) {
  if (!client.isConnected()) return "not connected";
  if (!client.authenticate()) return "refused";
  if (!client.write(tarnel::test::bytesOf({.member = "FetchDisplayURL"}))) return "refused";
  return client.readSome().find("URL not available") != std::string::npos ? "accepted" : "refused";
}

void say(const std::string& text) {
  std::printf("%s\n", text.c_str());
  std::fflush(stdout);
}

// Returns when the input has ended.
void waitForInputEnd() {
  std::array<char, 64> ignored{};
  while (::read(STDIN_FILENO, ignored.data(), ignored.size()) > 0) {
  }
}

// The daemon is stopped meanwhile: when it looks, the process that connected is the trusted program.
int connectThenExec(const char* socket, char* program) {
  const RawBusClient client(socket);
  if (!client.isConnected()) {
    say("not connected");
    return 1;
  }
  const pid_t child = ::fork();
  if (child == 0) {
    waitForInputEnd();
    say(resultOf(client));
    ::_exit(0);
  }
  std::array<char*, 4> arguments{program, const_cast<char*>("idle"), nullptr, nullptr};
  ::execv(program, arguments.data());
  say(std::string("no exec: ") + std::strerror(errno));
  return 1;
}

int steal(const char* socket, char* program) {
  std::array<int, 2> input{};
  std::array<int, 2> output{};
  if (::pipe(input.data()) != 0 || ::pipe(output.data()) != 0) return 1;
  const pid_t victim = ::fork();
  if (victim == 0) {
    ::dup2(input[0], STDIN_FILENO);
    ::dup2(output[1], STDOUT_FILENO);
    ::close(input[1]);
    std::array<char*, 4> arguments{program, const_cast<char*>("hold"), const_cast<char*>(socket), nullptr};
    ::execv(program, arguments.data());
    ::_exit(1);
  }
  std::array<char, 64> line{};
  const ssize_t length = ::read(output[0], line.data(), line.size() - 1);
  say(std::string("the victim was ") +
      std::string(line.data(), length > 0 ? static_cast<size_t>(length) - 1 : 0));
  const int pidfd = static_cast<int>(::syscall(SYS_pidfd_open, victim, 0));
  std::string result = "nothing was stolen";
  for (int fd = 3; fd < 64; ++fd) {
    const int stolen = static_cast<int>(::syscall(SYS_pidfd_getfd, pidfd, fd, 0));
    int type = 0;
    socklen_t size = sizeof type;
    if (stolen >= 0 && ::getsockopt(stolen, SOL_SOCKET, SO_TYPE, &type, &size) == 0)
      result = "a socket was stolen";
    if (stolen >= 0) ::close(stolen);
  }
  say(result);
  ::close(input[1]);
  ::waitpid(victim, nullptr, 0);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  const std::string mode = argc > 1 ? argv[1] : "";
  if (mode == "idle") {
    // It keeps what connected busy until the test is over.
    say("running");
    ::pause();
    return 0;
  }
  if (mode == "call" && argc == 3) {
    say(resultOf(RawBusClient(argv[2])));
    return 0;
  }
  if (mode == "hold" && argc == 3) {
    const RawBusClient client(argv[2]);
    say(resultOf(client));
    waitForInputEnd();
    return 0;
  }
  if (mode == "exec" && argc == 4) return connectThenExec(argv[2], argv[3]);
  if (mode == "steal" && argc == 4) return steal(argv[2], argv[3]);
  return 2;
}

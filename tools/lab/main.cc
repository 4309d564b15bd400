#include <poll.h>
#include <sys/signalfd.h>
#include <sys/time.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "base/unique_fd.h"
#include "tools/files/file_io.h"
#include "tools/lab/lab.h"

namespace {

using namespace tarnel;
using namespace tarnel::lab;

class WallClock final : public Clock {
 public:
  TimeValue timeOfDay() override {
    timeval now{};
    ::gettimeofday(&now, nullptr);
    return {.seconds = now.tv_sec, .microseconds = static_cast<int32_t>(now.tv_usec)};
  }
};

// Blocked before any thread begins, so that all of them leave these signals to the descriptor.
UniqueFd endSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  std::signal(SIGPIPE, SIG_IGN);
  return UniqueFd(::signalfd(-1, &set, SFD_CLOEXEC));
}

void waitForEnd(int signalFd, int stopFd) {
  pollfd entries[2] = {{.fd = signalFd, .events = POLLIN, .revents = 0},
                       {.fd = stopFd, .events = POLLIN, .revents = 0}};
  while (::poll(entries, 2, -1) < 0 && errno == EINTR) {
  }
}

bool wantsColour() {
  const char* noColour = std::getenv("NO_COLOR");
  const char* terminal = std::getenv("TERM");
  return ::isatty(STDOUT_FILENO) == 1 && (noColour == nullptr || *noColour == '\0') &&
         (terminal == nullptr || std::string_view(terminal) != "dumb");
}

}  // namespace

int main(int argc, char** argv) {
  const ParsedOptions parsed = parseOptions(argc, argv);
  if (parsed.exitCode) return *parsed.exitCode;
  const UniqueFd signals = endSignals();
  WallClock clock;
  const ConsoleStyle style = parsed.options.json
                                 ? ConsoleStyle::json
                                 : (parsed.options.quiet ? ConsoleStyle::quiet : ConsoleStyle::text);
  Console console(stdout, stderr, style, wantsColour(), clock);
  const Result<std::unique_ptr<Lab>> lab = Lab::start(parsed.options, console, clock);
  if (!lab) {
    std::fprintf(stderr, "tarnel-lab: %s\n", lab.error().localizedDescription().c_str());
    return EXIT_FAILURE;
  }
  waitForEnd(signals.get(), (*lab)->stopRequestedFd());
  (*lab)->stop();
  const Dictionary status = (*lab)->status();
  const auto count = [&status](const char* key, const char* what) {
    const int64_t number = status.find(key)->int64Value();
    return std::to_string(number) + " " + what + (number == 1 ? "" : "s");
  };
  console.ended("ended: received " + count("events", "event") + " in " + count("posts", "post") + ", " +
                count("uploads", "file") + ", " + count("logArchives", "log archive") + " and " +
                count("datagrams", "datagram"));
  return EXIT_SUCCESS;
}

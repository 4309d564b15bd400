#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string_view>

#include "daemon/linux_world.h"

namespace {

constexpr char kUsage[] =
    "Usage: tarneld [--help | --version]\n"
    "The Tarnel reporting daemon. It takes no other arguments; its directories come from the environment\n"
    "variables RUNTIME_DIRECTORY, STATE_DIRECTORY, LOGS_DIRECTORY and CONFIGURATION_DIRECTORY, and the\n"
    "key that it trusts from the folder named in TARNEL_BUNDLE.\n"
    "See tarneld(8) and tarneld.conf(5).\n";

// Nothing that the daemon does depends on its arguments; these are for people who ask.
int answerArguments(std::string_view argument) {
  if (argument == "--help") {
    std::fputs(kUsage, stdout);
    return EXIT_SUCCESS;
  }
  if (argument == "--version") {
    std::puts("tarneld " TARNEL_VERSION);
    return EXIT_SUCCESS;
  }
  std::fprintf(stderr, "tarneld: unexpected argument '%.*s'\n%s", static_cast<int>(argument.size()),
               argument.data(), kUsage);
  return 2;
}

// Catches what is thrown while the world still stands, so that nothing unwinds it.
int run(tarnel::LinuxWorld& world) {
  try {
    return tarnel::runService(world);
  } catch (const std::exception& failure) {
    std::fprintf(stderr, "tarneld: cannot go on: %s\n", failure.what());
    return EXIT_FAILURE;
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1) return answerArguments(argv[1]);
  tarnel::LinuxWorld world;
  const int status = run(world);
  if (world.hasCallsLeftBehind()) std::_Exit(status);
  return status;
}

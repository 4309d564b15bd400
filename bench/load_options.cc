#include "bench/load_options.h"

#include <CLI/CLI.hpp>
#include <map>

namespace tarnel::bench {

ParsedLoadOptions parseLoadOptions(int argc, const char* const* argv) {
  ParsedLoadOptions parsed;
  LoadOptions& o = parsed.options;
  CLI::App app("Loads a running daemon through the client library and tells what it cost", "tarnel-load");
  app.add_option("--socket", o.socketPath, "the daemon's socket; default as any client");
  app.add_option("--pid", o.pid, "the daemon's process")->required()->check(CLI::PositiveNumber);
  app.add_option("--clients", o.clients, "sessions that send at once")
      ->check(CLI::Range(1, 64))
      ->capture_default_str();
  app.add_option("--messages", o.messages, "messages of all clients together, 0 for none")
      ->check(CLI::Range(0, 100'000'000))
      ->capture_default_str();
  auto* realtime = app.add_flag("--realtime", o.realtime, "a post for each message");
  app.add_flag_function(
         "--batch", [](int64_t) {}, "posts of many messages, the default")
      ->excludes(realtime);
  app.add_option("--payload", o.payload, "small (3 fields, 50 bytes) or call (25 fields, 700 bytes)")
      ->transform(CLI::CheckedTransformer(
          std::map<std::string, Payload>{{"small", Payload::small}, {"call", Payload::call}}));
  app.add_option("--calls", o.calls, "many messages in a bus call, or a single one")
      ->transform(CLI::CheckedTransformer(
          std::map<std::string, Calls>{{"many", Calls::many}, {"single", Calls::single}}));
  app.add_option("--window", o.window, "messages of a client that may wait for their answer")
      ->check(CLI::Range(1, 4096))
      ->capture_default_str();
  app.add_option("--idle", o.idle,
                 "sessions to open, first connected, then configured, before anything is sent")
      ->check(CLI::Range(0, 1000))
      ->capture_default_str();
  app.add_option("--service", o.service, "service name of the user information")->capture_default_str();
  app.add_option("--client-type", o.clientType, "0 to 17")->check(CLI::Range(0, 17))->capture_default_str();
  app.add_flag("--json", o.json, "print one JSON object");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    parsed.exitCode = app.exit(error) == 0 ? 0 : 2;
  }
  return parsed;
}

}  // namespace tarnel::bench

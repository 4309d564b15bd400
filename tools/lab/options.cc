#include "tools/lab/options.h"

#include <CLI/CLI.hpp>

namespace tarnel::lab {
namespace {

constexpr int kUsageExit = 2;

constexpr char kFooter[] =
    "Exit status: 0 ended by a signal or through the control address; 1 could not start; 2 wrong command "
    "line.\n\n"
    "Example: tarnel-lab --directory lab, then copy inner documents to lab/storebags/NAME.json";

void addOptions(CLI::App& app, LabOptions& options) {
  app.add_option("-d,--directory", options.directory, "folder for keys, storebags and what arrives")
      ->capture_default_str();
  app.add_option("--listen", options.listen, "numeric address for HTTPS and datagrams")
      ->capture_default_str();
  app.add_option("-p,--port", options.port, "port for HTTPS, 0 for any free one")
      ->check(CLI::Range(0, 65535))
      ->capture_default_str();
  app.add_option("--control-port", options.controlPort, "port of the control address, 0 for any free one")
      ->check(CLI::Range(0, 65535))
      ->capture_default_str();
  app.add_option("--datagram-port", options.datagramPort,
                 "UDP port for datagrams, 0 for any free one [8445, or any free one with --port 0]")
      ->check(CLI::Range(0, 65535));
  app.add_option("--max-upload", options.maxUploadMiB,
                 "largest file taken, in MiB, packed and unpacked; bodies take up to 256 MiB of memory, "
                 "or twice this if it is more")
      ->check(CLI::Range(1, 1024))
      ->capture_default_str();
  app.add_option("--keep", options.keep, "arrivals of each kind kept in memory")
      ->check(CLI::Range(0, 1'000'000))
      ->capture_default_str();
  app.add_option("--storebag-max-age", options.storebagMaxAge, "seconds for which clients keep a storebag")
      ->check(CLI::Range(0, 31'536'000))
      ->capture_default_str();
  app.add_option("--bundle-version", options.bundleVersion, "version text of the client bundle that is made")
      ->capture_default_str();
  app.add_option("--ready-file", options.readyFile, "file to write the status to once listening");
  auto* json = app.add_flag("--json", options.json, "print one JSON object a line");
  app.add_flag("-q,--quiet", options.quiet, "print warnings only")->excludes(json);
  app.set_version_flag("--version", "tarnel-lab " TARNEL_VERSION);
  app.failure_message([](const CLI::App* /*app*/, const CLI::Error& error) {
    return "tarnel-lab: " + std::string(error.what()) + "\nRun it with --help for more information.\n";
  });
}

}  // namespace

ParsedOptions parseOptions(int argc, const char* const* argv) {
  ParsedOptions parsed;
  CLI::App app("Development server: serves signed storebags and receives what the service sends",
               "tarnel-lab");
  app.footer(kFooter);
  addOptions(app, parsed.options);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    parsed.exitCode = app.exit(error) == 0 ? 0 : kUsageExit;
  }
  return parsed;
}

}  // namespace tarnel::lab

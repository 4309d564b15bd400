// The command line of tarnelctl: options in, one call of a command out.

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdlib>
#include <exception>
#include <functional>
#include <iostream>
#include <limits>
#include <string_view>

#include "platform/linux/configuration/directories.h"
#include "tools/tarnelctl/acting_as_owner.h"
#include "tools/tarnelctl/commands/archive_command.h"
#include "tools/tarnelctl/commands/consent_command.h"
#include "tools/tarnelctl/commands/log_command.h"
#include "tools/tarnelctl/commands/power_log_command.h"
#include "tools/tarnelctl/commands/replay_command.h"
#include "tools/tarnelctl/commands/send_command.h"
#include "tools/tarnelctl/commands/settings_command.h"
#include "tools/tarnelctl/commands/storebag_command.h"
#include "tools/tarnelctl/commands/upload_command.h"
#include "tools/tarnelctl/standard_streams.h"

#ifndef TARNEL_VERSION
#error "TARNEL_VERSION comes from the build"
#endif

namespace tarnel::ctl {
namespace {

constexpr char kFooter[] =
    "Exit status: 0 done, 1 failed, 2 wrong usage, 3 no daemon is listening or it refuses this process.\n"
    "A private instance is chosen by RUNTIME_DIRECTORY, STATE_DIRECTORY, LOGS_DIRECTORY and\n"
    "CONFIGURATION_DIRECTORY; --socket and TARNEL_SOCKET name another socket. See tarnelctl(1).";

// All that the options of all commands fill in, and the command that was chosen.
struct CommandLine {
  CLI::App app{"Runs, configures and debugs the Tarnel reporting daemon.", "tarnelctl"};
  StandardStreams streams;
  Terminal terminal{streams.out, streams.err, streams.outIsTerminal, streams.errIsTerminal, &std::cerr};
  Directories directories = Directories::fromEnvironment();
  StandardErrorLog log{terminal};
  std::string socketPath;
  std::function<ExitStatus()> run;

  SendOptions send;
  ReplayOptions replay;
  std::string recording;
  uint32_t timeoutSeconds = 30;
  std::string uploaded;
  uint32_t uploadSeconds = 600;
  LogOptions logOptions;
  PowerLogOptions powerLog;
  SettingsOptions settings;
  bool consentJson = false;
  StorebagOptions storebag;
  ArchiveOptions archive;

  TomlSettingsStore store() { return {directories.configuration(), directories.state(), log}; }
  // Empty where the client library finds the installed daemon, or what TARNEL_SOCKET names, by itself.
  std::string socket() const {
    const bool privateInstance = std::getenv("RUNTIME_DIRECTORY") != nullptr;
    if (!socketPath.empty() || std::getenv("TARNEL_SOCKET") != nullptr || !privateInstance) return socketPath;
    return directories.runtime() + "/com.orvane.tarneld";
  }
};

void addSocketOption(CommandLine& line, CLI::App* command) {
  command->add_option(
      "--socket", line.socketPath,
      "the daemon's socket (default TARNEL_SOCKET, else the one in RUNTIME_DIRECTORY or the installed one)");
}

void addSessionOptions(CommandLine& line, CLI::App* command) {
  auto& send = line.send;
  addSocketOption(line, command);
  command->add_option("--client-type", send.clientType, "client type; 5 to 17 have a storebag")->required();
  command->add_option("--session-id", send.sessionID, "session number, 0 to 4294967295")
      ->capture_default_str()
      ->check(CLI::Range(uint32_t{0}, std::numeric_limits<uint32_t>::max()));
  command->add_option("--client-version", send.clientVersion, "version of the client, 0 to 65535")
      ->capture_default_str()
      ->check(CLI::Range(0, 65535));
  command->add_option("--client-name", send.clientName, "user info: name of the client");
  command->add_option("--service-name", send.serviceName, "user info: name of the service");
  command
      ->add_option("--user-info", send.userInfo,
                   "more user info, KEY=VALUE or KEY:TYPE=VALUE; may be repeated")
      ->allow_extra_args(false);
  command->add_flag("--json", send.json, "answer in JSON");
}

void addMessageOptions(CommandLine& line, CLI::App* command) {
  auto& send = line.send;
  addSessionOptions(line, command);
  command->add_option("--category", send.category, "category of the message, 0 to 65535")
      ->required()
      ->check(CLI::Range(0, 65535));
  command->add_option("--type", send.type, "type of the message, 0 to 65535")
      ->required()
      ->check(CLI::Range(0, 65535));
  command->add_option(
      "payload", send.payload,
      "payload, KEY=VALUE or KEY:TYPE=VALUE with TYPE string, int, real, bool, date, data or json");
  command->add_option("--timeout", line.timeoutSeconds, "seconds to wait for each answer")
      ->capture_default_str()
      ->check(CLI::Range(1, 86400));
}

void addSend(CommandLine& line) {
  auto* command = line.app.add_subcommand("send", "send one message through a session of its own");
  addMessageOptions(line, command);
  command->add_flag("--batch", line.send.batch, "let the daemon batch events");
  command->add_option("--flag", line.send.flag, "0 normal, 1 real-time, 2 important, 3 both")
      ->capture_default_str()
      ->check(CLI::Range(0, 3));
  command->add_flag("--flush", line.send.flush, "flush after sending, and wait for it");
  command->callback([&line] {
    line.run = [&line] {
      line.send.socketPath = line.socket();
      line.send.timeout = std::chrono::seconds(line.timeoutSeconds);
      return sendMessage(line.send, line.terminal);
    };
  });
}

void addSingle(CommandLine& line) {
  auto* command = line.app.add_subcommand("single", "send one message with its session info in one call");
  addMessageOptions(line, command);
  command->callback([&line] {
    line.run = [&line] {
      line.send.socketPath = line.socket();
      line.send.timeout = std::chrono::seconds(line.timeoutSeconds);
      return sendSingleMessage(line.send, line.terminal);
    };
  });
}

void addUpload(CommandLine& line, const char* name, const char* what, const char* file,
               ExitStatus (*upload)(const SendOptions&, const std::string&, const Terminal&)) {
  auto* command = line.app.add_subcommand(name, what);
  addSessionOptions(line, command);
  command->add_option("file", line.uploaded, file)->required();
  command->add_option("--timeout", line.uploadSeconds, "seconds to wait for each answer")
      ->capture_default_str()
      ->check(CLI::Range(1, 86400));
  command->callback([&line, upload] {
    line.run = [&line, upload] {
      line.send.socketPath = line.socket();
      line.send.timeout = std::chrono::seconds(line.uploadSeconds);
      return upload(line.send, line.uploaded, line.terminal);
    };
  });
}

void addReplay(CommandLine& line) {
  auto* command = line.app.add_subcommand("replay", "send recorded sessions anew");
  addSocketOption(line, command);
  command->add_option("recording", line.recording, "recording in NDJSON, - for standard input")->required();
  command->add_flag("--fast", line.replay.fast, "as fast as possible instead of at the recorded pace");
  command->add_flag("--quiet", line.replay.quiet, "no progress bar");
  command->add_flag("--json", line.replay.json, "summary in JSON");
  command->callback([&line] {
    line.run = [&line] {
      line.replay.socketPath = line.socket();
      return replayFile(line.recording, line.replay, line.terminal);
    };
  });
}

void addLog(CommandLine& line) {
  auto* command = line.app.add_subcommand("log", "show the message log: what sessions sent");
  command->add_option("-n,--lines", line.logOptions.lines, "only the last N lines");
  command->add_flag("-f,--follow", line.logOptions.follow, "go on with what is written, until interrupted");
  command->add_flag("--path", line.logOptions.path, "only say where it is");
  command->callback([&line] {
    line.run = [&line] {
      line.logOptions.directory = line.directories.messageLogDirectory();
      return showMessageLog(line.logOptions, line.terminal);
    };
  });
}

void addPowerLog(CommandLine& line) {
  auto& options = line.powerLog;
  auto* command = line.app.add_subcommand("power-log", "show the power log: events that were recorded there");
  command->add_option("-n,--lines", options.lines, "only the last N records");
  command->add_flag("-f,--follow", options.follow, "go on with what is recorded, until interrupted");
  command->add_flag("--json", options.json, "one line of JSON for each");
  command->add_option("--unit", options.unit, "whose entries of the journal count; empty: everybody's")
      ->capture_default_str();
  auto* directory =
      command->add_option("--directory", options.journalDirectory, "a folder with the journal's files");
  command->add_option("--file", options.file, "a file of records")->excludes(directory);
  command->callback([&line] {
    line.run = [&line] {
      if (line.powerLog.journalDirectory.empty() && line.powerLog.file.empty())
        line.powerLog.file = powerLogFile(line.directories, kJournalSocket);
      return showPowerLog(line.powerLog, line.terminal);
    };
  });
}

void addSettings(CommandLine& line) {
  using Action = ExitStatus (*)(const SettingsOptions&, TomlSettingsStore&, const Terminal&);
  auto* group =
      line.app.add_subcommand("settings", "list, get, set and unset settings")->require_subcommand(1);
  const auto add = [&line, group](const char* name, const char* what, Action action) {
    auto* command = group->add_subcommand(name, what);
    command->callback([&line, action] {
      line.run = [&line, action] {
        const ActingAsOwner owner(line.directories.state());
        auto store = line.store();
        return action(line.settings, store, line.terminal);
      };
    });
    return command;
  };
  auto& settings = line.settings;
  auto* list = add("list", "all settings with the layer that decides each", listSettings);
  list->add_option("domain", settings.domain, "only this domain");
  list->add_flag("--json", settings.json, "answer in JSON");
  auto* get = add("get", "one setting's value", getSetting);
  get->add_flag("--json", settings.json, "answer in JSON");
  auto* set = add("set", "store a value in the daemon's own layer", setSetting);
  auto* unset = add("unset", "remove a value from the daemon's own layer", unsetSetting);
  for (auto* command : {get, set, unset}) {
    command->add_option("domain", settings.domain, "domain, such as com.orvane.tarnel")->required();
    command->add_option("key", settings.key, "key")->required();
  }
  set->add_option("value", settings.value, "value")->required();
  set->add_option("--type", settings.type,
                  "string, int, real, bool, date, data or json (default: as it reads)");
}

void addConsent(CommandLine& line) {
  auto* group = line.app.add_subcommand("consent", "the user's consent to diagnostics: status, on, off")
                    ->require_subcommand(1);
  auto* status = group->add_subcommand("status", "whether diagnostics may be submitted");
  status->add_flag("--json", line.consentJson, "answer in JSON");
  status->callback([&line] {
    line.run = [&line] {
      const ActingAsOwner owner(line.directories.state());  // as the daemon sees it
      return showConsent(line.directories.configuration(), line.consentJson, line.terminal);
    };
  });
  for (const bool allowed : {true, false}) {
    auto* command =
        group->add_subcommand(allowed ? "on" : "off", allowed ? "agree to diagnostics" : "withhold consent");
    command->callback([&line, allowed] {
      line.run = [&line, allowed] {
        auto store = line.store();
        return storeConsent(line.directories.configuration(), line.directories.state(), allowed, store,
                            line.terminal);
      };
    });
  }
}

void addStorebag(CommandLine& line) {
  using Action = ExitStatus (*)(const StorebagOptions&, const Terminal&);
  auto* group = line.app.add_subcommand("storebag", "make, sign and check storebags")->require_subcommand(1);
  const auto add = [&line, group](const char* name, const char* what, Action action) {
    auto* command = group->add_subcommand(name, what);
    command->callback(
        [&line, action] { line.run = [&line, action] { return action(line.storebag, line.terminal); }; });
    return command;
  };
  auto& options = line.storebag;
  auto* keygen = add("keygen", "make a signing key and the bundle that trusts it", makeStorebagKey);
  keygen->add_option("folder", options.output, "where to put them")->required();
  keygen->add_option("--bundle-version", options.bundleVersion, "version of the client library")
      ->capture_default_str();
  keygen->add_option("--bits", options.bits, "length of the key")
      ->capture_default_str()
      ->check(CLI::Range(2048, 16384));
  auto* fresh = add("new", "write a storebag to begin with", newStorebag);
  fresh->add_option("--version", options.version, "its version")->capture_default_str();
  fresh->add_option("--client-name", options.client, "client names, separated by commas")
      ->capture_default_str();
  fresh->add_option("--service-name", options.service, "service names or parts")->capture_default_str();
  fresh->add_option("--server", options.postURL, "address of the reporting server")->capture_default_str();
  auto* sign = add("sign", "sign a storebag", signStorebag);
  sign->add_flag("--binary", options.binary, "outer document in binary form");
  auto* verify = add("verify", "check signature and contents of a signed storebag", verifyStorebag);
  auto* show = add("show", "print what a storebag holds", showStorebag);
  for (auto* command : {sign, verify, show})
    command->add_option("file", options.input, "the storebag")->required();
  sign->add_option("--key", options.key, "private key (PEM)")->required();
  verify->add_option("--key", options.key, "public key (DER) or bundle folder")->required();
  show->add_option("--key", options.key, "public key (DER) or bundle folder, to check the signature");
  for (auto* command : {fresh, sign}) {
    command->add_option("-o,--output", options.output, "file to write (default: standard output)");
  }
  for (auto* command : {keygen, fresh}) command->add_flag("--force", options.force, "replace what is there");
  sign->add_flag("--force", options.force, "replace what is there; sign in spite of errors");
}

void addArchive(CommandLine& line) {
  auto* group = line.app.add_subcommand("archive", "look into uploaded log data")->require_subcommand(1);
  auto* show = group->add_subcommand("show", "print what a keyed archive holds");
  show->add_option("file", line.archive.file,
                   "the body of a log data upload, at most 16 MiB; - for standard input")
      ->required();
  show->add_flag("--json", line.archive.json,
                 "one JSON document; a date is {\"$date\": ...}, data is {\"$data\": base-64}");
  show->callback(
      [&line] { line.run = [&line] { return showArchive(line.archive, STDIN_FILENO, line.terminal); }; });
}

// The parser itself would only say that a command is missing.
bool isUnknownCommand(const CommandLine& line, int argc, char** argv) {
  const CLI::App* app = &line.app;
  std::string called = "tarnelctl";
  for (int i = 1; i < argc && argv[i][0] != '-'; ++i) {
    const auto commands = app->get_subcommands([](const CLI::App*) { return true; });
    if (commands.empty()) return false;
    const auto isNamed = [name = argv[i]](const CLI::App* command) { return command->check_name(name); };
    const auto found = std::find_if(commands.begin(), commands.end(), isNamed);
    if (found == commands.end()) {
      line.terminal.err << "tarnelctl: unknown command '" << argv[i] << "': " << called
                        << " --help lists them\n";
      return true;
    }
    app = *found;
    called += std::string(" ") + argv[i];
  }
  return false;
}

std::string usageError(const CLI::App* /*app*/, const CLI::Error& error) {
  return "tarnelctl: " + std::string(error.what()) + "\nRun it with --help for more information.\n";
}

int runCommandLine(int argc, char** argv) {
  CommandLine line;
  line.app.footer(kFooter);
  line.app.failure_message(usageError);
  line.app.set_version_flag("--version", "tarnelctl " TARNEL_VERSION);
  line.app.require_subcommand(1);
  addSend(line);
  addReplay(line);
  addSingle(line);
  addUpload(line, "upload", "upload a file, which is deleted when the server takes it", "the file",
            uploadFile);
  addUpload(line, "upload-log", "upload log records",
            "JSON array of records, or one record a line; - for standard input", uploadLogRecords);
  addLog(line);
  addPowerLog(line);
  addSettings(line);
  addConsent(line);
  addStorebag(line);
  addArchive(line);
  if (isUnknownCommand(line, argc, argv)) return static_cast<int>(ExitStatus::usage);
  try {
    line.app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    // Help and version come this way too, with code 0.
    return line.app.exit(error, std::cout, line.terminal.err) == 0 ? 0 : static_cast<int>(ExitStatus::usage);
  }
  for (const auto& problem : line.directories.problems())
    line.terminal.err << "tarnelctl: " << problem << '\n';
  const auto status = line.run();
  line.terminal.out.flush();
  return line.terminal.out.good() ? static_cast<int>(status) : static_cast<int>(ExitStatus::failed);
}

}  // namespace
}  // namespace tarnel::ctl

int main(int argc, char** argv) {
  try {
    return tarnel::ctl::runCommandLine(argc, argv);
  } catch (const std::exception& failure) {
    std::cerr << "tarnelctl: " << failure.what() << '\n';
    return static_cast<int>(tarnel::ctl::ExitStatus::failed);
  }
}

#include "tools/tarnelctl/commands/consent_command.h"

#include <cerrno>
#include <ostream>
#include <string_view>

#include "base/log.h"
#include "platform/linux/device/file_consent.h"
#include "platform/linux/system/system_random.h"
#include "tools/tarnelctl/acting_as_owner.h"
#include "util/consent_identifiers.h"

namespace tarnel::ctl {
namespace {

// Why a consent file counts as "off" is worth seeing.
class TerminalLog final : public Log {
 public:
  explicit TerminalLog(const Terminal& terminal) : terminal_(terminal) {}

 protected:
  void write(LogLevel /*level*/, std::string_view text) override {
    terminal_.err << "tarnelctl: " << text << '\n';
  }

 private:
  const Terminal& terminal_;
};

std::string remedyFor(const Error& error) {
  if (error.code() == EACCES || error.code() == EPERM) return "; run it as root";
  return error.code() == ENOENT ? "; install the daemon, or name its directory in CONFIGURATION_DIRECTORY"
                                : "";
}

}  // namespace

ExitStatus showConsent(const std::string& configurationDirectory, bool json, const Terminal& terminal) {
  TerminalLog log(terminal);
  const bool allowed = FileConsent(configurationDirectory, log).isDiagnosticSubmissionAllowed();
  if (json) {
    terminal.out << "{\"diagnostics\":" << (allowed ? "true" : "false") << "}\n";
  } else {
    terminal.out << "Submission of diagnostics is " << (allowed ? "on" : "off") << ".\n";
  }
  return ExitStatus::ok;
}

ExitStatus storeConsent(const std::string& configurationDirectory, const std::string& stateDirectory,
                        bool allowed, TomlSettingsStore& store, const Terminal& terminal) {
  if (const auto error = FileConsent::store(configurationDirectory, allowed)) {
    terminal.err << "tarnelctl: " << error->localizedDescription() << remedyFor(*error) << '\n';
    return ExitStatus::failed;
  }
  const auto notForgotten = [&]() -> MaybeError {
    const ActingAsOwner owner(stateDirectory);
    TerminalLog log(terminal);
    FileConsent consent(configurationDirectory, log);
    SystemRandom random;
    return ConsentIdentifiers(store, consent, random).consentChanged();
  }();
  terminal.out << "Submission of diagnostics is now " << (allowed ? "on" : "off")
               << ". Sessions that start from now on follow it.\n";
  if (!notForgotten) return ExitStatus::ok;
  terminal.err << "tarnelctl: the identifier of before could not be forgotten: "
               << notForgotten->localizedDescription() << "; mend that and run this command again\n";
  return ExitStatus::failed;
}

}  // namespace tarnel::ctl

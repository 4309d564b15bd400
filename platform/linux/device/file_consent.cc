#include "platform/linux/device/file_consent.h"

#include <vector>

#include "base/file_access.h"
#include "platform/linux/configuration/toml_file.h"

namespace tarnel {

namespace {

std::string consentPath(const std::string& configurationDirectory) {
  return configurationDirectory + "/consent.toml";
}

}  // namespace

FileConsent::FileConsent(const std::string& configurationDirectory, Log& log)
    : path_(consentPath(configurationDirectory)),
      problems_("FileConsent(isDiagnosticSubmissionAllowed)", log) {}

bool FileConsent::isDiagnosticSubmissionAllowed() {
  std::vector<ConfigurationProblem> problems;
  bool allowed = false;
  if (const auto document = readTomlFile(path_, problems)) {
    for (const auto& [key, node] : document->entries) {
      if (key != "diagnostics") {
        problems.push_back(unknownKey(path_, node, key));
      } else if (const bool* value = node.scalar.boolean()) {
        allowed = *value;
      } else {
        problems.push_back(badValue(path_, node, key, "true or false"));
      }
    }
  }
  problems_.report(problems);
  return allowed;
}

MaybeError FileConsent::store(const std::string& configurationDirectory, bool allowed) {
  const std::string text =
      std::string("# Whether diagnostics may be submitted; written by tarnelctl consent.\n") +
      "diagnostics = " + (allowed ? "true" : "false") + "\n";
  return replaceFile(consentPath(configurationDirectory), text, 0644);
}

}  // namespace tarnel

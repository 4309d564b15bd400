#pragma once

#include <string>

#include "base/error.h"
#include "base/log.h"
#include "platform/consent.h"
#include "platform/linux/configuration/once_log.h"

namespace tarnel {

// Consent as <configuration>/consent.toml states it (diagnostics = true), read on every question, so that a
// change takes effect at once. A file that is missing, damaged or not trusted means: not allowed.
class FileConsent final : public Consent {
 public:
  FileConsent(const std::string& configurationDirectory, Log& log);

  bool isDiagnosticSubmissionAllowed() override;

  // Writes the file, for the command-line tool. The error text names the file and the reason.
  static MaybeError store(const std::string& configurationDirectory, bool allowed);

 private:
  const std::string path_;
  OnceLog problems_;
};

}  // namespace tarnel

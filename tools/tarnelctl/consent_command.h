#pragma once

#include <string>

#include "tools/tarnelctl/terminal.h"

// `tarnelctl consent`: whether the user has agreed to the submission of diagnostics.

namespace tarnel::ctl {

ExitStatus showConsent(const std::string& configurationDirectory, bool json, const Terminal& terminal);
ExitStatus storeConsent(const std::string& configurationDirectory, bool allowed, const Terminal& terminal);

}  // namespace tarnel::ctl

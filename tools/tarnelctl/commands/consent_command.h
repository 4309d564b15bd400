#pragma once

#include <string>

#include "platform/linux/configuration/toml_settings_store.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl consent`: whether the user has agreed to the submission of diagnostics.

namespace tarnel::ctl {

ExitStatus showConsent(const std::string& configurationDirectory, bool json, const Terminal& terminal);
// Withholding consent also drops the identifier that honours it, so that one made later tells nothing of the
// old.
ExitStatus storeConsent(const std::string& configurationDirectory, const std::string& stateDirectory,
                        bool allowed, TomlSettingsStore& store, const Terminal& terminal);

}  // namespace tarnel::ctl

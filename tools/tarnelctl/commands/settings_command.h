#pragma once

#include <string>

#include "platform/linux/configuration/toml_settings_store.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl settings`: what is set, and which layer it comes from.

namespace tarnel::ctl {

inline constexpr char kDefaultDomain[] = "com.orvane.tarnel";

struct SettingsOptions {
  std::string domain;  // list: empty means all
  std::string key;
  std::string value;
  std::string type;  // as typedValue takes it
  bool json = false;
};

ExitStatus listSettings(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal);
ExitStatus getSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal);
// Says so when the administrator's layer hides what was set.
ExitStatus setSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal);
ExitStatus unsetSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal);

}  // namespace tarnel::ctl

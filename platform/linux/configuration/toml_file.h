#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "formats/toml.h"
#include "platform/linux/configuration/configuration.h"

// Reading the administrator's TOML files, and how their mistakes are worded. Threads: any.

namespace tarnel {

// The document of a trusted file. Nothing, with one problem added, when the file is not trusted, cannot be
// read or has a syntax error; nothing, without a problem, when there is no such file.
std::optional<TomlNode> readTomlFile(const std::string& path, std::vector<ConfigurationProblem>& problems);

// "<path>:<line>: unknown key <name>; ..."
ConfigurationProblem unknownKey(const std::string& path, const TomlNode& node, std::string_view name);
// "<path>:<line>: <name> must be <expected>; the default stays"
ConfigurationProblem badValue(const std::string& path, const TomlNode& node, std::string_view name,
                              std::string_view expected);
// "<path>:<line>: <text>"
std::string atLine(const std::string& path, int64_t line, std::string_view text);

}  // namespace tarnel

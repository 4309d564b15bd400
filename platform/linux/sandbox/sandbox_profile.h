#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"

namespace tarnel {

// What a confined process may still do; the file format is described in tarneld.conf(5).
struct SandboxProfile {
  std::vector<std::string> read;                    // absolute paths, with everything below them
  std::vector<std::string> readWrite;               // as above
  std::vector<int> families;                        // socket families (AF_*)
  std::optional<std::vector<uint16_t>> connectTcp;  // ports; nothing: all
  std::vector<uint16_t> bindTcp;                    // ports
  std::vector<std::string> deniedCalls;             // beside those that are always denied
};

// Values of the ${NAME} that a profile's paths may begin with.
using SandboxVariables = std::map<std::string, std::string, std::less<>>;

// Reads a trusted profile file. Unlike other configuration, a profile with any mistake is refused: what it
// meant to forbid cannot be guessed. The error text names file, line and remedy.
Result<SandboxProfile> readSandboxProfile(const std::string& path, const SandboxVariables& variables);

}  // namespace tarnel

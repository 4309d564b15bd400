#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tarnel::lab {

struct LabOptions {
  std::string directory = "tarnel-lab";
  std::string listen = "127.0.0.1";      // numeric address
  uint16_t port = 8443;                  // 0: any free one
  uint16_t controlPort = 8444;           // 0: any free one; always on 127.0.0.1
  std::optional<uint16_t> datagramPort;  // 0: any free one; nothing: see effectiveDatagramPort
  size_t keep = 1000;                    // arrivals of each kind in memory
  uint64_t maxUploadMiB = 64;            // of one file, packed and unpacked
  int storebagMaxAge = 60;               // seconds, for "Cache-Control"
  std::string bundleVersion = "8.0";
  std::string readyFile;  // empty: none
  bool json = false;
  bool quiet = false;
};

// 8445 unless told otherwise, and any free one beside a free HTTPS port.
uint16_t effectiveDatagramPort(const LabOptions& options);

struct ParsedOptions {
  LabOptions options;
  // Set when the program is to end with this code at once; what is to be said has been said.
  std::optional<int> exitCode;
};

// Reads the command line; prints help and errors itself.
ParsedOptions parseOptions(int argc, const char* const* argv);

}  // namespace tarnel::lab

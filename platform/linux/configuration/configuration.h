#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/log.h"

// What the administrator decides: the TOML files of the configuration directory, described in
// tarneld.conf(5). Every file counts only when it is trusted (see FileTrust). Loading never fails: what
// cannot be used is named in a problem, and the default stays.
//
// Threads: values, immutable once loaded.

namespace tarnel {

// One thing that is wrong with the configuration. The text names file, line where there is one, and remedy.
struct ConfigurationProblem {
  LogLevel level = LogLevel::warning;
  std::string text;
};

struct Configuration {
  struct Limits {
    uint32_t connections = 1024;  // of all clients together
    uint32_t connectionsPerUser = 64;
    std::chrono::seconds idleExit{0};      // 0: an idle process stays
    uint64_t maxUploadBytes = 32U << 20U;  // of one client file; at most half of what may be queued
    friend bool operator==(const Limits&, const Limits&) = default;
  };
  struct Http {
    std::chrono::seconds connectTimeout{30};
    std::chrono::seconds noProgress{60};   // without a byte in either direction
    uint64_t maxAnswerBytes = 8U << 20U;   // of one answer
    uint64_t maxQueuedBytes = 64U << 20U;  // bodies of all posts that have not ended
    uint32_t connectionsPerHost = 6;
    uint32_t connections = 32;
    friend bool operator==(const Http&, const Http&) = default;
  };

  std::optional<LogLevel> logLevel;    // nothing: the default
  bool filterHeldEvents = false;       // once more before they are posted
  std::optional<std::string> country;  // ISO 3166, upper case; nothing: from the locale
  Limits limits;
  Http http;
  std::string bundleRoot;  // before the paths of code bundles: absolute, without a slash at the end; or empty
  std::vector<std::string> trustFiles;  // PEM files beside the system's certificates
  std::vector<ConfigurationProblem> problems;
};

// Reads tarneld.toml, then tarneld.d/*.toml in order of their names, a later file winning key by key; and
// lists trust.d/*.pem. A file with a syntax error is left out whole.
Configuration loadConfiguration(const std::string& configurationDirectory);

}  // namespace tarnel

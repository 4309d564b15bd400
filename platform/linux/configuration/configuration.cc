#include "platform/linux/configuration/configuration.h"

#include <algorithm>
#include <array>
#include <cerrno>

#include "base/file_access.h"
#include "platform/linux/configuration/toml_file.h"

namespace tarnel {

namespace {

// What a key takes and where it goes. `take` gives what was expected when the value does not fit, else null.
struct KeyRule {
  const char* section;
  const char* key;
  const char* (*take)(const TomlNode& node, Configuration& configuration);
};

const int64_t* integerIn(const TomlNode& node, int64_t least, int64_t most) {
  const int64_t* number = node.scalar.integer();
  return number != nullptr && *number >= least && *number <= most ? number : nullptr;
}

template <class T>
const char* takeCount(const TomlNode& node, T& target) {
  const int64_t* number = integerIn(node, 1, 1'000'000);
  if (number == nullptr) return "an integer from 1 to 1000000";
  target = static_cast<T>(*number);
  return nullptr;
}

const char* takeBytes(const TomlNode& node, uint64_t& target) {
  const int64_t* number = integerIn(node, 1024, int64_t{1} << 40U);
  if (number == nullptr) return "an integer from 1024 to 1099511627776 (bytes)";
  target = static_cast<uint64_t>(*number);
  return nullptr;
}

// A file is compressed in one piece, whose length is counted in 32 bits.
const char* takeUploadBytes(const TomlNode& node, Configuration& configuration) {
  const int64_t* number = integerIn(node, 1024, UINT32_MAX);
  if (number == nullptr) return "an integer from 1024 to 4294967295 (bytes)";
  configuration.limits.maxUploadBytes = static_cast<uint64_t>(*number);
  return nullptr;
}

const char* takeWait(const TomlNode& node, std::chrono::seconds& target) {
  const int64_t* number = integerIn(node, 1, 3600);
  if (number == nullptr) return "an integer from 1 to 3600 (seconds)";
  target = std::chrono::seconds(*number);
  return nullptr;
}

const char* takeIdleExit(const TomlNode& node, Configuration& configuration) {
  const int64_t* number = integerIn(node, 0, 86400);
  if (number == nullptr) return "an integer from 0 to 86400 (seconds; 0 switches it off)";
  configuration.limits.idleExit = std::chrono::seconds(*number);
  return nullptr;
}

const char* takeLogLevel(const TomlNode& node, Configuration& configuration) {
  std::optional<LogLevel> level;
  if (const std::string* name = node.scalar.string()) level = logLevelFromText(*name);
  if (const int64_t* number = node.scalar.integer()) level = logLevelFromText(std::to_string(*number));
  if (!level) return "\"error\", \"warning\", \"information\" or \"debug\" (or 3, 4, 6, 7)";
  configuration.logLevel = level;
  return nullptr;
}

const char* takeCountry(const TomlNode& node, Configuration& configuration) {
  const std::string* code = node.scalar.string();
  const auto isUpperCase = [](char letter) { return letter >= 'A' && letter <= 'Z'; };
  if (code == nullptr || code->size() != 2 || !std::all_of(code->begin(), code->end(), isUpperCase)) {
    return "an ISO 3166 country code of two capital letters, such as \"DE\"";
  }
  configuration.country = *code;
  return nullptr;
}

// The root of the file system is written as the empty text.
bool isPlainPath(std::string_view path) {
  if (path.empty()) return true;
  if (path.front() != '/' || path.find('\0') != std::string_view::npos) return false;
  for (size_t start = 1; start <= path.size();) {
    const size_t end = std::min(path.find('/', start), path.size());
    const std::string_view part = path.substr(start, end - start);
    if (part.empty() || part == "." || part == "..") return false;
    start = end + 1;
  }
  return true;
}

const char* takeBundleRoot(const TomlNode& node, Configuration& configuration) {
  const std::string* path = node.scalar.string();
  if (path == nullptr || !isPlainPath(*path)) {
    return "an absolute path without \".\", \"..\" and superfluous slashes, or the empty text";
  }
  configuration.bundleRoot = *path;
  return nullptr;
}

const char* takeFilterHeldEvents(const TomlNode& node, Configuration& configuration) {
  const bool* on = node.scalar.boolean();
  if (on == nullptr) return "true or false";
  configuration.filterHeldEvents = *on;
  return nullptr;
}

using C = Configuration;
constexpr std::array kRules{
    KeyRule{"log", "level", takeLogLevel},
    KeyRule{"locale", "country", takeCountry},
    KeyRule{"privacy", "filter_held_events", takeFilterHeldEvents},
    KeyRule{"bundles", "root", takeBundleRoot},
    KeyRule{"limits", "idle_exit_seconds", takeIdleExit},
    KeyRule{"limits", "connections",
            [](const TomlNode& node, C& c) { return takeCount(node, c.limits.connections); }},
    KeyRule{"limits", "connections_per_user",
            [](const TomlNode& node, C& c) { return takeCount(node, c.limits.connectionsPerUser); }},
    KeyRule{"limits", "max_upload_bytes", takeUploadBytes},
    KeyRule{"http", "connect_timeout_seconds",
            [](const TomlNode& node, C& c) { return takeWait(node, c.http.connectTimeout); }},
    KeyRule{"http", "no_progress_seconds",
            [](const TomlNode& node, C& c) { return takeWait(node, c.http.noProgress); }},
    KeyRule{"http", "max_answer_bytes",
            [](const TomlNode& node, C& c) { return takeBytes(node, c.http.maxAnswerBytes); }},
    KeyRule{"http", "max_queued_bytes",
            [](const TomlNode& node, C& c) { return takeBytes(node, c.http.maxQueuedBytes); }},
    KeyRule{"http", "connections_per_host",
            [](const TomlNode& node, C& c) { return takeCount(node, c.http.connectionsPerHost); }},
    KeyRule{"http", "connections",
            [](const TomlNode& node, C& c) { return takeCount(node, c.http.connections); }},
};

bool isSection(std::string_view name) {
  return std::any_of(kRules.begin(), kRules.end(),
                     [name](const KeyRule& rule) { return name == rule.section; });
}

const KeyRule* findRule(std::string_view section, std::string_view key) {
  for (const KeyRule& rule : kRules) {
    if (section == rule.section && key == rule.key) return &rule;
  }
  return nullptr;
}

void applySection(const std::string& path, const std::string& section, const TomlNode& table,
                  Configuration& configuration) {
  for (const auto& [key, node] : table.entries) {
    const KeyRule* rule = findRule(section, key);
    if (rule == nullptr) {
      configuration.problems.push_back(unknownKey(path, node, section + "." + key));
    } else if (const char* expected = rule->take(node, configuration)) {
      configuration.problems.push_back(badValue(path, node, section + "." + key, expected));
    }
  }
}

void applyFile(const std::string& path, Configuration& configuration) {
  const auto document = readTomlFile(path, configuration.problems);
  if (!document) return;
  for (const auto& [section, node] : document->entries) {
    if (!isSection(section)) {
      configuration.problems.push_back(unknownKey(path, node, section));
    } else if (node.kind != TomlNode::Kind::table) {
      configuration.problems.push_back(badValue(path, node, section, "a section with this name in brackets"));
    } else {
      applySection(path, section, node, configuration);
    }
  }
}

// A file is compressed and sent from memory, where other uploads and posts need room as well.
void fitUploads(const std::string& configurationDirectory, Configuration& configuration) {
  auto& allowed = configuration.limits.maxUploadBytes;
  const uint64_t most = configuration.http.maxQueuedBytes / 2;
  if (allowed <= most) return;
  configuration.problems.push_back(
      {LogLevel::warning,
       configurationDirectory + ": limits.max_upload_bytes is " + std::to_string(allowed) +
           ", but must not be more than half of http.max_queued_bytes: " + std::to_string(most) +
           " is used; raise http.max_queued_bytes to " + std::to_string(allowed * 2)});
  allowed = most;
}

void listTrustFiles(const std::string& directory, Configuration& configuration) {
  for (const std::string& name : sortedEntries(directory, ".pem")) {
    const std::string path = directory + "/" + name;
    const auto contents = readFile(path, FileTrust::trusted);
    if (!contents) {
      configuration.problems.push_back({LogLevel::error, contents.error().localizedDescription()});
    } else if (contents->text.find("-----BEGIN CERTIFICATE-----") == std::string::npos) {
      configuration.problems.push_back(
          {LogLevel::error, path +
                                ": holds no certificate in PEM form (a line -----BEGIN CERTIFICATE-----); it "
                                "is not used"});
    } else {
      configuration.trustFiles.push_back(path);
    }
  }
}

}  // namespace

Configuration loadConfiguration(const std::string& configurationDirectory) {
  Configuration configuration;
  applyFile(configurationDirectory + "/tarneld.toml", configuration);
  const std::string dropIns = configurationDirectory + "/tarneld.d";
  for (const std::string& name : sortedEntries(dropIns, ".toml")) {
    applyFile(dropIns + "/" + name, configuration);
  }
  fitUploads(configurationDirectory, configuration);
  listTrustFiles(configurationDirectory + "/trust.d", configuration);
  return configuration;
}

}  // namespace tarnel

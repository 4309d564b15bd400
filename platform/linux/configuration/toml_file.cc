#include "platform/linux/configuration/toml_file.h"

#include <cerrno>

#include "base/file_access.h"

namespace tarnel {

std::optional<TomlNode> readTomlFile(const std::string& path, std::vector<ConfigurationProblem>& problems) {
  const auto contents = readFile(path, FileTrust::trusted);
  if (!contents) {
    if (contents.error().code() != ENOENT) {
      problems.push_back({LogLevel::error, contents.error().localizedDescription()});
    }
    return std::nullopt;
  }
  auto document = parseToml(contents->text);
  if (!document) {
    problems.push_back({LogLevel::error, atLine(path, document.error().code(),
                                                document.error().localizedDescription() +
                                                    "; nothing of this file is used until that is mended")});
    return std::nullopt;
  }
  return *std::move(document);
}

ConfigurationProblem unknownKey(const std::string& path, const TomlNode& node, std::string_view name) {
  return {LogLevel::warning,
          atLine(path, node.line,
                 "unknown key " + std::string(name) + "; it is ignored, tarneld.conf(5) lists the keys")};
}

ConfigurationProblem badValue(const std::string& path, const TomlNode& node, std::string_view name,
                              std::string_view expected) {
  return {LogLevel::warning,
          atLine(path, node.line,
                 std::string(name) + " must be " + std::string(expected) + "; the default stays")};
}

std::string atLine(const std::string& path, int64_t line, std::string_view text) {
  return path + ":" + std::to_string(line) + ": " + std::string(text);
}

}  // namespace tarnel

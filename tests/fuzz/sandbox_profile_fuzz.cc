// Sandbox profiles of any text. The whole input is the file. What is granted must be in the text, word for
// word, and a profile with any mistake grants nothing.

#include "platform/linux/sandbox/sandbox_profile.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "formats/toml.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/scratch_folder.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {
    "syntax error",   "unknown key",   "wrong kind",   "path refused", "variable", "unknown variable",
    "family refused", "port refused",  "call refused", "profile",      "paths",    "families",
    "ports",          "no connection", "calls"};

namespace {

const SandboxVariables kVariables{
    {"STATE", "/var/lib/example"}, {"BUNDLE_ROOT", ""}, {"LOGS", "/var/log/example"}};
constexpr std::array<std::pair<std::string_view, int>, 4> kFamilies{
    {{"unix", AF_UNIX}, {"inet", AF_INET}, {"inet6", AF_INET6}, {"netlink", AF_NETLINK}}};

// The elements of a list of the document; nothing when there is none.
std::vector<TomlNode> elementsOf(const TomlNode& document, std::string_view section, std::string_view key) {
  const auto* table = document.find(section);
  const auto* list = table == nullptr ? nullptr : table->find(key);
  return list == nullptr ? std::vector<TomlNode>() : list->elements;
}

std::string expanded(std::string path) {
  for (const auto& [name, value] : kVariables) {
    const auto written = "${" + name + "}";
    if (path.starts_with(written)) {
      reached("variable");
      return value + path.substr(written.size());
    }
  }
  return path;
}

void checkPaths(const std::vector<std::string>& granted, const std::vector<TomlNode>& written) {
  require(granted.size() == written.size(), "a path for each that is written");
  for (size_t i = 0; i < granted.size(); ++i) {
    const auto& path = granted[i];
    require(written[i].scalar.string() != nullptr, "a path is a text");
    require(path == expanded(*written[i].scalar.string()), "the path is the one that is written");
    require(path.starts_with('/'), "a path is absolute");
    require(path.find('\0') == std::string::npos, "the system sees all of a path");
    const auto plain = std::filesystem::path(path).lexically_normal();
    require(plain.has_relative_path(), "no path opens the whole file system");
    reached("paths");
  }
}

void checkPorts(const std::vector<uint16_t>& granted, const std::vector<TomlNode>& written) {
  require(granted.size() == written.size(), "a port for each that is written");
  for (size_t i = 0; i < granted.size(); ++i) {
    require(written[i].scalar == Value(granted[i]), "the port is the one that is written");
    reached("ports");
  }
}

void checkNetwork(const SandboxProfile& profile, const TomlNode& document) {
  const auto families = elementsOf(document, "network", "families");
  require(profile.families.size() == families.size(), "a family for each that is written");
  for (size_t i = 0; i < families.size(); ++i) {
    const auto found = std::find_if(kFamilies.begin(), kFamilies.end(), [&](const auto& family) {
      return families[i].scalar == Value(family.first) && profile.families[i] == family.second;
    });
    require(found != kFamilies.end(), "the family is the one that is written");
    reached("families");
  }
  checkPorts(profile.bindTcp, elementsOf(document, "network", "bind_tcp"));
  const auto* network = document.find("network");
  const bool isLimited = network != nullptr && network->find("connect_tcp") != nullptr;
  require(profile.connectTcp.has_value() == isLimited,
          "connections are free only when nothing is said of them");
  if (!isLimited) return;
  checkPorts(*profile.connectTcp, elementsOf(document, "network", "connect_tcp"));
  if (profile.connectTcp->empty()) reached("no connection");
}

void checkCalls(const SandboxProfile& profile, const TomlNode& document) {
  const auto denied = elementsOf(document, "calls", "deny");
  require(profile.deniedCalls.size() == denied.size(), "every call that is written is denied");
  for (size_t i = 0; i < denied.size(); ++i) {
    require(denied[i].scalar == Value(profile.deniedCalls[i]), "by its name");
    reached("calls");
  }
}

// A word that is not known may have been meant to forbid something.
void checkKnown(const TomlNode& document) {
  const std::map<std::string_view, std::set<std::string_view>> known{
      {"files", {"read", "read_write"}},
      {"network", {"families", "connect_tcp", "bind_tcp"}},
      {"calls", {"deny"}}};
  for (const auto& [section, table] : document.entries) {
    require(known.contains(section) && table.kind == TomlNode::Kind::table, "every section is known");
    for (const auto& [key, node] : table.entries) {
      require(known.at(section).contains(key) && node.kind == TomlNode::Kind::array, "every key is known");
    }
  }
}

void checkProfile(const SandboxProfile& profile, const TomlNode& document) {
  checkKnown(document);
  checkPaths(profile.read, elementsOf(document, "files", "read"));
  checkPaths(profile.readWrite, elementsOf(document, "files", "read_write"));
  checkNetwork(profile, document);
  checkCalls(profile, document);
  reached("profile");
}

void noteRefusal(const std::string& text) {
  constexpr std::array<std::pair<std::string_view, std::string_view>, 9> kReasons{
      {{": unknown key ", "unknown key"},
       {" must be a list in brackets", "wrong kind"},
       {" is no absolute path", "path refused"},
       {" opens the whole file system", "path refused"},
       {"a path must be a text", "path refused"},
       {"unknown variable at the start", "unknown variable"},
       {"network.families may hold", "family refused"},
       {"a port must be", "port refused"},
       {"calls.deny must hold", "call refused"}}};
  for (const auto& [words, milestone] : kReasons) {
    if (text.find(words) != std::string::npos) reached(milestone);
  }
}

void checkRefusal(const Error& error, const std::string& path, std::string_view text) {
  const auto& words = error.localizedDescription();
  require(words.starts_with(path + ":"), "the error names the file");
  require(words.find("; correct the profile") != std::string::npos, "and the remedy");
  const auto line = Value(words.substr(path.size() + 1)).int64Value();
  require(line >= 1 && line <= std::count(text.begin(), text.end(), '\n') + 1, "and the line");
}

}  // namespace

void runOne(std::span<const uint8_t> input) {
  static const ScratchFolder folder;
  const auto text = asText(input);
  folder.write("any.profile", text);
  const auto path = folder.path() + "/any.profile";
  const auto profile = readSandboxProfile(path, kVariables);
  const auto document = parseToml(text);
  if (profile) {
    require(static_cast<bool>(document), "a profile is a document");
    return checkProfile(*profile, *document);
  }
  checkRefusal(profile.error(), path, text);
  if (document) return noteRefusal(profile.error().localizedDescription());
  reached("syntax error");
}

}  // namespace tarnel::fuzz

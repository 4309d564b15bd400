#include "platform/linux/sandbox/sandbox_profile.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "base/file_access.h"
#include "platform/linux/configuration/toml_file.h"

namespace tarnel {

namespace {

struct Family {
  std::string_view name;
  int number;
};
constexpr std::array kFamilies{Family{"unix", AF_UNIX}, Family{"inet", AF_INET}, Family{"inet6", AF_INET6},
                               Family{"netlink", AF_NETLINK}};

// A path with such a part opens more than it seems to.
bool hasDots(std::string_view path) {
  for (size_t start = 0; start <= path.size();) {
    const size_t end = std::min(path.find('/', start), path.size());
    const std::string_view part = path.substr(start, end - start);
    if (part == "." || part == "..") return true;
    start = end + 1;
  }
  return false;
}

class ProfileReader {
 public:
  ProfileReader(const std::string& path, const SandboxVariables& variables)
      : path_(path), variables_(variables) {}

  Result<SandboxProfile> read(const TomlNode& document) {
    for (const auto& [section, table] : document.entries) {
      if (table.kind != TomlNode::Kind::table || !isSection(section)) {
        refuse(table, "unknown key " + section);
        continue;
      }
      for (const auto& [key, node] : table.entries) readKey(section + "." + key, node);
    }
    if (!problem_.empty()) return Error(kTomlErrorDomain, EINVAL, problem_);
    return std::move(profile_);
  }

 private:
  // The first mistake is the one that is told.
  void refuse(const TomlNode& node, const std::string& reason) {
    if (problem_.empty()) problem_ = atLine(path_, node.line, reason + "; correct the profile");
  }

  void readKey(const std::string& name, const TomlNode& node) {
    if (node.kind != TomlNode::Kind::array) {
      refuse(node, isKnown(name) ? name + " must be a list in brackets" : "unknown key " + name);
      return;
    }
    if (name == "network.connect_tcp") profile_.connectTcp.emplace();
    for (const TomlNode& element : node.elements) readElement(name, element);
    if (!isKnown(name)) refuse(node, "unknown key " + name);
  }

  static bool isSection(std::string_view name) {
    return name == "files" || name == "network" || name == "calls";
  }

  static bool isKnown(std::string_view name) {
    return name == "files.read" || name == "files.read_write" || name == "network.families" ||
           name == "network.connect_tcp" || name == "network.bind_tcp" || name == "calls.deny";
  }

  void readElement(const std::string& name, const TomlNode& element) {
    if (name == "files.read") {
      readPath(element, profile_.read);
    } else if (name == "files.read_write") {
      readPath(element, profile_.readWrite);
    } else if (name == "network.families") {
      readFamily(element);
    } else if (name == "network.connect_tcp") {
      readPort(element, *profile_.connectTcp);
    } else if (name == "network.bind_tcp") {
      readPort(element, profile_.bindTcp);
    } else if (name == "calls.deny") {
      if (const auto* call = element.scalar.string()) {
        profile_.deniedCalls.push_back(*call);
      } else {
        refuse(element, "calls.deny must hold names of system calls");
      }
    }
  }

  void readPath(const TomlNode& element, std::vector<std::string>& paths) {
    const std::string* text = element.scalar.string();
    if (text == nullptr) {
      refuse(element, "a path must be a text");
      return;
    }
    if (text->find('\0') != std::string::npos) {
      refuse(element, "a path must hold no zero character");
      return;
    }
    if (hasDots(*text)) {
      refuse(element, "\"" + *text + "\" must have no \".\" and no \"..\" between slashes");
      return;
    }
    std::string path = *text;
    if (path.starts_with("${")) {
      const size_t end = path.find('}');
      const auto found =
          end == std::string::npos ? variables_.end() : variables_.find(path.substr(2, end - 2));
      if (found == variables_.end()) {
        refuse(element, "unknown variable at the start of \"" + path + "\", known are " + knownVariables());
        return;
      }
      path = found->second + path.substr(end + 1);
    }
    if (!path.starts_with('/')) {
      refuse(element, "\"" + *text + "\" is no absolute path");
    } else if (path.find_first_not_of('/') == std::string::npos) {
      refuse(element, "\"" + *text + "\" opens the whole file system");
    } else {
      paths.push_back(std::move(path));
    }
  }

  std::string knownVariables() const {
    std::string names;
    for (const auto& [name, value] : variables_) names += (names.empty() ? "${" : ", ${") + name + "}";
    return names;
  }

  void readFamily(const TomlNode& element) {
    const std::string* name = element.scalar.string();
    for (const Family& family : kFamilies) {
      if (name != nullptr && *name == family.name) {
        profile_.families.push_back(family.number);
        return;
      }
    }
    refuse(element, "network.families may hold \"unix\", \"inet\", \"inet6\" and \"netlink\"");
  }

  void readPort(const TomlNode& element, std::vector<uint16_t>& ports) {
    const int64_t* number = element.scalar.integer();
    if (number == nullptr || *number < 0 || *number > UINT16_MAX) {
      refuse(element, "a port must be an integer from 0 to 65535");
      return;
    }
    ports.push_back(static_cast<uint16_t>(*number));
  }

  const std::string& path_;
  const SandboxVariables& variables_;
  SandboxProfile profile_;
  std::string problem_;
};

}  // namespace

Result<SandboxProfile> readSandboxProfile(const std::string& path, const SandboxVariables& variables) {
  const auto contents = readFile(path, FileTrust::trusted);
  if (!contents) {
    if (contents.error().code() != ENOENT) return contents.error();
    return Error(
        kTomlErrorDomain, ENOENT,
        path +
            ": there is no such sandbox profile; copy the one that was installed with the daemon (see "
            "tarneld.conf(5)) to this place");
  }
  const auto document = parseToml(contents->text);
  if (!document) {
    return Error(kTomlErrorDomain, document.error().code(),
                 atLine(path, document.error().code(),
                        document.error().localizedDescription() + "; correct the profile"));
  }
  return ProfileReader(path, variables).read(*document);
}

}  // namespace tarnel

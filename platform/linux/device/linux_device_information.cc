#include "platform/linux/device/linux_device_information.h"

#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <utility>
#include <vector>

#include "base/file_access.h"
#include "base/hex.h"
#include "platform/linux/configuration/toml_file.h"

namespace tarnel {

namespace {

constexpr std::array<std::string_view, 8> kKeys{"ProductVersion", "BuildVersion",  "ProductType",
                                                "DeviceName",     "HWModelStr",    "SerialNumber",
                                                "ReleaseType",    "UniqueDeviceID"};

// The value of a NAME=value line as os-release(5) writes them: with or without quotes, backslash escapes.
std::optional<std::string> assignedValue(std::string_view text, std::string_view name) {
  for (size_t start = 0; start < text.size();) {
    const size_t end = std::min(text.find('\n', start), text.size());
    std::string_view line = text.substr(start, end - start);
    start = end + 1;
    if (!line.starts_with(name) || line.size() <= name.size() || line[name.size()] != '=') continue;
    line.remove_prefix(name.size() + 1);
    while (!line.empty() && (line.back() == ' ' || line.back() == '\t' || line.back() == '\r'))
      line.remove_suffix(1);
    if (line.size() >= 2 && (line.front() == '"' || line.front() == '\'') && line.back() == line.front()) {
      line = line.substr(1, line.size() - 2);
    }
    std::string value;
    for (size_t index = 0; index < line.size(); ++index) {
      if (line[index] == '\\' && index + 1 < line.size()) ++index;
      value += line[index];
    }
    if (!value.empty()) return value;
  }
  return std::nullopt;
}

std::optional<std::string> fromFile(const std::string& path, std::string_view name) {
  const auto contents = readFile(path);
  return contents ? assignedValue(contents->text, name) : std::nullopt;
}

std::optional<std::string> orElse(std::optional<std::string> first, std::optional<std::string> second) {
  return first ? std::move(first) : std::move(second);
}

std::optional<std::string> osRelease(const std::string& root, std::string_view name) {
  return orElse(fromFile(root + "/etc/os-release", name), fromFile(root + "/usr/lib/os-release", name));
}

std::optional<std::string> kernelRelease() {
  utsname names{};
  return ::uname(&names) == 0 ? std::optional<std::string>(&names.release[0]) : std::nullopt;
}

std::optional<std::string> hostName() {
  std::array<char, 257> name{};
  if (::gethostname(name.data(), name.size() - 1) != 0 || name[0] == '\0') return std::nullopt;
  return std::string(name.data());
}

// Firmware vendors leave these in fields that they did not fill.
bool isPlaceholder(const std::string& text) {
  constexpr std::array<std::string_view, 9> kPlaceholders{"none",
                                                          "not specified",
                                                          "default string",
                                                          "to be filled by o.e.m.",
                                                          "system serial number",
                                                          "not available",
                                                          "unknown",
                                                          "0",
                                                          "system product name"};
  std::string lower(text);
  std::transform(lower.begin(), lower.end(), lower.begin(), [](char letter) {
    return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter + 32) : letter;
  });
  return std::find(kPlaceholders.begin(), kPlaceholders.end(), lower) != kPlaceholders.end();
}

}  // namespace

std::optional<std::string> uniqueDeviceID(std::string_view machineID) {
  const auto isDigit = [](char c) { return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'); };
  if (machineID.size() != 32 || !std::all_of(machineID.begin(), machineID.end(), isDigit) ||
      machineID.find_first_not_of('0') == std::string_view::npos) {
    return std::nullopt;
  }
  // Keyed by the machine-id, so that neither it nor another program's identifier can be worked out.
  constexpr std::string_view kPurpose = "com.orvane.tarneld UniqueDeviceID";
  std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
  unsigned size = 0;
  if (HMAC(EVP_sha1(), machineID.data(), static_cast<int>(machineID.size()),
           reinterpret_cast<const unsigned char*>(kPurpose.data()), kPurpose.size(), digest.data(),
           &size) == nullptr ||
      size != 20) {
    return std::nullopt;
  }
  return hexText(std::span(digest).first(size));
}

LinuxDeviceInformation::LinuxDeviceInformation(const std::string& configurationDirectory,
                                               std::string rootDirectory, Log& log)
    : overrides_(configurationDirectory + "/device.toml"),
      root_(std::move(rootDirectory)),
      problems_("LinuxDeviceInformation(copyAnswer)", log),
      missing_("LinuxDeviceInformation(copyAnswer)", log) {}

std::optional<std::string> LinuxDeviceInformation::overridden(std::string_view key) {
  std::vector<ConfigurationProblem> problems;
  std::optional<std::string> answer;
  if (const auto document = readTomlFile(overrides_, problems)) {
    for (const auto& [name, node] : document->entries) {
      if (std::find(kKeys.begin(), kKeys.end(), name) == kKeys.end()) {
        problems.push_back(unknownKey(overrides_, node, name));
      } else if (node.scalar.string() == nullptr) {
        problems.push_back(badValue(overrides_, node, name, "a text in quotes"));
      } else if (name == key) {
        answer = *node.scalar.string();
      }
    }
  }
  problems_.report(problems);
  return answer;
}

std::optional<std::string> LinuxDeviceInformation::firmware(const char* deviceTreeName,
                                                            const char* dmiName) const {
  for (const std::string& path :
       {root_ + "/proc/device-tree/" + deviceTreeName, root_ + "/sys/class/dmi/id/" + dmiName}) {
    auto text = readFirstLine(path);
    if (!text) continue;
    // The device tree lists several texts behind zero bytes; the first is the most specific.
    text->resize(std::min(text->find('\0'), text->size()));
    if (!isPlaceholder(*text) && isValidUtf8(*text)) return text;
  }
  return std::nullopt;
}

std::optional<std::string> LinuxDeviceInformation::copyAnswer(std::string_view key) {
  if (auto answer = overridden(key)) return answer->empty() ? std::nullopt : std::move(answer);
  if (key == "ProductVersion") return osRelease(root_, "VERSION_ID");
  if (key == "BuildVersion") return orElse(osRelease(root_, "BUILD_ID"), kernelRelease());
  if (key == "ProductType") return firmware("model", "product_name");
  if (key == "DeviceName") {
    return orElse(fromFile(root_ + "/etc/machine-info", "PRETTY_HOSTNAME"), hostName());
  }
  if (key == "HWModelStr") return firmware("compatible", "board_name");
  if (key == "SerialNumber") return firmware("serial-number", "product_serial");
  if (key == "UniqueDeviceID") return uniqueDeviceIDOfThisMachine();
  return std::nullopt;
}

std::optional<std::string> LinuxDeviceInformation::uniqueDeviceIDOfThisMachine() {
  const std::string path = root_ + "/etc/machine-id";
  const auto machineID = readFirstLine(path);
  auto identifier = machineID ? uniqueDeviceID(*machineID) : std::nullopt;
  std::vector<ConfigurationProblem> problems;
  if (!identifier) {
    problems.push_back({LogLevel::warning, path +
                                               " holds no identifier, so that this device has none: run "
                                               "systemd-machine-id-setup, or set UniqueDeviceID in " +
                                               overrides_});
  }
  missing_.report(problems);
  return identifier;
}

}  // namespace tarnel

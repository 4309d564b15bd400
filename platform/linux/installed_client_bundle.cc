#include "platform/linux/installed_client_bundle.h"

#include <utility>

#include "platform/linux/file_access.h"

namespace tarnel {

InstalledClientBundle::InstalledClientBundle(std::string folder) : folder_(std::move(folder)) {}

std::string InstalledClientBundle::folder(const char* variable) {
  return variable != nullptr && *variable == '/' ? variable : TARNEL_BUNDLE_DIRECTORY;
}

std::optional<std::string> InstalledClientBundle::version() {
  auto text = readFirstLine(folder_ + "/version");
  return text && isValidUtf8(*text) ? std::move(text) : std::nullopt;
}

std::optional<Data> InstalledClientBundle::resource(std::string_view name, std::string_view type) {
  const std::string file = std::string(name) + "." + std::string(type);
  if (file.find('/') != std::string::npos || file.find('\0') != std::string::npos) return std::nullopt;
  const auto contents = readFile(folder_ + "/" + file);
  if (!contents) return std::nullopt;
  return Data(contents->text.begin(), contents->text.end());
}

}  // namespace tarnel

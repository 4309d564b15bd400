#include "platform/linux/device/installed_client_bundle.h"

#include <utility>

#include "base/file_access.h"
#include "formats/cryptography.h"

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

std::vector<std::string> InstalledClientBundle::problems() {
  const std::string other = "or name the folder of another bundle with TARNEL_BUNDLE";
  const std::string keyRemedy =
      ", so no storebag can be verified; put the public key there that belongs to your signing key "
      "(tarnelctl storebag keygen makes one), " +
      other;
  std::vector<std::string> problems;
  const std::string key = folder_ + "/publicKey.der";
  const auto contents = readFile(key);
  const auto der = resource("publicKey", "der");
  if (!contents) {
    problems.push_back(contents.error().localizedDescription() + keyRemedy);
  } else if (!der || RsaPublicKey::fromDer(*der) == nullptr) {
    problems.push_back(key + ": holds no RSA public key in DER form" + keyRemedy);
  }
  if (!version()) {
    problems.push_back(
        folder_ + "/version: holds no version, so storebags are asked for as by 8.0; install libtarnel, " +
        other);
  }
  return problems;
}

}  // namespace tarnel

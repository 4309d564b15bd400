#pragma once

#include <string>
#include <vector>

#include "platform/client_bundle.h"

namespace tarnel {

// The client library's bundle as a folder: "version" (one line) and the resource files. Read on every call.
class InstalledClientBundle final : public ClientBundle {
 public:
  explicit InstalledClientBundle(std::string folder);

  // The folder that the variable TARNEL_BUNDLE names (`variable`, null when it is not set), else the
  // installed one.
  static std::string folder(const char* variable);

  std::optional<std::string> version() override;
  // A name or type with a slash is no resource of the bundle. At most 1 MiB.
  std::optional<Data> resource(std::string_view name, std::string_view type) override;

  // What keeps the service from using it, each with the remedy; empty when all is well.
  std::vector<std::string> problems();

 private:
  const std::string folder_;
};

}  // namespace tarnel

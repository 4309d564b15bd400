#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"

namespace tarnel {

// The client library's resources as installed beside it. Threads: any.
class ClientBundle {
 public:
  ClientBundle() = default;
  ClientBundle(const ClientBundle&) = delete;
  ClientBundle& operator=(const ClientBundle&) = delete;
  virtual ~ClientBundle() = default;

  // Version text such as "8.2"; nothing when the bundle has none.
  virtual std::optional<std::string> version() = 0;
  // Bytes of the resource file "name.type"; nothing when it is missing or cannot be read.
  virtual std::optional<Data> resource(std::string_view name, std::string_view type) = 0;
};

}  // namespace tarnel

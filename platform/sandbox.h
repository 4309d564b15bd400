#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

class Sandbox {
 public:
  Sandbox() = default;
  Sandbox(const Sandbox&) = delete;
  Sandbox& operator=(const Sandbox&) = delete;
  virtual ~Sandbox() = default;

  // Confines the process for good by the profile of that name. Must be called while the process has one
  // thread. The error text names the cause and the remedy; nothing means: confined.
  virtual std::optional<std::string> enter(std::string_view profileName) = 0;
};

}  // namespace tarnel

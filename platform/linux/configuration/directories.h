#pragma once

#include <functional>
#include <string>
#include <vector>

#include "base/error.h"

namespace tarnel {

// The four directories of an instance, absolute and without a slash at the end, and what follows from them.
//
// Each comes from the variable that the service manager sets (RUNTIME_DIRECTORY, STATE_DIRECTORY,
// LOGS_DIRECTORY, CONFIGURATION_DIRECTORY; the first of several separated by colons), else from the
// installation. Threads: immutable once made.
class Directories {
 public:
  // Value of an environment variable, or null.
  using Environment = std::function<const char*(const char* name)>;

  // A variable that holds no absolute path counts as not set, and problems() says so.
  static Directories fromEnvironment(const Environment& environment);
  // From the environment of this process.
  static Directories fromEnvironment();

  const std::string& runtime() const noexcept { return runtime_; }
  const std::string& state() const noexcept { return state_; }
  const std::string& logs() const noexcept { return logs_; }
  const std::string& configuration() const noexcept { return configuration_; }

  // True when all four were set and none of them is the installed one: an instance of somebody's own.
  bool isPrivate() const noexcept { return private_; }
  // Where the message log goes: the device's directory, which a private instance has below logs().
  const std::string& messageLogDirectory() const noexcept { return messageLog_; }

  // Makes the directories that are missing, with mode 0700 (the installed runtime directory: 0755, because
  // clients of all users connect through it). The configuration directory is the administrator's and is
  // made for private instances alone; of the message log's only the parent is made. Returns one text for
  // each that is missing and cannot be made.
  std::vector<std::string> create() const;

  const std::vector<std::string>& problems() const noexcept { return problems_; }

 private:
  std::string runtime_;
  std::string state_;
  std::string logs_;
  std::string configuration_;
  std::string messageLog_;
  bool private_ = false;
  std::vector<std::string> problems_;
};

// Makes the directory and its missing parents with that mode; no error when it exists.
MaybeError makeDirectories(const std::string& path, unsigned mode);

}  // namespace tarnel

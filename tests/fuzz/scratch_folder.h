#pragma once

#include <map>
#include <string>
#include <string_view>

namespace tarnel::fuzz {

// A folder of its own, in memory where the system has one there, for code that reads files. Empty at first;
// gone with the object.
class ScratchFolder {
 public:
  ScratchFolder();
  ScratchFolder(const ScratchFolder&) = delete;
  ScratchFolder& operator=(const ScratchFolder&) = delete;
  ~ScratchFolder();

  const std::string& path() const { return path_; }
  // Makes the file, with the folders above it.
  void write(const std::string& name, std::string_view text) const;
  // Every regular file's name below the folder, and what it holds.
  std::map<std::string, std::string> files() const;
  // Everything in it goes.
  void clear() const;

 private:
  std::string path_;
};

}  // namespace tarnel::fuzz

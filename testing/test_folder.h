#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

namespace tarnel::test {

struct Account {
  uid_t uid = 0;
  gid_t gid = 0;
};

// The account that programs run under when the test itself runs as root; none when it does not.
std::optional<Account> unprivilegedAccount();

// A folder under the temporary directory, which goes with its contents. What is written belongs to the
// unprivileged account where there is one.
class TestFolder {
 public:
  TestFolder();
  TestFolder(const TestFolder&) = delete;
  TestFolder& operator=(const TestFolder&) = delete;
  ~TestFolder();

  const std::string& path() const { return path_; }
  std::string path(std::string_view relative) const { return path_ + "/" + std::string(relative); }

  // With all missing parents.
  void makeDirectory(std::string_view relative, mode_t mode = 0755) const;
  // Replaces the file in one step, with all missing parents.
  void write(std::string_view relative, std::string_view text, mode_t mode = 0644) const;
  void copyFrom(const std::string& source, std::string_view relative, mode_t mode = 0644) const;
  void remove(std::string_view relative) const;
  // Empty when it cannot be read.
  std::string read(std::string_view relative) const;
  bool exists(std::string_view relative) const;

 private:
  void give(const std::string& path) const;

  std::string path_;
};

// The bytes of a file; empty when it cannot be read.
std::string readWholeFile(const std::string& path);

}  // namespace tarnel::test

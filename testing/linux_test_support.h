#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>

#include "base/unique_fd.h"

// What the tests of this folder share.

namespace tarnel {

// A folder of the test's own, which goes with it.
class TemporaryFolder {
 public:
  TemporaryFolder() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tarnel-test-XXXXXX").string();
    if (::mkdtemp(pattern.data()) != nullptr) path_ = pattern;
    EXPECT_FALSE(path_.empty());
  }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  ~TemporaryFolder() {
    std::error_code ignored;
    if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }
  std::string path(const std::string& name) const { return path_ + "/" + name; }
  void makeDirectory(const std::string& name) const {
    std::filesystem::create_directories(path(name));
    ::chmod(path(name).c_str(), 0755);
  }
  void write(const std::string& name, const std::string& text) const {
    makeDirectory(std::filesystem::path(name).parent_path().string());
    std::ofstream(path(name), std::ios::binary | std::ios::trunc) << text;
    ::chmod(path(name).c_str(), 0644);
  }
  std::string read(const std::string& name) const {
    std::ifstream stream(path(name), std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>());
  }
  bool exists(const std::string& name) const { return std::filesystem::exists(path(name)); }
  void remove(const std::string& name) const { std::filesystem::remove_all(path(name)); }

 private:
  std::string path_;
};

// Runs the action in a process of its own and gives what it returned; how the process ended when it did not
// return.
inline std::string runInChild(const std::function<std::string()>& action) {
  std::array<int, 2> ends{};
  if (::pipe(ends.data()) != 0) return "no pipe";
  UniqueFd readEnd(ends[0]);
  UniqueFd writeEnd(ends[1]);
  const pid_t pid = ::fork();
  if (pid < 0) return "no process";
  if (pid == 0) {
    const std::string text = action();
    const ssize_t written = ::write(writeEnd.get(), text.data(), text.size());
    ::_exit(written == static_cast<ssize_t>(text.size()) ? 0 : 1);
  }
  writeEnd.reset();
  std::string text;
  std::array<char, 4096> buffer{};
  for (;;) {
    const ssize_t count = ::read(readEnd.get(), buffer.data(), buffer.size());
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) break;
    text.append(buffer.data(), static_cast<size_t>(count));
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    return text + " [the process ended with status " + std::to_string(status) + "]";
  }
  return text;
}

}  // namespace tarnel

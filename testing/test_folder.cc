#include "testing/test_folder.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>

namespace tarnel::test {

namespace fs = std::filesystem;

std::optional<Account> unprivilegedAccount() {
  if (::geteuid() != 0) return std::nullopt;
  const passwd* nobody = ::getpwnam("nobody");
  if (nobody == nullptr) throw std::runtime_error("there is no user nobody to run programs as");
  return Account{nobody->pw_uid, nobody->pw_gid};
}

TestFolder::TestFolder() {
  std::string pattern = (fs::temp_directory_path() / "tarnel-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("cannot make " + pattern);
  path_ = pattern;
  ::chmod(path_.c_str(), 0755);
  give(path_);
}

TestFolder::~TestFolder() {
  std::error_code ignored;
  fs::remove_all(path_, ignored);
}

void TestFolder::give(const std::string& path) const {
  if (const auto account = unprivilegedAccount()) {
    if (::lchown(path.c_str(), account->uid, account->gid) != 0) {
      throw std::runtime_error("cannot give away " + path);
    }
  }
}

void TestFolder::makeDirectory(std::string_view relative, mode_t mode) const {
  const std::string whole = path(relative);
  if (fs::is_directory(whole)) return;
  const auto slash = relative.rfind('/');
  if (slash != std::string_view::npos) makeDirectory(relative.substr(0, slash));
  fs::create_directory(whole);
  ::chmod(whole.c_str(), mode);
  give(whole);
}

void TestFolder::write(std::string_view relative, std::string_view text, mode_t mode) const {
  const auto slash = relative.rfind('/');
  if (slash != std::string_view::npos) makeDirectory(relative.substr(0, slash));
  const std::string target = path(relative);
  const std::string fresh = target + ".writing";
  {
    std::ofstream stream(fresh, std::ios::binary | std::ios::trunc);
    stream << text;
    if (!stream.flush()) throw std::runtime_error("cannot write " + fresh);
  }
  ::chmod(fresh.c_str(), mode);
  give(fresh);
  fs::rename(fresh, target);
}

void TestFolder::copyFrom(const std::string& source, std::string_view relative, mode_t mode) const {
  const std::string text = readWholeFile(source);
  if (text.empty()) throw std::runtime_error("cannot read " + source);
  write(relative, text, mode);
}

void TestFolder::remove(std::string_view relative) const {
  fs::remove_all(path(relative));
}

std::string TestFolder::read(std::string_view relative) const {
  return readWholeFile(path(relative));
}

bool TestFolder::exists(std::string_view relative) const {
  return fs::exists(fs::symlink_status(path(relative)));
}

std::string readWholeFile(const std::string& path) {
  std::ifstream stream(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
}

}  // namespace tarnel::test

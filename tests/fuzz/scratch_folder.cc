#include "tests/fuzz/scratch_folder.h"

#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>

#include "tests/fuzz/fuzz_target.h"

namespace tarnel::fuzz {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kPrefix = "tarnel-fuzz-";

// A fuzzer mostly ends without destructors; its number stands in its folder's name.
void removeLeftovers(const fs::path& parent) {
  std::error_code ignored;
  for (const auto& entry : fs::directory_iterator(parent, ignored)) {
    const auto name = entry.path().filename().string();
    if (!name.starts_with(kPrefix)) continue;
    const auto process = ::atoi(name.c_str() + kPrefix.size());
    if (process > 0 && ::kill(process, 0) != 0 && errno == ESRCH) fs::remove_all(entry.path(), ignored);
  }
}

}  // namespace

ScratchFolder::ScratchFolder() {
  ::umask(022);  // files that others can write are not trusted
  const fs::path memory("/dev/shm");
  const auto parent = fs::is_directory(memory) ? memory : fs::temp_directory_path();
  removeLeftovers(parent);
  std::string pattern = parent / (std::string(kPrefix) + std::to_string(::getpid()) + "-XXXXXX");
  require(mkdtemp(pattern.data()) != nullptr, "a folder for files can be made");
  path_ = pattern;
}

ScratchFolder::~ScratchFolder() {
  std::error_code ignored;
  fs::remove_all(path_, ignored);
}

void ScratchFolder::write(const std::string& name, std::string_view text) const {
  const fs::path file = path_ + "/" + name;
  fs::create_directories(file.parent_path());
  std::ofstream stream(file, std::ios::binary | std::ios::trunc);
  stream.write(text.data(), static_cast<std::streamsize>(text.size()));
  stream.close();
  require(stream.good(), "a file can be written");
}

std::map<std::string, std::string> ScratchFolder::files() const {
  std::map<std::string, std::string> found;
  for (const auto& entry : fs::recursive_directory_iterator(path_)) {
    if (!entry.is_regular_file()) continue;
    std::ifstream stream(entry.path(), std::ios::binary);
    found[entry.path().string().substr(path_.size() + 1)] = {std::istreambuf_iterator<char>(stream), {}};
  }
  return found;
}

void ScratchFolder::clear() const {
  for (const auto& entry : fs::directory_iterator(path_)) fs::remove_all(entry.path());
}

}  // namespace tarnel::fuzz

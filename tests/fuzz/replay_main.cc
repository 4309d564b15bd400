// Takes a folder's files, or single files, through a fuzz target without libFuzzer.

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/milestones.h"

namespace {

using Bytes = std::vector<uint8_t>;

Bytes contentsOf(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary);
  return Bytes(std::istreambuf_iterator<char>(file), {});
}

std::vector<std::filesystem::path> filesIn(const std::filesystem::path& path) {
  if (!std::filesystem::is_directory(path)) return {path};
  std::vector<std::filesystem::path> files;
  for (const auto& entry : std::filesystem::directory_iterator(path)) files.push_back(entry.path());
  std::sort(files.begin(), files.end());
  return files;
}

// How many milestones the corpus does not reach; names them.
int missedMilestones() {
  int missed = 0;
  for (const auto name : tarnel::fuzz::kMilestones) {
    if (tarnel::fuzz::reachedMilestones().contains(name)) continue;
    std::fprintf(stderr, "no input of the corpus reached: %.*s\n", static_cast<int>(name.size()),
                 name.data());
    ++missed;
  }
  return missed;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr, "Usage: %s FOLDER-OR-FILE...\n", argv[0]);
    return 2;
  }
  size_t count = 0;
  bool whole = false;  // a whole corpus, which must reach every milestone
  for (int i = 1; i < argc; ++i) {
    whole = whole || std::filesystem::is_directory(argv[i]);
    for (const auto& file : filesIn(argv[i])) {
      // Told before it is run, so that a crash names its input.
      std::printf("%s\n", file.c_str());
      std::fflush(stdout);
      // A copy of its exact size, so that a read beyond its end is found.
      const Bytes input = contentsOf(file);
      tarnel::fuzz::runOne(input);
      ++count;
    }
  }
  std::printf("%zu inputs, %zu of %zu milestones\n", count, tarnel::fuzz::reachedMilestones().size(),
              tarnel::fuzz::kMilestones.size());
  if (count == 0) std::fprintf(stderr, "no input found\n");
  if (whole && missedMilestones() > 0) return 1;
  return count == 0 ? 1 : 0;
}

#include "platform/linux/system/start_up_pages.h"

#include <gtest/gtest.h>

#include <fstream>
#include <stdexcept>
#include <string>

namespace tarnel {
namespace {

// Kilobytes of this process that come from files.
long residentFiles() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("RssFile:")) return std::stol(line.substr(8));
  }
  return 0;
}

TEST(StartUpPagesTest, CodeIsGivenBackAndStillRuns) {
  residentFiles();
  const long before = residentFiles();
  releaseStartUpPages();
  EXPECT_LT(residentFiles(), before);
  // Unwinding reads tables and code of several objects.
  EXPECT_THROW(throw std::runtime_error("still here"), std::runtime_error);
  releaseStartUpPages();
  EXPECT_GT(residentFiles(), 0);
}

}  // namespace
}  // namespace tarnel

#pragma once

#include <ctime>
#include <string>
#include <vector>

#include "base/error.h"
#include "base/unique_fd.h"
#include "tools/files/file_io.h"
#include "tools/lab/http/certificate_authority.h"
#include "tools/storebag/storebag_key.h"

namespace tarnel::lab {

// Everything the lab keeps, in one folder.
struct LabPaths {
  explicit LabPaths(const std::string& directory);

  std::string directory;
  CertificateFiles certificates;
  std::string storebagKey;
  std::string bundle;
  std::string storebags;
  std::string arrivals;
  std::string uploads;
  std::string logData;
};

// The folder, ready for use and taken by this process until the object goes.
struct LabDirectory {
  LabPaths paths;
  StorebagKey key;
  UniqueFd lock;
  std::vector<std::string> made;  // sentences about what was made
};

// Makes what is missing and checks what is there. names: the addresses and host names to serve under.
// The error names file and remedy; one of them is that another lab uses the folder.
Result<LabDirectory> openLabDirectory(const std::string& directory, const std::vector<std::string>& names,
                                      const std::string& bundleVersion, std::time_t now);

}  // namespace tarnel::lab

#pragma once

#include <string>
#include <vector>

#include "base/value.h"

namespace tarnel {

// What a new inner document is made from.
struct StorebagTemplate {
  std::string version = "1.0.0";
  std::string client = "Example";           // client names, separated by commas
  std::string service = "example-service";  // service names or parts of them, separated by commas
  std::string baseURL = "{{LAB_URL}}";      // of the reporting server; the lab puts its own address there
  std::vector<std::string> countries = {"DE", "FR", "GB", "JP", "US"};
};

// An inner document that passes validateStorebag without a finding: "seed" and "release" alike, with one
// client entry that holds a filter of each kind and every threshold. Threads: any.
Dictionary newStorebagTemplate(const StorebagTemplate& from = {});

}  // namespace tarnel

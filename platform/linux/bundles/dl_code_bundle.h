#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "base/log.h"
#include "platform/code_bundle.h"
#include "platform/linux/configuration/once_log.h"

namespace tarnel {

// Bundles whose code is a shared library, as include/tarnel/tarnel_adaptor.h describes them: the
// library lies in the bundle's folder under the folder's name without its ending, and exports one C function.
//
// A library is loaded only when nobody but root and this process's user could have written to it (see
// checkTrustedPath), and is never unloaded. Why one is refused is logged once, until the reason changes. A
// confined process finds only what its sandbox profile lets it read.
//
// Threads: any.
class DlCodeBundles final : public CodeBundles {
 public:
  // `root` stands before every path; empty for the paths as they are. `log` is kept by reference.
  DlCodeBundles(std::string root, Log& log);
  ~DlCodeBundles() override;

  std::shared_ptr<CodeBundle> bundleWithPath(const std::string& path) override;

 private:
  const std::string root_;
  Log& log_;
  std::mutex mutex_;
  std::map<std::string, std::shared_ptr<CodeBundle>> bundles_;
};

// "<folder>/<folder's name without its ending>.so".
std::string libraryOfBundle(const std::string& bundleFolder);

}  // namespace tarnel

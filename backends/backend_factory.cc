#include <array>

#include "backends/dashboard/dashboard_backend.h"
#include "backends/https/https_post_backend.h"
#include "backends/tarnel_backend.h"
#include "backends/upload/upload_backend.h"
#include "client/include/tarnel/keys.h"

namespace tarnel {
namespace {

struct Blueprint {
  const Dependencies& dependencies;
  const std::string& name;
  const MaybeDictionary& profile;
  const MaybeString& productFamily;
  int32_t clientType;
};

template <class Backend>
std::shared_ptr<TarnelBackend> make(const Blueprint& blueprint) {
  return Backend::initWithName(blueprint.dependencies, blueprint.name, blueprint.profile,
                               blueprint.productFamily);
}

struct Row {
  const char* name;
  std::shared_ptr<TarnelBackend> (*make)(const Blueprint&);
};

// A name that is missing here is an unknown one.
constexpr std::array kRows{
    Row{kTarnelBackendDashboard, make<DashboardBackend>},
    Row{kTarnelBackendUploadServer, make<UploadBackend>},
    Row{kTarnelBackendHTTPPost, make<HTTPSPostBackend>},
    Row{kTarnelBackendHTTPPost2, make<HTTPSPostBackend>},
};

MaybeDictionary profileFrom(const Dependencies& dependencies, const std::string& name, const Value& section) {
  if (const auto* profile = section.dictionary()) return *profile;
  TARNEL_LOG(dependencies.log, warning,
             "TarnelBackend(newBackendWithName): %s: the section %s is not a dictionary and counts as absent",
             name.c_str(), name.c_str());
  return std::nullopt;
}

}  // namespace

std::shared_ptr<TarnelBackend> TarnelBackend::newBackendWithName(const Dependencies& dependencies,
                                                                 const std::string& name,
                                                                 const Value& profile,
                                                                 const MaybeString& productFamily,
                                                                 int32_t clientType) {
  for (const auto& row : kRows) {
    if (name != row.name) continue;
    const auto section = profileFrom(dependencies, name, profile);
    return row.make({dependencies, name, section, productFamily, clientType});
  }
  TARNEL_LOG(dependencies.log, error, "TarnelBackend(newBackendWithName): %s", name.c_str());
  return nullptr;
}

}  // namespace tarnel

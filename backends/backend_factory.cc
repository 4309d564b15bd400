#include <algorithm>
#include <array>

#include "backends/dashboard/dashboard_backend.h"
#include "backends/dravik/dravik_backend.h"
#include "backends/https/https_post_backend.h"
#include "backends/tarnel_backend.h"
#include "backends/upload/upload_backend.h"
#include "backends/vesmer/vesmer_backend.h"
#include "tarnel/keys.h"
#include "util/device_facts.h"

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

std::shared_ptr<TarnelBackend> makeDravik(const Blueprint& blueprint) {
  return DravikBackend::initWithName(blueprint.dependencies, blueprint.name, blueprint.profile,
                                     blueprint.productFamily, blueprint.clientType);
}

enum class Machines { all, notDesktop };

struct Row {
  const char* name;
  std::shared_ptr<TarnelBackend> (*make)(const Blueprint&);
  Machines machines = Machines::all;
};

// A name that is missing here is an unknown one.
constexpr std::array kRows{
    Row{kTarnelBackendDashboard, make<DashboardBackend>},
    Row{kTarnelBackendUploadServer, make<UploadBackend>},
    Row{kTarnelBackendHTTPPost, make<HTTPSPostBackend>},
    Row{kTarnelBackendHTTPPost2, make<HTTPSPostBackend>},
    Row{kTarnelBackendVesmer, make<VesmerBackend>},
    Row{kTarnelBackendDravik, makeDravik, Machines::notDesktop},
};

// Where a backend is not made, its name is unknown.
bool isMadeHere(const Row& row, const Dependencies& dependencies) {
  return row.machines == Machines::all || productType(dependencies.deviceInformation) != "Deskbox";
}

MaybeDictionary profileFrom(const Dependencies& dependencies, const std::string& name, const Value& section) {
  if (const auto* profile = section.dictionary()) return *profile;
  TARNEL_LOG(dependencies.log, warning,
             "TarnelBackend(newBackendWithName): %s: the section %s is not a dictionary and counts as absent",
             name.c_str(), name.c_str());
  return std::nullopt;
}

}  // namespace

bool TarnelBackend::isBackendName(std::string_view name) {
  return std::any_of(kRows.begin(), kRows.end(), [name](const Row& row) { return name == row.name; });
}

std::shared_ptr<TarnelBackend> TarnelBackend::newBackendWithName(const Dependencies& dependencies,
                                                                 const std::string& name,
                                                                 const Value& profile,
                                                                 const MaybeString& productFamily,
                                                                 int32_t clientType) {
  for (const auto& row : kRows) {
    if (name != row.name || !isMadeHere(row, dependencies)) continue;
    const auto section = profileFrom(dependencies, name, profile);
    return row.make({dependencies, name, section, productFamily, clientType});
  }
  TARNEL_LOG(dependencies.log, error, "TarnelBackend(newBackendWithName): %s", name.c_str());
  return nullptr;
}

}  // namespace tarnel

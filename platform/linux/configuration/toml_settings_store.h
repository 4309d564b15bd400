#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "base/file_access.h"
#include "base/log.h"
#include "platform/settings_store.h"

namespace tarnel {

inline constexpr char kSettingsErrorDomain[] = "TarnelSettingsErrorDomain";

// Where a value comes from.
enum class SettingsLayer : uint8_t { administrator, own };

struct SettingsEntry {
  std::string key;
  Value value;
  SettingsLayer layer = SettingsLayer::own;
};

// User defaults in TOML files, one per domain and layer:
// <configuration>/settings/<domain>.toml, the administrator's, which wins and is never written;
// <state>/settings/<domain>.toml, the process's own.
//
// Several processes may use one store: writers take turns by a lock file, and everybody notices that a file
// was replaced. A damaged own file is reported, gives nothing, and is moved aside to <domain>.toml.damaged-N
// when the next value is written. A damaged administrator's file is reported once and ignored.
//
// A domain's name consists of letters, digits, '.', '-' and '_', at most 128, and begins with no '.'. A file
// holds at most 1 MiB.
//
// Threads: any.
class TomlSettingsStore final : public SettingsStore {
 public:
  // `log` is kept by reference and must outlive the store.
  TomlSettingsStore(const std::string& configurationDirectory, const std::string& stateDirectory, Log& log);

  std::optional<Value> objectForKey(std::string_view domain, std::string_view key) override;
  MaybeError setObject(std::string_view domain, std::string_view key, const Value& value) override;
  MaybeError removeObject(std::string_view domain, std::string_view key) override;
  std::vector<std::string> ownKeys(std::string_view domain, std::string_view prefix) override;

  // As objectForKey, with the layer that decided.
  std::optional<SettingsEntry> entryForKey(std::string_view domain, std::string_view key);
  // Every key of the domain once, with the layer that decides it, sorted by key. An error when the own file
  // is there and cannot be used; its text names file, line and remedy.
  Result<std::vector<SettingsEntry>> entries(std::string_view domain);
  // Names of the domains that have a file in either layer, sorted.
  std::vector<std::string> domains() const;
  // The file of a layer, whether it exists or not.
  std::string path(SettingsLayer layer, std::string_view domain) const;

 private:
  // One file as it was last read.
  struct Layer {
    std::optional<FileIdentity> identity;  // nothing: no file, or not read yet
    Dictionary values;
    MaybeError problem;
  };
  struct Domain {
    Layer administrator;
    Layer own;
  };

  Domain& refreshed(std::string_view domain);
  void refresh(SettingsLayer layer, std::string_view domain, Layer& target);
  static Layer read(SettingsLayer layer, const std::string& path);
  void reportOnce(const std::string& text);
  // Runs the change on the own values under the lock file and stores the result when it returns true.
  template <class Change>
  MaybeError change(std::string_view domain, Change change);
  MaybeError moveAside(const std::string& path);

  const std::string configurationDirectory_;
  const std::string stateDirectory_;
  Log& log_;
  std::mutex mutex_;
  std::map<std::string, Domain, std::less<>> domains_;  // guarded by mutex_
  std::set<std::string> reported_;                      // guarded by mutex_
};

}  // namespace tarnel

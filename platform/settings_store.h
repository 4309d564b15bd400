#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"
#include "base/value.h"

namespace tarnel {

// User defaults: small values by domain and key, kept across restarts.
//
// Two layers: what the administrator wrote wins over what the process itself stored.
// Threads: any.
class SettingsStore {
 public:
  SettingsStore() = default;
  SettingsStore(const SettingsStore&) = delete;
  SettingsStore& operator=(const SettingsStore&) = delete;
  virtual ~SettingsStore() = default;

  // Nothing when neither layer has the key, or when the store cannot be read (logged once per cause).
  virtual std::optional<Value> objectForKey(std::string_view domain, std::string_view key) = 0;

  // Writes to the process's own layer, durably before it returns: a kill at any instant leaves either the
  // old or the new store. An error means that nothing changed. Booleans, integers, reals, strings, dates and
  // arrays and dictionaries of them can be stored.
  virtual MaybeError setObject(std::string_view domain, std::string_view key, const Value& value) = 0;
  // Removes the key from the process's own layer; no error when it was not there.
  virtual MaybeError removeObject(std::string_view domain, std::string_view key) = 0;
  // The keys of the process's own layer that begin with the prefix, in any order; none when the store cannot
  // be read.
  virtual std::vector<std::string> ownKeys(std::string_view domain, std::string_view prefix) = 0;
};

}  // namespace tarnel

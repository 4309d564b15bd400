#include "platform/linux/configuration/toml_settings_store.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "formats/toml.h"
#include "platform/linux/configuration/directories.h"

namespace tarnel {

namespace {

constexpr size_t kMaxDomainName = 128;
constexpr size_t kMaxReported = 64;  // texts; a file that keeps breaking in new ways is not news for ever
constexpr int kMaxDamagedFiles = 1000;

bool isDomainName(std::string_view name) {
  return !name.empty() && name.size() <= kMaxDomainName && name.front() != '.' &&
         std::all_of(name.begin(), name.end(), [](char letter) {
           return (letter >= 'a' && letter <= 'z') || (letter >= 'A' && letter <= 'Z') ||
                  (letter >= '0' && letter <= '9') || letter == '.' || letter == '-' || letter == '_';
         });
}

Error invalidDomain(std::string_view name) {
  return Error(
      kSettingsErrorDomain, EINVAL,
      "\"" + std::string(name) +
          "\" is no domain: use letters, digits, '.', '-' and '_', at most 128, not beginning with '.'");
}

// A file that stands in the way of reading, as opposed to one that can be read and makes no sense.
bool isDamage(const Error& error) {
  return error.domain() == kTomlErrorDomain || error.code() == EFBIG;
}

}  // namespace

TomlSettingsStore::TomlSettingsStore(const std::string& configurationDirectory,
                                     const std::string& stateDirectory, Log& log)
    : configurationDirectory_(configurationDirectory + "/settings"),
      stateDirectory_(stateDirectory + "/settings"),
      log_(log) {}

std::string TomlSettingsStore::path(SettingsLayer layer, std::string_view domain) const {
  return (layer == SettingsLayer::own ? stateDirectory_ : configurationDirectory_) + "/" +
         std::string(domain) + ".toml";
}

TomlSettingsStore::Layer TomlSettingsStore::read(SettingsLayer layer, const std::string& path) {
  Layer result;
  // The own file lies in a directory of mode 0700 and may belong to the daemon's user while root reads it.
  const auto contents = readFile(path, layer == SettingsLayer::own ? FileTrust::any : FileTrust::trusted);
  if (!contents) {
    if (contents.error().code() != ENOENT) {
      result.problem = contents.error();
      result.identity = fileIdentity(path);
    }
    return result;
  }
  result.identity = contents->identity;
  const auto document = parseToml(contents->text);
  if (!document) {
    result.problem = Error(kTomlErrorDomain, document.error().code(),
                           path + ":" + std::to_string(document.error().code()) + ": " +
                               document.error().localizedDescription());
    return result;
  }
  result.values = *document->value().dictionary();
  if (const auto text = writeToml(result.values); !text) {  // a time without a date, which is no value
    result.problem = Error(kTomlErrorDomain, 0, path + ": " + text.error().localizedDescription());
    result.values = Dictionary();
  }
  return result;
}

void TomlSettingsStore::reportOnce(const std::string& text) {
  if (reported_.size() >= kMaxReported || !reported_.insert(text).second) return;
  TARNEL_LOG(log_, error, "TomlSettingsStore(read): %s", text.c_str());
}

void TomlSettingsStore::refresh(SettingsLayer layer, std::string_view domain, Layer& target) {
  const std::string file = path(layer, domain);
  const auto identity = fileIdentity(file);
  if (identity && identity == target.identity) return;
  // Without an identity there is mostly no file; one behind a closed directory must not look the same.
  target = identity || errno != ENOENT ? read(layer, file) : Layer();
  if (!target.problem) return;
  const char* consequence = "; it is ignored until it is mended";
  if (layer == SettingsLayer::own) {
    consequence = isDamage(*target.problem) ? "; it will be moved aside when the next value is stored"
                                            : "; nothing can be stored until that is mended";
  }
  reportOnce(target.problem->localizedDescription() + consequence);
}

TomlSettingsStore::Domain& TomlSettingsStore::refreshed(std::string_view domain) {
  auto found = domains_.find(domain);
  if (found == domains_.end()) found = domains_.emplace(std::string(domain), Domain()).first;
  refresh(SettingsLayer::administrator, domain, found->second.administrator);
  refresh(SettingsLayer::own, domain, found->second.own);
  return found->second;
}

std::optional<SettingsEntry> TomlSettingsStore::entryForKey(std::string_view domain, std::string_view key) {
  if (!isDomainName(domain)) return std::nullopt;
  const std::lock_guard guard(mutex_);
  const Domain& files = refreshed(domain);
  if (const Value* value = files.administrator.values.find(key)) {
    return SettingsEntry{std::string(key), *value, SettingsLayer::administrator};
  }
  if (const Value* value = files.own.values.find(key)) {
    return SettingsEntry{std::string(key), *value, SettingsLayer::own};
  }
  return std::nullopt;
}

std::optional<Value> TomlSettingsStore::objectForKey(std::string_view domain, std::string_view key) {
  auto entry = entryForKey(domain, key);
  return entry ? std::optional(std::move(entry->value)) : std::nullopt;
}

Result<std::vector<SettingsEntry>> TomlSettingsStore::entries(std::string_view domain) {
  if (!isDomainName(domain)) return invalidDomain(domain);
  const std::lock_guard guard(mutex_);
  const Domain& files = refreshed(domain);
  if (files.own.problem) return *files.own.problem;
  std::vector<SettingsEntry> result;
  for (const auto& [key, value] : files.administrator.values) {
    result.push_back({key, value, SettingsLayer::administrator});
  }
  for (const auto& [key, value] : files.own.values) {
    if (!files.administrator.values.contains(key)) result.push_back({key, value, SettingsLayer::own});
  }
  std::sort(result.begin(), result.end(),
            [](const SettingsEntry& a, const SettingsEntry& b) { return a.key < b.key; });
  return result;
}

std::vector<std::string> TomlSettingsStore::domains() const {
  std::set<std::string> names;
  constexpr std::string_view kEnding = ".toml";
  for (const std::string& directory : {configurationDirectory_, stateDirectory_}) {
    for (std::string& name : sortedEntries(directory, kEnding)) {
      name.resize(name.size() - kEnding.size());
      if (isDomainName(name)) names.insert(std::move(name));
    }
  }
  return {names.begin(), names.end()};
}

MaybeError TomlSettingsStore::moveAside(const std::string& path) {
  for (int number = 1; number <= kMaxDamagedFiles; ++number) {
    const std::string target = path + ".damaged-" + std::to_string(number);
    if (::renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, target.c_str(), RENAME_NOREPLACE) == 0) {
      TARNEL_LOG(log_, warning, "TomlSettingsStore(write): %s was damaged and is kept as %s", path.c_str(),
                 target.c_str());
      return std::nullopt;
    }
    if (errno != EEXIST) return systemError(path, "is damaged and cannot be moved aside");
  }
  return Error(kSettingsErrorDomain, EEXIST,
               path + ": is damaged, and too many damaged ones are kept beside it; remove some");
}

template <class Change>
MaybeError TomlSettingsStore::change(std::string_view domain, Change change) {
  if (!isDomainName(domain)) return invalidDomain(domain);
  const std::lock_guard guard(mutex_);
  if (auto error = makeDirectories(stateDirectory_, 0700)) return error;
  const std::string file = path(SettingsLayer::own, domain);
  const auto lock = lockFile(stateDirectory_ + "/" + std::string(domain) + ".lock");
  if (!lock) return lock.error();

  // Read again: another process may have replaced the file since.
  Layer current = read(SettingsLayer::own, file);
  if (current.problem && !isDamage(*current.problem)) return current.problem;
  Dictionary values = current.values;
  if (!change(values)) return std::nullopt;
  const auto text = writeToml(values);
  if (!text) return text.error();
  if (text->size() > kMaxFileBytes) {
    return Error(kSettingsErrorDomain, EFBIG,
                 file + ": would grow beyond " + std::to_string(kMaxFileBytes) + " bytes; remove keys first");
  }
  if (current.problem) {
    if (auto error = moveAside(file)) return error;
  }
  return replaceFile(file, *text, 0600);
}

MaybeError TomlSettingsStore::setObject(std::string_view domain, std::string_view key, const Value& value) {
  return change(domain, [key, &value](Dictionary& values) {
    const Value* old = values.find(key);
    if (old != nullptr && *old == value) return false;
    values.set(key, value);
    return true;
  });
}

MaybeError TomlSettingsStore::removeObject(std::string_view domain, std::string_view key) {
  // Without a file there is nothing to remove, and no reason to make its directory.
  if (isDomainName(domain) && !fileIdentity(path(SettingsLayer::own, domain)) && errno == ENOENT) {
    return std::nullopt;
  }
  return change(domain, [key](Dictionary& values) { return values.remove(key); });
}

std::vector<std::string> TomlSettingsStore::ownKeys(std::string_view domain, std::string_view prefix) {
  std::vector<std::string> keys;
  if (!isDomainName(domain)) return keys;
  const std::lock_guard guard(mutex_);
  for (const auto& [key, value] : refreshed(domain).own.values) {
    if (key.starts_with(prefix)) keys.push_back(key);
  }
  return keys;
}

}  // namespace tarnel

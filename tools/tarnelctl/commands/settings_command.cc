#include "tools/tarnelctl/commands/settings_command.h"

#include <cerrno>
#include <ostream>
#include <utility>

#include "formats/document.h"
#include "platform/file_system.h"
#include "tools/tarnelctl/typed_value.h"

namespace tarnel::ctl {
namespace {

const char* layerName(SettingsLayer layer) {
  return layer == SettingsLayer::administrator ? "administrator" : "own";
}

ExitStatus fail(const Terminal& terminal, const std::string& text) {
  terminal.err << "tarnelctl: " << text << '\n';
  return ExitStatus::failed;
}

const char* remedyFor(const Error& error) {
  const bool denied = error.code() == EACCES || error.code() == EPERM || error.code() == EROFS;
  return denied && error.domain() == kFileErrorDomain ? "; run it as root or as the daemon's user" : "";
}

Dictionary asDictionary(const std::string& domain, const SettingsEntry& entry) {
  return {{"domain", domain},
          {"key", entry.key},
          {"value", entry.value},
          {"type", typeName(entry.value)},
          {"layer", layerName(entry.layer)}};
}

bool listDomain(const std::string& domain, TomlSettingsStore& store, const Terminal& terminal, Array* json) {
  const auto entries = store.entries(domain);
  if (!entries) {
    terminal.err << "tarnelctl: " << entries.error().localizedDescription() << '\n';
    return false;
  }
  for (const auto& entry : *entries) {
    if (json != nullptr) {
      json->append(asDictionary(domain, entry));
    } else {
      terminal.out << domain << "  " << entry.key << " = " << entry.value.description() << "  ("
                   << typeName(entry.value) << ", " << layerName(entry.layer) << ")\n";
    }
  }
  return true;
}

void warnWhenHidden(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal,
                    const char* change) {
  const auto entry = store.entryForKey(options.domain, options.key);
  if (!entry || entry->layer != SettingsLayer::administrator) return;
  terminal.err << "tarnelctl: " << change << ", but the administrator's file "
               << store.path(SettingsLayer::administrator, options.domain) << " decides: " << options.key
               << " = " << entry->value.description() << '\n';
}

}  // namespace

ExitStatus listSettings(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal) {
  const auto domains = options.domain.empty() ? store.domains() : std::vector<std::string>{options.domain};
  Array json;
  bool complete = true;
  for (const auto& domain : domains) {
    complete = listDomain(domain, store, terminal, options.json ? &json : nullptr) && complete;
  }
  if (options.json) terminal.out << writeTextDocument(Value(json), true) << '\n';
  return complete ? ExitStatus::ok : ExitStatus::failed;
}

ExitStatus getSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal) {
  const auto entry = store.entryForKey(options.domain, options.key);
  if (!entry) {
    const auto entries = store.entries(options.domain);
    if (!entries) return fail(terminal, entries.error().localizedDescription());
    return fail(terminal, options.domain + " has no key " + options.key + ": see tarnelctl settings list " +
                              options.domain);
  }
  if (options.json) {
    terminal.out << writeTextDocument(Value(asDictionary(options.domain, *entry)), true) << '\n';
  } else {
    terminal.out << entry->value.description() << '\n';
    if (terminal.outIsTerminal) terminal.err << "(from " << store.path(entry->layer, options.domain) << ")\n";
  }
  return ExitStatus::ok;
}

ExitStatus setSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal) {
  const auto value = typedValue(options.value, options.type);
  if (!value) {
    terminal.err << "tarnelctl: " << value.error().localizedDescription() << '\n';
    return ExitStatus::usage;
  }
  if (const auto error = store.setObject(options.domain, options.key, *value)) {
    return fail(terminal, error->localizedDescription() + remedyFor(*error));
  }
  warnWhenHidden(options, store, terminal, "stored");
  return ExitStatus::ok;
}

ExitStatus unsetSetting(const SettingsOptions& options, TomlSettingsStore& store, const Terminal& terminal) {
  if (const auto error = store.removeObject(options.domain, options.key)) {
    return fail(terminal, error->localizedDescription() + remedyFor(*error));
  }
  warnWhenHidden(options, store, terminal, "removed");
  return ExitStatus::ok;
}

}  // namespace tarnel::ctl

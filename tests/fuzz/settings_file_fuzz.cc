// Files of the settings store with any text. The input's lines:
//   LAYER   'a' the text is the administrator's file; otherwise the process's own
//   DOMAIN
//   KEY
//   VALUE   JSON as documents have it; other text stands for itself
// The rest is the file.

#include <algorithm>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "formats/document.h"
#include "formats/toml.h"
#include "platform/fake/fake_log.h"
#include "platform/linux/configuration/toml_settings_store.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/scratch_folder.h"
#include "tests/fuzz/values.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"syntax error",
                                                "read",
                                                "table",
                                                "date",
                                                "time without date",
                                                "cannot be written",
                                                "reads back",
                                                "no domain",
                                                "damaged file moved aside",
                                                "damaged administrator's file",
                                                "administrator wins",
                                                "stored",
                                                "not stored",
                                                "unchanged",
                                                "replaced",
                                                "removed"};

namespace {

// Microseconds are written, and a double's last digit is as much in the year 9999.
constexpr double kDateTolerance = 4e-5;
// Stands beside the one that is used.
constexpr std::string_view kOtherDomain = "another";

uint32_t linesOf(std::string_view text) {
  return static_cast<uint32_t>(std::count(text.begin(), text.end(), '\n')) + 1;
}

// --- the language ---

void checkLines(const TomlNode& node, uint32_t lines) {
  require(node.line >= 1 && node.line <= lines, "every value knows its line");
  for (const auto& element : node.elements) checkLines(element, lines);
  for (const auto& entry : node.entries) checkLines(entry.node, lines);
  if (node.kind == TomlNode::Kind::table && !node.entries.empty()) reached("table");
  if (node.scalar.date() != nullptr) reached("date");
  if (node.kind == TomlNode::Kind::scalar && node.scalar.isNull()) reached("time without date");
}

Dictionary readBack(const std::string& text) {
  const auto document = parseToml(text);
  require(static_cast<bool>(document), "what was written can be read");
  return *document->value().dictionary();
}

void checkWriter(const Dictionary& values) {
  const auto text = writeToml(values);
  if (!text) {
    require(text.error().domain() == kTomlErrorDomain, "the error's domain");
    reached("cannot be written");
    return;
  }
  const auto once = readBack(*text);
  require(same(once, values, kDateTolerance), "what was written reads back as it was");
  const auto again = writeToml(once);
  require(again && same(readBack(*again), once), "and does not drift");
  reached("reads back");
}

// What the text holds; nothing when it cannot be used as settings->
std::optional<Dictionary> checkedText(std::string_view text) {
  const auto document = parseToml(text);
  if (!document) {
    require(document.error().code() >= 1 && document.error().code() <= linesOf(text),
            "the error knows its line");
    require(!document.error().localizedDescription().empty(), "the error says something");
    reached("syntax error");
    return std::nullopt;
  }
  reached("read");
  checkLines(*document, linesOf(text));
  const auto values = *document->value().dictionary();
  checkWriter(values);
  return writeToml(values) ? std::optional(values) : std::nullopt;
}

// --- the store ---

bool isPlainDomain(const std::string& name) {
  constexpr std::string_view kLetters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789.-_";
  return !name.empty() && name.size() <= 128 && name[0] != '.' &&
         name.find_first_not_of(kLetters) == std::string::npos;
}

struct Setting {
  bool isAdministrators;
  std::string domain;
  std::string key;
  Value value;

  explicit Setting(InputReader& input) {
    isAdministrators = input.line().starts_with('a');
    domain = input.line();
    key = input.line();
    const auto text = input.line();
    auto document = parseDocument(text);
    value = document ? *std::move(document) : Value(text);
  }
};

class StoreRun {
 public:
  StoreRun(const ScratchFolder& folder, const Setting& setting, std::string_view text)
      : folder_(folder), setting_(setting), held_(text), values_(checkedText(text)) {
    folder_.write("etc/settings/" + std::string(kOtherDomain) + ".toml", "kept = 1\n");
    folder_.write("var/settings/" + std::string(kOtherDomain) + ".toml", "kept = 2\n");
    if (isPlainDomain(setting_.domain)) folder_.write(fileName(), text);
    before_ = folder_.files();
  }

  void run() {
    if (!isPlainDomain(setting_.domain)) return checkNoDomain();
    checkReading();
    checkStoring();
    checkRemoving();
  }

 private:
  std::unique_ptr<TomlSettingsStore> store() {
    return std::make_unique<TomlSettingsStore>(folder_.path() + "/etc", folder_.path() + "/var", log_);
  }
  std::string ownName() const { return "var/settings/" + setting_.domain + ".toml"; }
  std::string fileName() const {
    return setting_.isAdministrators ? "etc/settings/" + setting_.domain + ".toml" : ownName();
  }
  const Value* heldValue() const { return values_ ? values_->find(setting_.key) : nullptr; }

  void checkNoDomain() {
    const auto settings = store();
    require(!settings->objectForKey(setting_.domain, setting_.key), "what is no domain holds nothing");
    require(!settings->entries(setting_.domain), "and has no entries");
    require(settings->setObject(setting_.domain, setting_.key, 1).has_value(), "and takes nothing");
    require(settings->removeObject(setting_.domain, setting_.key).has_value(), "and gives nothing up");
    require(folder_.files() == before_, "and no file comes of it");
    reached("no domain");
  }

  void checkReading() {
    const auto settings = store();
    const auto found = settings->objectForKey(setting_.domain, setting_.key);
    require(found.has_value() == (heldValue() != nullptr), "a key is there when the file has it");
    if (found) require(same(*found, *heldValue()), "with the file's value");
    const auto entries = settings->entries(setting_.domain);
    const auto layer = setting_.isAdministrators ? SettingsLayer::administrator : SettingsLayer::own;
    if (entries) {
      require(entries->size() == (values_ ? values_->size() : 0), "the entries are the file's keys");
      for (const auto& entry : *entries) {
        require(entry.layer == layer && values_->contains(entry.key), "of its layer");
      }
    } else {
      require(!values_ && !setting_.isAdministrators, "only an own file that is damaged is an error");
      const auto& text = entries.error().localizedDescription();
      require(text.starts_with(folder_.path() + "/" + ownName() + ":"), "that names the file");
    }
    if (!values_) require(log_.lines().size() == 1, "a damaged file is reported once");
    if (!values_ && setting_.isAdministrators) reached("damaged administrator's file");
    require(folder_.files() == before_, "reading changes nothing");
  }

  void checkStoring() {
    const auto settings = store();
    const bool canBeWritten = static_cast<bool>(writeToml(Dictionary{{setting_.key, setting_.value}}));
    const auto error = settings->setObject(setting_.domain, setting_.key, setting_.value);
    const auto* old = setting_.isAdministrators ? nullptr : heldValue();
    const bool isUnchanged = old != nullptr && *old == setting_.value;
    require(error.has_value() == !canBeWritten || isUnchanged, "what can be written is stored");
    const auto after = folder_.files();
    checkOthers(after);
    if (error || isUnchanged) {
      require(withoutLocks(after) == before_, "what is not stored changes nothing");
      reached(error ? "not stored" : "unchanged");
      return;
    }
    reached(old != nullptr ? "replaced" : "stored");
    if (setting_.isAdministrators) return checkAdministratorWins();
    checkStored(after);
  }

  void checkAdministratorWins() {
    auto settings = store();
    const auto entry = settings->entryForKey(setting_.domain, setting_.key);
    require(entry.has_value(), "a stored key is there");
    const bool isHeld = heldValue() != nullptr;
    require((entry->layer == SettingsLayer::administrator) == isHeld, "the administrator's value wins");
    require(same(entry->value, isHeld ? *heldValue() : setting_.value, kDateTolerance), "with its value");
    if (isHeld) reached("administrator wins");
  }

  void checkStored(const std::map<std::string, std::string>& after) {
    const auto aside = after.find(ownName() + ".damaged-1");
    require((aside != after.end()) == !values_, "a damaged file is moved aside, no other");
    if (!values_) {
      require(aside->second == held_, "as it was");
      reached("damaged file moved aside");
    }
    auto expected = values_.value_or(Dictionary());
    expected.set(setting_.key, setting_.value);
    const auto now = readBack(after.at(ownName()));
    require(same(now, expected, kDateTolerance), "the other keys stay");
    const auto found = store()->objectForKey(setting_.domain, setting_.key);
    require(found && same(*found, setting_.value, kDateTolerance), "and the stored one is read by others");
  }

  void checkRemoving() {
    const auto settings = store();
    require(!settings->removeObject(setting_.domain, setting_.key), "a key can be removed");
    const auto entry = store()->entryForKey(setting_.domain, setting_.key);
    require(!entry || entry->layer == SettingsLayer::administrator, "and is gone");
    checkOthers(folder_.files());
    reached("removed");
  }

  void checkOthers(const std::map<std::string, std::string>& after) const {
    for (const auto& [name, text] : before_) {
      if (name != ownName()) require(after.at(name) == text, "no other file is written");
    }
    for (const auto& entry : after) {
      const bool isKnown =
          before_.contains(entry.first) || entry.first.starts_with("var/settings/" + setting_.domain);
      require(isKnown, "no file of another name is made");
    }
  }

  static std::map<std::string, std::string> withoutLocks(std::map<std::string, std::string> files) {
    std::erase_if(files, [](const auto& file) { return file.first.ends_with(".lock"); });
    return files;
  }

  const ScratchFolder& folder_;
  const Setting& setting_;
  const std::string held_;
  const std::optional<Dictionary> values_;
  std::map<std::string, std::string> before_;
  fake::FakeLog log_;
};

}  // namespace

void runOne(std::span<const uint8_t> input) {
  static const ScratchFolder folder;
  folder.clear();
  InputReader reader(input);
  const Setting setting(reader);
  if (setting.domain == kOtherDomain) return;
  StoreRun(folder, setting, reader.rest()).run();
}

}  // namespace tarnel::fuzz

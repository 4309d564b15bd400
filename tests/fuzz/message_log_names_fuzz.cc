// The message log in a directory that holds anything, under any clock. The input's lines:
//   FAILURES  letters: d no directory, l listing fails, c creating, a appending, r removing
//   CLOCK     seconds since 1970, then, after blanks, seconds that pass before each further message
//   MESSAGE
// and one line for each entry of the directory: a letter for its age (see kAges), then its name.

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "platform/fake/fake_world.h"
#include "tests/fuzz/fuzz_target.h"
#include "util/message_log.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {
    "foreign entry",   "own entry",          "appended to one that was there",
    "new file",        "expired deleted",    "older deleted",
    "without a date",  "date from the name", "directory made",
    "listing failed",  "creating failed",    "appending failed",
    "removing failed", "name is taken",      "clock set back",
    "year 2038"};

namespace {

constexpr double kDay = 86400;
constexpr size_t kMostEntries = 64;
constexpr size_t kMostMessages = 4;
// Before the clock's time, by letter from 'a'; the last has no date.
constexpr double kAges[] = {0, 1, 2.5, 3600, 86399, 86400, 86400.5, 86401, 1e6, -1, -86401, 1e12, -1};
constexpr size_t kNoDate = std::size(kAges) - 1;

// The rule of the names, in other words than the code's: three parts between underscores.
bool isOwnName(const std::string& name) {
  constexpr std::string_view kFirst = "tarneld_";
  constexpr std::string_view kLast = "_messageLog.diag";
  return std::count(name.begin(), name.end(), '_') == 2 && name.starts_with(kFirst) && name.ends_with(kLast);
}

// A file's date in other words than the code's: when it was made, else the number of 32 bits in its name,
// counted on or back by whole turns of 32 bits until it is closest to the clock.
std::optional<Date> dateOf(const std::string& name, const fake::FakeFileSystem::File& file, int64_t now) {
  if (file.creationDate) return file.creationDate;
  const auto begin = name.find('_') + 1;
  const auto text = name.substr(begin, name.rfind('_') - begin);
  const auto digits = text.find_first_not_of('-') == 1 ? text.substr(1) : text;
  if (digits.empty() || digits.find_first_not_of("0123456789") != std::string::npos) return std::nullopt;
  const auto significant = digits.substr(std::min(digits.find_first_not_of('0'), digits.size()));
  if (significant.size() > 10) return std::nullopt;
  const int64_t number = Value(text).int64Value();
  if (number < INT32_MIN || number > INT32_MAX) return std::nullopt;
  constexpr int64_t kTurn = int64_t{1} << 32;
  int64_t seconds = number + (now - number) / kTurn * kTurn;
  while (now - seconds > INT32_MAX) seconds += kTurn;
  while (now - seconds < INT32_MIN) seconds -= kTurn;
  return Date{static_cast<double>(seconds)};
}

// Lets nothing out of the one directory, and nothing but the log's own files be changed in it.
class WatchedFiles final : public FileSystem {
 public:
  WatchedFiles(fake::FakeFileSystem& files, std::string directory)
      : files_(files), directory_(std::move(directory)) {}

  bool refuseRemoval = false;
  std::vector<std::string> created;
  std::vector<std::string> appended;
  std::vector<std::string> removed;

  Result<std::vector<std::string>> contentsOfDirectory(const std::string& path) override {
    require(path == directory_, "only the log's directory is listed");
    return files_.contentsOfDirectory(path);
  }
  MaybeError createDirectory(const std::string& path) override {
    require(path == directory_, "only the log's directory is made");
    return files_.createDirectory(path);
  }
  std::optional<Date> creationDate(const std::string& path) override {
    requireOwn(path);
    return files_.creationDate(path);
  }
  bool fileExists(const std::string& path) override {
    requireOwn(path);
    return files_.fileExists(path);
  }
  MaybeError createFile(const std::string& path) override {
    requireOwn(path);
    created.push_back(path);
    return files_.createFile(path);
  }
  MaybeError appendToFile(const std::string& path, std::string_view text) override {
    requireOwn(path);
    appended.push_back(path);
    return files_.appendToFile(path, text);
  }
  MaybeError removeFile(const std::string& path) override {
    requireOwn(path);
    removed.push_back(path);
    if (refuseRemoval) return Error(kFileErrorDomain, EACCES, "refused");
    return files_.removeFile(path);
  }

 private:
  void requireOwn(const std::string& path) const {
    require(path.starts_with(directory_ + "/"), "nothing outside the directory is touched");
    const auto name = path.substr(directory_.size() + 1);
    require(name.find('/') == std::string::npos, "nothing below the directory is touched");
    require(isOwnName(name), "no other file is touched");
  }

  fake::FakeFileSystem& files_;
  const std::string directory_;
};

using Files = std::map<std::string, fake::FakeFileSystem::File>;

class Run {
 public:
  explicit Run(InputReader& input) {
    const auto failures = input.line();
    const auto fails = [&failures](char letter) { return failures.find(letter) != std::string::npos; };
    readClock(input.line());
    message_ = input.line();
    message_ = message_.substr(0, message_.find('\0'));
    if (!fails('d')) fakes().directories.insert(directory());
    while (!fails('d') && !input.atEnd() && fakes().files.size() < kMostEntries) addEntry(input.line());
    const Error refused(kFileErrorDomain, EIO, "refused");
    if (fails('l')) fakes().listingError = refused;
    if (fails('c')) fakes().createError = refused;
    if (fails('a')) fakes().appendError = refused;
    watched_.refuseRemoval = fails('r');
  }

  void writeAll() {
    writeOne();
    for (const double pause : pauses_) {
      if (pause < 0) reached("clock set back");
      world_.clock.advance(pause);
      writeOne();
    }
  }

 private:
  fake::FakeFileSystem& fakes() { return world_.files; }
  const std::string& directory() const { return world_.dependencies.messageLogDirectory; }
  double now() { return secondsFromTimeValue(world_.clock.timeOfDay()); }
  std::string nameOf(const std::string& path) const { return path.substr(directory().size() + 1); }
  std::optional<Date> dateAt(const Files& files, const std::string& path) {
    return dateOf(nameOf(path), files.at(path), world_.clock.timeOfDay().seconds);
  }

  void readClock(const std::string& line) {
    constexpr int64_t kFarthest = 1'000'000'000'000;
    std::vector<int64_t> numbers;
    size_t start = 0;
    while (start <= line.size() && numbers.size() <= kMostMessages) {
      const auto end = std::min(line.find(' ', start), line.size());
      numbers.push_back(
          std::clamp(Value(line.substr(start, end - start)).int64Value(), -kFarthest, kFarthest));
      start = end + 1;
    }
    world_.clock.set({numbers.front(), 250000});
    if (numbers.front() > INT32_MAX) reached("year 2038");
    for (size_t i = 1; i < numbers.size(); ++i)
      pauses_.push_back(static_cast<double>(numbers[i] % 1'000'000));
  }

  // A directory's entry has no slash and no NUL in its name, and is neither "." nor "..".
  void addEntry(const std::string& line) {
    if (line.size() < 2) return;
    const auto name = line.substr(1);
    if (name == "." || name == ".." || name.find_first_of(std::string_view("/\0", 2)) != std::string::npos) {
      return;
    }
    const auto letter = static_cast<size_t>(static_cast<uint8_t>(line[0]) - 'a') % std::size(kAges);
    auto& file = fakes().files[directory() + "/" + name];
    file.text = "what " + name + " held\n";
    if (letter != kNoDate) file.creationDate = Date{now() - kAges[letter]};
    reached(isOwnName(name) ? "own entry" : "foreign entry");
    if (letter != kNoDate || !isOwnName(name)) return;
    reached(dateOf(name, file, world_.clock.timeOfDay().seconds) ? "date from the name" : "without a date");
  }

  void writeOne() {
    const Files before = fakes().files;
    watched_.created.clear();
    watched_.appended.clear();
    watched_.removed.clear();
    writeToLogFile(dependencies_, "%s", message_.c_str());
    const Files& after = fakes().files;
    for (const auto& [path, file] : before) {
      if (isOwnName(nameOf(path))) continue;
      const auto found = after.find(path);
      require(found != after.end() && found->second.text == file.text, "foreign files stay as they are");
    }
    require(watched_.created.size() <= 1 && watched_.appended.size() <= 1, "one file for one message");
    if (fakes().listingError) reached("listing failed");
    if (before.empty() && watched_.created.size() == 1) reached("directory made");
    if (!watched_.created.empty()) checkCreated(before, after);
    checkDeleted(before, after);
    checkAppended(before, after);
  }

  void checkCreated(const Files& before, const Files& after) {
    const auto seconds = static_cast<int32_t>(world_.clock.timeOfDay().seconds);
    const auto& path = watched_.created.front();
    require(nameOf(path) == "tarneld_" + std::to_string(seconds) + "_messageLog.diag",
            "a new file has the time in its name");
    const bool hasUsable = std::any_of(before.begin(), before.end(), [this, &before](const auto& entry) {
      if (!isOwnName(nameOf(entry.first))) return false;
      const auto made = dateAt(before, entry.first);
      return !made || now() - made->seconds <= kDay;
    });
    require(!hasUsable || fakes().listingError, "a new file is made only when none can be used");
    if (before.contains(path)) reached("name is taken");
    if (fakes().createError && !before.contains(path)) {
      require(!after.contains(path) && watched_.appended.empty(), "a message without a file is dropped");
      reached("creating failed");
    } else {
      reached("new file");
    }
  }

  void checkDeleted(const Files& before, const Files& after) {
    if (watched_.refuseRemoval) {
      if (!watched_.removed.empty()) reached("removing failed");
      return;
    }
    const bool isListed = !fakes().listingError && fakes().directories.contains(directory());
    for (const auto& [path, file] : before) {
      if (!isOwnName(nameOf(path)) || !isListed) continue;
      const auto made = dateAt(before, path);
      if (!made || now() - made->seconds <= kDay) continue;
      // The new file may have the name of one that expired.
      require(!after.contains(path) || !after.at(path).text.starts_with(file.text), "the expired go");
      reached("expired deleted");
    }
  }

  // The fresh file that must be taken: the newest that has a date.
  std::optional<Date> newestOf(const Files& files) {
    std::optional<Date> newest;
    for (const auto& [path, file] : files) {
      const auto made = isOwnName(nameOf(path)) ? dateAt(files, path) : std::nullopt;
      if (made && now() - made->seconds <= kDay && (!newest || made->seconds > newest->seconds))
        newest = made;
    }
    return newest;
  }

  void checkAppended(const Files& before, const Files& after) {
    if (watched_.appended.empty()) return;
    const auto& path = watched_.appended.front();
    if (fakes().appendError) {
      require(after.contains(path) == watched_.refuseRemoval, "a file that cannot be written to goes");
      reached("appending failed");
      return;
    }
    const auto line = "(" + description(Date{now()}) + ") " + message_ + "\n";
    const auto held =
        before.contains(path) && watched_.created.empty() ? before.at(path).text : std::string();
    require(after.contains(path), "the message is in a file");
    const auto& text = after.at(path).text;
    require(watched_.created.empty() ? text == held + line : text.ends_with(line),
            "the message, whole, at the end");
    if (fakes().listingError || !watched_.created.empty()) return;
    reached("appended to one that was there");
    const auto newest = newestOf(before);
    require(dateAt(before, path) == newest, "the newest that has not expired is taken");
    if (watched_.refuseRemoval || !newest) return;
    require(std::count_if(after.begin(), after.end(),
                          [this, &after](const auto& entry) {
                            return isOwnName(nameOf(entry.first)) && dateAt(after, entry.first);
                          }) == 1,
            "of those with a date one is left");
    if (!watched_.removed.empty()) reached("older deleted");
  }

  fake::FakeWorld world_;
  WatchedFiles watched_{world_.files, world_.dependencies.messageLogDirectory};
  Dependencies dependencies_ = world_.withFiles(watched_);
  std::vector<double> pauses_;
  std::string message_;
};

}  // namespace

void runOne(std::span<const uint8_t> input) {
  InputReader reader(input);
  Run(reader).writeAll();
}

}  // namespace tarnel::fuzz

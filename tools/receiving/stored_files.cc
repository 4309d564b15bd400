#include "tools/receiving/stored_files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <vector>

#include "base/unique_fd.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxNameBytes = 100;
constexpr size_t kStampBytes = 16;  // "20261120-142501-"
constexpr char kIncoming[] = "incoming-";
constexpr char kDescription[] = ".json";

bool isDigit(char letter) {
  return letter >= '0' && letter <= '9';
}

bool isPlain(char letter) {
  return isDigit(letter) || (letter >= 'a' && letter <= 'z') || (letter >= 'A' && letter <= 'Z') ||
         letter == '-' || letter == '_' || letter == '.';
}

// Universal time, so that the order of the names is the order of arrival.
std::string stampOf(double now) {
  const auto seconds = static_cast<std::time_t>(now);
  std::tm utc{};
  ::gmtime_r(&seconds, &utc);
  std::array<char, 32> text{};
  return {text.data(), std::strftime(text.data(), text.size(), "%Y%m%d-%H%M%S-", &utc)};
}

uint64_t numberIn(std::string_view storedName) {
  const std::string_view rest = storedName.substr(kStampBytes);
  return parseNumber(rest.substr(0, rest.find('-'))).value_or(0);
}

std::string numbered(uint64_t number) {
  const std::string digits = std::to_string(number);
  return std::string(4 - std::min<size_t>(4, digits.size()), '0') + digits;
}

}  // namespace

std::string safeFileName(std::string_view name) {
  // The end says what kind of file it is.
  std::string safe(name.substr(name.size() - std::min(name.size(), kMaxNameBytes)));
  std::replace_if(
      safe.begin(), safe.end(), [](char letter) { return !isPlain(letter); }, '_');
  return safe.empty() ? "file" : safe;
}

std::string descriptionOf(const std::string& path) {
  return path + kDescription;
}

bool isStoredName(std::string_view name) {
  if (name.size() < kStampBytes + 6 || !std::all_of(name.begin(), name.end(), isPlain)) return false;
  for (size_t i = 0; i < kStampBytes; ++i) {
    if (i == 8 || i == kStampBytes - 1 ? name[i] != '-' : !isDigit(name[i])) return false;
  }
  const std::string_view rest = name.substr(kStampBytes);
  const size_t digits = std::min(rest.find_first_not_of("0123456789"), rest.size());
  return digits >= 4 && digits + 1 < rest.size() && rest[digits] == '-';
}

IncomingFile::IncomingFile(std::string folder, std::string name, UniqueFd fd)
    : folder_(std::move(folder)), name_(std::move(name)), fd_(std::move(fd)) {}

IncomingFile::IncomingFile(IncomingFile&& other) noexcept = default;

IncomingFile::~IncomingFile() {
  if (fd_) ::unlink(incomingPath().c_str());
}

std::string IncomingFile::incomingPath() const {
  return folder_ + "/" + kIncoming + name_;
}

MaybeError IncomingFile::write(std::string_view bytes) {
  size_ += bytes.size();
  while (!bytes.empty()) {
    const ssize_t written = ::write(fd_.get(), bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return fileError("write", path(), errno);
    bytes.remove_prefix(static_cast<size_t>(written));
  }
  return std::nullopt;
}

StoredFiles::StoredFiles(std::string folder, Notices& notices, Bounds bounds)
    : folder_(std::move(folder)), notices_(notices), bounds_(bounds) {}

MaybeError StoredFiles::open() {
  std::error_code error;
  std::vector<Entry> found;
  for (std::filesystem::directory_iterator item(folder_, error), end; !error && item != end;
       item.increment(error)) {
    const std::string name = item->path().filename().string();
    struct stat status {};
    if (::lstat(item->path().c_str(), &status) != 0 || !S_ISREG(status.st_mode)) continue;
    if (name.starts_with(kIncoming) && isStoredName(name.substr(std::strlen(kIncoming)))) {
      ::unlink(item->path().c_str());  // was cut off when an earlier run ended
    } else if (isStoredName(name)) {
      found.push_back({name, static_cast<uint64_t>(status.st_size)});
    }
  }
  if (error) return fileError("read", folder_, error.value());
  std::sort(found.begin(), found.end(), [](const Entry& a, const Entry& b) { return a.name < b.name; });
  for (Entry& entry : found) {
    number_ = std::max(number_, numberIn(entry.name));
    bytes_ += entry.size;
    if (!entries_.empty() && entry.name == entries_.back().name + kDescription) {
      entries_.back().size += entry.size;
    } else {
      entries_.push_back(std::move(entry));
    }
  }
  makeRoom();
  return std::nullopt;
}

Result<IncomingFile> StoredFiles::createNamed(const std::string& name) const {
  IncomingFile file(folder_, name, {});
  file.fd_ = UniqueFd(
      ::open(file.incomingPath().c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!file.fd_) return fileError("write", file.path(), errno);
  return file;
}

Result<IncomingFile> StoredFiles::create(double now, std::string_view name) {
  return createNamed(stampOf(now) + numbered(++number_) + "-" + safeFileName(name));
}

MaybeError StoredFiles::giveName(IncomingFile& file) const {
  if (::renameat2(AT_FDCWD, file.incomingPath().c_str(), AT_FDCWD, file.path().c_str(), RENAME_NOREPLACE) !=
      0) {
    return fileError("write", file.path(), errno);
  }
  file.fd_.reset();
  return std::nullopt;
}

MaybeError StoredFiles::keep(IncomingFile& file, std::string_view description) {
  uint64_t size = file.size();
  if (!description.empty()) {
    Result<IncomingFile> beside = createNamed(file.name() + kDescription);
    if (!beside) return beside.error();
    if (MaybeError error = beside->write(description)) return error;
    if (MaybeError error = giveName(*beside)) return error;
    size += description.size();
  }
  if (MaybeError error = giveName(file)) {
    if (!description.empty()) ::unlink(descriptionOf(file.path()).c_str());
    return error;
  }
  entries_.push_back({file.name(), size});
  bytes_ += size;
  makeRoom();
  return std::nullopt;
}

void StoredFiles::makeRoom() {
  // The newest always stays: it has only just been taken.
  while (entries_.size() > 1 && (entries_.size() > bounds_.files || bytes_ > bounds_.bytes)) {
    const Entry oldest = entries_.front();
    entries_.pop_front();
    bytes_ -= oldest.size;
    const std::string path = folder_ + "/" + oldest.name;
    ::unlink((path + kDescription).c_str());
    if (::unlink(path.c_str()) == 0) {
      notices_.warning("removed " + path + " to make room for newer files");
    }
  }
}

}  // namespace tarnel::lab

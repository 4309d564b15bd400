#include "tools/lab/storebag_source.h"

#include <algorithm>
#include <cerrno>
#include <filesystem>

#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/receiving/text.h"
#include "tools/storebag/signed_storebag.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxDocumentBytes = 8U << 20U;
constexpr size_t kMaxNames = 1000;

bool sameTime(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

void replaceAll(std::string& text, std::string_view what, std::string_view by) {
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + by.size())) {
    text.replace(at, what.size(), by);
  }
}

// The number at the end of "... at byte 12".
std::optional<uint64_t> offsetIn(const std::string& errorText) {
  const size_t at = errorText.rfind(" at byte ");
  return at == std::string::npos ? std::nullopt : parseNumber(std::string_view(errorText).substr(at + 9));
}

std::string parseProblem(const std::string& path, const std::string& inner, const Error& error) {
  std::string reason = error.localizedDescription();
  std::string place = path;
  if (const auto offset = offsetIn(reason)) {
    place += ":" + std::to_string(lineOfOffset(inner, *offset));
    reason.erase(reason.rfind(" at byte "));
  }
  if (reason.ends_with('.')) reason.pop_back();
  return place + ": " + reason + "; correct the file, it is read again with the next request";
}

std::string withBrokenSignature(const StorebagKey& key, const std::string& inner) {
  // A sound signature, but of other bytes.
  Result<std::string> other = makeSignedStorebag(inner + " ", key);
  const Result<std::string> right = makeSignedStorebag(inner, key);
  if (!other || !right) return "";
  const Result<Value> otherOuter = parseDocument(*other);
  Result<Value> outer = parseDocument(*right);
  if (!otherOuter || !outer || outer->mutableDictionary() == nullptr) return "";
  outer->mutableDictionary()->set("signature", *otherOuter->dictionary()->find("signature"));
  return writeTextDocument(*outer);
}

}  // namespace

bool StorebagSource::Entry::isOf(const struct stat& status) const {
  return (storebag || !error.empty()) && sameTime(changed, status.st_ctim) &&
         sameTime(written, status.st_mtim) && size == status.st_size && inode == status.st_ino;
}

StorebagSource::StorebagSource(std::string folder, StorebagKey key, OwnAddresses lab, int64_t started)
    : folder_(std::move(folder)), key_(std::move(key)), lab_(std::move(lab)), started_(started) {}

StorebagSource::Lookup StorebagSource::find(const std::string& name) {
  Lookup lookup;
  const std::string path = folder_ + "/" + name + ".json";
  struct stat status {};
  if (!isStorebagName(name) || ::stat(path.c_str(), &status) != 0) {
    lookup.missing = true;
    lookup.error = isStorebagName(name) && errno != ENOENT
                       ? fileError("read", path, errno).localizedDescription()
                       : "there is no storebag \"" + printable(name, 64) +
                             "\": put its inner document into " + folder_ + "/NAME.json";
    return lookup;
  }
  const std::lock_guard lock(mutex_);
  Entry& entry = entries_[name];
  if (!entry.isOf(status)) {
    refresh(entry, path, status);
    lookup.fresh = true;
  }
  lookup.error = entry.error;
  if (entry.error.empty()) lookup.storebag = entry.storebag;
  return lookup;
}

void StorebagSource::refresh(Entry& entry, const std::string& path, const struct stat& status) {
  entry.changed = status.st_ctim;
  entry.written = status.st_mtim;
  entry.size = status.st_size;
  entry.inode = status.st_ino;
  entry.error.clear();
  Result<std::string> inner = readFile(path, kMaxDocumentBytes);
  if (!inner) {
    entry.error = inner.error().localizedDescription();
    return;
  }
  replaceAll(*inner, kLabURLPlaceholder, lab_.url);
  replaceAll(*inner, kLabDatagramPortPlaceholder, std::to_string(lab_.datagramPort));
  if (entry.storebag && *inner == entry.inner) return;
  const Result<Value> document = parseDocument(*inner);
  if (!document) {
    entry.error = parseProblem(path, *inner, document.error());
    return;
  }
  const Result<std::string> outer = makeSignedStorebag(*inner, key_);
  if (!outer) {
    entry.error = outer.error().localizedDescription();
    return;
  }
  auto prepared = std::make_shared<PreparedStorebag>();
  prepared->outer = *outer;
  prepared->brokenOuter = withBrokenSignature(key_, *inner);
  if (const Dictionary* members = document->dictionary()) {
    if (const std::string* version = findString(*members, "version")) prepared->version = *version;
  }
  // Dates have whole seconds: two contents within one second must still differ.
  const int64_t earlier = entry.storebag ? entry.storebag->lastModified + 1 : started_;
  prepared->lastModified = std::max<int64_t>(status.st_mtim.tv_sec, earlier);
  prepared->findings = validateStorebag(*document);
  entry.inner = *std::move(inner);
  entry.storebag = std::move(prepared);
}

std::vector<std::string> StorebagSource::names() const {
  std::vector<std::string> list;
  std::error_code error;
  for (const auto& item : std::filesystem::directory_iterator(folder_, error)) {
    const std::filesystem::path& path = item.path();
    if (path.extension() == ".json" && isStorebagName(path.stem().string()))
      list.push_back(path.stem().string());
    if (list.size() >= kMaxNames) break;
  }
  std::sort(list.begin(), list.end());
  return list;
}

bool isStorebagName(std::string_view name) {
  return !name.empty() && name.size() <= 64 && name.front() != '.' &&
         std::all_of(name.begin(), name.end(), [](char letter) {
           return (letter >= '0' && letter <= '9') || (letter >= 'A' && letter <= 'Z') ||
                  (letter >= 'a' && letter <= 'z') || letter == '-' || letter == '_' || letter == '.';
         });
}

bool isNotModified(const std::string* ifModifiedSince, int64_t lastModified) {
  if (ifModifiedSince == nullptr) return false;
  const std::optional<int64_t> since = parseHttpDate(*ifModifiedSince);
  return since && *since >= lastModified;
}

}  // namespace tarnel::lab

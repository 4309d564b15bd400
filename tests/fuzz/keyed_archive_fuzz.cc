// Keyed archives: any bytes read as one, and any value written as one. The input's first byte says which:
// 'v' takes a value from the rest, 'd' the value of the document in the rest; anything else is an archive.

#include "formats/archive.h"

#include <algorithm>
#include <string>

#include "formats/document.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/values.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {
    "malformed",        "table malformed", "beyond the limits", "beyond small limits",         "unarchived",
    "shared objects",   "dictionary",      "archived",          "repeated objects stand once", "no text",
    "archived document"};

namespace {

constexpr ArchiveLimits kSmall{.bytes = 200, .depth = 3, .values = 12};
constexpr size_t kMostWritten = 1U << 16U;  // what many references come to would take long
constexpr std::string_view kMark = "\xD9\xD9\xF7";

size_t textBytesOf(const Value& value) {
  if (value.string() != nullptr) return value.string()->size();
  if (value.data() != nullptr) return value.data()->size();
  size_t bytes = 0;
  if (const auto* array = value.array()) {
    for (const auto& element : *array) bytes += textBytesOf(element);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& [key, element] : *dictionary) bytes += key.size() + textBytesOf(element);
  }
  return bytes;
}

bool isAllText(const Value& value) {
  if (const auto* text = value.string()) return isValidUtf8(*text);
  if (const auto* array = value.array()) return std::all_of(array->begin(), array->end(), isAllText);
  const auto* dictionary = value.dictionary();
  return dictionary == nullptr ||
         std::all_of(dictionary->begin(), dictionary->end(), [](const Dictionary::Entry& entry) {
           return isValidUtf8(entry.first) && isAllText(entry.second);
         });
}

bool within(const Value& value, const ArchiveLimits& limits) {
  return depthOf(value) <= limits.depth && countOf(value) <= limits.values &&
         textBytesOf(value) <= limits.bytes;
}

void requireError(const Error& error) {
  require(error.domain() == kArchiveErrorDomain, "the error's domain");
  require(error.code() == kArchiveMalformed || error.code() == kArchiveTooLarge, "a reader's error");
  require(!error.localizedDescription().empty(), "the error says something");
}

// How many objects the archive's table holds.
size_t tableSize(std::string_view archive) {
  const auto document = parseDocument(archive);
  require(static_cast<bool>(document), "an archive is a document");
  const auto* objects = findArray(*document->dictionary(), "objects");
  require(objects != nullptr, "an archive has a table");
  return objects->size();
}

void checkWritten(const Value& value, const std::string& archive) {
  require(archive.starts_with(kMark), "every archive begins with its mark");
  const auto again = unarchiveObject(archive);
  require(static_cast<bool>(again), "what was archived can be unarchived");
  require(same(*again, value), "and is what it was");
  const auto twice = archiveObject(*again);
  require(twice && tableSize(*twice) == tableSize(archive), "the order of entries makes no other objects");
  if (archive.size() < textBytesOf(value)) reached("repeated objects stand once");
}

void checkArchive(const Value& value) {
  const auto archive = archiveObject(value);
  const bool isText = isAllText(value);
  if (!archive) {
    require(!isText || !within(value, ArchiveLimits()), "what is within the limits can be archived");
    if (archive.error().code() == kArchiveNotText) {
      require(!isText, "not text where there is none");
      reached("no text");
    }
    return;
  }
  require(isText && within(value, ArchiveLimits()), "what is archived is within the limits");
  checkWritten(value, *archive);
  reached("archived");
  const auto small = archiveObject(value, kSmall);
  if (small) require(*small == *archive && within(value, kSmall), "limits do not change what is written");
  if (!small) require(small.error().code() == kArchiveTooLarge, "only the limits can stand in the way");
}

// No value that an archive of so many bytes comes to is walked here before it is known to be within limits.
void checkUnarchive(std::string_view archive) {
  const auto value = unarchiveObject(archive);
  const auto small = unarchiveObject(archive, kSmall);
  if (!value) {
    requireError(value.error());
    require(!small, "smaller limits do not help");
    const bool inTable = value.error().localizedDescription().starts_with("object ");
    if (value.error().code() == kArchiveTooLarge) reached("beyond the limits");
    if (value.error().code() == kArchiveMalformed) reached(inTable ? "table malformed" : "malformed");
    return;
  }
  reached("unarchived");
  require(archive.starts_with(kMark), "nothing without the mark is read");
  require(within(*value, ArchiveLimits()), "the limits hold, however much is shared");
  if (textBytesOf(*value) > archive.size() || countOf(*value) > archive.size()) reached("shared objects");
  if (value->dictionary() != nullptr) reached("dictionary");
  if (small) {
    require(same(*small, *value) && within(*small, kSmall), "limits do not change what is read");
  } else {
    require(small.error().code() == kArchiveTooLarge, "only the limits can stand in the way");
    reached("beyond small limits");
  }
  if (countOf(*value) <= kMostWritten && textBytesOf(*value) <= kMostWritten) checkArchive(*value);
}

}  // namespace

void runOne(std::span<const uint8_t> input) {
  if (input.empty() || (input.front() != 'v' && input.front() != 'd')) return checkUnarchive(asText(input));
  const auto rest = input.subspan(1);
  if (input.front() == 'v') {
    InputReader reader(rest);
    return checkArchive(valueFrom(reader, 6));
  }
  const auto document = parseDocument(asText(rest));
  if (!document) return;
  checkArchive(*document);
  reached("archived document");
}

}  // namespace tarnel::fuzz

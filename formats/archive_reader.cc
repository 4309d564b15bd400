#include <algorithm>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "formats/archive.h"
#include "formats/archive_format.h"
#include "formats/document.h"

namespace tarnel {
namespace {

// An object with what it comes to when all its references are followed.
struct Unarchived {
  Value value;
  size_t values = 1;
  size_t bytes = 0;  // of text and data
  size_t depth = 0;
};

class ArchiveReader {
 public:
  explicit ArchiveReader(const ArchiveLimits& limits) : limits_(limits) {}

  Result<Value> read(std::string_view archive) {
    if (!archive.starts_with(kArchiveMark)) {
      return malformed("this is no keyed archive, which begins with the bytes D9 D9 F7; give it unpacked");
    }
    const auto document = parseDocument(archive, {.bytes = limits_.bytes, .values = documentValues()});
    if (!document) return documentError(document.error());
    const auto* head = document->dictionary();
    const auto* version = head == nullptr ? nullptr : head->find(kArchiveVersionKey);
    if (version == nullptr || !(*version == Value(kArchiveVersion))) {
      return malformed("the version is not " + std::to_string(kArchiveVersion) +
                       "; take a reader that knows it");
    }
    const auto* objects = findArray(*head, kArchiveObjectsKey);
    if (objects == nullptr) return malformed("there is no table of objects");
    if (objects->size() > limits_.values) {
      return tooLarge("more than " + std::to_string(limits_.values) + " objects");
    }
    objects_.reserve(objects->size());
    for (const auto& object : *objects) {
      if (add(object)) continue;
      return code_ == kArchiveTooLarge ? tooLarge(problem_) : malformed(problem_);
    }
    const auto* root = head->find(kArchiveRootKey);
    const auto place = root == nullptr ? std::nullopt : placeIn(*root);
    if (!place) return malformed("the root is no place in the table");
    return objects_[*place].value;
  }

 private:
  // An object and a reference for every value, four more for a dictionary's lists, and the head.
  size_t documentValues() const { return limits_.values * 6 + 16; }

  static Error malformed(const std::string& problem) {
    return {kArchiveErrorDomain, kArchiveMalformed, problem};
  }
  static Error tooLarge(const std::string& problem) {
    return {kArchiveErrorDomain, kArchiveTooLarge, problem + "; archive less at once"};
  }
  static Error documentError(const Error& error) {
    const auto& problem = error.localizedDescription();
    return error.code() == kDocumentTooLarge ? tooLarge(problem) : malformed(problem);
  }
  bool fail(int64_t code, const std::string& problem) {
    code_ = code;
    problem_ = "object " + std::to_string(objects_.size()) + ": " + problem;
    return false;
  }

  // The place that the value names, among the objects that were read so far: none can refer to itself.
  std::optional<size_t> placeIn(const Value& value) const {
    const auto* number = value.integer();
    if (number == nullptr || *number < 0 || static_cast<uint64_t>(*number) >= objects_.size()) {
      return std::nullopt;
    }
    return static_cast<size_t>(*number);
  }

  bool add(const Value& object) {
    Unarchived made;
    if (const auto* places = object.array()) {
      if (!readArray(*places, made)) return false;
    } else if (const auto* lists = object.dictionary()) {
      if (!readDictionary(*lists, made)) return false;
    } else {
      made.value = object;
      made.bytes = bytesOf(object);
    }
    objects_.push_back(std::move(made));
    return true;
  }

  static size_t bytesOf(const Value& value) {
    if (value.string() != nullptr) return value.string()->size();
    return value.data() != nullptr ? value.data()->size() : 0;
  }

  // Counts what `from`, copied into it, adds to `into`. Refused as soon as it is too much, so no sum
  // overflows. Arrays and dictionaries share their storage when copied, text and data do not.
  bool count(Unarchived& into, const Unarchived& from) {
    into.values += from.values;
    into.bytes += from.bytes;
    into.depth = std::max(into.depth, from.depth + 1);
    copied_ += bytesOf(from.value);
    if (into.values > limits_.values) {
      return fail(kArchiveTooLarge, "it comes to more than " + std::to_string(limits_.values) + " values");
    }
    if (into.bytes > limits_.bytes || copied_ > limits_.bytes) {
      return fail(kArchiveTooLarge, "it comes to more than " + std::to_string(limits_.bytes) + " bytes");
    }
    if (into.depth > limits_.depth) {
      return fail(kArchiveTooLarge, "more than " + std::to_string(limits_.depth) + " levels of nesting");
    }
    return true;
  }

  bool readArray(const Array& places, Unarchived& made) {
    made.depth = 1;
    Array array;
    array.reserve(places.size());
    for (const auto& entry : places) {
      const auto place = placeIn(entry);
      if (!place) return fail(kArchiveMalformed, "a reference that is no earlier place in the table");
      if (!count(made, objects_[*place])) return false;
      array.append(objects_[*place].value);
    }
    made.value = std::move(array);
    return true;
  }

  bool readDictionary(const Dictionary& lists, Unarchived& made) {
    const auto* keys = findArray(lists, kArchiveKeysKey);
    const auto* values = findArray(lists, kArchiveValuesKey);
    if (keys == nullptr || values == nullptr || lists.size() != 2 || keys->size() != values->size()) {
      return fail(kArchiveMalformed, "a dictionary is two lists of equal length, keys and values");
    }
    made.depth = 1;
    Dictionary dictionary;
    dictionary.reserve(keys->size());
    for (size_t i = 0; i < keys->size(); ++i) {
      const auto key = placeIn((*keys)[i]);
      const auto value = placeIn((*values)[i]);
      if (!key || !value) return fail(kArchiveMalformed, "a reference that is no earlier place in the table");
      const auto* name = objects_[*key].value.string();
      if (name == nullptr) return fail(kArchiveMalformed, "a key that is not text");
      if (dictionary.contains(*name)) return fail(kArchiveMalformed, "a key that occurs twice");
      if (!count(made, objects_[*key]) || !count(made, objects_[*value])) return false;
      dictionary.set(*name, objects_[*value].value);
    }
    made.value = std::move(dictionary);
    return true;
  }

  const ArchiveLimits limits_;
  std::vector<Unarchived> objects_;
  size_t copied_ = 0;
  int64_t code_ = 0;
  std::string problem_;
};

}  // namespace

Result<Value> unarchiveObject(std::string_view archive, const ArchiveLimits& limits) {
  return ArchiveReader(limits).read(archive);
}

}  // namespace tarnel

#include <cbor.h>

#include <algorithm>
#include <array>
#include <set>
#include <utility>
#include <vector>

#include "formats/archive.h"
#include "formats/archive_format.h"

namespace tarnel {
namespace {

using Index = uint32_t;

// Encoded objects one after the other, each once.
class ObjectTable {
 public:
  ObjectTable() : order_(Earlier{this}) {}
  ObjectTable(const ObjectTable&) = delete;
  ObjectTable& operator=(const ObjectTable&) = delete;

  // What is written between begin() and end() is one object.
  void begin() { starts_.push_back(bytes_.size()); }
  // The place of the object, or of the equal one that was there before. Compared in order rather than
  // hashed, so that no choice of values makes this slow.
  Index end() {
    const auto mine = static_cast<Index>(starts_.size() - 1);
    const auto [place, isNew] = order_.insert(mine);
    if (isNew) return mine;
    bytes_.resize(starts_.back());
    starts_.pop_back();
    return *place;
  }

  template <class Encode, class... Argument>
  void item(Encode encode, Argument... argument) {
    std::array<unsigned char, 9> buffer{};
    const size_t length = encode(argument..., buffer.data(), buffer.size());
    bytes_.append(reinterpret_cast<const char*>(buffer.data()), length);
  }
  void text(std::string_view text) {
    item(cbor_encode_string_start, text.size());
    bytes_ += text;
  }
  void data(const Data& data) {
    item(cbor_encode_bytestring_start, data.size());
    bytes_.append(data.begin(), data.end());
  }
  void raw(std::string_view bytes) { bytes_ += bytes; }

  size_t count() const { return starts_.size(); }
  std::string_view bytes() const { return bytes_; }

 private:
  struct Earlier {
    const ObjectTable* table;
    bool operator()(Index a, Index b) const { return table->object(a) < table->object(b); }
  };
  std::string_view object(Index index) const {
    const size_t end = index + 1 < starts_.size() ? starts_[index + 1] : bytes_.size();
    return std::string_view(bytes_).substr(starts_[index], end - starts_[index]);
  }

  std::string bytes_;
  std::vector<size_t> starts_;
  std::set<Index, Earlier> order_;
};

class ArchiveWriter {
 public:
  explicit ArchiveWriter(const ArchiveLimits& limits) : limits_(limits) {}

  Result<std::string> write(const Value& root) {
    const Index place = put(root, 0);
    if (!problem_.empty()) return error();
    ObjectTable whole;  // only for its writing
    whole.raw(kArchiveMark);
    whole.item(cbor_encode_map_start, size_t{3});
    whole.text(kArchiveVersionKey);
    whole.item(cbor_encode_uint, uint64_t{kArchiveVersion});
    whole.text(kArchiveRootKey);
    whole.item(cbor_encode_uint, uint64_t{place});
    whole.text(kArchiveObjectsKey);
    whole.item(cbor_encode_array_start, table_.count());
    whole.raw(table_.bytes());
    if (whole.bytes().size() > limits_.bytes) {
      failBytes();
      return error();
    }
    return std::string(whole.bytes());
  }

 private:
  void fail(int64_t code, std::string problem) {
    if (!problem_.empty()) return;
    code_ = code;
    problem_ = std::move(problem);
  }
  void failBytes() { fail(kArchiveTooLarge, "more than " + std::to_string(limits_.bytes) + " bytes"); }
  Error error() const {
    return {kArchiveErrorDomain, code_,
            problem_ + (code_ == kArchiveTooLarge ? "; archive less at once" : "; give it as data")};
  }
  // False as soon as something is wrong: nothing more is written then.
  bool mayGoOn() {
    if (++values_ > limits_.values) {
      fail(kArchiveTooLarge, "more than " + std::to_string(limits_.values) + " values");
    } else if (table_.bytes().size() > limits_.bytes || textBytes_ > limits_.bytes) {
      failBytes();
    }
    return problem_.empty();
  }

  Index put(const Value& value, size_t depth) {
    if (value.array() != nullptr) return putArray(*value.array(), depth);
    if (value.dictionary() != nullptr) return putDictionary(*value.dictionary(), depth);
    if (value.string() != nullptr) return putText(*value.string(), "text that is not UTF-8");
    if (value.data() != nullptr) textBytes_ += value.data()->size();
    if (!mayGoOn()) return 0;
    table_.begin();
    putScalar(value);
    return table_.end();
  }

  void putScalar(const Value& value) {
    if (const auto* flag = value.boolean()) {
      table_.item(cbor_encode_bool, *flag);
    } else if (const auto* number = value.integer()) {
      *number < 0 ? table_.item(cbor_encode_negint, static_cast<uint64_t>(-1 - *number))
                  : table_.item(cbor_encode_uint, static_cast<uint64_t>(*number));
    } else if (const auto* large = value.unsignedInteger()) {
      table_.item(cbor_encode_uint, *large);
    } else if (const auto* real = value.real()) {
      table_.item(cbor_encode_double, *real);
    } else if (const auto* date = value.date()) {
      table_.item(cbor_encode_tag, uint64_t{1});
      table_.item(cbor_encode_double, date->seconds);
    } else if (const auto* data = value.data()) {
      table_.data(*data);
    } else {
      table_.item(cbor_encode_null);
    }
  }

  Index putText(const std::string& text, const char* problem) {
    if (!isValidUtf8(text)) fail(kArchiveNotText, problem);
    textBytes_ += text.size();
    if (!mayGoOn()) return 0;
    table_.begin();
    table_.text(text);
    return table_.end();
  }

  bool mayNest(size_t depth) {
    if (depth < limits_.depth) return mayGoOn();
    fail(kArchiveTooLarge, "more than " + std::to_string(limits_.depth) + " levels of nesting");
    return false;
  }

  Index putArray(const Array& array, size_t depth) {
    if (!mayNest(depth)) return 0;
    std::vector<Index> places;
    places.reserve(array.size());
    for (const auto& element : array) {
      places.push_back(put(element, depth + 1));
      if (!problem_.empty()) return 0;
    }
    table_.begin();
    putPlaces(places);
    return table_.end();
  }

  // Entries in the order of their keys' places: dictionaries with equal entries are equal in any order.
  Index putDictionary(const Dictionary& dictionary, size_t depth) {
    if (!mayNest(depth)) return 0;
    std::vector<std::pair<Index, Index>> entries;
    entries.reserve(dictionary.size());
    for (const auto& [key, element] : dictionary) {
      const Index name = putText(key, "a key that is not UTF-8");
      entries.emplace_back(name, put(element, depth + 1));
      if (!problem_.empty()) return 0;
    }
    std::sort(entries.begin(), entries.end());
    std::vector<Index> keys(entries.size());
    std::vector<Index> values(entries.size());
    std::transform(entries.begin(), entries.end(), keys.begin(),
                   [](const auto& entry) { return entry.first; });
    std::transform(entries.begin(), entries.end(), values.begin(),
                   [](const auto& entry) { return entry.second; });
    table_.begin();
    table_.item(cbor_encode_map_start, size_t{2});
    table_.text(kArchiveKeysKey);
    putPlaces(keys);
    table_.text(kArchiveValuesKey);
    putPlaces(values);
    return table_.end();
  }

  void putPlaces(const std::vector<Index>& places) {
    table_.item(cbor_encode_array_start, places.size());
    for (const Index place : places) table_.item(cbor_encode_uint, uint64_t{place});
  }

  const ArchiveLimits limits_;
  ObjectTable table_;
  size_t values_ = 0;
  size_t textBytes_ = 0;
  int64_t code_ = 0;
  std::string problem_;
};

}  // namespace

Result<std::string> archiveObject(const Value& root, const ArchiveLimits& limits) {
  return ArchiveWriter(limits).write(root);
}

}  // namespace tarnel

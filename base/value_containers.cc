// Arrays and dictionaries.

#include <algorithm>
#include <iterator>
#include <utility>

#include "base/value.h"

namespace tarnel {
namespace {

const std::vector<Value>& noValues() {
  static const std::vector<Value> none;
  return none;
}

}  // namespace

Array::Array(std::initializer_list<Value> values) {
  values_.write().assign(values.begin(), values.end());
}

size_t Array::size() const noexcept {
  return values_.get() == nullptr ? 0 : values_.get()->size();
}

const Value& Array::operator[](size_t index) const {
  return (*values_.get())[index];
}

const Value* Array::begin() const noexcept {
  return values_.get() == nullptr ? noValues().data() : values_.get()->data();
}

const Value* Array::end() const noexcept {
  return begin() + size();
}

void Array::append(Value value) {
  values_.write().push_back(std::move(value));
}

void Array::reserve(size_t count) {
  values_.write().reserve(count);
}

std::span<Value> Array::mutableValues() {
  return values_.write();
}

bool operator==(const Array& a, const Array& b) {
  return a.values_.sharesValueWith(b.values_) || std::equal(a.begin(), a.end(), b.begin(), b.end());
}

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  reserve(entries.size());
  for (const auto& [key, value] : entries) set(key, value);
}

size_t Dictionary::size() const noexcept {
  return storage_.get() == nullptr ? 0 : storage_.get()->entries.size();
}

const Dictionary::Entry* Dictionary::begin() const noexcept {
  return storage_.get() == nullptr ? nullptr : storage_.get()->entries.data();
}

const Dictionary::Entry* Dictionary::end() const noexcept {
  return storage_.get() == nullptr ? nullptr : begin() + storage_.get()->entries.size();
}

unsigned Dictionary::KeySieve::bitOf(std::string_view key) noexcept {
  if (key.empty()) return 0;
  const auto letter = [key](size_t at) { return uint32_t{static_cast<uint8_t>(key[at])}; };
  const uint32_t mixed = letter(0) | letter(key.size() / 2) << 8U | letter(key.size() - 1) << 16U |
                         static_cast<uint32_t>(key.size() << 24U);
  return mixed * 0x9E3779B1U >> 24U;
}

const Dictionary::Entry* Dictionary::findIn(const Storage& storage, std::string_view key) {
  if (!storage.sieve.mayHold(key)) return nullptr;
  if (!storage.index.empty()) {
    const auto found = storage.index.find(std::string(key));
    return found == storage.index.end() ? nullptr : &storage.entries[found->second];
  }
  for (const auto& entry : storage.entries) {
    if (entry.first == key) return &entry;
  }
  return nullptr;
}

void Dictionary::rebuildIndex(Storage& storage) {
  storage.index.clear();
  if (storage.entries.size() <= kIndexThreshold) return;
  storage.index.reserve(storage.entries.size() * 2);
  for (size_t i = 0; i < storage.entries.size(); ++i) storage.index.emplace(storage.entries[i].first, i);
}

const Value* Dictionary::find(std::string_view key) const {
  if (storage_.get() == nullptr) return nullptr;
  const auto* entry = findIn(*storage_.get(), key);
  return entry == nullptr ? nullptr : &entry->second;
}

void Dictionary::set(std::string_view key, Value value) {
  auto& storage = storage_.write();
  if (const auto* entry = findIn(storage, key)) {
    storage.entries[static_cast<size_t>(entry - storage.entries.data())].second = std::move(value);
    return;
  }
  storage.entries.emplace_back(key, std::move(value));
  storage.sieve.add(storage.entries.back().first);
  if (!storage.index.empty()) {
    storage.index.emplace(storage.entries.back().first, storage.entries.size() - 1);
  } else if (storage.entries.size() > kIndexThreshold) {
    rebuildIndex(storage);
  }
}

void Dictionary::merge(const Dictionary& other) {
  if (other.empty()) return;
  if (empty()) {
    *this = other;
    return;
  }
  const Dictionary source = other;  // stays whole when other is this very dictionary
  reserve(size() + source.size());
  for (const auto& [key, value] : source) set(key, value);
}

bool Dictionary::remove(std::string_view key) {
  if (find(key) == nullptr) return false;
  auto& storage = storage_.write();
  const auto position = findIn(storage, key) - storage.entries.data();
  storage.entries.erase(storage.entries.begin() + position);
  rebuildIndex(storage);
  return true;
}

void Dictionary::editEntries(const std::function<bool(const std::string& key, Value& value)>& visit) {
  if (empty()) return;
  auto& storage = storage_.write();
  const auto gone =
      std::erase_if(storage.entries, [&visit](Entry& entry) { return !visit(entry.first, entry.second); });
  if (gone != 0) rebuildIndex(storage);
}

void Dictionary::reserve(size_t count) {
  storage_.write().entries.reserve(count);
}

Dictionary Dictionary::copyWithRoomFor(size_t count) const {
  Dictionary copy;
  auto& storage = copy.storage_.write();
  storage.entries.reserve(size() + count);
  if (const Storage* own = storage_.get()) {
    storage.entries.insert(storage.entries.end(), own->entries.begin(), own->entries.end());
    storage.sieve = own->sieve;
    storage.index = own->index;
  }
  return copy;
}

bool operator==(const Dictionary& a, const Dictionary& b) {
  if (a.storage_.sharesValueWith(b.storage_)) return true;
  if (a.size() != b.size()) return false;
  for (const auto& [key, value] : a) {
    const auto* other = b.find(key);
    if (other == nullptr || !(*other == value)) return false;
  }
  return true;
}

const std::string* findString(const Dictionary& dictionary, std::string_view key) {
  const auto* value = dictionary.find(key);
  return value == nullptr ? nullptr : value->string();
}

const Dictionary* findDictionary(const Dictionary& dictionary, std::string_view key) {
  const auto* value = dictionary.find(key);
  return value == nullptr ? nullptr : value->dictionary();
}

const Array* findArray(const Dictionary& dictionary, std::string_view key) {
  const auto* value = dictionary.find(key);
  return value == nullptr ? nullptr : value->array();
}

const Value* findNumber(const Dictionary& dictionary, std::string_view key) {
  const auto* value = dictionary.find(key);
  return value != nullptr && value->isNumber() ? value : nullptr;
}

}  // namespace tarnel

#include "backends/https/profile_reader.h"

#include <utility>

namespace tarnel {

ProfileReader::ProfileReader(Log& log, std::string backendName, const char* operation, const char* className)
    : log_(log), backendName_(std::move(backendName)), operation_(operation), className_(className) {}

ProfileSection ProfileReader::section(const Dictionary& profile) {
  return {*this, profile, {}, {}};
}

void ProfileReader::warn(const std::string& shape, const std::string& place, const char* expected,
                         const char* consequence) {
  if (!warned_.insert(shape).second) return;
  TARNEL_LOG(log_, warning, "%s(%s): %s: %s is not %s and %s", className_, operation_, backendName_.c_str(),
             place.c_str(), expected, consequence);
}

ProfileSection::ProfileSection(ProfileReader& reader, const Dictionary& values, std::string shape,
                               std::string place)
    : reader_(&reader), values_(&values), shape_(std::move(shape)), place_(std::move(place)) {}

void ProfileSection::warn(std::string_view key, const char* expected) const {
  reader_->warn(shapeOf(key), placeOf(key), expected);
}

const Value* ProfileSection::findAny(std::string_view key) const {
  const auto* value = values_->find(key);
  if (value == nullptr || !value->isNull()) return value;
  warn(key, "a value");
  return nullptr;
}

const std::string* ProfileSection::findString(std::string_view key) const {
  const auto* value = values_->find(key);
  if (value == nullptr || value->string() != nullptr) return value == nullptr ? nullptr : value->string();
  warn(key, "a text");
  return nullptr;
}

const Value* ProfileSection::findNumber(std::string_view key) const {
  const auto* value = values_->find(key);
  if (value == nullptr || value->isNumber()) return value;
  warn(key, "a number");
  return nullptr;
}

const Array* ProfileSection::findArray(std::string_view key) const {
  const auto* value = values_->find(key);
  if (value == nullptr || value->array() != nullptr) return value == nullptr ? nullptr : value->array();
  warn(key, "an array");
  return nullptr;
}

std::vector<ProfileSection> ProfileSection::findDictionaries(std::string_view key) const {
  std::vector<ProfileSection> sections;
  const auto* array = findArray(key);
  if (array == nullptr) return sections;
  sections.reserve(array->size());
  for (size_t i = 0; i < array->size(); ++i) {
    const std::string place = placeOf(key) + "[" + std::to_string(i) + "]";
    if (const auto* values = (*array)[i].dictionary()) {
      sections.push_back({*reader_, *values, shapeOf(key) + "[].", place + "."});
    } else {
      reader_->warn(shapeOf(key) + "[]", place, "a dictionary");
    }
  }
  return sections;
}

MaybeTextList ProfileSection::findTexts(std::string_view key) const {
  const auto* array = findArray(key);
  if (array == nullptr) return std::nullopt;
  TextList texts;
  texts.reserve(array->size());
  for (size_t i = 0; i < array->size(); ++i) {
    if (const auto* text = (*array)[i].string()) {
      texts.emplace_back(*text);
    } else {
      reader_->warn(shapeOf(key) + "[]", placeOf(key) + "[" + std::to_string(i) + "]", "a text");
    }
  }
  return texts;
}

bool ProfileSection::readNames(std::string_view key, MaybeTextList& names) const {
  const auto* value = values_->find(key);
  if (value == nullptr) return true;
  if (value->string() == nullptr) {
    reader_->warn(shapeOf(key), placeOf(key), "a text", "matches nobody");
    return false;
  }
  names = splitAtCommas(*value->string());
  return true;
}

int32_t ProfileSection::integerOrZero(std::string_view key) const {
  const auto* number = findNumber(key);
  return number == nullptr ? 0 : number->boundedInt32Value();
}

}  // namespace tarnel

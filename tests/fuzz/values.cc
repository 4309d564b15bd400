#include "tests/fuzz/values.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <utility>

namespace tarnel::fuzz {
namespace {

bool sameReal(double a, double b) {
  return (std::isnan(a) && std::isnan(b)) || std::bit_cast<uint64_t>(a) == std::bit_cast<uint64_t>(b);
}

Array arrayFrom(InputReader& input, size_t depth) {
  Array array;
  for (auto left = input.below(6); left > 0; --left) array.append(valueFrom(input, depth));
  return array;
}

Dictionary dictionaryFrom(InputReader& input, size_t depth) {
  Dictionary dictionary;
  for (auto left = input.below(6); left > 0; --left) {
    const auto key = input.shortText();
    dictionary.set(key, valueFrom(input, depth));
  }
  return dictionary;
}

}  // namespace

bool same(const Value& a, const Value& b, double tolerance) {
  if (a.type() != b.type()) return false;
  if (a.real() != nullptr) return sameReal(*a.real(), *b.real());
  if (a.date() != nullptr) {
    const double one = a.date()->seconds;
    const double other = b.date()->seconds;
    return one == other || std::fabs(one - other) <= tolerance || (std::isnan(one) && std::isnan(other));
  }
  if (const auto* array = a.array()) {
    return std::equal(
        array->begin(), array->end(), b.array()->begin(), b.array()->end(),
        [tolerance](const Value& one, const Value& other) { return same(one, other, tolerance); });
  }
  if (const auto* dictionary = a.dictionary()) {
    return dictionary->size() == b.dictionary()->size() &&
           std::all_of(dictionary->begin(), dictionary->end(),
                       [&b, tolerance](const Dictionary::Entry& entry) {
                         const auto* other = b.dictionary()->find(entry.first);
                         return other != nullptr && same(entry.second, *other, tolerance);
                       });
  }
  return a == b;
}

size_t countOf(const Value& value) {
  size_t count = 1;
  if (const auto* array = value.array()) {
    for (const auto& element : *array) count += countOf(element);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) count += 1 + countOf(entry.second);
  }
  return count;
}

size_t depthOf(const Value& value) {
  size_t below = 0;
  if (const auto* array = value.array()) {
    for (const auto& element : *array) below = std::max(below, depthOf(element));
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) below = std::max(below, depthOf(entry.second));
  } else {
    return 0;
  }
  return below + 1;
}

Value valueFrom(InputReader& input, size_t depth) {
  if (input.atEnd()) return {};
  switch (input.below(depth == 0 ? 10 : 14)) {
    case 0:
      return input.below(2) == 1;
    case 1:
      return static_cast<int8_t>(input.byte());
    case 2:
      return static_cast<int64_t>(input.number());
    case 3:
      return input.number();
    case 4:
      return std::bit_cast<double>(input.number());
    case 5:
      return static_cast<double>(static_cast<int8_t>(input.byte())) / 4;
    case 6:
      return Date{std::bit_cast<double>(input.number())};
    case 7:
      return Date{static_cast<double>(input.number() >> 28U) / 4 - 8e9};
    case 8: {
      const auto text = input.shortText();
      return Data(text.begin(), text.end());
    }
    case 9:
      return input.shortText();
    case 10:
    case 11:
      return arrayFrom(input, depth - 1);
    default:
      return dictionaryFrom(input, depth - 1);
  }
}

}  // namespace tarnel::fuzz

#include "tests/fuzz/value_input.h"

#include <bit>
#include <utility>

namespace tarnel::fuzz {
namespace {

constexpr uint32_t kMostEntries = 9;

// Numbers at which narrower ones end.
constexpr int64_t kEdges[] = {INT64_MIN, INT64_MAX, INT32_MIN,  INT32_MAX, UINT32_MAX, -1,
                              65535,     65536,     4294967296, 32768,     127,        256};

}  // namespace

std::string readText(InputReader& input, Words words) {
  const uint32_t which = input.byte();
  if (which == 255 || words.empty()) return input.shortText();
  // A long one, for the bounds on texts.
  if (which == 254) return std::string(size_t{input.byte()} * 64, static_cast<char>(input.byte()));
  return std::string(words[which % words.size()]);
}

Value readValue(InputReader& input, Words words, int depth) {
  enum Kind { null, no, yes, small, edge, number, real, date, text, data, array, dictionary, kinds };
  switch (input.below(kinds)) {
    case no:
      return false;
    case yes:
      return true;
    case small:
      return input.byte();
    case edge:
      return kEdges[input.below(std::size(kEdges))];
    case number:
      return input.number();
    case real:
      return std::bit_cast<double>(input.number());
    case date:
      return Date{std::bit_cast<double>(input.number())};
    case text:
      return readText(input, words);
    case data: {
      const auto bytes = input.shortText();
      return Data(bytes.begin(), bytes.end());
    }
    case array:
      return depth > 0 ? Value(readArray(input, words, depth - 1)) : Value();
    case dictionary:
      return depth > 0 ? Value(readDictionary(input, words, depth - 1)) : Value();
    default:
      return {};
  }
}

Dictionary readDictionary(InputReader& input, Words words, int depth) {
  Dictionary dictionary;
  for (uint32_t left = input.below(kMostEntries); left > 0 && !input.atEnd(); --left) {
    auto key = readText(input, words);
    dictionary.set(key, readValue(input, words, depth));
  }
  return dictionary;
}

Array readArray(InputReader& input, Words words, int depth) {
  Array array;
  for (uint32_t left = input.below(kMostEntries); left > 0 && !input.atEnd(); --left) {
    array.append(readValue(input, words, depth));
  }
  return array;
}

MaybeDictionary readMaybeDictionary(InputReader& input, Words words, int depth) {
  if (input.below(4) == 0) return std::nullopt;
  return readDictionary(input, words, depth);
}

}  // namespace tarnel::fuzz

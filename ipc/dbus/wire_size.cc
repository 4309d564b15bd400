#include "ipc/dbus/wire_size.h"

namespace tarnel::wire {
namespace {

// A length, a signature, a NUL and the padding between them.
constexpr size_t kPerValue = 16;

}  // namespace

size_t approximateSize(const Value& value) {
  if (const auto* text = value.string()) return kPerValue + text->size();
  if (const auto* data = value.data()) return kPerValue + data->size();
  if (const auto* array = value.array()) return kPerValue + approximateSize(*array);
  if (const auto* dictionary = value.dictionary()) return kPerValue + approximateSize(*dictionary);
  return kPerValue;
}

size_t approximateSize(const Dictionary& dictionary) {
  size_t sum = kPerValue;
  for (const auto& [key, value] : dictionary) sum += kPerValue + key.size() + approximateSize(value);
  return sum;
}

size_t approximateSize(const Array& array) {
  size_t sum = kPerValue;
  for (const auto& value : array) sum += approximateSize(value);
  return sum;
}

size_t approximateSize(const MaybeDictionary& dictionary) {
  return dictionary ? approximateSize(*dictionary) : kPerValue;
}

}  // namespace tarnel::wire

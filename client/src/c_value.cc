#include "tarnel/tarnel_c_value.h"

#include <cstring>
#include <memory>
#include <new>
#include <string_view>
#include <utility>

#include "client/src/c_support.h"

// The C interface of values. Everything here is too frequent for more than a cheap check of its arguments.

namespace tarnel::core {
namespace {

template <class Held>
Held* create(const Held& from) noexcept {
  try {
    return std::make_unique<Held>(from).release();
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

tarnel_status missing() noexcept {
  return report(TARNEL_ERROR_INVALID_ARGUMENT, "a dictionary, array, key or value is NULL");
}

// `make` makes the value; it may run out of memory.
template <class Make>
tarnel_status set(tarnel_dictionary* dictionary, const char* key, bool isValid, Make make) noexcept {
  if (dictionary == nullptr || key == nullptr || !isValid) return missing();
  try {
    unwrap(dictionary)->set(key, make());
    return TARNEL_OK;
  } catch (const std::bad_alloc&) {
    return report(TARNEL_ERROR_SYSTEM, "memory is short");
  }
}

template <class Make>
tarnel_status append(tarnel_array* array, bool isValid, Make make) noexcept {
  if (array == nullptr || !isValid) return missing();
  try {
    unwrap(array)->append(make());
    return TARNEL_OK;
  } catch (const std::bad_alloc&) {
    return report(TARNEL_ERROR_SYSTEM, "memory is short");
  }
}

Value textValue(const char* text, size_t length) {
  return length == TARNEL_NUL_TERMINATED ? Value(text) : Value(std::string_view(text, length));
}

Value dataValue(const void* bytes, size_t length) {
  const auto* first = static_cast<const uint8_t*>(bytes);
  return length == 0 ? Value(Data()) : Value(Data(first, first + length));
}

bool isRange(const void* bytes, size_t length) {
  return bytes != nullptr || length == 0;
}

}  // namespace
}  // namespace tarnel::core

using tarnel::Array;
using tarnel::Date;
using tarnel::Dictionary;
using tarnel::Value;
using namespace tarnel::core;

extern "C" {

tarnel_dictionary* tarnel_dictionary_create(void) {
  return reinterpret_cast<tarnel_dictionary*>(create(Dictionary()));
}
tarnel_array* tarnel_array_create(void) {
  return reinterpret_cast<tarnel_array*>(create(Array()));
}
tarnel_dictionary* tarnel_dictionary_copy(const tarnel_dictionary* dictionary) {
  return dictionary == nullptr ? nullptr : reinterpret_cast<tarnel_dictionary*>(create(*unwrap(dictionary)));
}
tarnel_array* tarnel_array_copy(const tarnel_array* array) {
  return array == nullptr ? nullptr : reinterpret_cast<tarnel_array*>(create(*unwrap(array)));
}
void tarnel_dictionary_destroy(tarnel_dictionary* dictionary) {
  const std::unique_ptr<Dictionary> owned(unwrap(dictionary));
}
void tarnel_array_destroy(tarnel_array* array) {
  const std::unique_ptr<Array> owned(unwrap(array));
}

tarnel_status tarnel_dictionary_set_bool(tarnel_dictionary* dictionary, const char* key, bool value) {
  return set(dictionary, key, true, [value] { return Value(value); });
}
tarnel_status tarnel_dictionary_set_int64(tarnel_dictionary* dictionary, const char* key, int64_t value) {
  return set(dictionary, key, true, [value] { return Value(value); });
}
tarnel_status tarnel_dictionary_set_uint64(tarnel_dictionary* dictionary, const char* key, uint64_t value) {
  return set(dictionary, key, true, [value] { return Value(value); });
}
tarnel_status tarnel_dictionary_set_double(tarnel_dictionary* dictionary, const char* key, double value) {
  return set(dictionary, key, true, [value] { return Value(value); });
}
tarnel_status tarnel_dictionary_set_date(tarnel_dictionary* dictionary, const char* key, double seconds) {
  return set(dictionary, key, true, [seconds] { return Value(Date{seconds}); });
}
tarnel_status tarnel_dictionary_set_string(tarnel_dictionary* dictionary, const char* key, const char* text,
                                           size_t length) {
  return set(dictionary, key, text != nullptr, [text, length] { return textValue(text, length); });
}
tarnel_status tarnel_dictionary_set_data(tarnel_dictionary* dictionary, const char* key, const void* bytes,
                                         size_t length) {
  return set(dictionary, key, isRange(bytes, length), [bytes, length] { return dataValue(bytes, length); });
}
tarnel_status tarnel_dictionary_set_array(tarnel_dictionary* dictionary, const char* key,
                                          const tarnel_array* value) {
  return set(dictionary, key, value != nullptr, [value] { return Value(*unwrap(value)); });
}
tarnel_status tarnel_dictionary_set_dictionary(tarnel_dictionary* dictionary, const char* key,
                                               const tarnel_dictionary* value) {
  return set(dictionary, key, value != nullptr, [value] { return Value(*unwrap(value)); });
}
tarnel_status tarnel_dictionary_set_value(tarnel_dictionary* dictionary, const char* key,
                                          const tarnel_value* value) {
  return set(dictionary, key, value != nullptr, [value] { return *unwrap(value); });
}
bool tarnel_dictionary_remove(tarnel_dictionary* dictionary, const char* key) {
  return dictionary != nullptr && key != nullptr && unwrap(dictionary)->remove(key);
}

tarnel_status tarnel_array_append_bool(tarnel_array* array, bool value) {
  return append(array, true, [value] { return Value(value); });
}
tarnel_status tarnel_array_append_int64(tarnel_array* array, int64_t value) {
  return append(array, true, [value] { return Value(value); });
}
tarnel_status tarnel_array_append_uint64(tarnel_array* array, uint64_t value) {
  return append(array, true, [value] { return Value(value); });
}
tarnel_status tarnel_array_append_double(tarnel_array* array, double value) {
  return append(array, true, [value] { return Value(value); });
}
tarnel_status tarnel_array_append_date(tarnel_array* array, double seconds) {
  return append(array, true, [seconds] { return Value(Date{seconds}); });
}
tarnel_status tarnel_array_append_string(tarnel_array* array, const char* text, size_t length) {
  return append(array, text != nullptr, [text, length] { return textValue(text, length); });
}
tarnel_status tarnel_array_append_data(tarnel_array* array, const void* bytes, size_t length) {
  return append(array, isRange(bytes, length), [bytes, length] { return dataValue(bytes, length); });
}
tarnel_status tarnel_array_append_array(tarnel_array* array, const tarnel_array* value) {
  return append(array, value != nullptr, [value] { return Value(*unwrap(value)); });
}
tarnel_status tarnel_array_append_dictionary(tarnel_array* array, const tarnel_dictionary* value) {
  return append(array, value != nullptr, [value] { return Value(*unwrap(value)); });
}
tarnel_status tarnel_array_append_value(tarnel_array* array, const tarnel_value* value) {
  return append(array, value != nullptr, [value] { return *unwrap(value); });
}

size_t tarnel_dictionary_count(const tarnel_dictionary* dictionary) {
  return dictionary == nullptr ? 0 : unwrap(dictionary)->size();
}
const char* tarnel_dictionary_key_at(const tarnel_dictionary* dictionary, size_t index) {
  if (index >= tarnel_dictionary_count(dictionary)) return nullptr;
  return unwrap(dictionary)->begin()[index].first.c_str();
}
const tarnel_value* tarnel_dictionary_value_at(const tarnel_dictionary* dictionary, size_t index) {
  if (index >= tarnel_dictionary_count(dictionary)) return nullptr;
  return wrap(&unwrap(dictionary)->begin()[index].second);
}
const tarnel_value* tarnel_dictionary_find(const tarnel_dictionary* dictionary, const char* key) {
  return dictionary == nullptr || key == nullptr ? nullptr : wrap(unwrap(dictionary)->find(key));
}
size_t tarnel_array_count(const tarnel_array* array) {
  return array == nullptr ? 0 : unwrap(array)->size();
}
const tarnel_value* tarnel_array_value_at(const tarnel_array* array, size_t index) {
  return index >= tarnel_array_count(array) ? nullptr : wrap(&(*unwrap(array))[index]);
}

tarnel_type tarnel_value_type(const tarnel_value* value) {
  return value == nullptr ? TARNEL_TYPE_NULL : static_cast<tarnel_type>(unwrap(value)->type());
}
bool tarnel_value_bool(const tarnel_value* value) {
  return value != nullptr && unwrap(value)->boolValue();
}
int64_t tarnel_value_int64(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->int64Value();
}
uint64_t tarnel_value_uint64(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->uint64Value();
}
double tarnel_value_double(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->doubleValue();
}
double tarnel_value_date(const tarnel_value* value) {
  const Date* date = value == nullptr ? nullptr : unwrap(value)->date();
  return date == nullptr ? 0 : date->seconds;
}
const char* tarnel_value_string(const tarnel_value* value, size_t* length) {
  const std::string* text = value == nullptr ? nullptr : unwrap(value)->string();
  if (length != nullptr) *length = text == nullptr ? 0 : text->size();
  return text == nullptr ? nullptr : text->c_str();
}
const uint8_t* tarnel_value_data(const tarnel_value* value, size_t* length) {
  static constexpr uint8_t kNothing = 0;
  const tarnel::Data* data = value == nullptr ? nullptr : unwrap(value)->data();
  if (length != nullptr) *length = data == nullptr ? 0 : data->size();
  if (data == nullptr) return nullptr;
  return data->empty() ? &kNothing : data->data();
}
const tarnel_array* tarnel_value_array(const tarnel_value* value) {
  return value == nullptr ? nullptr : wrap(unwrap(value)->array());
}
const tarnel_dictionary* tarnel_value_dictionary(const tarnel_value* value) {
  return value == nullptr ? nullptr : wrap(unwrap(value)->dictionary());
}

}  // extern "C"

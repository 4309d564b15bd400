#include "platform/linux/bundles/adaptor_values.h"

#include "tarnel/tarnel_adaptor.h"

namespace tarnel {

namespace {

static_assert(static_cast<int>(Value::Type::null) == TARNEL_TYPE_NULL);
static_assert(static_cast<int>(Value::Type::boolean) == TARNEL_TYPE_BOOLEAN);
static_assert(static_cast<int>(Value::Type::integer) == TARNEL_TYPE_INTEGER);
static_assert(static_cast<int>(Value::Type::unsignedInteger) == TARNEL_TYPE_UNSIGNED_INTEGER);
static_assert(static_cast<int>(Value::Type::real) == TARNEL_TYPE_REAL);
static_assert(static_cast<int>(Value::Type::date) == TARNEL_TYPE_DATE);
static_assert(static_cast<int>(Value::Type::string) == TARNEL_TYPE_STRING);
static_assert(static_cast<int>(Value::Type::data) == TARNEL_TYPE_DATA);
static_assert(static_cast<int>(Value::Type::array) == TARNEL_TYPE_ARRAY);
static_assert(static_cast<int>(Value::Type::dictionary) == TARNEL_TYPE_DICTIONARY);

const Dictionary* unwrap(const tarnel_dictionary* dictionary) noexcept {
  return reinterpret_cast<const Dictionary*>(dictionary);
}
const Array* unwrap(const tarnel_array* array) noexcept {
  return reinterpret_cast<const Array*>(array);
}
const Value* unwrap(const tarnel_value* value) noexcept {
  return reinterpret_cast<const Value*>(value);
}
const tarnel_dictionary* wrap(const Dictionary* dictionary) noexcept {
  return reinterpret_cast<const tarnel_dictionary*>(dictionary);
}
const tarnel_array* wrap(const Array* array) noexcept {
  return reinterpret_cast<const tarnel_array*>(array);
}
const tarnel_value* wrap(const Value* value) noexcept {
  return reinterpret_cast<const tarnel_value*>(value);
}

size_t dictionaryCount(const tarnel_dictionary* dictionary) {
  return dictionary == nullptr ? 0 : unwrap(dictionary)->size();
}
const char* dictionaryKeyAt(const tarnel_dictionary* dictionary, size_t index) {
  if (index >= dictionaryCount(dictionary)) return nullptr;
  return unwrap(dictionary)->begin()[index].first.c_str();
}
const tarnel_value* dictionaryValueAt(const tarnel_dictionary* dictionary, size_t index) {
  if (index >= dictionaryCount(dictionary)) return nullptr;
  return wrap(&unwrap(dictionary)->begin()[index].second);
}
const tarnel_value* dictionaryFind(const tarnel_dictionary* dictionary, const char* key) {
  if (dictionary == nullptr || key == nullptr) return nullptr;
  return wrap(unwrap(dictionary)->find(key));
}
size_t arrayCount(const tarnel_array* array) {
  return array == nullptr ? 0 : unwrap(array)->size();
}
const tarnel_value* arrayValueAt(const tarnel_array* array, size_t index) {
  return index < arrayCount(array) ? wrap(&(*unwrap(array))[index]) : nullptr;
}
tarnel_type valueType(const tarnel_value* value) {
  return value == nullptr ? TARNEL_TYPE_NULL : static_cast<tarnel_type>(unwrap(value)->type());
}
bool valueBool(const tarnel_value* value) {
  return value != nullptr && unwrap(value)->boolValue();
}
int64_t valueInt64(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->int64Value();
}
uint64_t valueUint64(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->uint64Value();
}
double valueDouble(const tarnel_value* value) {
  return value == nullptr ? 0 : unwrap(value)->doubleValue();
}
double valueDate(const tarnel_value* value) {
  const Date* date = value == nullptr ? nullptr : unwrap(value)->date();
  return date == nullptr ? 0 : date->seconds;
}
const char* valueString(const tarnel_value* value, size_t* length) {
  const std::string* text = value == nullptr ? nullptr : unwrap(value)->string();
  if (length != nullptr) *length = text == nullptr ? 0 : text->size();
  return text == nullptr ? nullptr : text->c_str();
}
const uint8_t* valueData(const tarnel_value* value, size_t* length) {
  const Data* data = value == nullptr ? nullptr : unwrap(value)->data();
  if (length != nullptr) *length = data == nullptr ? 0 : data->size();
  return data == nullptr ? nullptr : data->data();
}
const tarnel_array* valueArray(const tarnel_value* value) {
  return value == nullptr ? nullptr : wrap(unwrap(value)->array());
}
const tarnel_dictionary* valueDictionary(const tarnel_value* value) {
  return value == nullptr ? nullptr : wrap(unwrap(value)->dictionary());
}

constexpr tarnel_adaptor_values kValues{.size = sizeof(tarnel_adaptor_values),
                                        .dictionary_count = dictionaryCount,
                                        .dictionary_key_at = dictionaryKeyAt,
                                        .dictionary_value_at = dictionaryValueAt,
                                        .dictionary_find = dictionaryFind,
                                        .array_count = arrayCount,
                                        .array_value_at = arrayValueAt,
                                        .value_type = valueType,
                                        .value_bool = valueBool,
                                        .value_int64 = valueInt64,
                                        .value_uint64 = valueUint64,
                                        .value_double = valueDouble,
                                        .value_date = valueDate,
                                        .value_string = valueString,
                                        .value_data = valueData,
                                        .value_array = valueArray,
                                        .value_dictionary = valueDictionary};

}  // namespace

const tarnel_adaptor_values& adaptorValues() noexcept {
  return kValues;
}

const tarnel_dictionary* forAdaptor(const MaybeDictionary& dictionary) noexcept {
  return dictionary ? wrap(&*dictionary) : nullptr;
}

}  // namespace tarnel

#pragma once

#include <array>
#include <compare>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

#include "base/cow_ptr.h"
#include "base/utf8.h"

// The values that travel through the system: what a client puts into a payload, what a configuration
// document holds, what an event is made of.
//
// Copying a value is cheap: arrays and dictionaries share their storage until one of the copies is written.
// Threads: one object is used by one thread at a time; copies that share storage may live on other threads.

namespace tarnel {

class Value;

// Uninterpreted bytes.
using Data = std::vector<uint8_t>;

// A point in time: seconds since 1970-01-01 00:00 UTC, leap seconds not counted.
struct Date {
  double seconds = 0;
  friend bool operator==(const Date&, const Date&) = default;
};

// An ordered list of values.
class Array {
 public:
  Array() noexcept = default;
  Array(std::initializer_list<Value> values);

  size_t size() const noexcept;
  bool empty() const noexcept { return size() == 0; }
  const Value& operator[](size_t index) const;  // index < size()
  const Value* begin() const noexcept;
  const Value* end() const noexcept;

  void append(Value value);
  void reserve(size_t count);
  // For changing elements in place; pointers stay valid until the next change of the array.
  std::span<Value> mutableValues();

  friend bool operator==(const Array& a, const Array& b);

 private:
  detail::CowPtr<std::vector<Value>> values_;
};

// Text keys to values, in order of insertion. Small dictionaries are searched linearly; beyond
// kIndexThreshold entries an index is kept, so that a dictionary of any size is searched in constant time.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;
  static constexpr size_t kIndexThreshold = 64;

  Dictionary() noexcept = default;
  Dictionary(std::initializer_list<Entry> entries);

  size_t size() const noexcept;
  bool empty() const noexcept { return size() == 0; }
  const Entry* begin() const noexcept;
  const Entry* end() const noexcept;

  // The value under the key, or null. Valid until the next change of this dictionary.
  const Value* find(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }

  // Puts the value under the key; a key that exists keeps its place and gets the new value.
  void set(std::string_view key, Value value);
  // Every entry of other is set here.
  void merge(const Dictionary& other);
  bool remove(std::string_view key);
  // Changes all entries in one pass. `visit` may write the value; entries for which it returns false go.
  void editEntries(const std::function<bool(const std::string& key, Value& value)>& visit);
  void reserve(size_t count);
  // A copy that takes `count` more entries without moving its own.
  Dictionary copyWithRoomFor(size_t count) const;

  // Equal when both hold equal values under the same keys; the order does not matter.
  friend bool operator==(const Dictionary& a, const Dictionary& b);

 private:
  // Which keys may be there: a key whose bit is not set is not. Removing a key leaves its bit.
  class KeySieve {
   public:
    bool mayHold(std::string_view key) const noexcept {
      const unsigned bit = bitOf(key);
      return (bits_[bit / 64] >> (bit % 64) & 1U) != 0;
    }
    void add(std::string_view key) noexcept {
      const unsigned bit = bitOf(key);
      bits_[bit / 64] |= uint64_t{1} << (bit % 64);
    }

   private:
    // Of 256, from the length and three of the letters.
    static unsigned bitOf(std::string_view key) noexcept;
    std::array<uint64_t, 4> bits_{};
  };
  struct Storage {
    std::vector<Entry> entries;
    KeySieve sieve;
    std::unordered_map<std::string, size_t> index;  // key to position; empty while not needed
  };
  static const Entry* findIn(const Storage& storage, std::string_view key);
  static void rebuildIndex(Storage& storage);

  detail::CowPtr<Storage> storage_;
};

class Value {
 public:
  enum class Type : uint8_t {
    null,
    boolean,
    integer,
    unsignedInteger,
    real,
    date,
    string,
    data,
    array,
    dictionary
  };

  Value() noexcept = default;
  Value(bool value) noexcept : value_(value) {}
  // Every integer is kept as signed 64-bit; only what does not fit there is kept unsigned.
  template <std::integral T>
  requires(!std::same_as<T, bool>) Value(T value)
  noexcept {
    if constexpr (std::is_signed_v<T>) {
      value_ = static_cast<int64_t>(value);
    } else if (static_cast<uint64_t>(value) <= static_cast<uint64_t>(INT64_MAX)) {
      value_ = static_cast<int64_t>(value);
    } else {
      value_ = static_cast<uint64_t>(value);
    }
  }
  Value(double value) noexcept : value_(value) {}
  Value(Date value) noexcept : value_(value) {}
  Value(std::string value) noexcept : value_(std::move(value)) {}
  Value(std::string_view value) : value_(std::string(value)) {}
  Value(const char* value) : value_(std::string(value)) {}
  Value(Data value) noexcept : value_(std::move(value)) {}
  Value(Array value) noexcept : value_(std::move(value)) {}
  Value(Dictionary value) noexcept : value_(std::move(value)) {}
  Value(const void*) = delete;

  Type type() const noexcept { return static_cast<Type>(value_.index()); }
  bool isNull() const noexcept { return type() == Type::null; }
  // A boolean counts as a number wherever numbers are allowed.
  bool isNumber() const noexcept { return type() >= Type::boolean && type() <= Type::real; }

  // The held value when the type fits, else null. Valid until the value changes.
  const bool* boolean() const noexcept { return std::get_if<bool>(&value_); }
  const int64_t* integer() const noexcept { return std::get_if<int64_t>(&value_); }
  const uint64_t* unsignedInteger() const noexcept { return std::get_if<uint64_t>(&value_); }
  const double* real() const noexcept { return std::get_if<double>(&value_); }
  const Date* date() const noexcept { return std::get_if<Date>(&value_); }
  const std::string* string() const noexcept { return std::get_if<std::string>(&value_); }
  const Data* data() const noexcept { return std::get_if<Data>(&value_); }
  const Array* array() const noexcept { return std::get_if<Array>(&value_); }
  const Dictionary* dictionary() const noexcept { return std::get_if<Dictionary>(&value_); }
  std::string* mutableString() noexcept { return std::get_if<std::string>(&value_); }
  Array* mutableArray() noexcept { return std::get_if<Array>(&value_); }
  Dictionary* mutableDictionary() noexcept { return std::get_if<Dictionary>(&value_); }

  // Reading a number: integers keep their low bits in the narrower width; a real is cut toward zero and
  // held to the 64-bit range first (not-a-number reads as 0); text reads as its leading integer (or real);
  // anything else reads as 0.
  int64_t int64Value() const noexcept;
  // Whether int64Value() reads a number that is there: of a number, or of a text that begins with one.
  bool hasInteger() const noexcept;
  uint64_t uint64Value() const noexcept;
  int32_t int32Value() const noexcept { return static_cast<int32_t>(int64Value()); }
  uint32_t uint32Value() const noexcept { return static_cast<uint32_t>(uint64Value()); }
  uint16_t uint16Value() const noexcept { return static_cast<uint16_t>(uint64Value()); }
  // The number held to the bounds of 32 bits instead of cut to its low ones: how a configuration is read,
  // where a number that is too large must not come to mean a small one.
  int32_t boundedInt32Value() const noexcept;
  double doubleValue() const noexcept;
  // Numbers: other than zero. Text: begins (after blanks, a sign and zeros) with Y, y, T, t or 1 to 9.
  bool boolValue() const noexcept;

  // Readable text: strings as they are, numbers in decimal (booleans as 1 and 0), dates in UTC
  // ("2026-01-31 12:00:00 +0000"), data as <hex>, containers as JSON-like text on one line, null as "(null)".
  std::string description() const;

  friend bool operator==(const Value& a, const Value& b) = default;

 private:
  std::variant<std::monostate, bool, int64_t, uint64_t, double, Date, std::string, Data, Array, Dictionary>
      value_;
};

std::string description(const Dictionary& dictionary);
std::string description(const Array& array);
// "2026-01-31 12:00:00 +0000"; a date that no calendar holds is given in seconds.
std::string description(Date date);

// The shortest decimal text that reads back as the same double, written into the buffer: plain digits from
// 1e-5 up to 1e17, with an exponent outside, "inf" and "nan" when it is not finite.
inline constexpr size_t kRealTextSize = 40;
std::string_view writeReal(double number, std::span<char, kRealTextSize> buffer) noexcept;

// A double as the system sends it: infinite and not-a-number become -1.0.
double finiteOrMinusOne(double value) noexcept;

// Lookups in dictionaries whose shape nobody vouches for: a missing key and a value of another type
// both give nothing. Valid until the dictionary changes.
const std::string* findString(const Dictionary& dictionary, std::string_view key);
const Dictionary* findDictionary(const Dictionary& dictionary, std::string_view key);
const Array* findArray(const Dictionary& dictionary, std::string_view key);
// Also takes booleans.
const Value* findNumber(const Dictionary& dictionary, std::string_view key);

// Dictionaries and strings that may be absent.
using MaybeString = std::optional<std::string>;
using MaybeDictionary = std::optional<Dictionary>;

}  // namespace tarnel

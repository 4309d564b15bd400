#ifndef TARNEL_VALUE_H_
#define TARNEL_VALUE_H_

// Dictionaries and arrays of the C++ interface of libtarnel; see tarnel_c_value.h for what they hold.
//
// Everything here is inline over the C interface, so that a program and the library may be built by different
// compilers. Needs C++17. Copies are cheap: they share their contents until one of them is changed.
// Setting and appending throw std::bad_alloc when memory is short; nothing else throws.
//
// Threads: one object is used by one thread at a time.

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <new>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "tarnel/tarnel_c_value.h"

namespace tarnel::client {

// A point in time: seconds since 1970-01-01 00:00 UTC.
struct Date {
  double seconds = 0;
};

// A text that ends with NUL.
class Key {
 public:
  Key(const char* text) noexcept : text_(text) {}
  Key(const std::string& text) noexcept : text_(text.c_str()) {}
  const char* get() const noexcept { return text_; }

 private:
  const char* text_;
};

class Array;
class DictionaryView;
class ArrayView;

// A value inside a dictionary or array, or none. Valid until what holds it changes or goes.
class ValueView {
 public:
  ValueView() noexcept = default;
  explicit ValueView(const tarnel_value* handle) noexcept : handle_(handle) {}

  explicit operator bool() const noexcept { return handle_ != nullptr; }
  const tarnel_value* handle() const noexcept { return handle_; }

  tarnel_type type() const noexcept { return tarnel_value_type(handle_); }
  // Conversions as the C interface does them; 0, false or empty for what does not convert.
  bool toBool() const noexcept { return tarnel_value_bool(handle_); }
  std::int64_t toInt64() const noexcept { return tarnel_value_int64(handle_); }
  std::uint64_t toUint64() const noexcept { return tarnel_value_uint64(handle_); }
  double toDouble() const noexcept { return tarnel_value_double(handle_); }
  Date toDate() const noexcept { return {tarnel_value_date(handle_)}; }
  std::string_view toString() const noexcept {
    std::size_t length = 0;
    const char* text = tarnel_value_string(handle_, &length);
    return {text == nullptr ? "" : text, length};
  }
  std::vector<std::uint8_t> toData() const {
    std::size_t length = 0;
    const std::uint8_t* bytes = tarnel_value_data(handle_, &length);
    return bytes == nullptr ? std::vector<std::uint8_t>() : std::vector<std::uint8_t>(bytes, bytes + length);
  }
  ArrayView toArray() const noexcept;
  DictionaryView toDictionary() const noexcept;

 private:
  const tarnel_value* handle_ = nullptr;
};

// A dictionary that somebody else holds, or none: as an argument, {} means that there is none.
class DictionaryView {
 public:
  DictionaryView() noexcept = default;
  explicit DictionaryView(const tarnel_dictionary* handle) noexcept : handle_(handle) {}

  explicit operator bool() const noexcept { return handle_ != nullptr; }
  const tarnel_dictionary* handle() const noexcept { return handle_; }

  std::size_t size() const noexcept { return tarnel_dictionary_count(handle_); }
  // index: 0 to size() - 1; entries are in order of insertion.
  std::string_view keyAt(std::size_t index) const noexcept {
    const char* key = tarnel_dictionary_key_at(handle_, index);
    return key == nullptr ? std::string_view() : std::string_view(key);
  }
  ValueView valueAt(std::size_t index) const noexcept {
    return ValueView(tarnel_dictionary_value_at(handle_, index));
  }
  // None when the key is not there.
  ValueView find(Key key) const noexcept { return ValueView(tarnel_dictionary_find(handle_, key.get())); }

 private:
  const tarnel_dictionary* handle_ = nullptr;
};

// The same for an array.
class ArrayView {
 public:
  ArrayView() noexcept = default;
  explicit ArrayView(const tarnel_array* handle) noexcept : handle_(handle) {}

  explicit operator bool() const noexcept { return handle_ != nullptr; }
  const tarnel_array* handle() const noexcept { return handle_; }

  std::size_t size() const noexcept { return tarnel_array_count(handle_); }
  ValueView operator[](std::size_t index) const noexcept {
    return ValueView(tarnel_array_value_at(handle_, index));
  }

 private:
  const tarnel_array* handle_ = nullptr;
};

inline ArrayView ValueView::toArray() const noexcept {
  return ArrayView(tarnel_value_array(handle_));
}
inline DictionaryView ValueView::toDictionary() const noexcept {
  return DictionaryView(tarnel_value_dictionary(handle_));
}

namespace detail {

inline void check(tarnel_status status) {
  if (status == TARNEL_ERROR_SYSTEM) throw std::bad_alloc();
}

template <class Handle>
Handle* checked(Handle* handle) {
  if (handle == nullptr) throw std::bad_alloc();
  return handle;
}

// bool, or any other arithmetic type that is no character of text.
template <class T>
using EnableIfInteger = std::enable_if_t<std::is_integral_v<T> && !std::is_same_v<T, bool>, int>;

}  // namespace detail

// Text keys to values. `Dictionary().set("a", 1).set("b", "text")` builds one in an expression.
class Dictionary {
 public:
  Dictionary() : handle_(detail::checked(tarnel_dictionary_create())) {}
  // A copy of what the view shows; empty when it shows none.
  explicit Dictionary(DictionaryView from)
      : handle_(detail::checked(from ? tarnel_dictionary_copy(from.handle()) : tarnel_dictionary_create())) {}
  Dictionary(const Dictionary& other) : Dictionary(DictionaryView(other.handle_)) {}
  // What was moved from may only be assigned to or destroyed.
  Dictionary(Dictionary&& other) noexcept : handle_(std::exchange(other.handle_, nullptr)) {}
  Dictionary& operator=(Dictionary other) noexcept {
    std::swap(handle_, other.handle_);
    return *this;
  }
  ~Dictionary() { tarnel_dictionary_destroy(handle_); }

  operator DictionaryView() const noexcept { return DictionaryView(handle_); }
  DictionaryView view() const noexcept { return DictionaryView(handle_); }
  std::size_t size() const noexcept { return view().size(); }
  ValueView find(Key key) const noexcept { return view().find(key); }

  // A key that exists keeps its place and gets the new value.
  Dictionary& set(Key key, bool value) { return done(tarnel_dictionary_set_bool(handle_, key.get(), value)); }
  template <class T, detail::EnableIfInteger<T> = 0>
  Dictionary& set(Key key, T value) {
    if constexpr (std::is_signed_v<T>) {
      return done(tarnel_dictionary_set_int64(handle_, key.get(), value));
    } else {
      return done(tarnel_dictionary_set_uint64(handle_, key.get(), value));
    }
  }
  Dictionary& set(Key key, double value) {
    return done(tarnel_dictionary_set_double(handle_, key.get(), value));
  }
  Dictionary& set(Key key, Date value) {
    return done(tarnel_dictionary_set_date(handle_, key.get(), value.seconds));
  }
  Dictionary& set(Key key, const char* value) {
    return done(tarnel_dictionary_set_string(handle_, key.get(), value, TARNEL_NUL_TERMINATED));
  }
  Dictionary& set(Key key, std::string_view value) {
    return done(
        tarnel_dictionary_set_string(handle_, key.get(), value.empty() ? "" : value.data(), value.size()));
  }
  Dictionary& set(Key key, const std::string& value) { return set(key, std::string_view(value)); }
  Dictionary& set(Key key, const std::vector<std::uint8_t>& value) {
    return done(tarnel_dictionary_set_data(handle_, key.get(), value.data(), value.size()));
  }
  // A view that shows none changes nothing.
  Dictionary& set(Key key, ArrayView value) {
    return done(tarnel_dictionary_set_array(handle_, key.get(), value.handle()));
  }
  Dictionary& set(Key key, DictionaryView value) {
    return done(tarnel_dictionary_set_dictionary(handle_, key.get(), value.handle()));
  }
  Dictionary& set(Key key, ValueView value) {
    return done(tarnel_dictionary_set_value(handle_, key.get(), value.handle()));
  }
  inline Dictionary& set(Key key, const Array& value);
  Dictionary& set(Key key, const Dictionary& value) { return set(key, value.view()); }
  Dictionary& set(Key key, const void* value) = delete;
  bool remove(Key key) noexcept { return tarnel_dictionary_remove(handle_, key.get()); }

 private:
  Dictionary& done(tarnel_status status) {
    detail::check(status);
    return *this;
  }

  tarnel_dictionary* handle_;
};

// A list of values.
class Array {
 public:
  Array() : handle_(detail::checked(tarnel_array_create())) {}
  explicit Array(ArrayView from)
      : handle_(detail::checked(from ? tarnel_array_copy(from.handle()) : tarnel_array_create())) {}
  Array(const Array& other) : Array(ArrayView(other.handle_)) {}
  Array(Array&& other) noexcept : handle_(std::exchange(other.handle_, nullptr)) {}
  Array& operator=(Array other) noexcept {
    std::swap(handle_, other.handle_);
    return *this;
  }
  ~Array() { tarnel_array_destroy(handle_); }

  operator ArrayView() const noexcept { return ArrayView(handle_); }
  ArrayView view() const noexcept { return ArrayView(handle_); }
  std::size_t size() const noexcept { return view().size(); }
  ValueView operator[](std::size_t index) const noexcept { return view()[index]; }

  Array& append(bool value) { return done(tarnel_array_append_bool(handle_, value)); }
  template <class T, detail::EnableIfInteger<T> = 0>
  Array& append(T value) {
    if constexpr (std::is_signed_v<T>) {
      return done(tarnel_array_append_int64(handle_, value));
    } else {
      return done(tarnel_array_append_uint64(handle_, value));
    }
  }
  Array& append(double value) { return done(tarnel_array_append_double(handle_, value)); }
  Array& append(Date value) { return done(tarnel_array_append_date(handle_, value.seconds)); }
  Array& append(const char* value) {
    return done(tarnel_array_append_string(handle_, value, TARNEL_NUL_TERMINATED));
  }
  Array& append(std::string_view value) {
    return done(tarnel_array_append_string(handle_, value.empty() ? "" : value.data(), value.size()));
  }
  Array& append(const std::string& value) { return append(std::string_view(value)); }
  Array& append(const std::vector<std::uint8_t>& value) {
    return done(tarnel_array_append_data(handle_, value.data(), value.size()));
  }
  Array& append(ArrayView value) { return done(tarnel_array_append_array(handle_, value.handle())); }
  Array& append(DictionaryView value) {
    return done(tarnel_array_append_dictionary(handle_, value.handle()));
  }
  Array& append(ValueView value) { return done(tarnel_array_append_value(handle_, value.handle())); }
  Array& append(const Array& value) { return append(value.view()); }
  Array& append(const Dictionary& value) { return append(value.view()); }
  Array& append(const void* value) = delete;

 private:
  Array& done(tarnel_status status) {
    detail::check(status);
    return *this;
  }

  tarnel_array* handle_;
};

inline Dictionary& Dictionary::set(Key key, const Array& value) {
  return set(key, value.view());
}

}  // namespace tarnel::client

#endif

#pragma once

#include <cstdint>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <variant>

namespace tarnel {

// What went wrong: a domain (see include/tarnel/keys.h for the system's own), a code of that domain
// and a sentence for people. Immutable; absent where an std::optional<Error> is empty.
class Error {
 public:
  Error(std::string domain, int64_t code, std::string description)
      : domain_(std::move(domain)), code_(code), description_(std::move(description)) {}

  const std::string& domain() const noexcept { return domain_; }
  int64_t code() const noexcept { return code_; }
  const std::string& localizedDescription() const noexcept { return description_; }
  // "domain (code): description", for logs.
  std::string description() const { return domain_ + " (" + std::to_string(code_) + "): " + description_; }

  friend bool operator==(const Error&, const Error&) = default;

 private:
  std::string domain_;
  int64_t code_;
  std::string description_;
};

using MaybeError = std::optional<Error>;

// Errors of files and folders; the code is the system's errno.
inline constexpr char kFileErrorDomain[] = "TarnelFileErrorDomain";

// What a backend's send hands back for the message log and the client: the text of what it sent, or an error.
using SentObject = std::variant<std::string, Error>;
using MaybeSentObject = std::optional<SentObject>;

// For logs: the text itself, or the error's description.
inline std::string description(const SentObject& object) {
  const auto* text = std::get_if<std::string>(&object);
  return text != nullptr ? *text : std::get<Error>(object).description();
}

// A value, or why there is none.
template <class T>
class [[nodiscard]] Result {
 public:
  Result(T value) : held_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : held_(std::in_place_index<1>, std::move(error)) {}

  explicit operator bool() const noexcept { return held_.index() == 0; }
  T& operator*() & { return std::get<0>(held_); }
  const T& operator*() const& { return std::get<0>(held_); }
  T&& operator*() && { return std::get<0>(std::move(held_)); }
  T* operator->() { return &std::get<0>(held_); }
  const T* operator->() const { return &std::get<0>(held_); }
  const Error& error() const { return std::get<1>(held_); }

 private:
  std::variant<T, Error> held_;
};

// The one failure that unwinds: an argument the system itself counts as invalid (a client type
// without a storebag name as a cache key; a verified document without a version). Every entry that calls
// into the daemon (IPC dispatch, queue tasks, HTTP completions) catches it, logs it at level 3 and answers
// the caller with an error; locks are released on the way by their guards.
class InvalidArgument : public std::invalid_argument {
 public:
  using std::invalid_argument::invalid_argument;
};

}  // namespace tarnel

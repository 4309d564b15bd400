#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "base/error.h"
#include "base/value.h"
#include "formats/document.h"

namespace tarnel::detail {

// Puts a document together from the items that a reader of either form meets, and holds it to its limits.
// Every call returns false once something is wrong; problem() then says what.
class DocumentBuilder {
 public:
  explicit DocumentBuilder(const DocumentLimits& limits) : limits_(limits) {}

  bool add(Value value);
  bool key(std::string key);
  bool openArray();
  bool openDictionary();
  // Ends the innermost array or dictionary, which must be open, and hands it to `finish` before it takes its
  // place: finish may replace it, or refuse it by returning false after fail().
  template <class Finish>
  bool close(const Finish& finish) {
    Frame frame = std::move(frames_.back());
    frames_.pop_back();
    Value value = frame.isArray ? Value(std::move(frame.array)) : Value(std::move(frame.dictionary));
    return finish(value) && place(std::move(value));
  }

  bool isOpen() const { return !frames_.empty(); }
  bool expectsKey() const { return !frames_.empty() && !frames_.back().isArray && !frames_.back().hasKey; }
  bool isComplete() const { return complete_; }
  Value take() { return std::move(root_); }

  bool fail(int64_t code, std::string text) {
    if (text_.empty()) {
      code_ = code;
      text_ = std::move(text);
    }
    return false;
  }
  bool failed() const { return !text_.empty(); }
  // The problem and the byte at which it was met.
  Error error(size_t offset) const;

 private:
  struct Frame {
    bool isArray = true;
    bool hasKey = false;
    Array array;
    Dictionary dictionary;
    std::string key;
  };

  bool count();
  bool open(bool isArray);
  bool place(Value value);

  DocumentLimits limits_;
  std::vector<Frame> frames_;
  size_t values_ = 0;
  Value root_;
  bool complete_ = false;
  int64_t code_ = 0;
  std::string text_;
};

// The two forms. The bytes are within the size limit.
Result<Value> parseTextDocument(std::string_view bytes, const DocumentLimits& limits);
Result<Value> parseBinaryDocument(std::string_view bytes, const DocumentLimits& limits);

}  // namespace tarnel::detail

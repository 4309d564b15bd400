#include "formats/document.h"

#include <string>

#include "formats/document_builder.h"

namespace tarnel {
namespace detail {

bool DocumentBuilder::count() {
  if (++values_ <= limits_.values) return true;
  return fail(kDocumentTooLarge,
              "the document holds more than " + std::to_string(limits_.values) + " values");
}

bool DocumentBuilder::place(Value value) {
  if (frames_.empty()) {
    root_ = std::move(value);
    complete_ = true;
    return true;
  }
  Frame& frame = frames_.back();
  if (frame.isArray) {
    frame.array.append(std::move(value));
  } else {
    frame.dictionary.set(frame.key, std::move(value));
    frame.hasKey = false;
  }
  return true;
}

bool DocumentBuilder::add(Value value) {
  const auto* text = value.string();
  if (text != nullptr && !isValidUtf8(*text)) return fail(kDocumentMalformed, "text that is not UTF-8");
  return count() && place(std::move(value));
}

bool DocumentBuilder::key(std::string key) {
  if (!isValidUtf8(key)) return fail(kDocumentMalformed, "a key that is not UTF-8");
  if (!count()) return false;
  frames_.back().key = std::move(key);
  frames_.back().hasKey = true;
  return true;
}

bool DocumentBuilder::open(bool isArray) {
  if (!count()) return false;
  if (frames_.size() >= limits_.depth) {
    return fail(kDocumentTooLarge, "more than " + std::to_string(limits_.depth) + " levels of nesting");
  }
  frames_.emplace_back().isArray = isArray;
  return true;
}

bool DocumentBuilder::openArray() {
  return open(true);
}

bool DocumentBuilder::openDictionary() {
  return open(false);
}

Error DocumentBuilder::error(size_t offset) const {
  return {kDocumentErrorDomain, code_, text_ + " at byte " + std::to_string(offset)};
}

}  // namespace detail

Result<Value> parseDocument(std::string_view bytes, const DocumentLimits& limits) {
  if (bytes.empty()) return Error(kDocumentErrorDomain, kDocumentMalformed, "the document is empty");
  if (bytes.size() > limits.bytes) {
    return Error(kDocumentErrorDomain, kDocumentTooLarge,
                 "the document has " + std::to_string(bytes.size()) + " bytes, more than " +
                     std::to_string(limits.bytes));
  }
  const bool isText = static_cast<uint8_t>(bytes.front()) < 0x80 || bytes.starts_with("\xEF\xBB\xBF");
  return isText ? detail::parseTextDocument(bytes, limits) : detail::parseBinaryDocument(bytes, limits);
}

}  // namespace tarnel

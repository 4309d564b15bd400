#include <cbor.h>

#include <array>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/rfc3339.h"
#include "formats/document.h"
#include "formats/document_builder.h"

namespace tarnel {
namespace {

constexpr std::string_view kSelfDescribed = "\xD9\xD9\xF7";  // tag 55799
constexpr uint64_t kTextDateTag = 0;
constexpr uint64_t kNumberDateTag = 1;

// Reads item by item, so that nothing is set aside for what a document merely claims to hold.
class BinaryReader {
 public:
  BinaryReader(std::string_view bytes, const DocumentLimits& limits) : bytes_(bytes), builder_(limits) {}

  Result<Value> read() {
    if (bytes_.starts_with(kSelfDescribed)) offset_ = kSelfDescribed.size();
    while (!builder_.isComplete() && !builder_.failed()) {
      const auto result = cbor_stream_decode(reinterpret_cast<const unsigned char*>(bytes_.data()) + offset_,
                                             bytes_.size() - offset_, &callbacks(), this);
      if (result.status == CBOR_DECODER_NEDATA) {
        builder_.fail(kDocumentMalformed, "the document ends too early: an item is incomplete");
      } else if (result.status == CBOR_DECODER_ERROR) {
        builder_.fail(kDocumentMalformed, "an item that CBOR does not know");
      } else if (!builder_.failed()) {
        offset_ += result.read;
      }
    }
    if (!builder_.failed() && offset_ != bytes_.size()) {
      builder_.fail(kDocumentMalformed, "bytes after the document");
    }
    if (builder_.failed()) return builder_.error(offset_);
    return builder_.take();
  }

 private:
  // How an open array or dictionary ends: after that many more values, or by a break.
  struct Open {
    bool isArray;
    std::optional<size_t> remaining;
  };
  struct Chunks {
    bool isText;
    std::string bytes;
  };

  static const cbor_callbacks& callbacks() {
    static const cbor_callbacks table = makeCallbacks();
    return table;
  }
  static BinaryReader& self(void* context) { return *static_cast<BinaryReader*>(context); }
  static cbor_callbacks makeCallbacks() {
    cbor_callbacks table = cbor_empty_callbacks;
    table.uint8 = [](void* context, uint8_t n) { self(context).number(n); };
    table.uint16 = [](void* context, uint16_t n) { self(context).number(n); };
    table.uint32 = [](void* context, uint32_t n) { self(context).number(n); };
    table.uint64 = [](void* context, uint64_t n) { self(context).number(n); };
    table.negint8 = [](void* context, uint8_t n) { self(context).negative(n); };
    table.negint16 = [](void* context, uint16_t n) { self(context).negative(n); };
    table.negint32 = [](void* context, uint32_t n) { self(context).negative(n); };
    table.negint64 = [](void* context, uint64_t n) { self(context).negative(n); };
    table.float2 = [](void* context, float n) { self(context).number(static_cast<double>(n)); };
    table.float4 = [](void* context, float n) { self(context).number(static_cast<double>(n)); };
    table.float8 = [](void* context, double n) { self(context).number(n); };
    table.byte_string_start = [](void* context) { self(context).startChunks(false); };
    table.string_start = [](void* context) { self(context).startChunks(true); };
    table.byte_string = [](void* context, cbor_data bytes, size_t length) {
      self(context).bytes({reinterpret_cast<const char*>(bytes), length}, false);
    };
    table.string = [](void* context, cbor_data bytes, size_t length) {
      self(context).bytes({reinterpret_cast<const char*>(bytes), length}, true);
    };
    table.array_start = [](void* context, size_t count) { self(context).open(true, count); };
    table.indef_array_start = [](void* context) { self(context).open(true, std::nullopt); };
    table.map_start = [](void* context, size_t count) { self(context).open(false, count); };
    table.indef_map_start = [](void* context) { self(context).open(false, std::nullopt); };
    table.tag = [](void* context, uint64_t tag) { self(context).tag(tag); };
    table.null = [](void* context) { self(context).value(Value()); };
    table.undefined = [](void* context) { self(context).value(Value()); };
    table.boolean = [](void* context, bool flag) { self(context).value(flag); };
    table.indef_break = [](void* context) { self(context).breakItem(); };
    return table;
  }

  bool fail(std::string text) { return builder_.fail(kDocumentMalformed, std::move(text)); }

  // Whether any item but a chunk may stand here.
  bool mayStand(bool isText) {
    if (chunks_) return fail("a chunk that is not of the kind of its string");
    if (builder_.expectsKey() && (!isText || tag_)) return fail("a key that is not text");
    return true;
  }

  void value(Value value) {
    if (!mayStand(false)) return;
    if (tag_) {
      fail("a date tag on something that is no date");
    } else if (builder_.add(std::move(value))) {
      settle();
    }
  }

  void number(Value number) {
    if (tag_ != kNumberDateTag) return value(std::move(number));
    tag_.reset();
    value(Date{number.doubleValue()});
  }
  void negative(uint64_t n) {
    // The number is -1 - n.
    if (n <= static_cast<uint64_t>(INT64_MAX)) {
      number(-1 - static_cast<int64_t>(n));
    } else {
      number(-1.0 - static_cast<double>(n));
    }
  }

  void bytes(std::string_view bytes, bool isText) {
    if (chunks_ && chunks_->isText == isText) {
      chunks_->bytes += bytes;
    } else if (mayStand(isText)) {
      string(bytes, isText);
    }
  }
  void string(std::string_view bytes, bool isText) {
    if (!isText) return value(Data(bytes.begin(), bytes.end()));
    if (builder_.expectsKey()) {
      builder_.key(std::string(bytes));
    } else if (tag_ == kTextDateTag) {
      const auto date = parseRfc3339(bytes);
      if (!date) {
        fail("a date that is no RFC 3339 time");
        return;
      }
      tag_.reset();
      value(*date);
    } else {
      value(std::string(bytes));
    }
  }
  void startChunks(bool isText) {
    if (mayStand(isText)) chunks_ = Chunks{isText, {}};
  }

  void tag(uint64_t tag) {
    if (!mayStand(false)) return;
    if (tag_ || (tag != kTextDateTag && tag != kNumberDateTag)) {
      fail("tag " + std::to_string(tag) + ", which is not known here");
    } else {
      tag_ = tag;
    }
  }

  void open(bool isArray, std::optional<size_t> count) {
    if (!mayStand(false)) return;
    if (tag_) {
      fail("a date tag on something that is no date");
      return;
    }
    // Every value takes a byte at least, and so does every key.
    const size_t left = bytes_.size() - offset_;
    if (count && *count > (isArray ? left : left / 2)) {
      fail("the document claims to hold more than it has bytes for");
      return;
    }
    if (!(isArray ? builder_.openArray() : builder_.openDictionary())) return;
    open_.push_back({isArray, count});
    if (count == size_t{0}) end();
  }

  void breakItem() {
    if (chunks_) {
      const Chunks whole = std::move(*chunks_);
      chunks_.reset();
      string(whole.bytes, whole.isText);
      return;
    }
    const bool atEnd =
        !open_.empty() && !open_.back().remaining && (open_.back().isArray || builder_.expectsKey()) && !tag_;
    if (!atEnd) {
      fail("a break where nothing can end");
      return;
    }
    end();
  }

  void end() {
    open_.pop_back();
    if (builder_.close([](Value&) { return true; })) settle();
  }

  // A value has taken its place; whatever that makes complete is closed. No recursion deeper than nesting.
  void settle() {
    if (!open_.empty() && open_.back().remaining && --*open_.back().remaining == 0) end();
  }

  std::string_view bytes_;
  size_t offset_ = 0;
  detail::DocumentBuilder builder_;
  std::vector<Open> open_;
  std::optional<Chunks> chunks_;
  std::optional<uint64_t> tag_;
};

class BinaryWriter {
 public:
  std::string write(const Value& value) {
    put(value);
    if (static_cast<uint8_t>(out_.front()) < 0x80) out_.insert(0, kSelfDescribed);
    return std::move(out_);
  }

 private:
  template <class Encode, class... Argument>
  void item(Encode encode, Argument... argument) {
    std::array<unsigned char, 9> buffer{};
    const size_t length = encode(argument..., buffer.data(), buffer.size());
    out_.append(reinterpret_cast<const char*>(buffer.data()), length);
  }
  void text(std::string_view text) {
    item(cbor_encode_string_start, text.size());
    out_ += text;
  }
  void put(const Value& value) {
    switch (value.type()) {
      case Value::Type::null:
        return item(cbor_encode_null);
      case Value::Type::boolean:
        return item(cbor_encode_bool, *value.boolean());
      case Value::Type::integer: {
        const int64_t number = *value.integer();
        return number < 0 ? item(cbor_encode_negint, static_cast<uint64_t>(-1 - number))
                          : item(cbor_encode_uint, static_cast<uint64_t>(number));
      }
      case Value::Type::unsignedInteger:
        return item(cbor_encode_uint, *value.unsignedInteger());
      case Value::Type::real:
        return item(cbor_encode_double, *value.real());
      case Value::Type::date:
        item(cbor_encode_tag, kNumberDateTag);
        return item(cbor_encode_double, value.date()->seconds);
      case Value::Type::string:
        return text(*value.string());
      case Value::Type::data:
        item(cbor_encode_bytestring_start, value.data()->size());
        out_.append(value.data()->begin(), value.data()->end());
        return;
      case Value::Type::array:
        item(cbor_encode_array_start, value.array()->size());
        for (const auto& element : *value.array()) put(element);
        return;
      case Value::Type::dictionary:
        item(cbor_encode_map_start, value.dictionary()->size());
        for (const auto& [key, element] : *value.dictionary()) {
          text(key);
          put(element);
        }
        return;
    }
  }

  std::string out_;
};

}  // namespace

namespace detail {

Result<Value> parseBinaryDocument(std::string_view bytes, const DocumentLimits& limits) {
  return BinaryReader(bytes, limits).read();
}

}  // namespace detail

std::string writeBinaryDocument(const Value& value) {
  return BinaryWriter().write(value);
}

}  // namespace tarnel

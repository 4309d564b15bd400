#include "ipc/server/send_call.h"

#include <bit>
#include <cstring>
#include <utility>

#include "ipc/protocol/wire.h"

namespace tarnel {
namespace {

constexpr size_t kFixedHeader = 16;
// Deeper payloads are rare; the library counts exactly.
constexpr unsigned kMaxPlainDepth = 8;
// Entries that room is made for before the first is stored; see the library's reader.
constexpr size_t kReserveOutermost = 32;
constexpr size_t kReserveNested = 4;

// True when the text is one that every reader of the protocol takes: UTF-8 without NUL, and without the
// characters among which Unicode reserves some.
bool isPlainText(std::string_view text) {
  constexpr uint64_t kHighBits = 0x8080808080808080U;
  constexpr uint64_t kOnes = 0x0101010101010101U;
  size_t i = 0;
  for (; i + sizeof(uint64_t) <= text.size(); i += sizeof(uint64_t)) {
    uint64_t eight = 0;
    std::memcpy(&eight, text.data() + i, sizeof eight);
    // Without a high bit in any byte, the difference sets one exactly where a byte is zero.
    if (((eight | (eight - kOnes)) & kHighBits) != 0) break;
  }
  bool isAscii = true;
  for (; i < text.size(); ++i) {
    const auto byte = static_cast<uint8_t>(text[i]);
    if (byte == 0 || byte >= 0xEF) return false;
    if (byte >= 0x80) isAscii = false;
  }
  return isAscii || isValidUtf8(text);
}

// Walks the bytes of one message. Every function returns false when the bytes are not plainly right.
class Cursor {
 public:
  explicit Cursor(std::string_view bytes) : bytes_(bytes) {}

  size_t at() const { return at_; }
  bool atEnd() const { return at_ == bytes_.size(); }

  bool align(size_t alignment) {
    const size_t next = (at_ + alignment - 1) & ~(alignment - 1);
    if (next > bytes_.size()) return false;
    for (; at_ < next; ++at_) {
      if (bytes_[at_] != 0) return false;
    }
    return true;
  }
  template <class Number>
  bool number(Number& out) {
    if (!align(sizeof out) || bytes_.size() - at_ < sizeof out) return false;
    std::memcpy(&out, bytes_.data() + at_, sizeof out);
    at_ += sizeof out;
    return true;
  }
  bool byte(uint8_t& out) { return number(out); }
  // `size` bytes and the NUL after them.
  bool terminated(size_t size, std::string_view& out) {
    if (bytes_.size() - at_ <= size || bytes_[at_ + size] != 0) return false;
    out = bytes_.substr(at_, size);
    at_ += size + 1;
    return true;
  }
  bool text(std::string_view& out) {
    uint32_t size = 0;
    return number(size) && terminated(size, out) && isPlainText(out);
  }
  bool signature(std::string_view& out) {
    uint8_t size = 0;
    return byte(size) && terminated(size, out);
  }
  // The end of an array whose elements are aligned so.
  bool array(size_t elementAlignment, size_t& end) {
    uint32_t size = 0;
    if (!number(size) || !align(elementAlignment) || bytes_.size() - at_ < size) return false;
    end = at_ + size;
    return true;
  }
  bool data(Data& out) {
    size_t end = 0;
    if (!array(1, end)) return false;
    const auto* first = reinterpret_cast<const uint8_t*>(bytes_.data()) + at_;
    out.assign(first, first + (end - at_));
    at_ = end;
    return true;
  }

 private:
  std::string_view bytes_;
  size_t at_ = 0;
};

template <class Wire>
bool readNumber(Cursor& in, Value& out) {
  Wire held{};
  if (!in.number(held)) return false;
  out = Value(held);
  return true;
}

bool readDictionary(Cursor& in, Dictionary& out, unsigned depth);
bool readArray(Cursor& in, Array& out, unsigned depth);

bool readBasic(Cursor& in, char type, Value& out) {
  switch (type) {
    case 's': {
      std::string_view held;
      if (!in.text(held)) return false;
      out = Value(held);
      return true;
    }
    case 'x':
      return readNumber<int64_t>(in, out);
    case 'd':
      return readNumber<double>(in, out);
    case 'b': {
      uint32_t held = 0;
      if (!in.number(held) || held > 1) return false;
      out = Value(held == 1);
      return true;
    }
    case 't':
      return readNumber<uint64_t>(in, out);
    case 'i':
      return readNumber<int32_t>(in, out);
    case 'u':
      return readNumber<uint32_t>(in, out);
    case 'n':
      return readNumber<int16_t>(in, out);
    case 'q':
      return readNumber<uint16_t>(in, out);
    case 'y':
      return readNumber<uint8_t>(in, out);
    default:
      return false;
  }
}

template <class Held, class Read>
bool readHeld(Value& out, Read read) {
  Held held;
  if (!read(held)) return false;
  out = Value(std::move(held));
  return true;
}

bool readVariant(Cursor& in, Value& out, unsigned depth) {
  std::string_view signature;
  if (!in.signature(signature)) return false;
  if (signature.size() == 1) return readBasic(in, signature.front(), out);
  if (signature == "a{sv}") {
    return readHeld<Dictionary>(out, [&](Dictionary& held) { return readDictionary(in, held, depth + 1); });
  }
  if (signature == "av") {
    return readHeld<Array>(out, [&](Array& held) { return readArray(in, held, depth + 1); });
  }
  if (signature == "ay") return readHeld<Data>(out, [&](Data& held) { return in.data(held); });
  double seconds = 0;
  if (signature != "(d)" || !in.align(8) || !in.number(seconds)) return false;
  out = Value(Date{seconds});
  return true;
}

bool readDictionary(Cursor& in, Dictionary& out, unsigned depth) {
  size_t end = 0;
  if (depth > kMaxPlainDepth || !in.array(8, end)) return false;
  if (in.at() < end) out.reserve(depth == 1 ? kReserveOutermost : kReserveNested);
  while (in.at() < end) {
    std::string_view key;
    Value value;
    if (!in.align(8) || !in.text(key) || !readVariant(in, value, depth)) return false;
    out.set(key, std::move(value));
  }
  return in.at() == end;
}

bool readArray(Cursor& in, Array& out, unsigned depth) {
  size_t end = 0;
  if (depth > kMaxPlainDepth || !in.array(1, end)) return false;
  while (in.at() < end) {
    Value value;
    if (!readVariant(in, value, depth)) return false;
    out.append(std::move(value));
  }
  return in.at() == end;
}

bool readMaybeDictionary(Cursor& in, MaybeDictionary& out) {
  size_t end = 0;
  if (!in.array(4, end)) return false;
  if (in.at() < end && !readDictionary(in, out.emplace(), 1)) return false;
  return in.at() == end;
}

bool readBatchBody(Cursor& in, std::vector<BatchedMessage>& out) {
  size_t end = 0;
  if (!in.array(8, end)) return false;
  while (in.at() < end) {
    auto& next = out.emplace_back();
    if (!in.align(8) || !in.number(next.category) || !in.number(next.type) || !in.number(next.flag) ||
        !readMaybeDictionary(in, next.payload)) {
      return false;
    }
  }
  return in.at() == end;
}

struct Header {
  std::string_view path;
  std::string_view interface;
  std::string_view member;
  std::string_view signature;
};

// Each field once, and no other field: nobody but the library knows what those mean.
bool readField(Cursor& in, Header& out) {
  uint8_t code = 0;
  std::string_view type;
  if (!in.align(8) || !in.byte(code) || !in.signature(type)) return false;
  const auto take = [&](std::string_view& field, std::string_view expected) {
    if (!field.empty() || type != expected) return false;
    return expected == "g" ? in.signature(field) : in.text(field);
  };
  switch (code) {
    case 1:
      return take(out.path, "o");
    case 2:
      return take(out.interface, "s");
    case 3:
      return take(out.member, "s");
    case 8:
      return take(out.signature, "g");
    default:
      return false;
  }
}

bool readHeader(Cursor& in, SendCall& call, Header& header, uint32_t& bodySize) {
  uint8_t order = 0;
  uint8_t type = 0;
  uint8_t flags = 0;
  uint8_t version = 0;
  if (!in.byte(order) || !in.byte(type) || !in.byte(flags) || !in.byte(version)) return false;
  constexpr uint8_t kMethodCall = 1;
  constexpr uint8_t kNoReply = 1;
  if (order != 'l' || type != kMethodCall || (flags & ~kNoReply) != 0 || version != 1) return false;
  size_t fieldsEnd = 0;
  if (!in.number(bodySize) || !in.number(call.serial) || call.serial == 0 || !in.array(8, fieldsEnd))
    return false;
  while (in.at() < fieldsEnd) {
    if (!readField(in, header)) return false;
  }
  call.wantsReply = flags == 0;
  return in.at() == fieldsEnd && in.align(8) && header.path == wire::kSessionPath &&
         header.interface == wire::kSessionInterface;
}

bool readBody(Cursor& in, const Header& header, SendCall& call) {
  const auto isCallOf = [&header](const wire::Method& method) {
    return header.member == method.name && header.signature == method.arguments;
  };
  if (isCallOf(wire::kSendMessages)) {
    call.kind = SendCall::Kind::batch;
    return readBatchBody(in, call.messages);
  }
  if (isCallOf(wire::kSendMessageDictionary)) {
    call.kind = SendCall::Kind::dictionary;
    return readDictionary(in, call.dictionary, 1);
  }
  if (!isCallOf(wire::kSendMessage)) return false;
  auto& message = call.messages.emplace_back();
  return in.number(message.category) && in.number(message.type) && readMaybeDictionary(in, message.payload);
}

}  // namespace

const char* SendCall::member() const noexcept {
  switch (kind) {
    case Kind::message:
      return wire::kSendMessage.name;
    case Kind::dictionary:
      return wire::kSendMessageDictionary.name;
    case Kind::batch:
      break;
  }
  return wire::kSendMessages.name;
}

bool mayBeSendCall(std::string_view start) {
  return std::endian::native == std::endian::little && start.size() > kFixedHeader && start[0] == 'l' &&
         start.substr(0, kSendCallStart).find(wire::kSendMessage.name) != std::string_view::npos;
}

std::optional<SendCall> readSendCall(std::string_view message) {
  Cursor in(message);
  SendCall call;
  Header header;
  uint32_t bodySize = 0;
  if (!readHeader(in, call, header, bodySize) || message.size() - in.at() != bodySize) return std::nullopt;
  if (!readBody(in, header, call) || !in.atEnd()) return std::nullopt;
  return call;
}

}  // namespace tarnel

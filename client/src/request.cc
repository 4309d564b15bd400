#include "client/src/request.h"

#include <algorithm>
#include <string>
#include <string_view>

#include "base/utf8.h"
#include "ipc/dbus/wire_size.h"
#include "ipc/protocol/wire.h"

namespace tarnel::core {
namespace {

// Fixed header, field array and padding of a call with this protocol's names, rounded up.
constexpr size_t kFrameOverhead = 256;

// True for a text with a code point that Unicode reserves as no character, which D-Bus does not carry:
// U+FDD0 to U+FDEF and the last two of each plane. The text is valid UTF-8.
bool holdsNonCharacter(std::string_view text) {
  const auto byteAt = [text](size_t i) { return static_cast<unsigned char>(text[i]); };
  for (size_t i = 0; i < text.size(); ++i) {
    if (byteAt(i) == 0xEF) {
      const unsigned low = (byteAt(i + 1) & 0x3FU) << 6U | (byteAt(i + 2) & 0x3FU);
      if ((low >= 0xDD0 && low <= 0xDEF) || low >= 0xFFE) return true;
    } else if (byteAt(i) >= 0xF0) {
      const unsigned low =
          (byteAt(i + 1) & 0x0FU) << 12U | (byteAt(i + 2) & 0x3FU) << 6U | (byteAt(i + 3) & 0x3FU);
      if ((low & 0xFFFEU) == 0xFFFE) return true;
    }
  }
  return false;
}

// Adds up what the values take on the wire, alignment included. Every function returns false when a value
// cannot be sent; why is then in problem().
class Meter {
 public:
  bool maybe(const MaybeDictionary& held) {
    return arrayOfOne([&] { return !held || dictionary(*held, 1); });
  }
  bool maybe(const std::optional<Array>& held) {
    return arrayOfOne([&] { return !held || array(*held, 1); });
  }

  bool dictionary(const Dictionary& held, unsigned depth) {
    if (!admits(depth)) return false;
    openArray(8);
    for (const auto& [key, value] : held) {
      if (value.isNull()) continue;
      align(8);
      if (!text(key) || !variant(value, depth)) return at("key \"" + printable(key) + "\"");
    }
    return true;
  }

  bool array(const Array& held, unsigned depth) {
    if (!admits(depth)) return false;
    openArray(1);
    for (const auto& value : held) {
      if (value.isNull()) continue;
      if (!variant(value, depth)) return at("element " + std::to_string(&value - held.begin()));
    }
    return true;
  }

  void fixed(size_t alignment, size_t size) {
    align(alignment);
    bytes_ += size;
  }

  size_t bytes() const { return bytes_; }
  std::string problem() const { return path_.empty() ? reason_ : "at " + path_ + ": " + reason_; }

 private:
  template <class Element>
  bool arrayOfOne(Element element) {
    openArray(4);
    return element();
  }

  void align(size_t alignment) { bytes_ = (bytes_ + alignment - 1) / alignment * alignment; }
  void openArray(size_t elementAlignment) {
    fixed(4, 4);
    align(elementAlignment);
  }
  void signature(size_t length) { bytes_ += length + 2; }

  bool text(const std::string& held) {
    if (held.find('\0') != std::string::npos) return refuse("the text holds a NUL byte");
    if (!isValidUtf8(held)) return refuse("the text is not UTF-8");
    if (holdsNonCharacter(held)) return refuse("the text holds a code point that is no character");
    fixed(4, 4 + held.size() + 1);
    return true;
  }

  bool variant(const Value& value, unsigned depth) {
    switch (value.type()) {
      case Value::Type::null:
        return true;
      case Value::Type::boolean:
        signature(1);
        fixed(4, 4);
        return true;
      case Value::Type::integer:
      case Value::Type::unsignedInteger:
      case Value::Type::real:
        signature(1);
        fixed(8, 8);
        return true;
      case Value::Type::date:
        signature(3);
        fixed(8, 8);
        return true;
      case Value::Type::string:
        signature(1);
        return text(*value.string());
      case Value::Type::data:
        signature(2);
        openArray(1);
        bytes_ += value.data()->size();
        return true;
      case Value::Type::array:
        signature(2);
        return array(*value.array(), depth + 1);
      case Value::Type::dictionary:
        signature(5);
        return dictionary(*value.dictionary(), depth + 1);
    }
    return true;
  }

  bool admits(unsigned depth) {
    return depth <= wire::kMaxDepth ||
           refuse("dictionaries and arrays nest deeper than " + std::to_string(wire::kMaxDepth) + " levels");
  }
  bool refuse(std::string reason) {
    reason_ = std::move(reason);
    return false;
  }
  // On the way out of a failure, each level puts its place in front; the outermost ones are enough.
  bool at(std::string place) {
    if (!path_.empty()) place += ", " + path_;
    path_ = place.size() > 200 ? place.substr(0, 200) : std::move(place);
    return false;
  }
  static std::string printable(const std::string& key) {
    if (!isValidUtf8(key)) return "?";
    std::string start(wholeCharacters(key, 64));
    std::replace(start.begin(), start.end(), '\0', '?');
    return start;
  }

  size_t bytes_ = 0;
  std::string reason_;
  std::string path_;
};

bool measureArguments(const Request& request, Meter& meter) {
  using Kind = Request::Kind;
  switch (request.kind) {
    case Kind::setSessionInfo:
      if (!meter.maybe(request.sessionInfo) || !meter.maybe(request.userInfo) ||
          !meter.maybe(request.array)) {
        return false;
      }
      meter.fixed(4, 4);
      return true;
    case Kind::fetchStates:
      return meter.maybe(request.userInfo);
    case Kind::sendMessage:
      meter.fixed(8, 8);  // as an element of a batch
      return meter.maybe(request.dictionary);
    case Kind::sendDictionary:
      return meter.dictionary(*request.dictionary, 1);
    case Kind::uploadFile:
      meter.fixed(4, 4 + request.file->fileURL().size() + 1);
      meter.fixed(4, 4);
      return true;
    case Kind::uploadLogData:
      return meter.array(*request.array, 1);
    case Kind::sendSingleMessage:
      if (!meter.maybe(request.sessionInfo) || !meter.maybe(request.userInfo)) return false;
      meter.fixed(2, 4);
      return meter.maybe(request.dictionary);
    case Kind::startConfig:
    case Kind::fetchDisplayURL:
    case Kind::flush:
    case Kind::finish:
    case Kind::barrier:
      return true;
  }
  return true;
}

}  // namespace

Outcome measure(Request& request) {
  Meter meter;
  if (!measureArguments(request, meter)) {
    return failure(TARNEL_ERROR_INVALID_ARGUMENT, "this cannot be sent: " + meter.problem());
  }
  request.bytes = meter.bytes() + kFrameOverhead;
  const bool isKept =
      request.kind == Request::Kind::setSessionInfo || request.kind == Request::Kind::fetchStates;
  const size_t most = isKept ? wire::kMaxKeptBytes : wire::kMaxMessageBytes;
  if (request.bytes > most) {
    return failure(TARNEL_ERROR_TOO_LARGE, "the call takes " + std::to_string(request.bytes) +
                                               " bytes; the daemon takes at most " + std::to_string(most) +
                                               ": send less at once");
  }
  if (request.kind == Request::Kind::sendSingleMessage) {
    // Counted as the daemon does.
    const size_t kept = wire::approximateSize(request.sessionInfo) + wire::approximateSize(request.userInfo);
    if (kept > wire::kMaxKeptBytes) {
      return failure(TARNEL_ERROR_TOO_LARGE, "session info and user info take about " + std::to_string(kept) +
                                                 " bytes; the daemon takes at most " +
                                                 std::to_string(wire::kMaxKeptBytes) +
                                                 ": put what is large into the payload");
    }
  }
  return {};
}

}  // namespace tarnel::core

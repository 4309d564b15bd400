#include <systemd/sd-bus.h>

#include <concepts>
#include <string_view>
#include <utility>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/error_text.h"
#include "ipc/protocol/wire.h"

namespace tarnel::wire {
namespace {

// Entries that room is made for before the first one is stored: the number to come is not on the wire. A
// nested dictionary gets little, so that a message of small ones cannot make us hold many times its size.
constexpr size_t kReserveOutermost = 16;
constexpr size_t kReserveNested = 4;

constexpr char kNotUtf8[] = "the text is not UTF-8, holds a NUL byte or is cut off";
constexpr char kCutOff[] = "the value is cut off or not what its signature says";

// Walks one argument of a message. Every function returns false when it failed; why is then in failure().
//
// Signatures are handed down as NUL-terminated texts, as sd-bus wants them back on entering a container;
// asking the message for them would cost an allocation each time.
class Reader {
 public:
  explicit Reader(sd_bus_message* message) : message_(message) {}

  bool dictionary(Dictionary& out, unsigned depth) {
    if (!admits(depth) || !enter(SD_BUS_TYPE_ARRAY, "{sv}")) return false;
    while (true) {
      const int entered = sd_bus_message_enter_container(message_, SD_BUS_TYPE_DICT_ENTRY, "sv");
      if (entered == 0) return leave();
      if (entered < 0) return malformed(kCutOff);
      const char* key = nullptr;
      if (!text('s', key)) return inKey();
      if (out.empty()) out.reserve(depth == 1 ? kReserveOutermost : kReserveNested);
      Value value;
      if (!variant(value, depth) || !leave()) return under(key);
      out.set(key, std::move(value));
    }
  }

  bool array(Array& out, unsigned depth) { return typedArray("v", out, depth); }

  bool string(std::string& out) {
    const char* held = nullptr;
    if (!text('s', held)) return false;
    out = held;
    return true;
  }

  bool names(std::vector<std::string>& out) {
    if (!enter(SD_BUS_TYPE_ARRAY, "s")) return false;
    while (!atEnd()) {
      if (!string(out.emplace_back())) return under(out.size() - 1);
    }
    return leave();
  }

  bool error(MaybeError& out) {
    if (!enter(SD_BUS_TYPE_STRUCT, "sxs")) return false;
    std::string domain;
    std::string description;
    int64_t code = 0;
    if (!string(domain) || !basic('x', &code) || !string(description) || !leave()) return false;
    out.emplace(std::move(domain), code, std::move(description));
    return true;
  }

  bool sentObject(MaybeSentObject& out) {
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(message_, &type, &contents) <= 0 || type != 'v') return malformed(kCutOff);
    if (std::string_view(contents) == "s") {
      std::string held;
      if (!enter(SD_BUS_TYPE_VARIANT, "s") || !string(held) || !leave()) return false;
      out.emplace(std::move(held));
      return true;
    }
    if (std::string_view(contents) != "(sxs)") {
      return refuse(kErrorInvalidArguments,
                    "what was sent is a text (s) or an error (sxs), not " + std::string(contents));
    }
    MaybeError held;
    if (!enter(SD_BUS_TYPE_VARIANT, "(sxs)") || !error(held) || !leave()) return false;
    out.emplace(std::move(*held));
    return true;
  }

  // An array of at most one element, read by `element`.
  template <class T, class ReadElement>
  bool optional(const char* signature, std::optional<T>& out, ReadElement element) {
    if (!enter(SD_BUS_TYPE_ARRAY, signature)) return false;
    if (!atEnd()) {
      if (!element(out.emplace())) return false;
      if (!atEnd()) {
        return refuse(kErrorInvalidArguments, "an optional argument is an array of at most one element");
      }
    }
    return leave();
  }

  bool enter(char type, const char* contents) {
    return sd_bus_message_enter_container(message_, type, contents) > 0 || malformed(kCutOff);
  }
  bool leave() { return sd_bus_message_exit_container(message_) >= 0 || malformed(kCutOff); }
  // A failure to look counts as "more", so that the read that follows reports it.
  bool atEnd() { return sd_bus_message_at_end(message_, 0) > 0; }

  Error failure() const { return {name_, -1, path_.empty() ? reason_ : "at " + path_ + ": " + reason_}; }

 private:
  bool admits(unsigned depth) {
    return depth <= kMaxDepth || refuse(kErrorTooDeep, "dictionaries and arrays nest deeper than " +
                                                           std::to_string(kMaxDepth) + " levels");
  }

  bool variant(Value& out, unsigned depth) {
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(message_, &type, &contents) <= 0 || type != 'v') return malformed(kCutOff);
    // `contents` lies in the message's body and stays valid while its insides are read.
    return enter(SD_BUS_TYPE_VARIANT, contents) && value(contents, out, depth) && leave();
  }

  // A value of the one complete type `signature`, inside a container at `depth`.
  bool value(const char* signature, Value& out, unsigned depth) {
    switch (signature[0]) {
      case 's':
      case 'o':
      case 'g': {
        const char* held = nullptr;
        if (!text(signature[0], held)) return false;
        out = Value(held);
        return true;
      }
      case 'b':
        return number<int, bool>('b', out);
      case 'x':
        return number<int64_t>('x', out);
      case 't':
        return number<uint64_t>('t', out);
      case 'd':
        return number<double>('d', out);
      case 'y':
        return number<uint8_t>('y', out);
      case 'n':
        return number<int16_t>('n', out);
      case 'q':
        return number<uint16_t>('q', out);
      case 'i':
        return number<int32_t>('i', out);
      case 'u':
        return number<uint32_t>('u', out);
      case 'v':
        return admits(depth + 1) && variant(out, depth + 1);
      case 'a':
        return arrayLike(signature + 1, out, depth + 1);
      case '(':
        if (std::string_view(signature) == "(d)") return date(out);
        return refuse(kErrorInvalidArguments,
                      "a structure " + std::string(signature) + " is no value; only (d), a date, is");
      default:
        return refuse(kErrorInvalidArguments,
                      "type '" + std::string(signature) + "' is no value; descriptors travel by themselves");
    }
  }

  bool arrayLike(const char* element, Value& out, unsigned depth) {
    const std::string_view view(element);
    if (view == "y") return data(out);
    if (view == "{sv}") {
      Dictionary held;
      if (!dictionary(held, depth)) return false;
      out = Value(std::move(held));
      return true;
    }
    if (view.front() == '{') return typedDictionary(view, out, depth);
    Array held;
    if (!typedArray(element, held, depth)) return false;
    out = Value(std::move(held));
    return true;
  }

  bool typedArray(const char* element, Array& out, unsigned depth) {
    if (!admits(depth) || !enter(SD_BUS_TYPE_ARRAY, element)) return false;
    while (!atEnd()) {
      Value held;
      const bool isRead = element[0] == 'v' ? variant(held, depth) : value(element, held, depth);
      if (!isRead) return under(out.size());
      out.append(std::move(held));
    }
    return leave();
  }

  // `entry` is {sT} for any T but v.
  bool typedDictionary(std::string_view entry, Value& out, unsigned depth) {
    const std::string contents(entry.substr(1, entry.size() - 2));
    if (contents.front() != 's') {
      return refuse(kErrorInvalidArguments,
                    "the keys of a dictionary are texts (s), not '" + contents.substr(0, 1) + "'");
    }
    if (!admits(depth) || !enter(SD_BUS_TYPE_ARRAY, entry.data())) return false;
    Dictionary held;
    while (true) {
      const int entered = sd_bus_message_enter_container(message_, SD_BUS_TYPE_DICT_ENTRY, contents.c_str());
      if (entered == 0) break;
      if (entered < 0) return malformed(kCutOff);
      const char* key = nullptr;
      if (!text('s', key)) return inKey();
      Value inner;
      if (!value(contents.c_str() + 1, inner, depth) || !leave()) return under(key);
      held.set(key, std::move(inner));
    }
    out = Value(std::move(held));
    return leave();
  }

  bool date(Value& out) {
    double seconds = 0;
    if (!enter(SD_BUS_TYPE_STRUCT, "d") || !basic('d', &seconds)) return false;
    out = Value(Date{seconds});
    return leave();
  }

  bool data(Value& out) {
    const void* bytes = nullptr;
    size_t size = 0;
    if (sd_bus_message_read_array(message_, 'y', &bytes, &size) < 0) return malformed(kCutOff);
    const auto* first = static_cast<const uint8_t*>(bytes);
    out = size == 0 ? Value(Data()) : Value(Data(first, first + size));
    return true;
  }

  template <class Wire, class Held = Wire>
  bool number(char type, Value& out) {
    Wire held{};
    if (!basic(type, &held)) return false;
    if constexpr (std::same_as<Held, bool>) {
      out = Value(held != 0);
    } else {
      out = Value(static_cast<Held>(held));
    }
    return true;
  }

  bool basic(char type, void* into) {
    return sd_bus_message_read_basic(message_, type, into) > 0 || malformed(kCutOff);
  }
  bool text(char type, const char*& into) {
    return sd_bus_message_read_basic(message_, type, static_cast<void*>(&into)) > 0 || malformed(kNotUtf8);
  }

  bool refuse(const char* name, std::string reason) {
    name_ = name;
    reason_ = std::move(reason);
    return false;
  }
  bool malformed(const char* reason) { return refuse(kErrorInvalidArguments, reason); }
  bool inKey() {
    reason_ = "a key: " + reason_;
    return false;
  }

  // On the way out of a failure, each level puts its key or index in front.
  bool under(std::string_view key) {
    prependStep(path_, quotedKey(key));
    return false;
  }
  bool under(size_t index) {
    prependStep(path_, "element " + std::to_string(index));
    return false;
  }

  sd_bus_message* message_;
  const char* name_ = kErrorInvalidArguments;
  std::string reason_;
  std::string path_;
};

template <class T, class Read>
Result<T> readWith(sd_bus_message* message, Read read) {
  Reader reader(message);
  T out;
  if (!read(reader, out)) return reader.failure();
  return out;
}

}  // namespace

Result<Dictionary> readDictionary(sd_bus_message* message) {
  return readWith<Dictionary>(message, [](Reader& r, Dictionary& out) { return r.dictionary(out, 1); });
}

Result<MaybeDictionary> readMaybeDictionary(sd_bus_message* message) {
  return readWith<MaybeDictionary>(message, [](Reader& r, MaybeDictionary& out) {
    return r.optional("a{sv}", out, [&r](Dictionary& held) { return r.dictionary(held, 1); });
  });
}

Result<Array> readArray(sd_bus_message* message) {
  return readWith<Array>(message, [](Reader& r, Array& out) { return r.array(out, 1); });
}

Result<std::optional<Array>> readMaybeArray(sd_bus_message* message) {
  return readWith<std::optional<Array>>(message, [](Reader& r, std::optional<Array>& out) {
    return r.optional("av", out, [&r](Array& held) { return r.array(held, 1); });
  });
}

Result<MaybeString> readMaybeString(sd_bus_message* message) {
  return readWith<MaybeString>(message, [](Reader& r, MaybeString& out) {
    return r.optional("s", out, [&r](std::string& held) { return r.string(held); });
  });
}

Result<std::optional<std::vector<std::string>>> readMaybeNames(sd_bus_message* message) {
  using Names = std::vector<std::string>;
  return readWith<std::optional<Names>>(message, [](Reader& r, std::optional<Names>& out) {
    return r.optional("as", out, [&r](Names& held) { return r.names(held); });
  });
}

Result<MaybeSentObject> readMaybeSentObject(sd_bus_message* message) {
  return readWith<MaybeSentObject>(message, [](Reader& r, MaybeSentObject& out) {
    std::optional<MaybeSentObject> held;
    if (!r.optional("v", held, [&r](MaybeSentObject& inner) { return r.sentObject(inner); })) return false;
    if (held) out = std::move(*held);
    return true;
  });
}

Result<MaybeError> readMaybeError(sd_bus_message* message) {
  return readWith<MaybeError>(message, [](Reader& r, MaybeError& out) {
    std::optional<MaybeError> held;
    if (!r.optional("(sxs)", held, [&r](MaybeError& inner) { return r.error(inner); })) return false;
    if (held) out = std::move(*held);
    return true;
  });
}

}  // namespace tarnel::wire

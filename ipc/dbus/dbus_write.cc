#include <systemd/sd-bus.h>

#include <algorithm>
#include <cerrno>
#include <string_view>
#include <variant>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/error_text.h"
#include "ipc/protocol/wire.h"

namespace tarnel::wire {
namespace {

// Why the library refused a text.
const char* whyUnsendable(std::string_view text) {
  return isValidUtf8(text) ? "the text holds a code point that is no character" : "the text is not UTF-8";
}

// Appends one argument. Every function returns false when it failed; why is then in failure(), and the
// message is of no further use.
class Writer {
 public:
  explicit Writer(sd_bus_message* message) : message_(message) {}

  bool dictionary(const Dictionary& held, unsigned depth) {
    if (!admits(depth) || !open(SD_BUS_TYPE_ARRAY, "{sv}")) return false;
    for (const auto& [key, value] : held) {
      if (value.isNull()) continue;
      if (!open(SD_BUS_TYPE_DICT_ENTRY, "sv") || !string(key) || !variant(value, depth) || !close()) {
        prependStep(path_, quotedKey(key));
        return false;
      }
    }
    return close();
  }

  bool array(const Array& held, unsigned depth) {
    if (!admits(depth) || !open(SD_BUS_TYPE_ARRAY, "v")) return false;
    for (const auto& value : held) {
      if (value.isNull()) continue;
      if (!variant(value, depth)) {
        prependStep(path_, "element " + std::to_string(&value - held.begin()));
        return false;
      }
    }
    return close();
  }

  bool string(const std::string& text) {
    if (text.find('\0') != std::string::npos) {
      return refuse(kErrorInvalidArguments, "the text holds a NUL byte");
    }
    // The library checks what it appends: UTF-8, and no code point that Unicode never assigns.
    const int appended = sd_bus_message_append_basic(message_, 's', text.c_str());
    if (appended >= 0) return true;
    return appended == -EINVAL ? refuse(kErrorInvalidArguments, whyUnsendable(text)) : outOfRoom();
  }

  bool error(const Error& held) {
    const int64_t code = held.code();
    return open(SD_BUS_TYPE_STRUCT, "sxs") && string(held.domain()) && basic('x', &code) &&
           string(held.localizedDescription()) && close();
  }

  bool sentObject(const SentObject& held) {
    if (const auto* text = std::get_if<std::string>(&held)) {
      return open(SD_BUS_TYPE_VARIANT, "s") && string(*text) && close();
    }
    return open(SD_BUS_TYPE_VARIANT, "(sxs)") && error(std::get<Error>(held)) && close();
  }

  // An array of at most one element, written by `element`.
  template <class T, class WriteElement>
  bool optional(const char* signature, const std::optional<T>& held, WriteElement element) {
    return open(SD_BUS_TYPE_ARRAY, signature) && (!held || element(*held)) && close();
  }

  bool open(char type, const char* contents) {
    return sd_bus_message_open_container(message_, type, contents) >= 0 || outOfRoom();
  }
  bool close() { return sd_bus_message_close_container(message_) >= 0 || outOfRoom(); }

  Error failure() const { return {name_, -1, path_.empty() ? reason_ : "at " + path_ + ": " + reason_}; }

 private:
  bool admits(unsigned depth) {
    return depth <= kMaxDepth || refuse(kErrorTooDeep, "dictionaries and arrays nest deeper than " +
                                                           std::to_string(kMaxDepth) + " levels");
  }

  bool variant(const Value& value, unsigned depth) {
    switch (value.type()) {
      case Value::Type::boolean: {
        const int held = *value.boolean() ? 1 : 0;
        return wrapped("b", &held);
      }
      case Value::Type::integer:
        return wrapped("x", value.integer());
      case Value::Type::unsignedInteger:
        return wrapped("t", value.unsignedInteger());
      case Value::Type::real:
        return wrapped("d", value.real());
      case Value::Type::date:
        return open('v', "(d)") && open('r', "d") && basic('d', &value.date()->seconds) && close() && close();
      case Value::Type::string:
        return open('v', "s") && string(*value.string()) && close();
      case Value::Type::data:
        return open('v', "ay") && data(*value.data()) && close();
      case Value::Type::array:
        return open('v', "av") && array(*value.array(), depth + 1) && close();
      case Value::Type::dictionary:
        return open('v', "a{sv}") && dictionary(*value.dictionary(), depth + 1) && close();
      case Value::Type::null:
        break;  // left out by the caller
    }
    return true;
  }

  bool wrapped(const char* signature, const void* held) {
    return open('v', signature) && basic(signature[0], held) && close();
  }
  bool data(const Data& held) {
    return sd_bus_message_append_array(message_, 'y', held.data(), held.size()) >= 0 || outOfRoom();
  }
  bool basic(char type, const void* held) {
    return sd_bus_message_append_basic(message_, type, held) >= 0 || outOfRoom();
  }

  bool refuse(const char* name, std::string reason) {
    name_ = name;
    reason_ = std::move(reason);
    return false;
  }
  // What remains once texts and depth are checked: the message cannot grow.
  bool outOfRoom() { return refuse(kErrorTooLarge, "the message cannot hold the value"); }

  sd_bus_message* message_;
  const char* name_ = kErrorInvalidArguments;
  std::string reason_;
  std::string path_;
};

template <class Write>
MaybeError appendWith(sd_bus_message* message, Write write) {
  Writer writer(message);
  if (write(writer)) return std::nullopt;
  return writer.failure();
}

}  // namespace

MaybeError appendDictionary(sd_bus_message* message, const Dictionary& dictionary) {
  return appendWith(message, [&dictionary](Writer& w) { return w.dictionary(dictionary, 1); });
}

MaybeError appendMaybeDictionary(sd_bus_message* message, const MaybeDictionary& dictionary) {
  return appendWith(message, [&dictionary](Writer& w) {
    return w.optional("a{sv}", dictionary, [&w](const Dictionary& held) { return w.dictionary(held, 1); });
  });
}

MaybeError appendArray(sd_bus_message* message, const Array& array) {
  return appendWith(message, [&array](Writer& w) { return w.array(array, 1); });
}

MaybeError appendMaybeArray(sd_bus_message* message, const std::optional<Array>& array) {
  return appendWith(message, [&array](Writer& w) {
    return w.optional("av", array, [&w](const Array& held) { return w.array(held, 1); });
  });
}

MaybeError appendMaybeString(sd_bus_message* message, const MaybeString& text) {
  return appendWith(message, [&text](Writer& w) {
    return w.optional("s", text, [&w](const std::string& held) { return w.string(held); });
  });
}

MaybeError appendMaybeNames(sd_bus_message* message, const std::optional<std::vector<std::string>>& names) {
  return appendWith(message, [&names](Writer& w) {
    return w.optional("as", names, [&w](const std::vector<std::string>& held) {
      return w.open(SD_BUS_TYPE_ARRAY, "s") &&
             std::all_of(held.begin(), held.end(), [&w](const auto& name) { return w.string(name); }) &&
             w.close();
    });
  });
}

MaybeError appendMaybeSentObject(sd_bus_message* message, const MaybeSentObject& object) {
  return appendWith(message, [&object](Writer& w) {
    return w.optional("v", object, [&w](const SentObject& held) { return w.sentObject(held); });
  });
}

MaybeError appendMaybeError(sd_bus_message* message, const MaybeError& error) {
  return appendWith(message, [&error](Writer& w) {
    return w.optional("(sxs)", error, [&w](const Error& held) { return w.error(held); });
  });
}

}  // namespace tarnel::wire

#include "formats/json_writer.h"

#include <cmath>

#include "formats/json_emitter.h"

namespace tarnel {
namespace {

// A buffer that one large message made big is given back; up to this size it is kept.
constexpr size_t kKeptCapacity = 1U << 20U;

struct StrictLeaves {
  template <class Writer>
  bool text(Writer& writer, const std::string& text) {
    return detail::fits(text) && isValidUtf8(text) && writer.String(text.data(), detail::sizeOf(text));
  }
  template <class Writer>
  bool key(Writer& writer, const std::string& text) {
    return detail::fits(text) && isValidUtf8(text) && writer.Key(text.data(), detail::sizeOf(text));
  }
  template <class Writer>
  bool real(Writer& writer, double number) {
    return std::isfinite(number) && detail::emitReal(writer, number);
  }
  template <class Writer>
  bool date(Writer& writer, Date date) {
    return real(writer, date.seconds);
  }
  template <class Writer>
  bool data(Writer&, const Data&) {
    return false;
  }
};

template <class Writer, class Root>
bool emitTo(Writer& writer, const Root& root) {
  StrictLeaves leaves;
  return detail::JsonEmitter<Writer, StrictLeaves>(writer, leaves).emit(root);
}

template <class Root>
bool write(const Root& root, JsonStyle style, std::string& out) {
  // Both keep their memory from one message to the next.
  thread_local rapidjson::StringBuffer buffer;
  thread_local rapidjson::Writer<rapidjson::StringBuffer> compact(buffer);
  buffer.Clear();
  bool written = false;
  if (style == JsonStyle::compact) {
    compact.Reset(buffer);
    written = emitTo(compact, root);
  } else {
    rapidjson::PrettyWriter<rapidjson::StringBuffer> pretty(buffer);
    pretty.SetIndent(' ', 2);
    written = emitTo(pretty, root);
  }
  if (written) out.append(buffer.GetString(), buffer.GetSize());
  if (buffer.GetSize() > kKeptCapacity) {
    buffer.Clear();
    buffer.ShrinkToFit();
  }
  return written;
}

}  // namespace

bool writeJson(const Value& value, JsonStyle style, std::string& out) {
  return write(value, style, out);
}

bool writeJson(const Dictionary& value, JsonStyle style, std::string& out) {
  return write(value, style, out);
}

}  // namespace tarnel

#include "tools/tarnelctl/client_values.h"

#include <ostream>

namespace tarnel::ctl {
namespace {

// Calls `put` with the client library's form of the value; a null has none.
template <class Put>
void visit(const Value& value, Put put) {
  switch (value.type()) {
    case Value::Type::null:
      return;
    case Value::Type::boolean:
      return put(*value.boolean());
    case Value::Type::integer:
      return put(*value.integer());
    case Value::Type::unsignedInteger:
      return put(*value.unsignedInteger());
    case Value::Type::real:
      return put(*value.real());
    case Value::Type::date:
      return put(client::Date{value.date()->seconds});
    case Value::Type::string:
      return put(*value.string());
    case Value::Type::data:
      return put(*value.data());
    case Value::Type::array:
      return put(toClient(*value.array()));
    case Value::Type::dictionary:
      return put(toClient(*value.dictionary()));
  }
}

}  // namespace

client::Dictionary toClient(const Dictionary& dictionary) {
  client::Dictionary result;
  for (const auto& [name, value] : dictionary) {
    visit(value, [&result, &key = name](const auto& held) { result.set(key, held); });
  }
  return result;
}

client::Array toClient(const Array& array) {
  client::Array result;
  for (const auto& value : array) {
    visit(value, [&result](const auto& held) { result.append(held); });
  }
  return result;
}

ExitStatus reportFailure(const client::Status& status, const Terminal& terminal) {
  terminal.err << "tarnelctl: " << status.message << '\n';
  const bool unreachable = status.code == TARNEL_ERROR_NO_DAEMON || status.code == TARNEL_ERROR_REFUSED;
  return unreachable ? ExitStatus::unreachable : ExitStatus::failed;
}

}  // namespace tarnel::ctl

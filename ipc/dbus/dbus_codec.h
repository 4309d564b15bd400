#pragma once

#include <optional>
#include <string>
#include <vector>

#include "base/error.h"
#include "base/value.h"

struct sd_bus_message;

// Values to and from D-Bus message bodies; see wire.h for the conventions.
//
// Threads: a message belongs to the thread that owns its bus.

namespace tarnel::wire {

// Each reads the next argument. The error's domain is one of wire.h's error names and its description says
// which argument or key is wrong and why (type, depth, text that is not UTF-8).
Result<Dictionary> readDictionary(sd_bus_message* message);                               // a{sv}
Result<MaybeDictionary> readMaybeDictionary(sd_bus_message* message);                     // aa{sv}
Result<Array> readArray(sd_bus_message* message);                                         // av
Result<std::optional<Array>> readMaybeArray(sd_bus_message* message);                     // aav
Result<MaybeString> readMaybeString(sd_bus_message* message);                             // as, at most one
Result<std::optional<std::vector<std::string>>> readMaybeNames(sd_bus_message* message);  // aas
Result<MaybeSentObject> readMaybeSentObject(sd_bus_message* message);                     // av, at most one
Result<MaybeError> readMaybeError(sd_bus_message* message);  // a(sxs), at most one

// Each appends one argument; an error when the value cannot be sent: not UTF-8, a NUL in a text, deeper
// than kMaxDepth. A null value inside a dictionary or array is left out.
MaybeError appendDictionary(sd_bus_message* message, const Dictionary& dictionary);
MaybeError appendMaybeDictionary(sd_bus_message* message, const MaybeDictionary& dictionary);
MaybeError appendArray(sd_bus_message* message, const Array& array);
MaybeError appendMaybeArray(sd_bus_message* message, const std::optional<Array>& array);
MaybeError appendMaybeString(sd_bus_message* message, const MaybeString& text);
MaybeError appendMaybeNames(sd_bus_message* message, const std::optional<std::vector<std::string>>& names);
MaybeError appendMaybeSentObject(sd_bus_message* message, const MaybeSentObject& object);
MaybeError appendMaybeError(sd_bus_message* message, const MaybeError& error);

}  // namespace tarnel::wire

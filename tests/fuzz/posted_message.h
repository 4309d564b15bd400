#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"
#include "platform/http_client.h"

// Reads what was posted, by means of its own: what the code under test writes is not to be judged by the
// code under test.

namespace tarnel::fuzz {

// Strictly RFC 8259; nothing for anything else. Whole numbers that fit are integers.
std::optional<Value> readJson(std::string_view text);

// The value of a header; absent when there is none.
std::optional<std::string> headerValue(const HttpRequest& request, std::string_view name);

// The message of a post of the HTTPS backend: requires that it is one JSON object, that its headers are fit
// to be sent, and that each event is flat. Nothing for a post of another backend, which has another form.
std::optional<Dictionary> readPostedMessage(const HttpRequest& request);

// The events of such a message.
Array eventsOf(const Dictionary& message);

// The uncompressed body; requires that it can be uncompressed.
std::string bodyOf(const HttpRequest& request);

}  // namespace tarnel::fuzz

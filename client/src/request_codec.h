#pragma once

#include <memory>
#include <span>
#include <vector>

#include "client/src/request.h"

struct sd_bus;
struct sd_bus_message;

namespace tarnel::core {

struct BusMessageDeleter {
  void operator()(sd_bus_message* message) const noexcept;
};
using BusMessage = std::unique_ptr<sd_bus_message, BusMessageDeleter>;

// The call that carries the requests: several messages, or any one request. Null and an outcome that is not
// ok when it cannot be made.
Outcome makeCall(sd_bus* bus, std::span<const Request> requests, BusMessage& call);

// One answer for each request, in order, from the reply to their call: an answer or an error.
std::vector<Answer> readAnswers(sd_bus_message* reply, std::span<const Request> requests);

}  // namespace tarnel::core

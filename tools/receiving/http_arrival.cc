#include "tools/receiving/http_arrival.h"

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxHeaderText = 1024;

}  // namespace

void describeRequest(const HttpRequest& request, double now, HttpArrival& arrival) {
  arrival.arrived = now;
  arrival.path = printable(request.path);
  arrival.sender = request.sender;
  for (const auto& [name, value] : request.headers) {
    arrival.headers.emplace_back(printable(name, kMaxHeaderText), printable(value, kMaxHeaderText));
  }
  arrival.wireBytes = request.body.size();
  arrival.plainBytes = request.body.size();
}

}  // namespace tarnel::lab

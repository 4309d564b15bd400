#include "tools/lab/receivers/post_receiver.h"

#include "formats/document.h"
#include "tools/receiving/event_check.h"
#include "tools/receiving/gunzip.h"
#include "tools/receiving/http_arrival.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

struct Refusal {
  int status;
  std::string reason;
};

// Unpacks and parses; the refusal when there is nothing to check.
std::optional<Refusal> readBody(const HttpRequest& request, Arrival& arrival, Value& document) {
  if (request.bodyState == BodyState::tooLarge)
    return Refusal{413, "body: larger than " + byteCount(PostReceiver::kMaxPlainBytes)};
  if (request.bodyState == BodyState::cutOff) return Refusal{400, "body: the connection ended within it"};
  std::string_view plain = request.body;
  Result<std::string> unpacked = std::string();
  if (const std::string* encoding = findHeader(request.headers, "Content-Encoding")) {
    if (*encoding == "gzip") {
      arrival.gzip = true;
      arrival.plainBytes = 0;
      unpacked = gunzip(request.body, PostReceiver::kMaxPlainBytes);
      if (!unpacked) return Refusal{400, "body: " + unpacked.error().localizedDescription()};
      plain = *unpacked;
    } else if (*encoding != "identity") {
      return Refusal{415, "header Content-Encoding: must be gzip or missing, but is \"" +
                              printable(*encoding, 80) + "\""};
    }
  }
  arrival.plainBytes = plain.size();
  Result<Value> parsed = parseDocument(plain);
  if (!parsed) return Refusal{400, "body: no JSON: " + printable(parsed.error().localizedDescription())};
  document = *std::move(parsed);
  return std::nullopt;
}

}  // namespace

HttpAnswer PostReceiver::receive(const HttpRequest& request) {
  Arrival arrival;
  describeRequest(request, secondsFromTimeValue(clock_.timeOfDay()), arrival);
  Problems problems;
  Value document;
  HttpAnswer answer;
  if (const auto refusal = readBody(request, arrival, document)) {
    answer.status = refusal->status;
    problems.add(refusal->reason);
  } else {
    const PostMessage message = readMessage(document, problems);
    for (size_t i = 0; i < message.events.size(); ++i) checkEvent(message.events[i], i + 1, problems);
    checkHeaders(request.headers, message,
                 {.wireBytes = request.body.size(), .plainBytes = arrival.plainBytes, .gzip = arrival.gzip},
                 problems);
    arrival.clientId = message.clientId;
    arrival.postTime = message.postTime;
    arrival.events = message.events;
    if (document.dictionary() == nullptr) answer.status = 400;
  }
  arrival.problems = problems.take();
  answer.body = writeTextDocument(
                    Dictionary{{"received", arrival.events.size()}, {"problems", listOf(arrival.problems)}}) +
                "\n";
  arrival.answered = std::to_string(answer.status);
  if (const auto misbehaviour = misbehaviours_.take(RequestKind::post)) {
    misbehaviour->applyTo(answer);
    arrival.answered = misbehaviour->description();
  }
  store_.add(std::move(arrival));
  return answer;
}

}  // namespace tarnel::lab

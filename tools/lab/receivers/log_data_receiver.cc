#include "tools/lab/receivers/log_data_receiver.h"

#include "formats/archive.h"
#include "formats/document.h"
#include "tools/receiving/http_arrival.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr char kName[] = "records.archive";

void checkRecords(const Value& root, LogDataArrival& arrival, Problems& problems) {
  const Array* records = root.array();
  if (records == nullptr) {
    problems.add("archive: its root must be a list of records");
    return;
  }
  arrival.records = *records;
  for (size_t i = 0; i < records->size(); ++i) {
    if ((*records)[i].dictionary() == nullptr) {
      problems.add("record " + std::to_string(i + 1) + ": must be a dictionary");
    }
  }
}

// What a refusal is; nothing when the body may be read.
int statusOf(const HttpRequest& request, Problems& problems) {
  if (request.bodyState == BodyState::tooLarge) {
    problems.add("body: larger than " + byteCount(LogDataReceiver::kMaxArchiveBytes));
    return 413;
  }
  if (request.bodyState == BodyState::cutOff) {
    problems.add("body: the connection ended within it");
    return 400;
  }
  const std::string* encoding = findHeader(request.headers, "Content-Encoding");
  if (encoding != nullptr && *encoding != "identity") {
    problems.add("header Content-Encoding: must be missing, but is \"" + printable(*encoding, 80) + "\"");
    return 415;
  }
  return 200;
}

}  // namespace

void LogDataReceiver::read(const HttpRequest& request, LogDataArrival& arrival, Problems& problems,
                           HttpAnswer& answer) {
  answer.status = statusOf(request, problems);
  Result<Value> root = Value();
  if (answer.status == 200) {
    root = unarchiveObject(request.body, {.bytes = kMaxArchiveBytes});
    if (root) {
      checkRecords(*root, arrival, problems);
    } else {
      answer.status = 400;
      problems.add("archive: " + printable(root.error().localizedDescription()));
    }
  }
  const bool readable = answer.status == 200;
  if (MaybeError error = keep(request, readable ? &*root : nullptr, arrival)) {
    answer.status = 500;
    problems.add(error->localizedDescription());
  }
}

MaybeError LogDataReceiver::keep(const HttpRequest& request, const Value* records, LogDataArrival& arrival) {
  const std::string text = records == nullptr ? "" : writeTextDocument(*records, true) + "\n";
  arrival.plainBytes = text.size();
  Result<IncomingFile> file = files_.create(arrival.arrived, kName);
  if (!file) return file.error();
  if (MaybeError error = file->write(request.body)) return error;
  if (MaybeError error = files_.keep(*file, text)) return error;
  arrival.archiveFile = file->path();
  if (records == nullptr) return std::nullopt;
  arrival.recordsFile = descriptionOf(file->path());
  arrival.location = locations_ + "/" + file->name();
  return std::nullopt;
}

HttpAnswer LogDataReceiver::receive(const HttpRequest& request) {
  LogDataArrival arrival;
  describeRequest(request, secondsFromTimeValue(clock_.timeOfDay()), arrival);
  Problems problems;
  HttpAnswer answer;
  {
    // A small archive may hold very much, and this many connections are read at once.
    const std::lock_guard lock(mutex_);
    read(request, arrival, problems, answer);
  }
  arrival.problems = problems.take();
  answer.contentType = "text/plain; charset=utf-8";
  answer.body = arrival.location;
  if (arrival.location.empty()) {
    for (const std::string& problem : arrival.problems) answer.body += problem + "\n";
  }
  arrival.answered = std::to_string(answer.status);
  if (const auto misbehaviour = misbehaviours_.take(RequestKind::logData)) {
    misbehaviour->applyTo(answer);
    arrival.answered = misbehaviour->description();
  }
  store_.addLogData(std::move(arrival));
  return answer;
}

}  // namespace tarnel::lab

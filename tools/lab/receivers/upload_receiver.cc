#include "tools/lab/receivers/upload_receiver.h"

#include "formats/document.h"
#include "tools/receiving/gunzip.h"
#include "tools/receiving/http_arrival.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

// The service has the client's file deleted when this stands anywhere in the answer, whatever its status.
constexpr char kTakenWord[] = "success";
constexpr std::string_view kPacked = ".gz";

MaybeString shown(const MaybeString& value) {
  constexpr size_t kMaxBytes = 1024;
  return value ? MaybeString(printable(*value, kMaxBytes)) : std::nullopt;
}

// Folder, file and whatever else stands in a reason may hold the word as well.
std::string refusalBody(const std::vector<std::string>& problems) {
  std::string body =
      writeTextDocument(Dictionary{{"result", "refused"}, {"problems", listOf(problems)}}) + "\n";
  if (body.find(kTakenWord) != std::string::npos) body = "{\"result\":\"refused\"}\n";
  return body;
}

std::string plainName(const UploadQuery& query) {
  std::string name = query.filename.value_or("");
  if (name.ends_with(kPacked)) name.resize(name.size() - kPacked.size());
  return name;
}

}  // namespace

std::optional<UploadReceiver::Refusal> UploadReceiver::take(const HttpRequest& request,
                                                            UploadArrival& arrival, Problems& problems) {
  const UploadQuery query = readUploadQuery(request.rawQuery);
  checkUploadQuery(query, problems);
  arrival.query = {.uuid = shown(query.uuid),
                   .sequence = shown(query.sequence),
                   .description = shown(query.description),
                   .filename = shown(query.filename),
                   .raw = shown(query.raw)};
  arrival.plainBytes = 0;
  if (request.bodyState == BodyState::tooLarge) {
    return Refusal{413, "body: larger than " + byteCount(maxFileBytes_)};
  }
  if (request.bodyState == BodyState::cutOff) return Refusal{400, "body: the connection ended within it"};
  const std::string* encoding = findHeader(request.headers, "Content-Encoding");
  if (encoding == nullptr || *encoding != "gzip") {
    return Refusal{415, "header Content-Encoding: must be gzip, but is " +
                            (encoding == nullptr ? "missing" : "\"" + printable(*encoding, 80) + "\"")};
  }
  arrival.gzip = true;
  const std::lock_guard lock(mutex_);
  Result<IncomingFile> file = files_.create(arrival.arrived, plainName(query));
  if (!file) return Refusal{500, file.error().localizedDescription()};
  MaybeError failure;
  const MaybeError error =
      gunzipTo(request.body, maxFileBytes_, [&file, &failure](std::string_view piece) -> MaybeError {
        failure = file->write(piece);
        return failure;
      });
  if (failure) return Refusal{500, failure->localizedDescription()};
  if (error) return Refusal{400, "body: " + error->localizedDescription()};
  arrival.plainBytes = file->size();
  if (file->size() == 0) problems.add("body: an empty file, which the service does not send");
  if (MaybeError unkept = keep(*file, arrival, problems)) return Refusal{500, unkept->localizedDescription()};
  return std::nullopt;
}

MaybeError UploadReceiver::keep(IncomingFile& file, UploadArrival& arrival, Problems& problems) {
  arrival.file = file.path();
  arrival.problems = problems.take();
  Dictionary description = recordOfUpload(arrival);
  // Number and answer are settled later.
  description.remove("upload");
  description.remove("answered");
  MaybeError error = files_.keep(file, writeTextDocument(description, true) + "\n");
  if (error) arrival.file.clear();
  return error;
}

HttpAnswer UploadReceiver::receive(const HttpRequest& request) {
  UploadArrival arrival;
  describeRequest(request, secondsFromTimeValue(clock_.timeOfDay()), arrival);
  Problems problems;
  HttpAnswer answer;
  if (const auto refusal = take(request, arrival, problems)) {
    answer.status = refusal->status;
    problems.add(refusal->reason);
    for (std::string& problem : problems.take()) arrival.problems.push_back(std::move(problem));
    answer.body = refusalBody(arrival.problems);
  } else {
    const std::string name = arrival.file.substr(arrival.file.rfind('/') + 1);
    answer.body = writeTextDocument(Dictionary{{"result", kTakenWord},
                                               {"file", name},
                                               {"bytes", arrival.plainBytes},
                                               {"problems", listOf(arrival.problems)}}) +
                  "\n";
  }
  arrival.answered = std::to_string(answer.status);
  if (const auto misbehaviour = misbehaviours_.take(RequestKind::upload)) {
    if (misbehaviour->refuse) answer.body = refusalBody({"on purpose"});
    misbehaviour->applyTo(answer);
    arrival.answered = misbehaviour->description();
  }
  store_.addUpload(std::move(arrival));
  return answer;
}

}  // namespace tarnel::lab

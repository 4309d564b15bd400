#include "tools/lab/service.h"

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr std::array<std::string_view, 3> kFolders = {"/storebags/alder/", "/bags/alder/", "/storebags/"};

}  // namespace

std::string storebagNameInPath(const std::string& path) {
  for (const std::string_view folder : kFolders) {
    if (!path.starts_with(folder)) continue;
    const std::string name = path.substr(folder.size());
    if (!name.empty() && name.find('/') == std::string::npos) return name;
  }
  return "";
}

HttpAnswer plainAnswer(int status, const std::string& text) {
  HttpAnswer answer;
  answer.status = status;
  answer.contentType = "text/plain; charset=utf-8";
  answer.body = text + "\n";
  return answer;
}

PostKind kindOfPost(const HttpRequest& request) {
  const std::string* type = findHeader(request.headers, "Content-Type");
  if (type == nullptr || !type->starts_with("application/octet-stream")) return PostKind::events;
  const bool packed = findHeader(request.headers, "Content-Encoding") != nullptr;
  return packed || findParameter(request.query, "filename") != nullptr ? PostKind::file : PostKind::logData;
}

size_t Service::maxBodyBytes(const HttpRequest& request) const {
  switch (kindOfPost(request)) {
    case PostKind::events:
      return PostReceiver::kMaxPlainBytes;
    case PostKind::file:
      return parts_.uploads.maxFileBytes();
    case PostKind::logData:
      return LogDataReceiver::kMaxArchiveBytes;
  }
  return 0;
}

HttpAnswer Service::answer(const HttpRequest& request) {
  if (request.method == "POST") {
    switch (kindOfPost(request)) {
      case PostKind::events:
        return parts_.posts.receive(request);
      case PostKind::file:
        return parts_.uploads.receive(request);
      case PostKind::logData:
        return parts_.logData.receive(request);
    }
  }
  const std::string name = storebagNameInPath(request.path);
  if (!name.empty()) return answerStorebag(request, name);
  if (request.path == "/") {
    return plainAnswer(
        200, "tarnel-lab: storebags at /storebags/NAME; events, files and log data are posted to any path");
  }
  return plainAnswer(404, "nothing here; storebags are at /storebags/NAME, posts go to any path");
}

HttpAnswer Service::answerStorebag(const HttpRequest& request, const std::string& name) {
  ServedStorebag served;
  served.time = secondsFromTimeValue(parts_.clock.timeOfDay());
  served.sender = request.sender;
  served.name = name;
  const std::optional<Misbehaviour> misbehaviour = parts_.misbehaviours.take(RequestKind::storebag);
  HttpAnswer answer = goodAnswer(request, name, misbehaviour ? &*misbehaviour : nullptr, served);
  if (misbehaviour) {
    misbehaviour->applyTo(answer);
    served.remark = "on purpose: " + misbehaviour->description();
  }
  served.status = answer.status;
  served.bytes = answer.body.size();
  ++storebagsServed_;
  parts_.notices.storebagServed(served);
  return answer;
}

HttpAnswer Service::goodAnswer(const HttpRequest& request, const std::string& name,
                               const Misbehaviour* misbehaviour, ServedStorebag& served) {
  const StorebagSource::Lookup lookup = parts_.storebags.find(name);
  if (!lookup.storebag) {
    if (lookup.fresh) parts_.notices.warning(lookup.error);
    served.remark = lookup.missing ? "no such file" : "cannot be served";
    return plainAnswer(lookup.missing ? 404 : 500, lookup.error);
  }
  const PreparedStorebag& storebag = *lookup.storebag;
  if (lookup.fresh) tellFindings(name, storebag);
  served.version = storebag.version;
  HttpAnswer answer;
  answer.headers = {{"Last-Modified", httpDate(storebag.lastModified)},
                    {"Cache-Control", "max-age=" + std::to_string(maxAge_)}};
  if (misbehaviour != nullptr && misbehaviour->breakSignature) {
    answer.body = storebag.brokenOuter;
  } else if (misbehaviour == nullptr &&
             isNotModified(findHeader(request.headers, "If-Modified-Since"), storebag.lastModified)) {
    answer.status = 304;
  } else {
    answer.body = storebag.outer;
  }
  return answer;
}

void Service::tellFindings(const std::string& name, const PreparedStorebag& storebag) {
  constexpr size_t kTold = 10;
  for (size_t i = 0; i < std::min(kTold, storebag.findings.size()); ++i) {
    parts_.notices.warning("storebags/" + name +
                           ".json: " + printable(storebag.findings[i].description(), 400));
  }
  if (storebag.findings.size() > kTold) {
    parts_.notices.warning("storebags/" + name + ".json: and " +
                           std::to_string(storebag.findings.size() - kTold) + " more findings");
  }
}

void Service::connectionFailed(const std::string& sender, const std::string& text) {
  parts_.notices.warning(sender + ": " + text);
}

}  // namespace tarnel::lab

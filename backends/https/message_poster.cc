#include "backends/https/message_poster.h"

#include <utility>

#include "base/text_format.h"
#include "formats/compression.h"
#include "tarnel/keys.h"

namespace tarnel {

void MessagePoster::post(std::string message, FlushCompletion completion) const {
  if (!url) {
    completion(std::nullopt, Error(kTarnelErrorDomain, -1, "postURL is nil"));
    return;
  }
  auto compressed = gzipDeflate(log, message);
  const bool useCompressed = compressed && !compressed->empty() && compressed->size() < message.size();
  HttpRequest request;
  request.method = "POST";
  request.url = *url;
  request.body = std::make_shared<const std::string>(std::move(useCompressed ? *compressed : message));
  request.headers = headers;
  request.headers.push_back({"Accept", "application/json"});
  request.headers.push_back({"Content-Type", "application/json"});
  request.headers.push_back({"Content-Length", std::to_string(request.body->size())});
  if (useCompressed) request.headers.push_back({"Content-Encoding", "gzip"});
  request.wantsBody = false;
  http.startDataTask(std::move(request), answerHandler(std::move(completion)));
}

bool MessagePoster::isBackendDisabled() const {
  const auto alive = backend.lock();
  return alive != nullptr && alive->state() == ReportingState::disabled;
}

HttpClient::Completion MessagePoster::answerHandler(FlushCompletion completion) const {
  return [backend = backend, &log = log, name = name,
          completion = std::move(completion)](HttpResult result) mutable {
    if (result.error) {
      TARNEL_LOG(log, error, "HTTPSPostBackend(postJsonMessage): post error: %s",
                 result.error->description().c_str());
    }
    const int status = result.response ? result.response->statusCode : 0;
    if (status < 500 || status > 599) {
      completion(std::nullopt, std::move(result.error));
      return;
    }
    auto text = formatText("backend %s disabled by server %d return code", name.c_str(), status);
    TARNEL_LOG(log, information, "postJSONMessage: %s", text.c_str());
    if (const auto alive = backend.lock()) alive->setState(ReportingState::disabled);
    completion(std::nullopt, Error(kTarnelErrorDomain, status, std::move(text)));
  };
}

}  // namespace tarnel

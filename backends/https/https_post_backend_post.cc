#include "backends/https/https_post_backend.h"
#include "backends/https/sender_names.h"
#include "base/text_format.h"
#include "formats/compression.h"
#include "tarnel/keys.h"

// Posting a message, and what its answer does.

namespace tarnel {
namespace {

// Longer names would make servers refuse the whole request.
constexpr size_t kMaxHeaderValue = 1024;

// Text of a client or the device as a header may carry it, cut to whole characters that fit.
std::string headerText(std::string_view text) {
  std::string safe = headerSafe(text);
  safe.resize(wholeCharacters(safe, kMaxHeaderValue).size());
  return safe;
}

Error localError(std::string text) {
  return {kTarnelErrorDomain, -1, std::move(text)};
}

}  // namespace

std::vector<HttpHeader> HTTPSPostBackend::headersForPost(std::optional<Method> method,
                                                         std::optional<RespCode> responseCode,
                                                         size_t contentLength, bool compressed) const {
  std::vector<HttpHeader> headers;
  headers.reserve(11);
  const auto clientName = userInfoText(kTarnelUserInfoClientName);
  const auto serviceName = userInfoText(kTarnelUserInfoServiceName);
  if (clientName) headers.push_back({"X-TRN-Client-Name", headerText(*clientName)});
  if (serviceName) headers.push_back({"X-TRN-Service-Name", headerText(*serviceName)});
  if (isInternal()) headers.push_back({"X-TRN-Internal-Build", "1"});
  headers.push_back({"User-Agent", headerText(formatText("Tarnel/%d.%d (%s; %s)", int{selfVersionMajor()},
                                                         int{selfVersionMinor()}, printable(hardwareType()),
                                                         printable(productVersion())))});
  headers.push_back({"X-TRN-Client-Version", std::to_string(clientVersion())});
  headers.push_back({"X-TRN-Sender", std::string(senderName(compType()))});
  if (method && responseCode) {
    headers.push_back(
        {"X-TRN-Event-Map", formatText("%d %d", static_cast<int>(*method), static_cast<int>(*responseCode))});
  }
  headers.push_back({"Accept", "application/json"});
  headers.push_back({"Content-Type", "application/json"});
  headers.push_back({"Content-Length", std::to_string(contentLength)});
  if (compressed) headers.push_back({"Content-Encoding", "gzip"});
  return headers;
}

void HTTPSPostBackend::postJSONMessage(std::string message, Flag withFlag, std::optional<Method> method,
                                       std::optional<RespCode> responseCode, FlushCompletion completion) {
  const auto& url = isRealtime(withFlag) ? _realtimePostURL : _postURL;
  if (!url) {
    completion(std::nullopt, localError("postURL is nil"));
    return;
  }
  auto compressed = gzipDeflate(dependencies().log, message);
  const bool useCompressed = compressed && !compressed->empty() && compressed->size() < message.size();
  HttpRequest request;
  request.method = "POST";
  request.url = *url;
  request.body = std::make_shared<const std::string>(std::move(useCompressed ? *compressed : message));
  request.headers = headersForPost(method, responseCode, request.body->size(), useCompressed);
  request.wantsBody = false;
  dependencies().http.startDataTask(std::move(request), answerHandler(std::move(completion)));
}

HttpClient::Completion HTTPSPostBackend::answerHandler(FlushCompletion completion) {
  return [backend = weak_from_this(), &log = dependencies().log, name = name(),
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

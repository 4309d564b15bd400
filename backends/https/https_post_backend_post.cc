#include "backends/https/https_post_backend.h"
#include "backends/https/sender_names.h"
#include "base/text_format.h"
#include "tarnel/keys.h"

// What a post tells of its sender, and where it goes.

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

}  // namespace

// Those that follow tell of the content.
std::vector<HttpHeader> HTTPSPostBackend::headersForPost(std::optional<Method> method,
                                                         std::optional<RespCode> responseCode) const {
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
  return headers;
}

MessagePoster HTTPSPostBackend::messagePoster(Flag flag, std::optional<Method> method,
                                              std::optional<RespCode> responseCode) {
  return {dependencies().http,
          dependencies().log,
          weak_from_this(),
          name(),
          isRealtime(flag) ? _realtimePostURL : _postURL,
          headersForPost(method, responseCode)};
}

void HTTPSPostBackend::postJSONMessage(std::string message, Flag withFlag, std::optional<Method> method,
                                       std::optional<RespCode> responseCode, FlushCompletion completion) {
  messagePoster(withFlag, method, responseCode).post(std::move(message), std::move(completion));
}

}  // namespace tarnel

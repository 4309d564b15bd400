#include <utility>

#include "backends/dashboard/dashboard_backend.h"
#include "backends/dashboard/log_data_announcement.h"
#include "formats/archive.h"
#include "util/uploads.h"

// The upload of a client's log records.

namespace tarnel {
namespace {

// Of a server's answer; a location is an address.
constexpr size_t kMaxLoggedLocation = 4096;

MaybeString logText(const MaybeString& location) {
  if (!location) return location;
  return std::string(wholeCharacters(*location, kMaxLoggedLocation));
}

}  // namespace

bool DashboardBackend::uploadLogData(const Array& logData) {
  auto& log = dependencies().log;
  if (!postURL) {
    TARNEL_LOG(log, error, "DashboardBackend(uploadLogData): Post URL for log data array is nil");
    return false;
  }
  auto archive = archiveObject(logData);
  if (!archive) {
    TARNEL_LOG(log, error, "DashboardBackend(uploadLogData): Failed to serialize log data array for upload");
    TARNEL_LOG(log, warning, "DashboardBackend(uploadLogData): %s: %s", name().c_str(),
               archive.error().description().c_str());
    return false;
  }
  HttpRequest request;
  request.method = "POST";
  request.url = *postURL;
  request.headers = {{"Content-Type", "application/octet-stream"}};
  request.body = std::make_shared<const std::string>(std::move(*archive));
  const HttpResult result = dependencies().uploads.perform(dependencies().http, std::move(request));
  if (result.error || !result.data) {
    TARNEL_LOG(log, error, "DashboardBackend(uploadLogData): Error uploading log data array (%s)",
               result.error ? result.error->description().c_str() : "(null)");
    return false;
  }
  // An answer that is no text names no location; the records have arrived all the same.
  const MaybeString location = isValidUtf8(*result.data) ? MaybeString(*result.data) : std::nullopt;
  TARNEL_LOG(log, debug, "DashboardBackend(uploadLogData): Log data uploaded to %s",
             printable(logText(location)));
  const LogDataAnnouncement message(location);
  // Through the flagged send, which for this backend ends in the base's default: no datagram is made.
  sendMessage(message.payload, dependencies().clock.timeOfDay(), message.method, message.respCode,
              message.flag);
  return true;
}

}  // namespace tarnel

// Uploads, and single messages with session info of their own.

#include <array>
#include <utility>

#include "base/log_text.h"
#include "session/separately.h"
#include "session/tarneld_session.h"
#include "tarnel/keys.h"
#include "util/device_facts.h"
#include "util/message_log.h"

namespace tarnel {
namespace {

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// The path of a file URL (RFC 8089), percent-decoded; text that is no file URL is a path already. A zero byte
// cannot stand in a path and stays encoded.
std::string pathOfURL(std::string_view url) {
  constexpr std::string_view kScheme = "file:";
  if (!url.starts_with(kScheme)) return std::string(url);
  url.remove_prefix(kScheme.size());
  if (url.starts_with("//")) {
    const size_t path = url.find('/', 2);
    url = path == std::string_view::npos ? std::string_view() : url.substr(path);
  }
  url = url.substr(0, url.find_first_of("?#"));
  std::string path;
  path.reserve(url.size());
  for (size_t i = 0; i < url.size(); ++i) {
    const int high = url[i] == '%' && i + 2 < url.size() ? hexDigit(url[i + 1]) : -1;
    const int low = high >= 0 ? hexDigit(url[i + 2]) : -1;
    if (low >= 0 && (high != 0 || low != 0)) {
      path.push_back(static_cast<char>(high * 16 + low));
      i += 2;
    } else {
      path.push_back(url[i]);
    }
  }
  return path;
}

bool holds(const MaybeDictionary& dictionary, const char* key) {
  return dictionary && dictionary->contains(key);
}

}  // namespace

void TarneldSession::uploadFileAtPath(std::string fileURL, std::string extensionToken,
                                      SuccessReply completionHandler) {
  TARNEL_LOG(dependencies_.log, debug, "uploadFileAtPath: Uploading file for session %u", sessionID());
  uploadFileWithURL(fileURL, extensionToken, std::move(completionHandler));
}

void TarneldSession::uploadFileWithURL(const std::string& fileURL, const std::string& extensionToken,
                                       SuccessReply completionHandler) {
  const std::string path = pathOfURL(fileURL);
  bool success = false;
  withEach(dependencies_.log, "uploadFileWithURL", currentBackends(),
           [&path, &extensionToken, &success](const std::string& /*name*/, TarnelBackend& each) {
             if (each.uploadFileAtPath(path, extensionToken)) success = true;
           });
  if (success) {
    TARNEL_LOG(dependencies_.log, debug, "uploadFileWithURL: File upload successful for %s", path.c_str());
  } else {
    TARNEL_LOG(dependencies_.log, error, "uploadFileWithURL: File upload failed for %s", path.c_str());
  }
  // The client's text must not look like lines of the log's own.
  writeToLogFile(dependencies_, "[uploadFileWithURL] Upload %s for file %s", success ? "succeeded" : "failed",
                 escapedForLog(fileURL).c_str());
  completionHandler(success);
}

void TarneldSession::uploadLogData(Array logData, UploadReply completionHandler) {
  bool success = false;
  withEach(dependencies_.log, "uploadLogData", currentBackends(),
           [&logData, &success](const std::string& /*name*/, TarnelBackend& each) {
             if (each.uploadLogData(logData)) success = true;
           });
  if (success) {
    TARNEL_LOG(dependencies_.log, debug, "uploadLogData: Log data array upload successful");
  } else {
    TARNEL_LOG(dependencies_.log, error, "uploadLogData: Log data array upload failed");
  }
  completionHandler(success, std::nullopt);
}

void TarneldSession::sendMessageWithSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo,
                                                uint16_t category, uint16_t type, MaybeDictionary payload,
                                                TextReply reply) {
  if (!holds(sessionInfo, kTarnelSessionInfoClientType) || !holds(sessionInfo, kTarnelSessionInfoSessionID)) {
    TARNEL_LOG(dependencies_.log, error,
               "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo");
    return;
  }
  setSessionID(sessionInfo->find(kTarnelSessionInfoSessionID)->uint32Value());
  _sessionInfo = std::move(sessionInfo);
  receivedUserInfo(userInfo);
  TARNEL_LOG(dependencies_.log, debug,
             "sendMessageWithSessionInfo: Sending message with session info for session %u", sessionID());
  const MaybeDictionary storebag = _sessionDelegate->storebagForSession(*this);
  if (!storebag) {
    reply("storebag not available");
    return;
  }
  sendMessageWithSessionInfo(dependencies_, backendFactory_, _sessionInfo, userInfo, storebag, category, type,
                             payload);
  reply("finished");
}

void TarneldSession::sendMessageWithSessionInfo(const Dependencies& dependencies,
                                                const BackendFactory& factory,
                                                const MaybeDictionary& sessionInfo,
                                                const MaybeDictionary& userInfo,
                                                const MaybeDictionary& storebag, uint16_t category,
                                                uint16_t type, const MaybeDictionary& payload) {
  Log& log = dependencies.log;
  const Value* number = sessionInfo ? sessionInfo->find(kTarnelSessionInfoSessionID) : nullptr;
  TARNEL_LOG(log, debug, "sendMessageWithSessionInfo: Sending single message with sessionID %ld",
             static_cast<long>(number != nullptr ? number->int64Value() : 0));
  if (!sessionInfo || !storebag) {
    TARNEL_LOG(log, error,
               "RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters");
    return;
  }
  std::array<char, 41> deviceid{};
  getUniqueDeviceID(dependencies.deviceInformation, deviceid.data(), deviceid.size());
  auto created = createBackends(dependencies, factory, storebag, sessionInfo, userInfo, deviceid.data());
  if (!created || created->empty()) {
    TARNEL_LOG(log, error, "sendMessageWithSessionInfo: No backends available to send single message");
    return;
  }
  const TemporaryBackends temporary(log, *std::move(created));
  const Value* required = sessionInfo->find(kTarnelSessionInfoRequireUserInfo);
  if (userInfo && (required == nullptr || !required->boolValue())) {
    TARNEL_LOG(log, warning, "sendMessageWithSessionInfo: user info provided without requiring it.");
  }
  const TimeValue now = dependencies.clock.timeOfDay();
  for (const auto& [name, backend] : temporary.backends()) {
    const MaybeSentObject sent =
        answerOf(log, "sendMessageWithSessionInfo", name, [&payload, &now, category, type, &each = *backend] {
          each.updateState();
          return each.sendMessage(payload, now, Method{category}, RespCode{type}, Flag::normal);
        });
    if (!sent) continue;
    writeToLogFile(dependencies, "[%s -> sendMessageWithSessionInfo] %s", name.c_str(),
                   tarnel::description(*sent).c_str());
  }
}

}  // namespace tarnel

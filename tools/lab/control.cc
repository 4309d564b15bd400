#include "tools/lab/control.h"

#include <algorithm>
#include <array>
#include <cerrno>

#include "formats/document.h"
#include "tools/lab/http/listener.h"
#include "tools/lab/service.h"
#include "tools/receiving/stored_files.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr uint64_t kDefaultLast = 20;
constexpr std::array<std::string_view, 4> kLists = {"/arrivals", "/uploads", "/log-data", "/datagrams"};
constexpr std::string_view kLogData = "/log-data/";
// Records of a whole archive with everything escaped.
constexpr size_t kMaxRecordsBytes = 256U << 20U;

HttpAnswer jsonAnswer(const Dictionary& value, int status = 200) {
  HttpAnswer answer;
  answer.status = status;
  answer.body = writeTextDocument(value, true) + "\n";
  return answer;
}

HttpAnswer errorAnswer(int status, const std::string& text) {
  return jsonAnswer({{"error", text}}, status);
}

// "127.0.0.1:8444", "[::1]:8444" or "localhost:8444": a name that a stranger's name server made point to us
// would be another one.
bool isLocalHost(const std::string& host) {
  std::string name = host.substr(0, host.rfind(':'));
  if (host.ends_with("]") || host.find(':') == std::string::npos) name = host;
  if (name.size() > 2 && name.front() == '[' && name.back() == ']') name = name.substr(1, name.size() - 2);
  return lowerCased(name) == "localhost" || isLoopbackAddress(name);
}

bool isFromElsewhere(const HttpRequest& request) {
  const std::string* site = findHeader(request.headers, "Sec-Fetch-Site");
  if (site != nullptr && *site != "none" && *site != "same-origin") return true;
  const std::string* host = findHeader(request.headers, "Host");
  if (host != nullptr && !isLocalHost(*host)) return true;
  const std::string* origin = findHeader(request.headers, "Origin");
  return origin != nullptr && (host == nullptr || *origin != "http://" + *host);
}

}  // namespace

HttpAnswer Control::answer(const HttpRequest& request) {
  if (isFromElsewhere(request)) {
    return errorAnswer(403, "the control address answers programs of this machine, not pages of other sites");
  }
  if (request.path == "/misbehave") return misbehave(request);
  const bool post = request.method == "POST";
  if (request.path == "/clear" || request.path == "/stop") {
    if (!post) return errorAnswer(405, request.path + " takes POST: curl -X POST ...");
    if (request.path == "/stop") {
      parts_.stop();
      return jsonAnswer({{"stopping", true}});
    }
    parts_.store.clear();
    return jsonAnswer({{"cleared", true}});
  }
  if (!post && request.path == "/status") return jsonAnswer(parts_.status());
  if (!post && std::find(kLists.begin(), kLists.end(), request.path) != kLists.end()) return list(request);
  if (!post && request.path.starts_with(kLogData)) return logRecords(request.path.substr(kLogData.size()));
  return errorAnswer(404,
                     "there is GET /status, GET /arrivals, /uploads, /log-data and /datagrams with ?last=N, "
                     "GET /log-data/NAME, GET or POST /misbehave?..., POST /clear and POST /stop");
}

HttpAnswer Control::list(const HttpRequest& request) const {
  uint64_t last = kDefaultLast;
  if (const std::string* text = findParameter(request.query, "last")) {
    const std::optional<uint64_t> number = parseNumber(*text);
    if (!number) return errorAnswer(400, "last takes a number of arrivals");
    last = *number;
  }
  Array list;
  if (request.path == "/uploads") {
    for (const UploadArrival& arrival : parts_.store.lastUploads(last)) list.append(recordOfUpload(arrival));
    return jsonAnswer({{"uploads", list}});
  }
  if (request.path == "/log-data") {
    for (const LogDataArrival& arrival : parts_.store.lastLogData(last)) {
      list.append(recordOfLogData(arrival, true));
    }
    return jsonAnswer({{"logData", list}});
  }
  if (request.path == "/datagrams") {
    for (const DatagramArrival& arrival : parts_.store.lastDatagrams(last)) {
      list.append(recordOfDatagram(arrival));
    }
    return jsonAnswer({{"datagrams", list}});
  }
  for (const Arrival& arrival : parts_.store.last(last)) list.append(recordOfPost(arrival, true));
  return jsonAnswer({{"arrivals", list}});
}

HttpAnswer Control::logRecords(const std::string& name) const {
  if (!isStoredName(name)) return errorAnswer(404, "no such log data");
  Result<std::string> text = readFile(descriptionOf(parts_.logDataFolder + "/" + name), kMaxRecordsBytes);
  if (!text) return errorAnswer(404, text.error().localizedDescription());
  HttpAnswer answer;
  answer.body = *std::move(text);
  return answer;
}

HttpAnswer Control::misbehave(const HttpRequest& request) {
  if (findParameter(request.query, "clear") != nullptr) {
    parts_.misbehaviours.clear();
    parts_.datagramFaults.clear();
  } else if (!request.query.empty()) {
    if (MaybeError error = setMisbehaviour(request.query)) {
      return errorAnswer(error->code() == EBUSY ? 409 : 400, error->localizedDescription());
    }
  }
  return jsonAnswer({{"misbehaviours", misbehaviours()}});
}

MaybeError Control::setMisbehaviour(const NameValues& query) {
  const std::string* target = findParameter(query, "for");
  if (target != nullptr && *target == "datagrams") {
    const Result<DatagramFaults::Shares> shares = DatagramFaults::sharesFromQuery(query);
    if (!shares) return shares.error();
    parts_.datagramFaults.set(*shares);
    return std::nullopt;
  }
  Result<Misbehaviour> misbehaviour = misbehaviourFromQuery(query);
  if (!misbehaviour) return misbehaviour.error();
  return parts_.misbehaviours.add(*std::move(misbehaviour));
}

Array Control::misbehaviours() const {
  Array list = parts_.misbehaviours.description();
  for (const Value& one : parts_.datagramFaults.description()) list.append(one);
  return list;
}

}  // namespace tarnel::lab

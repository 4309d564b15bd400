#include "tools/lab/summary.h"

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxMethodsShown = 8;
constexpr size_t kMaxNameShown = 60;
constexpr size_t kMaxTextShown = 200;

std::string headerOr(const Arrival& arrival, const char* name, const char* otherwise) {
  const std::string* value = findHeader(arrival.headers, name);
  return value == nullptr || value->empty() ? otherwise : printable(*value, 40);
}

std::string counted(uint64_t number, const char* one, const char* many) {
  return grouped(number) + " " + (number == 1 ? one : many);
}

std::string methodsText(const Array& events) {
  const Dictionary counts = methodCounts(events);
  std::string text;
  size_t shown = 0;
  for (const auto& [method, count] : counts) {
    if (++shown > kMaxMethodsShown) return text + ", ...";
    text += (text.empty() ? "" : ", ") + method;
    if (count.int64Value() != 1) text += " x" + std::to_string(count.int64Value());
  }
  return text;
}

std::string sizeText(const HttpArrival& arrival) {
  std::string text = byteCount(arrival.wireBytes);
  if (arrival.gzip) text += arrival.plainBytes == 0 ? " gzip" : " gzip of " + byteCount(arrival.plainBytes);
  return text;
}

std::string fileText(const std::string& path) {
  return path.empty() ? "" : "  in " + path.substr(path.rfind('/') + 1);
}

}  // namespace

std::string summaryOf(const Arrival& arrival) {
  std::string text = headerOr(arrival, "X-TRN-Sender", "unknown sender");
  const std::string client = headerOr(arrival, "X-TRN-Client-Name", "");
  const std::string service = headerOr(arrival, "X-TRN-Service-Name", "");
  if (!client.empty() || !service.empty()) {
    text += "  " + client + (client.empty() || service.empty() ? "" : " / ") + service;
  }
  text += "  " + counted(arrival.events.size(), "event", "events");
  if (const std::string methods = methodsText(arrival.events); !methods.empty())
    text += " (method " + methods + ")";
  return text + "  " + sizeText(arrival);
}

std::string summaryOf(const UploadArrival& arrival) {
  std::string text = "file ";
  text += arrival.query.filename ? "\"" + printable(*arrival.query.filename, kMaxNameShown) + "\""
                                 : std::string("without a name");
  if (arrival.query.sequence) text += "  session " + printable(*arrival.query.sequence, kMaxNameShown);
  return text + "  " + sizeText(arrival) + fileText(arrival.file);
}

std::string summaryOf(const LogDataArrival& arrival) {
  return "log data  " + counted(arrival.records.size(), "record", "records") + "  " +
         byteCount(arrival.wireBytes) + fileText(arrival.archiveFile);
}

std::string summaryOf(const DatagramArrival& arrival) {
  if (!arrival.content) return byteCount(arrival.size);
  const DashboardDatagram& content = *arrival.content;
  std::string text = "client type " + std::to_string(content.clientType) + "  session " +
                     std::to_string(content.sessionID) + "  event " + std::to_string(content.event) +
                     "  method " + std::to_string(content.method) + "  status " +
                     std::to_string(content.status);
  if (!content.text.empty()) text += " " + printable(content.text, kMaxTextShown);
  if (arrival.repetition > 1) text += "  again (" + std::to_string(arrival.repetition) + ")";
  return text;
}

}  // namespace tarnel::lab

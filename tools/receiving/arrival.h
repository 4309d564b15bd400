#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/value.h"
#include "tools/receiving/datagram_decoder.h"
#include "tools/receiving/http_message.h"
#include "tools/receiving/upload_query.h"

namespace tarnel::lab {

// What every POST has, well-formed or not.
struct HttpArrival {
  uint64_t number = 0;  // counts the arrivals of one kind in this run, from 1
  double arrived = 0;   // seconds since 1970
  std::string path;
  std::string sender;  // address and port
  NameValues headers;  // fit for printing
  bool gzip = false;
  uint64_t wireBytes = 0;             // of the body
  uint64_t plainBytes = 0;            // unpacked; 0 when it could not be
  std::vector<std::string> problems;  // plain sentences; empty when all is as it should be
  std::string answered;               // "200", "status 503" or what else was done on purpose
};

// One event post.
struct Arrival : HttpArrival {
  MaybeString clientId;
  Value postTime;  // null when absent
  Array events;
};

// One file of a client.
struct UploadArrival : HttpArrival {
  UploadQuery query;  // fit for printing
  std::string file;   // where it lies; empty when it was not taken
};

// One array of log records. Its plain bytes are those of the records as JSON.
struct LogDataArrival : HttpArrival {
  std::string location;     // the address that was answered; empty when nothing was taken
  std::string archiveFile;  // as it came
  std::string recordsFile;  // as JSON; empty when it could not be read
  Array records;
};

// What was done about a datagram; the last two on purpose.
enum class DatagramAnswer { nothing, acknowledged, dropped, acknowledgementDropped };

// One datagram.
struct DatagramArrival {
  uint64_t number = 0;
  double arrived = 0;
  std::string sender;
  std::vector<uint8_t> bytes;                // its first kMaxDatagramBytes + 1
  uint64_t size = 0;                         // of the whole one
  std::optional<DashboardDatagram> content;  // nothing when it is malformed
  uint64_t repetition = 1;                   // how often this message has come, with this time
  std::vector<std::string> problems;
  DatagramAnswer answer = DatagramAnswer::nothing;
};

// Is told of every arrival, in their order. Threads: one call at a time, on any thread.
class ArrivalObserver {
 public:
  ArrivalObserver() = default;
  ArrivalObserver(const ArrivalObserver&) = delete;
  ArrivalObserver& operator=(const ArrivalObserver&) = delete;
  virtual ~ArrivalObserver() = default;
  virtual void arrived(const Arrival& arrival) = 0;
  virtual void uploadArrived(const UploadArrival&) {}
  virtual void logDataArrived(const LogDataArrival&) {}
  virtual void datagramArrived(const DatagramArrival&) {}
};

// "nothing", "acknowledged", "dropped", "acknowledgement dropped".
std::string_view nameOf(DatagramAnswer answer);

// As texts of an array.
Array listOf(const std::vector<std::string>& problems);

// "_method" to the number of its events, in order of the methods.
Dictionary methodCounts(const Array& events);

// {"post", "arrived", "path", "sender", "answered", "headers", "clientId", "postTime", "eventCount",
// "methods", "wireBytes", "plainBytes", "gzip", "problems"} and, when asked for, "events".
Dictionary recordOfPost(const Arrival& arrival, bool withEvents);
// {"post", "arrived", "path", "headers", "clientId", "postTime", "event"}.
Dictionary recordOfEvent(const Arrival& arrival, const Value& event);
// {"upload", "arrived", "path", "sender", "answered", "headers", "uuid", "sequence", "description",
// "filename", "raw", "file", "wireBytes", "plainBytes", "gzip", "problems"}; what the query lacks is left
// out.
Dictionary recordOfUpload(const UploadArrival& arrival);
// {"logData", "arrived", "path", "sender", "answered", "headers", "location", "archiveFile", "recordsFile",
// "recordCount", "wireBytes", "problems"} and, when asked for, "records".
Dictionary recordOfLogData(const LogDataArrival& arrival, bool withRecords);
// {"datagram", "arrived", "sender", "answered", "repetition", "size", "clientType", "time", "sessionID",
// "clientVersion", "method", "status", "device", "event", "reportVersion", "reliable", "serverFromStorebag",
// "text", "entries", "problems"}; of a malformed one "bytes" in their place, hexadecimal.
Dictionary recordOfDatagram(const DatagramArrival& arrival);

}  // namespace tarnel::lab

#pragma once

#include <zlib.h>

#include <string>
#include <string_view>

#include "formats/document.h"
#include "tools/receiving/http_message.h"

// Posts as the service sends them, for the tests.

namespace tarnel::lab {

inline std::string gzipped(std::string_view text) {
  z_stream stream{};
  deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, 16 + MAX_WBITS, 8, Z_DEFAULT_STRATEGY);
  std::string packed(deflateBound(&stream, static_cast<uLong>(text.size())), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(packed.data());
  stream.avail_out = static_cast<uInt>(packed.size());
  deflate(&stream, Z_FINISH);
  packed.resize(stream.total_out);
  deflateEnd(&stream);
  return packed;
}

inline Dictionary goodEvent(int number, int method = 2, int status = 10) {
  return {{"lossPercent", 0.5},
          {"muted", false},
          {"_startTS", 1795176600},
          {"_sender", "OW"},
          {"_clientVersion", 3},
          {"_sessionID", "4101"},
          {"_eventNumber", number},
          {"_method", method},
          {"_status", status},
          {"_clientTS", 1795176610.25},
          {"eventTime", 1795176610.25},
          {"_productFamily", "Handset"},
          {"_productModel", "X1"},
          {"_osVersion", "12"},
          {"_build", "12A"},
          {"_internal", 2},
          {"_reportVers", "8.0"},
          {"_timezoneOffset", -3600}};
}

inline Dictionary goodMessage(const Array& events) {
  return {{"postTime", 1795176611.5}, {"clientId", "0f9c"}, {"events", events}};
}

inline HttpRequest goodRequest(const Value& message, bool gzip = false) {
  HttpRequest request;
  request.method = "POST";
  request.path = "/v1/events";
  request.sender = "127.0.0.1:50000";
  request.body = writeTextDocument(message);
  if (gzip) request.body = gzipped(request.body);
  request.headers = {{"X-TRN-Client-Name", "Meetwell"},
                     {"X-TRN-Service-Name", "video-call"},
                     {"User-Agent", "Tarnel/8.0 (X1; 12)"},
                     {"X-TRN-Client-Version", "3"},
                     {"X-TRN-Sender", "OW"},
                     {"Accept", "application/json"},
                     {"Content-Type", "application/json"},
                     {"Content-Length", std::to_string(request.body.size())}};
  if (gzip) request.headers.emplace_back("Content-Encoding", "gzip");
  return request;
}

// filename: as it stands in the query.
inline HttpRequest goodUpload(const std::string& filename, std::string_view contents) {
  HttpRequest request;
  request.method = "POST";
  request.path = "/v1/uploads";
  request.rawQuery =
      "uuid=0123456789abcdef0123456789abcdef01234567&sequence=77"
      "&description=Lumora%20AFRC%20log%20(Uploaded%20by%20QMX)&filename=" +
      filename + "&raw=true";
  request.sender = "127.0.0.1:50000";
  request.body = gzipped(contents);
  request.headers = {{"Content-Type", "application/octet-stream"},
                     {"Content-Encoding", "gzip"},
                     {"Content-Length", std::to_string(request.body.size())}};
  return request;
}

inline void setHeader(HttpRequest& request, const std::string& name, const std::string& value) {
  std::erase_if(request.headers, [&name](const auto& header) { return header.first == name; });
  if (!value.empty()) request.headers.emplace_back(name, value);
}

}  // namespace tarnel::lab

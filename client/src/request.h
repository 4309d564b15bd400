#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>

#include "client/src/outcome.h"
#include "client/src/upload_file.h"

namespace tarnel::core {

// One call of the client, as it waits and travels.
struct Request {
  enum class Kind : uint8_t {
    setSessionInfo,
    startConfig,
    fetchStates,
    fetchDisplayURL,
    sendMessage,
    sendDictionary,
    flush,
    finish,
    uploadFile,
    uploadLogData,
    sendSingleMessage,
    barrier,  // answered when everything before it has been answered
  };

  Kind kind = Kind::sendMessage;
  bool hasAggregation = false;             // setSessionInfo
  uint16_t category = 0;                   // sendMessage, sendSingleMessage
  uint16_t type = 0;                       // the same
  uint32_t flag = 0;                       // sendMessage
  size_t bytes = 0;                        // on the wire; filled in by measure()
  MaybeDictionary sessionInfo;             // setSessionInfo, sendSingleMessage
  MaybeDictionary userInfo;                // the same and fetchStates
  MaybeDictionary dictionary;              // payload; sendDictionary: the message
  std::optional<Array> array;              // setSessionInfo: frameworks; uploadLogData: records
  std::shared_ptr<const UploadFile> file;  // uploadFile
  Completion completion;                   // empty when no answer is wanted
};

// Checks that the request can be sent (text, nesting, size) and fills in its bytes, so that the caller hears
// of it at once. The bytes are exact for the arguments, and an upper bound for the whole frame.
Outcome measure(Request& request);

}  // namespace tarnel::core

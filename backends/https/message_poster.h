#pragma once

#include <memory>
#include <string>
#include <vector>

#include "backends/tarnel_backend.h"
#include "platform/http_client.h"

namespace tarnel {

// Posts JSON messages. It holds what that needs of a backend as values, so that messages of a flush can be
// posted when the backend is gone.
//
// Threads: any. HTTP client and log must outlive it and all answers.
struct MessagePoster {
  HttpClient& http;
  Log& log;
  std::weak_ptr<TarnelBackend> backend;  // which a server error disables
  std::string name;                      // the backend's
  MaybeString url;
  std::vector<HttpHeader> headers;  // that tell of the sender; those of the content follow them

  // Posts the message, compressed where that is shorter. The completion (may be empty) runs on the HTTP
  // client's thread, or at once when there is no address; it never gets a text.
  void post(std::string message, FlushCompletion completion) const;
  // True while the backend is there and disabled.
  bool isBackendDisabled() const;

 private:
  HttpClient::Completion answerHandler(FlushCompletion completion) const;
};

}  // namespace tarnel

#pragma once

#include <atomic>

#include "platform/clock.h"
#include "tools/lab/receivers/log_data_receiver.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/lab/receivers/post_receiver.h"
#include "tools/lab/receivers/upload_receiver.h"
#include "tools/lab/storebag_source.h"
#include "tools/receiving/http_message.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

// What stands behind the HTTPS address: GET of storebags, POST of events, files and log records. Threads:
// any.
class Service final : public HttpHandler {
 public:
  struct Parts {
    StorebagSource& storebags;
    PostReceiver& posts;
    UploadReceiver& uploads;
    LogDataReceiver& logData;
    Misbehaviours& misbehaviours;
    Notices& notices;
    Clock& clock;
  };

  // maxAge: seconds for "Cache-Control" of storebags.
  Service(const Parts& parts, int maxAge) : parts_(parts), maxAge_(maxAge) {}

  size_t maxBodyBytes(const HttpRequest& request) const override;
  HttpAnswer answer(const HttpRequest& request) override;
  void connectionFailed(const std::string& sender, const std::string& text) override;

  uint64_t storebagsServed() const { return storebagsServed_; }

 private:
  HttpAnswer answerStorebag(const HttpRequest& request, const std::string& name);
  HttpAnswer goodAnswer(const HttpRequest& request, const std::string& name, const Misbehaviour* misbehaviour,
                        ServedStorebag& served);
  void tellFindings(const std::string& name, const PreparedStorebag& storebag);

  const Parts parts_;
  const int maxAge_;
  std::atomic<uint64_t> storebagsServed_ = 0;
};

enum class PostKind { events, file, logData };

// What is posted: anything but "application/octet-stream" is events; of that, what is packed or has a file
// name in its query is a file, and everything else log data. Whatever the path.
PostKind kindOfPost(const HttpRequest& request);

// The storebag name in "/storebags/NAME", "/bags/alder/NAME" and "/storebags/alder/NAME"; empty for other
// paths.
std::string storebagNameInPath(const std::string& path);

HttpAnswer plainAnswer(int status, const std::string& text);

}  // namespace tarnel::lab

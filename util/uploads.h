#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

#include "ipc/client_files.h"
#include "platform/http_client.h"

namespace tarnel {

struct UploadLimits {
  uint64_t fileBytes = uint64_t{32} << 20U;  // of one file
  uint64_t bytesUnderWay = uint64_t{32}
                           << 20U;  // of all files that are being uploaded; not less than the former
  std::chrono::milliseconds waitForRoom{60'000};
};

// What the uploads of all sessions share: the clients' files, and how much of the process's memory may be
// taken by contents that are read, compressed and on their way. An upload holds its own session's thread;
// those beyond the bound wait for their turn: users take turns, the one next who had none for the longest
// time, and a user's own uploads go in the order in which they came. So nobody's crowd of uploads keeps
// others from theirs.
//
// Threads: any. Outlives all that was taken from it.
class Uploads {
 public:
  explicit Uploads(ClientFiles& files, UploadLimits limits = {});

  ClientFiles& files() const noexcept { return files_; }
  const UploadLimits& limits() const noexcept { return limits_; }

  // Room for one upload, given back when destroyed.
  class Place {
   public:
    Place(Uploads& uploads, uint64_t bytes) noexcept : uploads_(&uploads), bytes_(bytes) {}
    Place(Place&& other) noexcept : uploads_(std::exchange(other.uploads_, nullptr)), bytes_(other.bytes_) {}
    Place& operator=(Place&&) = delete;
    ~Place() {
      if (uploads_ != nullptr) uploads_->leave(bytes_);
    }

   private:
    Uploads* uploads_;
    uint64_t bytes_;
  };
  // Waits for room, at most limits().waitForRoom; nothing when there was none, or after stop(). The owner is
  // the user whose file it is.
  std::optional<Place> enter(uint64_t bytes, uint32_t owner);

  // Uploads that wait for room.
  size_t waiting() const;

  // Starts the request and holds the calling thread until it has ended or the uploads are stopped, which
  // gives an error with kHttpClientGoingAway; after that nothing is started any more. Never call it on the
  // client's thread.
  HttpResult perform(HttpClient& http, HttpRequest request);

  // The process is about to end: every wait here ends at once, now and later. Requests that were started go
  // on by themselves.
  void stop();

 private:
  struct State;

  void leave(uint64_t bytes);

  ClientFiles& files_;
  const UploadLimits limits_;
  const std::shared_ptr<State> state_;  // shared with answers that come late
};

}  // namespace tarnel

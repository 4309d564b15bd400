#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "backends/https/event_batch.h"
#include "backends/https/message_poster.h"
#include "backends/https/message_writer.h"
#include "backends/https/posted_texts.h"
#include "backends/tarnel_backend.h"

namespace tarnel {

// Posts a batch: usually as one message, as several when what is set in the events makes it larger than one
// may be. Of several, each is made when the one before is answered, so that no more than one of them is in
// memory, and in the HTTP client's queue, at any time. It outlives the backend, whose values it has.
//
// Each message is tried once, and one that fails does not stop the next. What is left is dropped, with a line
// in the log that counts it, when nothing more can or may be posted: a server error disabled the backend (or
// anything else did, meanwhile), there is no address, the HTTP client takes no more.
//
// Threads: the owner calls makeFirst, takeRefused and start in this order, on one thread. Later messages are
// made on the thread that brings the answer, the HTTP client's, where making one holds up the other transfers
// for about a tenth of a second at most. One thread at a time works here; the lock only orders a post that
// returns and its answer.
class BatchPoster final : public std::enable_shared_from_this<BatchPoster> {
 public:
  // Batches of the process with messages that wait for an answer of the one before. Each holds some times
  // EventBatch::kMaxBytes for as long as its server takes.
  static constexpr size_t kMaxWaiting = 8;

  BatchPoster(EventBatch batch, EventBatch::Finish finish, MessageWriter writer, MessagePoster poster,
              FlushCompletion completion);
  ~BatchPoster();
  BatchPoster(const BatchPoster&) = delete;
  BatchPoster& operator=(const BatchPoster&) = delete;

  // Makes the first message, of a batch without events, too. Returns its text for the log.
  MaybeString makeFirst();
  // The events of the later messages, when kMaxWaiting batches wait already: the owner keeps them for its
  // next flush, and the completion is told. Else nothing.
  std::optional<EventBatch> takeRefused();
  // Posts the first message, and all others as it is described above. The completion gets the texts of all
  // messages and the first error, once, on the thread of the last answer.
  void start();

 private:
  // Where the message stands that is under way.
  enum class Stage : uint8_t { starting, waiting, answered };

  void makeMessage();
  bool postMessage();
  // False when it was answered before.
  bool answered(size_t message, MaybeError error);
  void goOn();
  MaybeError reasonToStop();
  void noteError(MaybeError error);
  void dropRest(const Error& why);
  void logLoss(size_t events, const Error& why) const;

  EventBatch batch_;  // what is left
  const EventBatch::Finish finish_;
  const MessageWriter writer_;
  const MessagePoster poster_;
  FlushCompletion completion_;
  PostedTexts texts_;
  std::optional<std::string> body_;  // made and not yet posted
  size_t events_ = 0;                // in it
  bool waits_ = false;               // counted among kMaxWaiting

  std::mutex lock_;
  size_t message_ = 0;             // number of the one under way; guarded by lock_
  Stage stage_ = Stage::answered;  // guarded by lock_
  MaybeError firstError_;          // guarded by lock_
  MaybeError reasonToStop_;        // an answer after which no more is posted; guarded by lock_
};

}  // namespace tarnel

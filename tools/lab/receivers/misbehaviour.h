#pragma once

#include <chrono>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/error.h"
#include "base/value.h"
#include "tools/receiving/http_message.h"

namespace tarnel::lab {

enum class RequestKind { storebag, post, upload, logData };

// One way to answer other than well.
struct Misbehaviour {
  bool forStorebags = true;
  bool forPosts = true;
  bool forUploads = true;
  bool forLogData = true;
  uint64_t count = 1;  // requests that are answered this way; 0: until cleared

  std::optional<int> status;
  std::chrono::milliseconds delay{0};
  bool empty = false;
  bool breakSignature = false;  // storebags only
  bool refuse = false;          // uploads only
  bool endless = false;
  std::optional<uint64_t> resetAfter;  // bytes of the answer
  std::optional<std::string> body;
  NameValues headers;

  bool isFor(RequestKind kind) const;
  // "status 503, after 200 ms"
  std::string description() const;
  // Changes an answer that would have been good. breakSignature and refuse are left to
  // who answers.
  void applyTo(HttpAnswer& answer) const;
};

// From the query of the control address: status=N, delay=MS, hang=1, empty=1, break-signature=1, reset=1,
// reset-after=BYTES, endless=1, body=TEXT, header=NAME:VALUE, refuse=1,
// for=storebags|events|uploads|log-data|all, count=N.
// The error names the parameter and what it takes.
Result<Misbehaviour> misbehaviourFromQuery(const NameValues& query);

// What is in force, in the order in which it was asked for. Threads: any.
class Misbehaviours {
 public:
  static constexpr size_t kLimit = 64;

  // The error, EBUSY, says that kLimit is reached.
  MaybeError add(Misbehaviour misbehaviour);
  void clear();
  // The first that is meant for the kind, counted down.
  std::optional<Misbehaviour> take(RequestKind kind);
  // For the control address: [{"for": "all", "left": 2, "what": "status 503"}].
  Array description() const;

 private:
  struct Entry {
    Misbehaviour misbehaviour;
    uint64_t left;
  };

  mutable std::mutex mutex_;
  std::vector<Entry> entries_;
};

}  // namespace tarnel::lab

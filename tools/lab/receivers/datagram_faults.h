#pragma once

#include <cstdint>
#include <mutex>
#include <string_view>

#include "base/error.h"
#include "base/value.h"
#include "tools/receiving/http_message.h"

namespace tarnel::lab {

enum class DatagramFate { deliver, drop, dropAcknowledgement };

// Datagrams and acknowledgements that the lab loses on purpose. What becomes of one is settled by the
// message, how often it has come and the seed, so that no run differs from another. Threads: any.
class DatagramFaults {
 public:
  struct Shares {
    unsigned int drop = 0;                  // per cent of the datagrams
    unsigned int dropAcknowledgements = 0;  // per cent of the acknowledgements of those that are left
    uint64_t seed = 1;
  };

  // From the query of the control address: drop=PERCENT, drop-acknowledgements=PERCENT, seed=N, beside
  // for=datagrams. The error names the parameter and what it takes.
  static Result<Shares> sharesFromQuery(const NameValues& query);

  void set(const Shares& shares);
  void clear() { set({}); }

  // message: what tells messages apart. repetition: 1 for its first arrival.
  DatagramFate fateOf(std::string_view message, uint64_t repetition) const;
  // For the control address, as that of Misbehaviours; empty when nothing is lost.
  Array description() const;

 private:
  mutable std::mutex mutex_;
  Shares shares_;
};

}  // namespace tarnel::lab

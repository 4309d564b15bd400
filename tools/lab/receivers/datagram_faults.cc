#include "tools/lab/receivers/datagram_faults.h"

#include "tools/files/file_io.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

// A number below 100 that follows from all of these and shows no pattern (FNV-1a, then splitmix64's end).
unsigned int percentile(uint64_t seed, std::string_view message, uint64_t repetition, uint64_t purpose) {
  uint64_t hash = 0xcbf29ce484222325U ^ seed;
  const auto mix = [&hash](uint64_t part) { hash = (hash ^ part) * 0x100000001b3U; };
  for (const char byte : message) mix(static_cast<uint8_t>(byte));
  mix(repetition);
  mix(purpose);
  hash = (hash ^ (hash >> 30U)) * 0xbf58476d1ce4e5b9U;
  hash = (hash ^ (hash >> 27U)) * 0x94d049bb133111ebU;
  return static_cast<unsigned int>((hash ^ (hash >> 31U)) % 100);
}

Error takesError(const std::string& name, const std::string& value, const std::string& takes) {
  return Error(kToolErrorDomain, -1, name + "=" + printable(value, 60) + ": " + name + " takes " + takes);
}

}  // namespace

Result<DatagramFaults::Shares> DatagramFaults::sharesFromQuery(const NameValues& query) {
  Shares shares;
  bool any = false;
  for (const auto& [name, value] : query) {
    if (name == "for") continue;
    const std::optional<uint64_t> number = parseNumber(value);
    if (name == "seed") {
      if (!number) return takesError(name, value, "a number");
      shares.seed = *number;
    } else if (name == "drop" || name == "drop-acknowledgements") {
      if (!number || *number > 100) return takesError(name, value, "a percentage from 0 to 100");
      (name == "drop" ? shares.drop : shares.dropAcknowledgements) = static_cast<unsigned int>(*number);
      any = true;
    } else {
      return Error(kToolErrorDomain, -1,
                   "unknown parameter " + printable(name, 60) +
                       "; for=datagrams takes drop, drop-acknowledgements and seed");
    }
  }
  if (any) return shares;
  return Error(kToolErrorDomain, -1,
               "say how much of the datagrams to lose, for example drop=30&drop-acknowledgements=30");
}

void DatagramFaults::set(const Shares& shares) {
  const std::lock_guard lock(mutex_);
  shares_ = shares;
}

DatagramFate DatagramFaults::fateOf(std::string_view message, uint64_t repetition) const {
  const std::lock_guard lock(mutex_);
  if (percentile(shares_.seed, message, repetition, 1) < shares_.drop) return DatagramFate::drop;
  if (percentile(shares_.seed, message, repetition, 2) < shares_.dropAcknowledgements) {
    return DatagramFate::dropAcknowledgement;
  }
  return DatagramFate::deliver;
}

Array DatagramFaults::description() const {
  const std::lock_guard lock(mutex_);
  std::string what;
  if (shares_.drop > 0) what = std::to_string(shares_.drop) + " % dropped";
  if (shares_.dropAcknowledgements > 0) {
    what += (what.empty() ? "" : ", ") + std::to_string(shares_.dropAcknowledgements) +
            " % of the acknowledgements dropped";
  }
  if (what.empty()) return {};
  return {Dictionary{{"for", "datagrams"}, {"what", what}, {"left", "until cleared"}}};
}

}  // namespace tarnel::lab

#include "tools/lab/receivers/datagram_receiver.h"

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

// Session, device and event tell messages apart. The datagram has a whole header.
std::string messageIn(std::span<const uint8_t> bytes) {
  constexpr size_t kSessionOffset = 8;
  constexpr size_t kSessionBytes = 4;
  constexpr size_t kDeviceOffset = 20;
  constexpr size_t kDeviceAndEventBytes = 42;
  const auto session = bytes.subspan(kSessionOffset, kSessionBytes);
  const auto rest = bytes.subspan(kDeviceOffset, kDeviceAndEventBytes);
  std::string message(session.begin(), session.end());
  message.append(rest.begin(), rest.end());
  return message;
}

DatagramAnswer answerFor(const DashboardDatagram& datagram, DatagramFate fate) {
  if (fate == DatagramFate::drop) return DatagramAnswer::dropped;
  if (!datagram.isReliable) return DatagramAnswer::nothing;
  return fate == DatagramFate::dropAcknowledgement ? DatagramAnswer::acknowledgementDropped
                                                   : DatagramAnswer::acknowledged;
}

}  // namespace

bool DatagramReceiver::isWithinLimit(int64_t second) {
  if (second != second_) {
    wasOverLimit_ = inSecond_ > kMaxPerSecond;
    second_ = second;
    inSecond_ = 0;
  }
  if (++inSecond_ <= kMaxPerSecond) return true;
  store_.countDatagramOverLimit();
  if (inSecond_ == kMaxPerSecond + 1 && !wasOverLimit_) {
    notices_.warning("more than " + grouped(kMaxPerSecond) +
                     " datagrams came within a second; those beyond are lost");
  }
  return false;
}

uint64_t DatagramReceiver::countRepetition(const std::string& message) {
  const auto [found, isNew] = seen_.try_emplace(message, 0);
  const uint64_t count = ++found->second;
  if (isNew) {
    seenOrder_.push_back(message);
    if (seenOrder_.size() > kMaxRemembered) {
      seen_.erase(seenOrder_.front());
      seenOrder_.pop_front();
    }
  }
  return count;
}

void DatagramReceiver::receive(std::span<const uint8_t> bytes, size_t size, const std::string& sender,
                               const std::function<void(const std::vector<uint8_t>&)>& acknowledge) {
  const TimeValue now = clock_.timeOfDay();
  if (!isWithinLimit(now.seconds)) return;
  DatagramArrival arrival;
  arrival.arrived = secondsFromTimeValue(now);
  arrival.sender = sender;
  arrival.bytes.assign(bytes.begin(), bytes.end());
  arrival.size = size;
  Problems problems;
  arrival.content = readDatagram(bytes, problems);
  arrival.problems = problems.take();
  if (arrival.content) {
    const std::string message = messageIn(bytes);
    arrival.repetition = countRepetition(message);
    arrival.answer = answerFor(*arrival.content, faults_.fateOf(message, arrival.repetition));
  }
  const bool acknowledges = arrival.answer == DatagramAnswer::acknowledged;
  store_.addDatagram(std::move(arrival), [acknowledges, bytes, &acknowledge] {
    if (acknowledges) acknowledge(acknowledgementOf(bytes));
  });
}

}  // namespace tarnel::lab

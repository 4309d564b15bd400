#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

#include "base/types.h"

namespace tarnel {

// A datagram that waits to be sent or acknowledged, with how often it was.
//
// Threads: the dashboard's work queue; `data` may be read and replaced on any.
class UDPPacketToSend {
 private:
  struct Private {};  // construction goes through initWithBytes

 public:
  using Bytes = std::shared_ptr<const std::vector<uint8_t>>;
  enum class State : int { notSent = 0, awaitsAcknowledgement = 1 };

  // initWithBytes:length:eventNum:
  // Copies the bytes.
  static std::shared_ptr<UDPPacketToSend> initWithBytes(const uint8_t* bytes, size_t length,
                                                        EventID eventNum) {
    return std::make_shared<UDPPacketToSend>(
        Private{}, std::make_shared<const std::vector<uint8_t>>(bytes, bytes + length), eventNum);
  }
  UDPPacketToSend(Private, Bytes data, EventID eventNumber)
      : eventNumber_(eventNumber), data_(std::move(data)) {}

  State state() const noexcept { return state_; }
  void setState(State state) noexcept { state_ = state; }
  // Visits of the periodic task since the datagram was last sent.
  int numberOfChecks() const noexcept { return numberOfChecks_; }
  void setNumberOfChecks(int number) noexcept { numberOfChecks_ = number; }
  int numberOfRetransmits() const noexcept { return numberOfRetransmits_; }
  void setNumberOfRetransmits(int number) noexcept { numberOfRetransmits_ = number; }
  EventID eventNumber() const noexcept { return eventNumber_; }

  // The whole datagram.
  Bytes data() const {
    const std::lock_guard guard(mutex_);
    return data_;
  }
  void setData(Bytes data) {
    const std::lock_guard guard(mutex_);
    data_ = std::move(data);
  }

 private:
  State state_ = State::notSent;
  int numberOfChecks_ = 0;
  int numberOfRetransmits_ = 0;
  const EventID eventNumber_;
  mutable std::mutex mutex_;
  Bytes data_;  // under the mutex
};

}  // namespace tarnel

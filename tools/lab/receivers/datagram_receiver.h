#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/clock.h"
#include "tools/lab/receivers/datagram_faults.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

// Takes in datagrams: reads, stores and acknowledges them. Threads: one at a time.
class DatagramReceiver {
 public:
  // More in one second are lost, so that nobody fills the disk with them.
  static constexpr uint64_t kMaxPerSecond = 2000;
  // Messages whose repetitions are counted; the oldest are forgotten.
  static constexpr size_t kMaxRemembered = 4096;

  // All outlive the receiver.
  DatagramReceiver(ArrivalStore& store, const DatagramFaults& faults, Notices& notices, Clock& clock)
      : store_(store), faults_(faults), notices_(notices), clock_(clock) {}

  // bytes: the datagram, or its first kMaxDatagramBytes + 1 bytes. size: of the whole one.
  // acknowledge: sends back what it is given. It is called before this returns and without waiting for disk
  // or terminal, for every readable datagram that asks for it, each time that it comes.
  void receive(std::span<const uint8_t> bytes, size_t size, const std::string& sender,
               const std::function<void(const std::vector<uint8_t>&)>& acknowledge);

 private:
  bool isWithinLimit(int64_t second);
  uint64_t countRepetition(const std::string& message);

  ArrivalStore& store_;
  const DatagramFaults& faults_;
  Notices& notices_;
  Clock& clock_;
  int64_t second_ = -1;
  uint64_t inSecond_ = 0;
  bool wasOverLimit_ = false;
  std::unordered_map<std::string, uint64_t> seen_;
  std::deque<std::string> seenOrder_;
};

}  // namespace tarnel::lab

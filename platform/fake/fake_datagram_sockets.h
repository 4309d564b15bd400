#pragma once

#include <algorithm>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/datagram_socket.h"

namespace tarnel::fake {

using Datagram = std::vector<uint8_t>;

// What became of one socket; stays when the socket is gone.
struct SocketRecord {
  int descriptor = -1;
  bool isOpen = true;
  int closes = 0;
  std::vector<std::string> calls;  // "suppressBrokenPipeSignal", "bindToWildcard", "connectTo", "close"
  std::optional<Ipv4Address> peer;
  std::vector<Datagram> sent;  // those of which all bytes went out
  int sends = 0;               // tried
  // What the next sends give; when there is none, all bytes go out.
  std::deque<std::ptrdiff_t> sendResults;
  std::deque<Datagram> incoming;
};

// Sockets without a network. Threads: the test's.
class FakeDatagramSockets final : public DatagramSockets {
 public:
  // Error numbers; 0 lets the operation succeed.
  int createError = 0;
  int bindError = 0;
  int connectError = 0;

  // Set to have sockets come from there instead.
  DatagramSockets* real = nullptr;

  Result<std::unique_ptr<DatagramSocket>> create() override {
    if (real != nullptr) return real->create();
    if (createError != 0) return Error(kDatagramErrorDomain, createError, "refused by the test");
    auto record = std::make_shared<SocketRecord>();
    record->descriptor = 1000 + static_cast<int>(records.size());
    records.push_back(record);
    return std::unique_ptr<DatagramSocket>(std::make_unique<Socket>(*this, std::move(record)));
  }

  size_t open() const {
    return static_cast<size_t>(
        std::count_if(records.begin(), records.end(), [](const auto& record) { return record->isOpen; }));
  }
  SocketRecord& last() const { return *records.back(); }

  std::vector<std::shared_ptr<SocketRecord>> records;

 private:
  class Socket final : public DatagramSocket {
   public:
    Socket(const FakeDatagramSockets& sockets, std::shared_ptr<SocketRecord> record)
        : sockets_(sockets), record_(std::move(record)) {}
    ~Socket() override { closeOnce(); }

    int descriptor() const noexcept override { return record_->isOpen ? record_->descriptor : -1; }
    void suppressBrokenPipeSignal() override { record_->calls.emplace_back("suppressBrokenPipeSignal"); }
    int bindToWildcard() override {
      record_->calls.emplace_back("bindToWildcard");
      return sockets_.bindError;
    }
    int connectTo(const Ipv4Address& address) override {
      record_->calls.emplace_back("connectTo");
      if (sockets_.connectError == 0) record_->peer = address;
      return sockets_.connectError;
    }
    std::ptrdiff_t send(std::span<const uint8_t> datagram) override {
      ++record_->sends;
      if (!record_->isOpen) return -1;
      auto result = static_cast<std::ptrdiff_t>(datagram.size());
      if (!record_->sendResults.empty()) {
        result = record_->sendResults.front();
        record_->sendResults.pop_front();
      }
      if (result == static_cast<std::ptrdiff_t>(datagram.size())) {
        record_->sent.emplace_back(datagram.begin(), datagram.end());
      }
      return result;
    }
    std::ptrdiff_t receive(std::span<uint8_t> buffer) override {
      if (!record_->isOpen || record_->incoming.empty()) return -1;
      const Datagram datagram = std::move(record_->incoming.front());
      record_->incoming.pop_front();
      const size_t taken = std::min(buffer.size(), datagram.size());
      std::copy_n(datagram.begin(), taken, buffer.begin());
      return static_cast<std::ptrdiff_t>(taken);
    }
    void close() override { closeOnce(); }

   private:
    void closeOnce() {
      if (!std::exchange(record_->isOpen, false)) return;
      ++record_->closes;
      record_->calls.emplace_back("close");
    }

    const FakeDatagramSockets& sockets_;
    std::shared_ptr<SocketRecord> record_;
  };
};

}  // namespace tarnel::fake

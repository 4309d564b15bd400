#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <string>

namespace tarnel::detail {

// Which requests may be under way: at most so many to one host, and so many in all. Those that must wait go
// in the order in which they were added, as far as their hosts have room.
//
// The HTTP library has such limits of its own, but requests that wait inside it can be forgotten until some
// timer runs out, and their time-outs do not count.
// Threads: one at a time.
class TransferQueue {
 public:
  TransferQueue(size_t perHost, size_t total) : perHost_(perHost), total_(total) {}

  // Ids grow; an id may be added again once it was removed.
  void add(uint64_t id, const std::string& host);
  // The next one that may start, counted as under way from now on; nothing while all must wait.
  std::optional<uint64_t> next();
  // It ended, waits no longer, or was never added.
  void remove(uint64_t id);

 private:
  struct Host {
    size_t running = 0;
    std::deque<uint64_t> waiting;
  };
  struct Entry {
    std::string host;
    bool running = false;
  };

  const size_t perHost_;
  const size_t total_;
  size_t running_ = 0;
  std::map<std::string, Host> hosts_;  // with something running or waiting
  std::map<uint64_t, Entry> entries_;
};

}  // namespace tarnel::detail

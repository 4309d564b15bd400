#include "platform/linux/http/transfer_queue.h"

namespace tarnel::detail {

void TransferQueue::add(uint64_t id, const std::string& host) {
  hosts_[host].waiting.push_back(id);
  entries_[id] = Entry{host};
}

std::optional<uint64_t> TransferQueue::next() {
  if (running_ >= total_) return std::nullopt;
  Host* chosen = nullptr;
  for (auto& [name, host] : hosts_) {
    if (host.waiting.empty() || host.running >= perHost_) continue;
    if (chosen == nullptr || host.waiting.front() < chosen->waiting.front()) chosen = &host;
  }
  if (chosen == nullptr) return std::nullopt;
  const uint64_t id = chosen->waiting.front();
  chosen->waiting.pop_front();
  ++chosen->running;
  ++running_;
  entries_.at(id).running = true;
  return id;
}

void TransferQueue::remove(uint64_t id) {
  const auto entry = entries_.find(id);
  if (entry == entries_.end()) return;
  const auto host = hosts_.find(entry->second.host);
  if (entry->second.running) {
    --host->second.running;
    --running_;
  } else {
    std::erase(host->second.waiting, id);
  }
  if (host->second.running == 0 && host->second.waiting.empty()) hosts_.erase(host);
  entries_.erase(entry);
}

}  // namespace tarnel::detail

#pragma once

#include <benchmark/benchmark.h>
#include <systemd/sd-bus.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/https/https_post_backend.h"
#include "base/unique_fd.h"
#include "ipc/dbus/dbus_codec.h"
#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "session/tarneld_session.h"

namespace tarnel::bench {

// Events that one post carries: the default threshold of 49 lets a fiftieth in.
inline constexpr size_t kBatch = 50;

// Tells the time that one message took, whatever number of them one iteration handles.
inline void reportPerMessage(benchmark::State& state, size_t messagesPerIteration) {
  const auto messages = static_cast<double>(state.iterations()) * static_cast<double>(messagesPerIteration);
  state.counters["per_message"] =
      benchmark::Counter(messages, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}

// Calls `each` for the payloads of the next batch: a kRing of them goes round, so that neither the
// compression nor the processor's guesses get used to the same few.
inline constexpr size_t kRing = 20 * kBatch;
template <class T, class Each>
void forNextBatch(const std::vector<T>& ring, size_t& at, Each each) {
  for (size_t i = 0; i < kBatch; ++i) each(ring[at + i]);
  at = (at + kBatch) % ring.size();
}

// Whether a readable copy of every post goes to the message log, as it does when the user has consented and
// the client entry honours consent.
enum class MessageLog { off, on };

// The fakes' world as a quiet daemon sees it: diagnostics up to level 6, posts accepted at once.
class BenchWorld {
 public:
  BenchWorld() { fakes.log.setActiveLevel(LogLevel::information); }

  // Called between measurements: the fakes remember what a real log or disk would take away.
  void forget();

  fake::FakeWorld fakes;
  const Dependencies& dependencies = fakes.dependencies;
};

// One enabled HTTPS backend, set up as a session does it.
std::shared_ptr<HTTPSPostBackend> makeBackend(BenchWorld& world, MessageLog messageLog);

// One configured session with that one backend.
std::shared_ptr<TarneldSession> makeSession(BenchWorld& world, MessageLog messageLog);

// Sealed bus messages, as they stand once they have been read from a socket.
class SealedMessages {
 public:
  SealedMessages();

  struct Unref {
    void operator()(sd_bus_message* message) const noexcept { sd_bus_message_unref(message); }
  };
  using Message = std::unique_ptr<sd_bus_message, Unref>;

  // SendMessage of callPayload(index).
  Message single(size_t index);
  // SendMessages of kBatch payloads from this one on.
  Message batch(size_t first);
  // The same as it goes over the socket.
  static std::string batchBytes(size_t first);

 private:
  struct Close {
    void operator()(sd_bus* bus) const noexcept { sd_bus_close_unref(bus); }
  };
  Message newCall(const char* member);
  Message unsealedBatch(size_t first);

  UniqueFd peer_;
  std::unique_ptr<sd_bus, Close> bus_;
};

}  // namespace tarnel::bench

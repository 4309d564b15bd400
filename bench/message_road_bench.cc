// The pieces of the road of one message, and the whole of it inside the process.

#include <string>
#include <vector>

#include "bench/bench_world.h"
#include "bench/sample_payload.h"
#include "platform/linux/ipc/message_batch.h"
#include "util/compression.h"

namespace tarnel::bench {
namespace {

constexpr TimeValue kSentAt{1700000060, 750000};
constexpr Method kMethod{13};
constexpr RespCode kStatus{10};

MessageLog messageLogOf(const benchmark::State& state) {
  return state.range(0) != 0 ? MessageLog::on : MessageLog::off;
}

// A call of its own for each message, once the library has read it from the socket.
void busDecodeSingle(benchmark::State& state) {
  SealedMessages bus;
  std::vector<SealedMessages::Message> messages;
  for (size_t i = 0; i < kBatch; ++i) messages.push_back(bus.single(i));
  for (auto step : state) {
    for (const auto& message : messages) {
      sd_bus_message_rewind(message.get(), 1);
      sd_bus_message_skip(message.get(), "qq");
      benchmark::DoNotOptimize(wire::readMaybeDictionary(message.get()));
    }
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(busDecodeSingle);

// Fifty messages in one call.
void busDecodeBatch(benchmark::State& state) {
  SealedMessages bus;
  const auto message = bus.batch(kBatch);
  for (auto step : state) {
    sd_bus_message_rewind(message.get(), 1);
    benchmark::DoNotOptimize(readBatch(message.get()));
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(busDecodeBatch);

std::vector<MaybeDictionary> payloads() {
  std::vector<MaybeDictionary> result;
  for (size_t i = 0; i < kBatch; ++i) result.emplace_back(callPayload(i));
  return result;
}

// Nobody else holds the payload, as when it comes from a socket.
void eventAndFilters(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  const auto messages = payloads();
  for (auto step : state) {
    for (const auto& payload : messages) {
      auto event = backend->newEventDictfromPayload(payload, kSentAt, kMethod, kStatus, EventID{1});
      backend->prepareEventForMessage(event);
      benchmark::DoNotOptimize(event);
    }
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(eventAndFilters);

Array eventsOf(HTTPSPostBackend& backend) {
  Array events;
  for (size_t i = 0; i < kBatch; ++i) {
    auto event = backend.newEventDictfromPayload(callPayload(i), kSentAt, kMethod, kStatus, EventID{1});
    backend.prepareEventForMessage(event);
    events.append(Value(std::move(event)));
  }
  return events;
}

void messageJson(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, messageLogOf(state));
  auto events = eventsOf(*backend);
  size_t bytes = 0;
  for (auto step : state) {
    MaybeString pretty;
    const auto body = backend->createMessageForPostAndLogging(events, &pretty);
    bytes = body->size();
    benchmark::DoNotOptimize(pretty);
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(bytes) / kBatch;
}
BENCHMARK(messageJson)->ArgName("message_log")->Arg(0)->Arg(1);

void gzipOfMessage(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  auto events = eventsOf(*backend);
  const auto body = backend->createMessageForPostAndLogging(events, nullptr);
  size_t bytes = 0;
  for (auto step : state) bytes = gzipDeflate(world.dependencies.log, *body)->size();
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(bytes) / kBatch;
}
BENCHMARK(gzipOfMessage);

// From the session's dispatch to the post: event, filters, batch, JSON, gzip.
void sessionToPost(benchmark::State& state) {
  BenchWorld world;
  const auto session = makeSession(world, messageLogOf(state));
  const auto messages = payloads();
  for (auto step : state) {
    for (const auto& payload : messages) {
      session->sendMessageWithCategory(13, 10, payload,
                                       [](MaybeSentObject sent) { benchmark::DoNotOptimize(sent); });
    }
    world.forget();
  }
  reportPerMessage(state, kBatch);
  state.counters["posts"] =
      benchmark::Counter(static_cast<double>(world.http.posts()), benchmark::Counter::kAvgIterations);
}
BENCHMARK(sessionToPost)->ArgName("message_log")->Arg(0)->Arg(1);

// The same, from the bus message on: the whole road but the socket and the HTTP client.
void busToPost(benchmark::State& state) {
  BenchWorld world;
  const auto session = makeSession(world, messageLogOf(state));
  SealedMessages bus;
  const auto message = bus.batch(kBatch);
  for (auto step : state) {
    sd_bus_message_rewind(message.get(), 1);
    auto batch = readBatch(message.get());
    for (auto& item : *batch) {
      session->sendMessageWithCategory(item.category, item.type, std::move(item.payload),
                                       [](MaybeSentObject sent) { benchmark::DoNotOptimize(sent); });
    }
    world.forget();
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(busToPost)->ArgName("message_log")->Arg(0)->Arg(1);

}  // namespace
}  // namespace tarnel::bench

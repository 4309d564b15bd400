// The pieces of the road of one message, and the whole of it inside the process.

#include <string>
#include <vector>

#include "bench/bench_world.h"
#include "bench/sample_payload.h"
#include "formats/compression.h"
#include "ipc/server/message_batch.h"
#include "ipc/server/send_call.h"

namespace tarnel::bench {
namespace {

constexpr TimeValue kSentAt{1700000060, 750000};
constexpr Method kMethod{13};
constexpr RespCode kStatus{10};

MessageLog messageLogOf(const benchmark::State& state) {
  return state.range(0) != 0 ? MessageLog::on : MessageLog::off;
}

std::vector<SealedMessages::Message> batchCalls(SealedMessages& bus) {
  std::vector<SealedMessages::Message> calls;
  for (size_t first = 0; first < kRing; first += kBatch) calls.push_back(bus.batch(first));
  return calls;
}

std::vector<std::string> batchCallBytes() {
  std::vector<std::string> calls;
  for (size_t first = 0; first < kRing; first += kBatch) calls.push_back(SealedMessages::batchBytes(first));
  return calls;
}

std::vector<MaybeDictionary> payloads() {
  std::vector<MaybeDictionary> result;
  for (size_t i = 0; i < kRing; ++i) result.emplace_back(callPayload(i));
  return result;
}

// A call of its own for each message, read by the bus library once it has it from the socket.
void libraryDecodesSingle(benchmark::State& state) {
  SealedMessages bus;
  std::vector<SealedMessages::Message> messages;
  for (size_t i = 0; i < kRing; ++i) messages.push_back(bus.single(i));
  size_t at = 0;
  for (auto step : state) {
    forNextBatch(messages, at, [](const SealedMessages::Message& message) {
      sd_bus_message_rewind(message.get(), 1);
      sd_bus_message_skip(message.get(), "qq");
      benchmark::DoNotOptimize(wire::readMaybeDictionary(message.get()));
    });
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(libraryDecodesSingle);

// Fifty messages in one call, read by the bus library.
void libraryDecodesBatch(benchmark::State& state) {
  SealedMessages bus;
  const auto calls = batchCalls(bus);
  size_t at = 0;
  for (auto step : state) {
    sd_bus_message_rewind(calls[at].get(), 1);
    benchmark::DoNotOptimize(readBatch(calls[at].get()));
    at = (at + 1) % calls.size();
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(libraryDecodesBatch);

// The same call, read straight from its bytes, as the daemon does.
void directDecode(benchmark::State& state) {
  const auto calls = batchCallBytes();
  size_t at = 0;
  for (auto step : state) {
    benchmark::DoNotOptimize(readSendCall(calls[at]));
    at = (at + 1) % calls.size();
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(calls.front().size()) / kBatch;
}
BENCHMARK(directDecode);

void eventAndFilters(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  const auto messages = payloads();
  size_t at = 0;
  for (auto step : state) {
    forNextBatch(messages, at, [&](const MaybeDictionary& payload) {
      auto event = backend->newEventDictfromPayload(payload, kSentAt, kMethod, kStatus, EventID{1});
      backend->prepareEventForMessage(event);
      benchmark::DoNotOptimize(event);
    });
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(eventAndFilters);

std::vector<Array> eventsOf(HTTPSPostBackend& backend) {
  std::vector<Array> batches(kRing / kBatch);
  for (size_t i = 0; i < kRing; ++i) {
    auto event = backend.newEventDictfromPayload(callPayload(i), kSentAt, kMethod, kStatus, EventID{1});
    backend.prepareEventForMessage(event);
    batches[i / kBatch].append(Value(std::move(event)));
  }
  return batches;
}

void messageJson(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, messageLogOf(state));
  auto batches = eventsOf(*backend);
  size_t at = 0;
  size_t bytes = 0;
  for (auto step : state) {
    MaybeString pretty;
    bytes = backend->createMessageForPostAndLogging(batches[at], &pretty)->size();
    benchmark::DoNotOptimize(pretty);
    at = (at + 1) % batches.size();
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(bytes) / kBatch;
}
BENCHMARK(messageJson)->ArgName("message_log")->Arg(0)->Arg(1);

void gzipOfMessage(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  std::vector<std::string> bodies;
  for (auto& events : eventsOf(*backend)) {
    bodies.push_back(*backend->createMessageForPostAndLogging(events, nullptr));
  }
  size_t at = 0;
  size_t bytes = 0;
  for (auto step : state) {
    bytes = gzipDeflate(world.dependencies.log, bodies[at])->size();
    at = (at + 1) % bodies.size();
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(bytes) / kBatch;
}
BENCHMARK(gzipOfMessage);

void send(TarneldSession& session, MaybeDictionary payload) {
  session.sendMessageWithCategory(13, 10, std::move(payload),
                                  [](MaybeSentObject sent) { benchmark::DoNotOptimize(sent); });
}

// From the session's dispatch to the post: event, filters, batch, JSON, gzip.
void sessionToPost(benchmark::State& state) {
  BenchWorld world;
  const auto session = makeSession(world, messageLogOf(state));
  const auto messages = payloads();
  size_t at = 0;
  for (auto step : state) {
    forNextBatch(messages, at, [&](const MaybeDictionary& payload) { send(*session, payload); });
    world.forget();
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(sessionToPost)->ArgName("message_log")->Arg(0)->Arg(1);

// The whole road but the socket and the HTTP client: from the call's bytes to the post.
void bytesToPost(benchmark::State& state) {
  BenchWorld world;
  const auto session = makeSession(world, messageLogOf(state));
  const auto calls = batchCallBytes();
  size_t at = 0;
  for (auto step : state) {
    auto call = readSendCall(calls[at]);
    for (auto& message : call->messages) send(*session, std::move(message.payload));
    world.forget();
    at = (at + 1) % calls.size();
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(bytesToPost)->ArgName("message_log")->Arg(0)->Arg(1);

}  // namespace
}  // namespace tarnel::bench

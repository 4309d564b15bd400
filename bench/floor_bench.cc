// The floor: what nobody who delivers these messages compressed can do without.

#include <zlib.h>

#include <string>
#include <vector>

#include "bench/bench_world.h"
#include "bench/raw_codec.h"
#include "bench/sample_payload.h"
#include "formats/json_writer.h"

namespace tarnel::bench {
namespace {

std::vector<Data> rawMessages() {
  std::vector<Data> messages;
  for (size_t i = 0; i < kRing; ++i) messages.push_back(encodeRaw(callPayload(i)));
  return messages;
}

// A text of JSON for each batch of the ring.
std::vector<std::string> jsonOfBatches() {
  std::vector<std::string> batches(kRing / kBatch);
  for (size_t i = 0; i < kRing; ++i) writeJson(callPayload(i), JsonStyle::compact, batches[i / kBatch]);
  return batches;
}

// gzip at level 6 through one stream that is set up once.
class Gzip {
 public:
  Gzip() { deflateInit2(&stream_, 6, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY); }
  Gzip(const Gzip&) = delete;
  Gzip& operator=(const Gzip&) = delete;
  ~Gzip() { deflateEnd(&stream_); }

  size_t compress(const std::string& input) {
    deflateReset(&stream_);
    output_.resize(deflateBound(&stream_, input.size()));
    stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(input.data()));
    stream_.avail_in = static_cast<uInt>(input.size());
    stream_.next_out = reinterpret_cast<Bytef*>(output_.data());
    stream_.avail_out = static_cast<uInt>(output_.size());
    deflate(&stream_, Z_FINISH);
    return stream_.total_out;
  }

 private:
  z_stream stream_{};
  std::string output_;
};

void floorDecode(benchmark::State& state) {
  const auto messages = rawMessages();
  size_t at = 0;
  for (auto step : state) {
    forNextBatch(messages, at, [](const Data& message) { benchmark::DoNotOptimize(decodeRaw(message)); });
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(floorDecode);

void floorJson(benchmark::State& state) {
  std::vector<Dictionary> messages;
  for (size_t i = 0; i < kRing; ++i) messages.push_back(callPayload(i));
  size_t at = 0;
  std::string json;
  for (auto step : state) {
    json.clear();
    forNextBatch(messages, at,
                 [&](const Dictionary& message) { writeJson(message, JsonStyle::compact, json); });
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(json.size()) / kBatch;
}
BENCHMARK(floorJson);

void floorGzip(benchmark::State& state) {
  const auto batches = jsonOfBatches();
  Gzip gzip;
  size_t compressed = 0;
  size_t at = 0;
  for (auto step : state) {
    compressed = gzip.compress(batches[at]);
    at = (at + 1) % batches.size();
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(compressed) / kBatch;
}
BENCHMARK(floorGzip);

void decodeWriteCompress(benchmark::State& state, const std::vector<Data>& messages) {
  Gzip gzip;
  std::string json;
  size_t at = 0;
  for (auto step : state) {
    json.clear();
    forNextBatch(messages, at,
                 [&](const Data& message) { writeJson(*decodeRaw(message), JsonStyle::compact, json); });
    benchmark::DoNotOptimize(gzip.compress(json));
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(json.size()) / kBatch;
}

// The three together, in the order in which messages come: this is the floor.
void floorWhole(benchmark::State& state) {
  decodeWriteCompress(state, rawMessages());
}
BENCHMARK(floorWhole);

// The same for the event that the message becomes: its JSON and its compression without any of our code
// around them. The distance to floorWhole is what the event's standard fields cost.
void floorOfTheEvent(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  std::vector<Data> events;
  for (size_t i = 0; i < kRing; ++i) {
    auto event = backend->newEventDictfromPayload(callPayload(i), {1700000060, 750000}, Method{13},
                                                  RespCode{10}, EventID{static_cast<uint16_t>(i)});
    backend->prepareEventForMessage(event);
    events.push_back(encodeRaw(event));
  }
  decodeWriteCompress(state, events);
}
BENCHMARK(floorOfTheEvent);

}  // namespace
}  // namespace tarnel::bench

// The floor: what nobody who delivers these messages compressed can do without.

#include <zlib.h>

#include <string>
#include <vector>

#include "bench/bench_world.h"
#include "bench/raw_codec.h"
#include "bench/sample_payload.h"
#include "platform/json_writer.h"

namespace tarnel::bench {
namespace {

std::vector<Data> rawMessages() {
  std::vector<Data> messages;
  for (size_t i = 0; i < kBatch; ++i) messages.push_back(encodeRaw(callPayload(i)));
  return messages;
}

std::vector<Dictionary> payloads() {
  std::vector<Dictionary> result;
  for (size_t i = 0; i < kBatch; ++i) result.push_back(callPayload(i));
  return result;
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

void writeAll(const std::vector<Dictionary>& messages, std::string& json) {
  json.clear();
  for (const auto& message : messages) writeJson(message, JsonStyle::compact, json);
}

void floorDecode(benchmark::State& state) {
  const auto messages = rawMessages();
  for (auto step : state) {
    for (const auto& message : messages) benchmark::DoNotOptimize(decodeRaw(message));
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(floorDecode);

void floorJson(benchmark::State& state) {
  const auto messages = payloads();
  std::string json;
  for (auto step : state) writeAll(messages, json);
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(json.size()) / kBatch;
}
BENCHMARK(floorJson);

void floorGzip(benchmark::State& state) {
  std::string json;
  writeAll(payloads(), json);
  Gzip gzip;
  size_t compressed = 0;
  for (auto step : state) benchmark::DoNotOptimize(compressed = gzip.compress(json));
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(compressed) / kBatch;
}
BENCHMARK(floorGzip);

// The three together, in the order in which messages come: this is the floor.
void floorWhole(benchmark::State& state) {
  const auto messages = rawMessages();
  Gzip gzip;
  std::string json;
  for (auto step : state) {
    json.clear();
    for (const auto& message : messages) writeJson(*decodeRaw(message), JsonStyle::compact, json);
    benchmark::DoNotOptimize(gzip.compress(json));
  }
  reportPerMessage(state, kBatch);
}
BENCHMARK(floorWhole);

// The same for the event that the message becomes: its JSON and its compression without any of our code
// around them. The distance to floorWhole is what the event's standard fields cost.
void floorOfTheEvent(benchmark::State& state) {
  BenchWorld world;
  const auto backend = makeBackend(world, MessageLog::off);
  const auto messages = rawMessages();
  std::vector<Data> events;
  for (size_t i = 0; i < kBatch; ++i) {
    auto event = backend->newEventDictfromPayload(callPayload(i), {1700000060, 750000}, Method{13},
                                                  RespCode{10}, EventID{static_cast<uint16_t>(i)});
    backend->prepareEventForMessage(event);
    events.push_back(encodeRaw(event));
  }
  Gzip gzip;
  std::string json;
  size_t compressed = 0;
  for (auto step : state) {
    json.clear();
    for (const auto& event : events) writeJson(*decodeRaw(event), JsonStyle::compact, json);
    benchmark::DoNotOptimize(compressed = gzip.compress(json));
  }
  reportPerMessage(state, kBatch);
  state.counters["bytes"] = static_cast<double>(json.size()) / kBatch;
}
BENCHMARK(floorOfTheEvent);

}  // namespace
}  // namespace tarnel::bench

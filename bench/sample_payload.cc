#include "bench/sample_payload.h"

#include <cmath>
#include <cstdint>
#include <string>

#include "tarnel/keys.h"

namespace tarnel::bench {
namespace {

// Small, fast and the same on every machine.
class Noise {
 public:
  explicit Noise(uint64_t seed) : state_(seed * 0x9E3779B97F4A7C15U + 0xD1B54A32D192ED03U) {}
  // Below `limit`.
  int64_t integer(uint64_t limit) {
    state_ ^= state_ << 13U;
    state_ ^= state_ >> 7U;
    state_ ^= state_ << 17U;
    return static_cast<int64_t>(state_ % limit);
  }
  // Below `limit`, with six decimals.
  double real(uint64_t limit) { return static_cast<double>(integer(limit * 1000000)) / 1e6; }

 private:
  uint64_t state_;
};

std::string candidateText(Noise& noise) {
  return "candidate:" + std::to_string(noise.integer(4000000000U)) + " 1 udp " +
         std::to_string(2122000000 + noise.integer(260000)) + " 192.0.2." +
         std::to_string(noise.integer(255)) + " " + std::to_string(40000 + noise.integer(20000)) +
         " typ host";
}

}  // namespace

Dictionary callPayload(size_t index) {
  Noise noise(index + 1);
  const auto second = static_cast<int64_t>(index);
  Dictionary payload;
  payload.reserve(25);
  payload.set("userName", "zoe.mueller@example.org");
  payload.set("remoteUserName", "ravi.patel@example.org");
  payload.set("sampleIndex", second);
  payload.set("codec", "video/VP8");
  payload.set("packetsReceived", second * 68 + noise.integer(9));
  payload.set("bytesReceived", second * 55498 + noise.integer(9000));
  payload.set("packetsLost", noise.integer(12));
  payload.set("jitter", noise.real(1));
  payload.set("jitterBufferDelay", static_cast<double>(second) * 0.1 + noise.real(1));
  payload.set("jitterBufferEmittedCount", second * 20 + noise.integer(3));
  payload.set("framesReceived", second * 20 + noise.integer(3));
  payload.set("framesDecoded", second * 20);
  payload.set("framesDropped", noise.integer(4));
  payload.set("framesPerSecond", 20 + noise.integer(3));
  payload.set("frameWidth", 640);
  payload.set("frameHeight", 480);
  payload.set("qpSum", second * 616 + noise.integer(60));
  payload.set("totalFreezesDuration", noise.real(2));
  payload.set("pliCount", noise.integer(2));
  payload.set("retransmittedPacketsReceived", noise.integer(20));
  payload.set("lossPercent", noise.real(5));
  payload.set("bitrateKbps", 400 + noise.real(90));
  payload.set("localCandidate", candidateText(noise));
  payload.set("remoteCandidate", candidateText(noise));
  payload.set("writable", true);
  return payload;
}

Dictionary smallPayload(size_t index) {
  Noise noise(index + 1);
  Dictionary payload;
  payload.reserve(3);
  payload.set("sampleIndex", static_cast<int64_t>(index));
  payload.set("state", "connected");
  payload.set("lossPercent", noise.real(5));
  return payload;
}

Dictionary userInfo(const char* serviceName) {
  return {{kTarnelUserInfoClientName, "Meetwell"}, {kTarnelUserInfoServiceName, serviceName}};
}

}  // namespace tarnel::bench

#include "platform/linux/system/system_random.h"

#include <sys/random.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <span>

namespace tarnel {
namespace {

void fillWithRandom(std::span<uint8_t> bytes) {
  while (!bytes.empty()) {
    const ssize_t count = getrandom(bytes.data(), bytes.size(), 0);
    if (count > 0) {
      bytes = bytes.subspan(static_cast<size_t>(count));
    } else if (errno != EINTR) {
      // Going on with predictable identifiers would be worse.
      std::fprintf(stderr, "<2>getrandom: %s; the sandbox must allow this system call\n",
                   std::strerror(errno));
      std::abort();
    }
  }
}

}  // namespace

double SystemRandom::uniform() {
  std::array<uint8_t, sizeof(uint64_t)> bytes{};
  fillWithRandom(std::span(bytes).first<6>());
  uint64_t bits = 0;
  for (const uint8_t byte : bytes) bits = bits << 8U | byte;
  constexpr double kTwoTo64 = 18446744073709551616.0;
  return static_cast<double>(bits) / kTwoTo64;  // the 48 bits stand at the top
}

UuidBytes SystemRandom::uuid() {
  UuidBytes bytes{};
  fillWithRandom(bytes);
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0FU) | 0x40U);  // version 4
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3FU) | 0x80U);  // variant of RFC 4122
  return bytes;
}

}  // namespace tarnel

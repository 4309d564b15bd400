#include "tests/fuzz/dbus_frame.h"

#include <array>

#include "tests/fuzz/fuzz_target.h"

namespace tarnel::fuzz {
namespace {

constexpr size_t kFixedHeader = 16;

void pad(std::string& bytes, size_t boundary) {
  while (bytes.size() % boundary != 0) bytes += '\0';
}

void put(std::string& bytes, uint32_t number) {
  pad(bytes, 4);
  for (int i = 0; i < 4; ++i, number >>= 8U) bytes += static_cast<char>(number & 0xFFU);
}

void putField(std::string& bytes, uint8_t code, char type, std::string_view text) {
  if (text.empty()) return;
  pad(bytes, 8);
  bytes += {static_cast<char>(code), 1, type, 0};
  if (type == 'g') {
    bytes += static_cast<char>(text.size());
  } else {
    put(bytes, static_cast<uint32_t>(text.size()));
  }
  bytes += text;
  bytes += '\0';
}

void putField(std::string& bytes, uint8_t code, uint32_t number) {
  if (number == 0) return;
  pad(bytes, 8);
  bytes += {static_cast<char>(code), 1, 'u', 0};
  put(bytes, number);
}

uint32_t numberAt(std::string_view bytes, size_t offset) {
  uint32_t number = 0;
  for (size_t i = 4; i-- > 0;) number = number << 8U | static_cast<uint8_t>(bytes[offset + i]);
  return number;
}

}  // namespace

std::string bytesOf(const DbusFrame& frame) {
  std::string bytes{'l', static_cast<char>(frame.type), static_cast<char>(frame.flags), 1};
  put(bytes, static_cast<uint32_t>(frame.body.size()));
  put(bytes, frame.serial);
  put(bytes, 0);  // length of the fields, when it is known
  putField(bytes, 1, 'o', frame.path);
  putField(bytes, 2, 's', frame.interface);
  putField(bytes, 3, 's', frame.member);
  putField(bytes, 4, 's', frame.errorName);
  putField(bytes, 5, frame.replySerial);
  putField(bytes, 8, 'g', frame.signature);
  putField(bytes, 9, frame.descriptors);
  std::string length;
  put(length, static_cast<uint32_t>(bytes.size() - kFixedHeader));
  bytes.replace(kFixedHeader - length.size(), length.size(), length);
  pad(bytes, 8);
  return bytes.append(frame.body);
}

DbusCounts countMessages(std::string_view written) {
  while (!written.empty() && written.front() != 'l') {
    const auto end = written.find("\r\n");
    if (end == std::string_view::npos) return {};
    written.remove_prefix(end + 2);
  }
  std::array<size_t, 4> counts{};
  while (written.size() >= kFixedHeader) {
    const auto type = static_cast<uint8_t>(written[1]);
    require(written[0] == 'l' && type >= 1 && type <= 4, "what is written is messages");
    const size_t header = kFixedHeader + (size_t{numberAt(written, 12)} + 7) / 8 * 8;
    const size_t size = header + numberAt(written, 4);
    require(size <= written.size(), "a message is written whole");
    ++counts[type - 1];
    written.remove_prefix(size);
  }
  require(written.empty(), "nothing stands behind the last message");
  return {.calls = counts[0], .returns = counts[1], .errors = counts[2]};
}

}  // namespace tarnel::fuzz

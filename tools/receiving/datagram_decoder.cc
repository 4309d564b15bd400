#include "tools/receiving/datagram_decoder.h"

#include <algorithm>

#include "base/value.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr size_t kFormatOffset = 2;
constexpr size_t kFractionOffset = 3;
constexpr size_t kSecondsOffset = 4;
constexpr size_t kSessionOffset = 8;
constexpr size_t kClientVersionOffset = 12;
constexpr size_t kLengthOffset = 14;
constexpr size_t kMethodOffset = 16;
constexpr size_t kStatusOffset = 18;
constexpr size_t kDeviceOffset = 20;
constexpr size_t kDeviceBytes = 40;
constexpr size_t kEventOffset = 60;
constexpr size_t kFlagsOffset = 62;

constexpr unsigned int kFormat = 1;
constexpr unsigned int kFractionsPerSecond = 250;
constexpr unsigned int kReliableFlag = 1;
constexpr unsigned int kExplicitServerFlag = 2;

uint16_t number16(std::span<const uint8_t> bytes, size_t offset) {
  return static_cast<uint16_t>(bytes[offset] << 8U | bytes[offset + 1]);
}

uint32_t number32(std::span<const uint8_t> bytes, size_t offset) {
  return uint32_t{number16(bytes, offset)} << 16U | number16(bytes, offset + 2);
}

uint16_t inverted16(std::span<const uint8_t> bytes, size_t offset) {
  return static_cast<uint16_t>(~number16(bytes, offset));
}

std::string textOf(std::span<const uint8_t> bytes) {
  return {bytes.begin(), bytes.end()};
}

std::string unescaped(std::string_view value) {
  std::string plain;
  for (size_t i = 0; i < value.size(); ++i) {
    const bool escape = value[i] == '\\' && i + 1 < value.size();
    if (escape) ++i;
    plain += value[i];
  }
  return plain;
}

// Where the equal signs stand that end a key: those without a backslash before them.
std::vector<size_t> keyEnds(std::string_view text) {
  std::vector<size_t> ends;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\') {
      ++i;
    } else if (text[i] == '=') {
      ends.push_back(i);
    }
  }
  return ends;
}

void readEntries(DashboardDatagram& datagram, Problems& problems) {
  const std::string_view text = datagram.text;
  if (text.empty()) return;
  const std::vector<size_t> ends = keyEnds(text);
  if (text.front() != ' ' || ends.empty()) {
    problems.add("text: must consist of a blank, a key, = and a value for each entry");
    return;
  }
  // A key begins after the last blank before its end; what is between keys is the earlier one's value.
  std::vector<size_t> starts;
  for (const size_t end : ends) {
    const size_t blank = text.rfind(' ', end);
    if (!starts.empty() && blank <= ends[starts.size() - 1]) {
      problems.add("text: an equal sign at byte " + std::to_string(end) + " ends no key");
      return;
    }
    starts.push_back(blank + 1);
  }
  if (starts.front() != 1) problems.add("text: the first key has a blank in it");
  for (size_t i = 0; i < ends.size(); ++i) {
    const size_t valueEnd = i + 1 < ends.size() ? starts[i + 1] - 1 : text.size();
    datagram.entries.emplace_back(text.substr(starts[i], ends[i] - starts[i]),
                                  unescaped(text.substr(ends[i] + 1, valueEnd - ends[i] - 1)));
  }
}

void checkFields(std::span<const uint8_t> bytes, const DashboardDatagram& datagram, Problems& problems) {
  if (bytes[kFractionOffset] >= kFractionsPerSecond) {
    problems.add("byte 3: the part of the second must be below 250, but is " +
                 std::to_string(bytes[kFractionOffset]));
  }
  const unsigned int flags = number16(bytes, kFlagsOffset);
  if ((flags & ~(kReliableFlag | kExplicitServerFlag)) != 0) {
    problems.add("bytes 62 and 63: flags that do not exist are set: " + std::to_string(flags));
  }
  if (!isValidUtf8(datagram.text)) problems.add("text: is not UTF-8");
  if (!isValidUtf8(datagram.device)) problems.add("device identifier: is not UTF-8");
}

std::string reasonAgainst(std::span<const uint8_t> bytes) {
  const std::string size = std::to_string(bytes.size());
  if (bytes.size() < kDatagramHeaderBytes) return "has " + size + " bytes; the header alone has 64";
  if (bytes.size() > kMaxDatagramBytes) return "has more than 1,087 bytes";
  if (bytes[kFormatOffset] != kFormat) {
    return "byte 2 must be 1, but is " + std::to_string(bytes[kFormatOffset]);
  }
  const unsigned int length = inverted16(bytes, kLengthOffset);
  if (length != bytes.size()) return "has " + size + " bytes, but names " + std::to_string(length);
  return "";
}

}  // namespace

std::optional<DashboardDatagram> readDatagram(std::span<const uint8_t> bytes, Problems& problems) {
  if (const std::string reason = reasonAgainst(bytes); !reason.empty()) {
    problems.add("no datagram: " + reason);
    return std::nullopt;
  }
  DashboardDatagram datagram;
  datagram.reportVersion = bytes[0];
  datagram.clientType = bytes[1];
  datagram.time =
      number32(bytes, kSecondsOffset) + static_cast<double>(bytes[kFractionOffset]) / kFractionsPerSecond;
  datagram.sessionID = ~number32(bytes, kSessionOffset);
  datagram.clientVersion = inverted16(bytes, kClientVersionOffset);
  datagram.method = number16(bytes, kMethodOffset);
  datagram.status = number16(bytes, kStatusOffset);
  const auto device = bytes.subspan(kDeviceOffset, kDeviceBytes);
  datagram.device = textOf(device.first(
      static_cast<size_t>(std::find(device.begin(), device.end(), uint8_t{0}) - device.begin())));
  datagram.event = number16(bytes, kEventOffset);
  const unsigned int flags = number16(bytes, kFlagsOffset);
  datagram.isReliable = (flags & kReliableFlag) != 0;
  datagram.isServerFromStorebag = (flags & kExplicitServerFlag) == 0;
  datagram.text = textOf(bytes.subspan(kDatagramHeaderBytes));
  readEntries(datagram, problems);
  checkFields(bytes, datagram, problems);
  return datagram;
}

std::vector<uint8_t> acknowledgementOf(std::span<const uint8_t> datagram) {
  const auto header = datagram.first(kFlagsOffset);
  return {header.begin(), header.end()};
}

}  // namespace tarnel::lab

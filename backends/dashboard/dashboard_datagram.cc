#include "backends/dashboard/dashboard_datagram.h"

#include <algorithm>
#include <concepts>
#include <cstdio>
#include <vector>

#include "backends/https/sender_names.h"

namespace tarnel {
namespace {

constexpr size_t kSecondsOffset = 4;
constexpr size_t kSessionIDOffset = 8;
constexpr size_t kClientVersionOffset = 12;
constexpr size_t kLengthOffset = 14;
constexpr size_t kMethodOffset = 16;
constexpr size_t kRespCodeOffset = 18;
constexpr size_t kUdidOffset = 20;
constexpr size_t kUdidSize = 40;
constexpr size_t kEventIDOffset = 60;
constexpr size_t kFlagsOffset = 62;

constexpr int kMicrosecondsPerUnit = 4000;
constexpr int kMillisecondsPerUnit = 4;
constexpr uint16_t kReliableFlag = 1;
constexpr uint16_t kExplicitServerFlag = 2;

// The longest line fits with room to spare: 111 characters and the text.
constexpr size_t kLogLineSize = 1152;

// Big-endian.
template <std::unsigned_integral Number>
void put(DashboardBuffer& buffer, size_t offset, Number number) {
  for (size_t i = sizeof(Number); i-- > 0; number = static_cast<Number>(number >> 8U)) {
    buffer[offset + i] = static_cast<uint8_t>(number);
    if constexpr (sizeof(Number) == 1) break;
  }
}

template <std::unsigned_integral Number>
Number get(std::span<const uint8_t> bytes, size_t offset) {
  Number number = 0;
  for (size_t i = 0; i < sizeof(Number); ++i) number = static_cast<Number>(number << 8U | bytes[offset + i]);
  return number;
}

uint16_t complement(uint16_t number) {
  return static_cast<uint16_t>(number ^ 0xFFFFU);
}

// How long the description of the value is, in UTF-16 code units as everywhere where the length of a text
// counts: one for every character, a second for those beyond U+FFFF.
size_t descriptionLength(const Value& value) {
  const auto* text = value.string();
  if (text == nullptr) return descriptionForObject(value).size();
  size_t units = 0;
  for (const char c : *text) {
    const auto byte = static_cast<uint8_t>(c);
    if ((byte & 0xC0U) != 0x80U) units += byte >= 0xF0U ? 2 : 1;
  }
  return units;
}

// Text of a field, for %s, which takes it up to its first zero byte.
std::string fieldText(std::span<const uint8_t> field) {
  return {field.begin(), field.end()};
}

}  // namespace

size_t writeDashboardDatagram(const DashboardHeader& header, const std::string& text,
                              DashboardBuffer& buffer) {
  const size_t textSize = std::min(text.size(), kDashboardMaxText);
  const size_t length = kDashboardHeaderSize + textSize;
  std::fill_n(buffer.begin(), kDashboardHeaderSize, uint8_t{0});
  buffer[0] = header.selfVersionMajor;
  buffer[1] = static_cast<uint8_t>(header.compType);
  buffer[2] = 1;
  buffer[3] = static_cast<uint8_t>(header.timestamp.microseconds / kMicrosecondsPerUnit);
  put(buffer, kSecondsOffset, static_cast<uint32_t>(header.timestamp.seconds));
  put(buffer, kSessionIDOffset, ~header.sessionID);
  put(buffer, kClientVersionOffset, complement(header.clientVersion));
  put(buffer, kMethodOffset, static_cast<uint16_t>(header.method));
  put(buffer, kRespCodeOffset, static_cast<uint16_t>(header.respCode));
  std::copy_n(header.udid.begin(), std::min(header.udid.size(), kUdidSize), buffer.begin() + kUdidOffset);
  put(buffer, kEventIDOffset, static_cast<uint16_t>(header.eventID));
  put(buffer, kFlagsOffset,
      static_cast<uint16_t>((header.isReliable ? kReliableFlag : 0) |
                            (header.isServerFromProfile ? 0 : kExplicitServerFlag)));
  std::copy_n(text.begin(), textSize, buffer.begin() + kDashboardHeaderSize);
  put(buffer, kLengthOffset, complement(static_cast<uint16_t>(length)));
  return length;
}

std::string dashboardText(const Dictionary& payload) {
  struct Entry {
    size_t length;
    const Dictionary::Entry* entry;
  };
  std::vector<Entry> entries;
  entries.reserve(payload.size());
  for (const auto& entry : payload) entries.push_back({descriptionLength(entry.second), &entry});
  std::stable_sort(entries.begin(), entries.end(),
                   [](const Entry& a, const Entry& b) { return a.length < b.length; });
  std::string text;
  for (const auto& [length, entry] : entries) {
    const auto& [key, value] = *entry;
    text += ' ';
    text += key;
    text += '=';
    text += sanitize(descriptionForObject(value));
    if (text.size() <= kDashboardMaxText) continue;
    text.resize(wholeCharacters(text, kDashboardMaxText).size());
    break;
  }
  return text;
}

std::string descriptionForObject(const Value& object) {
  if (object.string() != nullptr) return *object.string();
  return object.isNumber() ? object.description() : "null";
}

std::string sanitize(std::string_view text) {
  std::string clean;
  clean.reserve(text.size());
  for (const char c : text) {
    if (c == '\n') continue;
    if (c == '\\' || c == '=') clean += '\\';
    clean += c;
  }
  return clean.empty() ? "empty" : clean;
}

std::string writeLocalLog(std::span<const uint8_t> datagram) {
  std::array<char, kLogLineSize> line;  // filled by snprintf
  const std::string udid = fieldText(datagram.subspan(kUdidOffset, kUdidSize));
  // Who has no name still has a column.
  const std::string_view name = senderName(datagram[1]);
  const std::string sender(name.empty() ? "-" : name);
  const std::string text = fieldText(datagram.subspan(kDashboardHeaderSize));
  const int length = std::snprintf(
      line.data(), line.size(), "%u.%03d %s 127.0.0.1 %s %5u %5u %5u %5u %5u %s",
      get<uint32_t>(datagram, kSecondsOffset), datagram[3] * kMillisecondsPerUnit, udid.c_str(),
      sender.c_str(), unsigned{complement(get<uint16_t>(datagram, kClientVersionOffset))},
      ~get<uint32_t>(datagram, kSessionIDOffset), unsigned{get<uint16_t>(datagram, kEventIDOffset)},
      unsigned{get<uint16_t>(datagram, kMethodOffset)}, unsigned{get<uint16_t>(datagram, kRespCodeOffset)},
      text.c_str());
  return {line.data(), std::clamp<size_t>(length < 0 ? 0 : static_cast<size_t>(length), 0, line.size() - 1)};
}

std::optional<EventID> acknowledgedEvent(std::span<const uint8_t> datagram) {
  if (datagram.size() < kEventIDOffset + sizeof(uint16_t)) return std::nullopt;
  return EventID{get<uint16_t>(datagram, kEventIDOffset)};
}

}  // namespace tarnel

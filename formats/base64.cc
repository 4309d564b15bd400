#include <algorithm>
#include <array>

#include "formats/cryptography.h"

namespace tarnel {
namespace {

constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr uint8_t kOutside = 0xFF;

constexpr std::array<uint8_t, 256> makeTable() {
  std::array<uint8_t, 256> table{};
  table.fill(kOutside);
  for (size_t i = 0; i < kAlphabet.size(); ++i) {
    table[static_cast<uint8_t>(kAlphabet[i])] = static_cast<uint8_t>(i);
  }
  return table;
}
constexpr auto kTable = makeTable();

// How many padding characters come before the next character of the alphabet or the end.
size_t paddingAtFront(std::string_view text) {
  size_t count = 0;
  for (const char c : text) {
    if (kTable[static_cast<uint8_t>(c)] != kOutside) break;
    if (c == '=') ++count;
  }
  return count;
}

}  // namespace

std::string base64Encode(std::span<const uint8_t> bytes) {
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  for (size_t i = 0; i < bytes.size(); i += 3) {
    const size_t count = std::min<size_t>(3, bytes.size() - i);
    uint32_t group = static_cast<uint32_t>(bytes[i]) << 16U;
    if (count > 1) group |= static_cast<uint32_t>(bytes[i + 1]) << 8U;
    if (count > 2) group |= bytes[i + 2];
    out += kAlphabet[group >> 18U];
    out += kAlphabet[(group >> 12U) & 63U];
    out += count > 1 ? kAlphabet[(group >> 6U) & 63U] : '=';
    out += count > 2 ? kAlphabet[group & 63U] : '=';
  }
  return out;
}

std::optional<Data> base64Decode(std::string_view text) {
  Data out;
  out.reserve(text.size() / 4 * 3 + 2);
  uint32_t group = 0;
  size_t held = 0;  // characters in the group
  size_t padding = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '=') {
      padding = paddingAtFront(text.substr(i));
      break;
    }
    const uint8_t bits = kTable[static_cast<uint8_t>(text[i])];
    if (bits == kOutside) continue;
    group = group << 6U | bits;
    if (++held < 4) continue;
    out.push_back(static_cast<uint8_t>(group >> 16U));
    out.push_back(static_cast<uint8_t>(group >> 8U));
    out.push_back(static_cast<uint8_t>(group));
    group = 0;
    held = 0;
  }
  if (held == 1 || (padding != 0 && (held == 0 || held + padding != 4))) return std::nullopt;
  if (held >= 2) out.push_back(static_cast<uint8_t>(group >> (held == 2 ? 4U : 10U)));
  if (held == 3) out.push_back(static_cast<uint8_t>(group >> 2U));
  return out;
}

}  // namespace tarnel

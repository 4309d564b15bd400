#include "backends/https/case_folding.h"

#include <cstdint>

namespace tarnel {
namespace {

constexpr char foldAscii(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

constexpr bool within(uint32_t character, uint32_t first, uint32_t last) {
  return character >= first && character <= last;
}

constexpr uint32_t foldLatin(uint32_t c) {
  if (within(c, 0xC0, 0xDE)) return c == 0xD7 ? c : c + 0x20;
  // Pairs of a capital and its small letter, the capital on even code points in these ranges ...
  if (within(c, 0x100, 0x12F) || within(c, 0x132, 0x137) || within(c, 0x14A, 0x177)) return c | 1U;
  // ... and on odd ones in these.
  if (within(c, 0x139, 0x148) || within(c, 0x179, 0x17E)) return c + (c & 1U);
  return c == 0x178 ? 0xFF : c;
}

constexpr uint32_t foldGreek(uint32_t c) {
  if (within(c, 0x391, 0x3A1) || within(c, 0x3A3, 0x3AB)) return c + 0x20;
  if (within(c, 0x388, 0x38A)) return c + 0x25;
  if (within(c, 0x38E, 0x38F)) return c + 0x3F;
  if (c == 0x386) return 0x3AC;
  if (c == 0x38C) return 0x3CC;
  return c == 0x3C2 ? 0x3C3 : c;  // final sigma
}

constexpr uint32_t foldCyrillic(uint32_t c) {
  if (within(c, 0x400, 0x40F)) return c + 0x50;
  return within(c, 0x410, 0x42F) ? c + 0x20 : c;
}

constexpr uint32_t foldCharacter(uint32_t c) {
  if (c < 0x180) return foldLatin(c);
  return c < 0x400 ? foldGreek(c) : foldCyrillic(c);
}

// The two-byte sequences of UTF-8 hold all letters that are folded here.
constexpr bool isTwoByteLead(uint8_t byte) {
  return byte >= 0xC2 && byte <= 0xDF;
}

}  // namespace

std::string foldCase(std::string_view text) {
  std::string folded(text);
  for (size_t i = 0; i < folded.size(); ++i) {
    const auto byte = static_cast<uint8_t>(folded[i]);
    if (byte < 0x80) {
      folded[i] = foldAscii(folded[i]);
    } else if (isTwoByteLead(byte) && i + 1 < folded.size()) {
      const uint32_t tail = static_cast<uint8_t>(folded[i + 1]) & 0x3FU;
      const uint32_t character = foldCharacter((byte & 0x1FU) << 6U | tail);
      folded[i] = static_cast<char>(0xC0U | character >> 6U);
      folded[i + 1] = static_cast<char>(0x80U | (character & 0x3FU));
      ++i;
    }
  }
  return folded;
}

bool equalsFolded(std::string_view folded, std::string_view text) {
  if (folded.size() != text.size()) return false;
  for (size_t i = 0; i < text.size(); ++i) {
    if (static_cast<uint8_t>(text[i]) >= 0x80) return folded.substr(i) == foldCase(text.substr(i));
    if (folded[i] != foldAscii(text[i])) return false;
  }
  return true;
}

}  // namespace tarnel

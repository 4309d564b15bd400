#include "base/text_case.h"

#include <locale.h>
#include <wctype.h>

#include <algorithm>
#include <array>
#include <cstdint>

#include "base/utf8.h"

namespace tarnel {
namespace {

// Made before main, because its data lies in files that the sandbox closes, and never freed, because threads
// may still use it while the process ends. Null where the system has no such locale.
const locale_t kCaseLocale = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);

constexpr char foldAscii(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

char32_t decodeCharacter(std::string_view bytes) {
  constexpr std::array<uint32_t, 5> kLeadBits = {0, 0x7F, 0x1F, 0x0F, 0x07};
  auto code = static_cast<unsigned char>(bytes.front()) & kLeadBits[bytes.size()];
  for (const char c : bytes.substr(1)) code = (code << 6U) | (static_cast<unsigned char>(c) & 0x3FU);
  return static_cast<char32_t>(code);
}

void appendCharacter(std::string& out, char32_t code) {
  if (code < 0x80) {
    out += static_cast<char>(code);
    return;
  }
  const int continuations = code < 0x800 ? 1 : code < 0x10000 ? 2 : 3;
  constexpr std::array<uint32_t, 4> kLeads = {0, 0xC0, 0xE0, 0xF0};
  out += static_cast<char>(kLeads[static_cast<size_t>(continuations)] | (code >> (6 * continuations)));
  for (int i = continuations - 1; i >= 0; --i) out += static_cast<char>(0x80U | ((code >> (6 * i)) & 0x3FU));
}

char32_t lowerCharacter(char32_t code) {
  return static_cast<char32_t>(towlower_l(static_cast<wint_t>(code), kCaseLocale));
}

char32_t foldCharacter(char32_t code) {
  return lowerCharacter(static_cast<char32_t>(towupper_l(static_cast<wint_t>(code), kCaseLocale)));
}

// Each character changed; of ASCII both ways change the same letters.
std::string changeEach(std::string_view text, char32_t (*change)(char32_t)) {
  std::string changed;
  if (isAscii(text) || !foldsBeyondAscii() || !isValidUtf8(text)) {
    changed.resize(text.size());
    std::transform(text.begin(), text.end(), changed.begin(), foldAscii);
    return changed;
  }
  changed.reserve(text.size());
  while (!text.empty()) {
    const auto character = text.substr(0, utf8CharacterLength(text));
    text.remove_prefix(character.size());
    appendCharacter(changed, change(decodeCharacter(character)));
  }
  return changed;
}

}  // namespace

std::string foldCase(std::string_view text) {
  return changeEach(text, foldCharacter);
}

std::string lowerCase(std::string_view text) {
  return changeEach(text, lowerCharacter);
}

bool equalsFolded(std::string_view folded, std::string_view text) {
  const size_t common = std::min(folded.size(), text.size());
  for (size_t i = 0; i < common; ++i) {
    if (static_cast<unsigned char>(text[i]) >= 0x80) return folded.substr(i) == foldCase(text.substr(i));
    if (folded[i] != foldAscii(text[i])) return false;
  }
  return folded.size() == text.size();
}

bool foldsBeyondAscii() noexcept {
  return kCaseLocale != nullptr;
}

}  // namespace tarnel

#include "base/log_text.h"

#include <cstdint>

#include "base/hex.h"
#include "base/utf8.h"

namespace tarnel {

namespace {

constexpr size_t kMaxText = 16384;

void appendEscape(std::string& out, char character) {
  switch (character) {
    case '\n':
      out += "\\n";
      return;
    case '\r':
      out += "\\r";
      return;
    case '\t':
      out += "\\t";
      return;
    default:
      out += "\\x";
      appendHex(out, static_cast<uint8_t>(character));
  }
}

// Terminals obey the control characters U+0080 to U+009F as well.
bool isControl(std::string_view sequence) {
  const auto first = static_cast<unsigned char>(sequence[0]);
  if (sequence.size() == 1) return first < 0x20 || first == 0x7F;
  return sequence.size() == 2 && first == 0xC2 && static_cast<unsigned char>(sequence[1]) < 0xA0;
}

}  // namespace

std::string escapedForLog(std::string_view text) {
  if (text.ends_with('\n')) text.remove_suffix(1);
  const size_t size = text.size();
  text = wholeCharacters(text, kMaxText);
  const size_t cut = size - text.size();
  std::string out;
  out.reserve(text.size());
  while (!text.empty()) {
    const size_t length = utf8CharacterLength(text);
    const std::string_view sequence = text.substr(0, length == 0 ? 1 : length);
    if (length == 0 || isControl(sequence)) {
      for (const char character : sequence) appendEscape(out, character);
    } else {
      out += sequence;
    }
    text.remove_prefix(sequence.size());
  }
  if (cut != 0) out += " [" + std::to_string(cut) + " bytes more]";
  return out;
}

}  // namespace tarnel

#include "tools/tarnelctl/visible_output.h"

#include <iterator>
#include <string>

#include "base/hex.h"

namespace tarnel::ctl {
namespace {

constexpr unsigned char kC2 = 0xC2;

bool isControl(unsigned char byte) {
  return (byte < 0x20 && byte != '\n' && byte != '\t') || byte == 0x7F;
}

}  // namespace

VisibleOutput::int_type VisibleOutput::overflow(int_type character) {
  if (traits_type::eq_int_type(character, traits_type::eof())) return traits_type::not_eof(character);
  const auto byte = static_cast<unsigned char>(traits_type::to_char_type(character));
  if (holdsC2_ && byte >= 0x80 && byte < 0xA0) {  // terminals obey U+0080 to U+009F too
    holdsC2_ = false;
    return putEscape(kC2) && putEscape(byte) ? character : traits_type::eof();
  }
  if (!putHeld()) return traits_type::eof();
  if (byte == kC2) {
    holdsC2_ = true;
    return character;
  }
  return (isControl(byte) ? putEscape(byte) : put(byte)) ? character : traits_type::eof();
}

int VisibleOutput::sync() {
  return target_.pubsync();
}

bool VisibleOutput::put(unsigned char byte) {
  const auto character = static_cast<char>(byte);
  return !traits_type::eq_int_type(target_.sputc(character), traits_type::eof());
}

bool VisibleOutput::putEscape(unsigned char byte) {
  std::string escape = "\\x";
  appendHex(escape, byte);
  return target_.sputn(escape.data(), std::ssize(escape)) == std::ssize(escape);
}

bool VisibleOutput::putHeld() {
  if (!holdsC2_) return true;
  holdsC2_ = false;
  return put(kC2);
}

}  // namespace tarnel::ctl

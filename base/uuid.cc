#include "base/uuid.h"

namespace tarnel {

std::string uuidText(const UuidBytes& uuid) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < uuid.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
    out += kDigits[uuid[i] >> 4U];
    out += kDigits[uuid[i] & 15U];
  }
  return out;
}

}  // namespace tarnel

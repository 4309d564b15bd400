#include "base/uuid.h"

#include "base/hex.h"

namespace tarnel {

std::string uuidText(const UuidBytes& uuid) {
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < uuid.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
    appendHex(out, uuid[i], kUpperHexDigits);
  }
  return out;
}

}  // namespace tarnel

#include "backends/https/sender_names.h"

#include <array>

namespace tarnel {

std::string_view senderName(int32_t compType) noexcept {
  static constexpr std::array<std::string_view, 18> kNames{
      "PX", "DW", "BOR", "HY",   "MQ",    "EJ",     "ZU",       "KA",     "OW",
      "FE", "YL", "UB",  "PLMA", "TOVAN", "VN-KRS", "VN-DULEX", "OSTRIK", "FRANDEL"};
  if (compType < 0 || static_cast<size_t>(compType) >= kNames.size()) return {};
  return kNames[static_cast<size_t>(compType)];
}

}  // namespace tarnel

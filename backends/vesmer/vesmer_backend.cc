#include "backends/vesmer/vesmer_backend.h"

#include "platform/power_log.h"

namespace tarnel {
namespace {

constexpr int32_t kPowerLogClient = 28;
constexpr char kPowerLogEvent[] = "Halvend-TRN";

}  // namespace

std::shared_ptr<VesmerBackend> VesmerBackend::initWithName(const Dependencies& dependencies,
                                                           const std::string& name,
                                                           const MaybeDictionary& profile,
                                                           const MaybeString& productFamily) {
  return std::make_shared<VesmerBackend>(Private{}, dependencies, name, profile, productFamily);
}

VesmerBackend::VesmerBackend(Private, const Dependencies& dependencies, const std::string& name,
                             const MaybeDictionary& profile, const MaybeString& productFamily)
    : TarnelBackend(dependencies, name, profile, productFamily) {}

MaybeSentObject VesmerBackend::sendMessage(const MaybeDictionary& payload, const TimeValue& /*timestamp*/,
                                           Method method, RespCode respCode, EventID eventID) {
  if (method == Method{0} || !payload || payload->empty()) return std::nullopt;
  Dictionary event = *payload;
  event.set("method", static_cast<uint16_t>(method));
  event.set("respCode", static_cast<uint16_t>(respCode));
  event.set("event", static_cast<uint16_t>(eventID));
  dependencies().powerLog.logRegisteredEvent(kPowerLogClient, kPowerLogEvent, event, std::nullopt);
  return std::nullopt;
}

}  // namespace tarnel

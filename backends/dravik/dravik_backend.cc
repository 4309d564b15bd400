#include "backends/dravik/dravik_backend.h"

namespace tarnel {
namespace {

constexpr char kBundlePath[] =
    "/System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";
constexpr char kForwardingMethod[] = "sendMessageWithMethod:respCode:dict:";

}  // namespace

std::shared_ptr<DravikBackend> DravikBackend::initWithName(const Dependencies& dependencies,
                                                           const std::string& name,
                                                           const MaybeDictionary& profile,
                                                           const MaybeString& productFamily,
                                                           int32_t clientType) {
  auto backend = std::make_shared<DravikBackend>(Private{}, dependencies, name, profile, productFamily);
  TARNEL_LOG(dependencies.log, information,
             "DravikBackend(initWithName): Loading Dravik adaptor class for client type %d", clientType);
  if (!isClientTypeAllowed(clientType)) {
    TARNEL_LOG(dependencies.log, error,
               "DravikBackend(initWithName): No matching bundle found for client type %d", clientType);
    return nullptr;
  }
  backend->loadAdaptor();
  return backend;
}

std::shared_ptr<DravikBackend> DravikBackend::initWithName(const Dependencies& dependencies,
                                                           const std::string& name,
                                                           const MaybeDictionary& profile,
                                                           const MaybeString& productFamily) {
  return initWithName(dependencies, name, profile, productFamily, 0);
}

DravikBackend::DravikBackend(Private, const Dependencies& dependencies, const std::string& name,
                             const MaybeDictionary& profile, const MaybeString& productFamily)
    : TarnelBackend(dependencies, name, profile, productFamily) {}

bool DravikBackend::isClientTypeAllowed(int32_t clientType) noexcept {
  return clientType == 7 || clientType == 11 || clientType == 13;
}

void DravikBackend::loadAdaptor() {
  clientBundle = dependencies().codeBundles.bundleWithPath(kBundlePath);
  if (clientBundle == nullptr) return;
  if (!clientBundle->isLoaded() && !clientBundle->load()) return;
  dravikAdaptorClass = clientBundle->classNamed("DravikAdaptor");
  if (dravikAdaptorClass != nullptr) dravikAdaptor = dravikAdaptorClass->newInstance();
}

MaybeSentObject DravikBackend::sendMessage(const MaybeDictionary& payload, const TimeValue& /*timestamp*/,
                                           Method method, RespCode respCode, EventID /*eventID*/,
                                           Flag /*flag*/) {
  if (dravikAdaptor != nullptr && dravikAdaptor->respondsTo(kForwardingMethod)) {
    dravikAdaptor->perform(kForwardingMethod, method, respCode, payload);
    return std::nullopt;
  }
  const MaybeString adaptor =
      dravikAdaptor == nullptr ? std::nullopt : MaybeString(dravikAdaptor->description());
  TARNEL_LOG(dependencies().log, error,
             "DravikBackend(sendMessage): Dravik adaptor %s does not respond to forwarding selector %s",
             printable(adaptor), kForwardingMethod);
  return std::nullopt;
}

}  // namespace tarnel

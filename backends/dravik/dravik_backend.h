#pragma once

#include <memory>

#include "backends/tarnel_backend.h"
#include "platform/code_bundle.h"

namespace tarnel {

// Hands each message to the diagnostics adaptor, an object of a code bundle, by the name of its method.
// Without that bundle it goes on, and says so with every message.
//
// Threads: the owning session's. The adaptor is called on it, one message at a time.
class DravikBackend final : public TarnelBackend {
 private:
  struct Private {};  // construction goes through initWithName

 public:
  // initWithName:profile:productFamily:clientType:
  // Null for the client types that have no adaptor.
  static std::shared_ptr<DravikBackend> initWithName(const Dependencies& dependencies,
                                                     const std::string& name, const MaybeDictionary& profile,
                                                     const MaybeString& productFamily, int32_t clientType);
  // initWithName:profile:productFamily: with client type 0, which has none.
  static std::shared_ptr<DravikBackend> initWithName(const Dependencies& dependencies,
                                                     const std::string& name, const MaybeDictionary& profile,
                                                     const MaybeString& productFamily);
  DravikBackend(Private, const Dependencies& dependencies, const std::string& name,
                const MaybeDictionary& profile, const MaybeString& productFamily);

  // isClientTypeAllowed:
  static bool isClientTypeAllowed(int32_t clientType) noexcept;

  using TarnelBackend::sendMessage;
  // Only method, respCode and payload reach the adaptor. Never returns anything.
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, EventID eventID, Flag flag) override;

 private:
  void loadAdaptor();

  // In this order: what stands further down goes first, and an instance needs its class, and that its bundle.
  std::shared_ptr<CodeBundle> clientBundle;
  std::shared_ptr<BundleClass> dravikAdaptorClass;
  std::unique_ptr<BundleInstance> dravikAdaptor;
};

}  // namespace tarnel

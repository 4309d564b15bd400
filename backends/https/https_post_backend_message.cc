#include "backends/https/https_post_backend.h"

// What of the backend goes into its messages.

namespace tarnel {

MaybeString HTTPSPostBackend::clientIdentifier() const {
  if (_extrasOnInternal != 0 && isInternal()) return udid();
  if (_uuidCustom) return _uuidCustom;
  return _dnuType != 0 ? _uuidOverrideDnu : _uuidRespectDnu;
}

bool HTTPSPostBackend::prettyCopyAllowed() const {
  if (_dnuType == 0 && _dnuEnabled) return true;
  if (!_forceEventLogging) return false;
  const auto environment = dependencies().process.currentEnvironmentType();
  return environment == EnvironmentType::development || environment == EnvironmentType::orvaneInternal;
}

MessageWriter HTTPSPostBackend::messageWriter() const {
  return {dependencies().log, dependencies().clock, clientIdentifier(), prettyCopyAllowed()};
}

std::optional<std::string> HTTPSPostBackend::createMessageForPostAndLogging(Array& events,
                                                                            MaybeString* prettyJsonString) {
  return messageWriter().write(events, prettyJsonString);
}

}  // namespace tarnel

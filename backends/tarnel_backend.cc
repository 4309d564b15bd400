#include "backends/tarnel_backend.h"

#include <algorithm>
#include <utility>

#include "base/hex.h"
#include "formats/cryptography.h"

namespace tarnel {
namespace {

// Length in UTF-16 code units: one for every character, a second for those beyond U+FFFF.
size_t utf16Length(std::string_view text) {
  size_t units = 0;
  for (const char c : text) {
    const auto byte = static_cast<uint8_t>(c);
    if ((byte & 0xC0U) != 0x80U) units += byte >= 0xF0U ? 2 : 1;
  }
  return units;
}

uint8_t versionComponent(std::string_view component) {
  return static_cast<uint8_t>(Value(component).uint64Value());
}

}  // namespace

TarnelBackend::TarnelBackend(const Dependencies& dependencies, std::string name,
                             const MaybeDictionary& profile, const MaybeString& productFamily)
    : _dependencies(dependencies),
      _name(std::move(name)),
      _productFamily(productFamily),
      _samplingFactor(dependencies.random.uniform()),
      _profile(profile) {}

std::shared_ptr<TarnelBackend> TarnelBackend::initWithName(const Dependencies& dependencies,
                                                           const std::string& name,
                                                           const MaybeDictionary& profile,
                                                           const MaybeString& productFamily) {
  struct PlainBackend final : TarnelBackend {
    PlainBackend(const Dependencies& dependencies, const std::string& name, const MaybeDictionary& profile,
                 const MaybeString& productFamily)
        : TarnelBackend(dependencies, name, profile, productFamily) {}
  };
  return std::make_shared<PlainBackend>(dependencies, name, profile, productFamily);
}

std::string TarnelBackend::convertIntoSHA256(std::string_view text) {
  const auto covered = text.substr(0, std::min(text.size(), utf16Length(text)));
  const auto* bytes = reinterpret_cast<const uint8_t*>(covered.data());
  return hexText(sha256({bytes, covered.size()}));
}

MaybeSentObject TarnelBackend::sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp,
                                           Method method, RespCode respCode, Flag flag) {
  ++_eventID;
  return sendMessage(payload, timestamp, method, respCode, EventID{_eventID}, flag);
}

MaybeSentObject TarnelBackend::sendMessage(const MaybeDictionary& /*payload*/, const TimeValue& /*timestamp*/,
                                           Method /*method*/, RespCode /*respCode*/, EventID /*eventID*/,
                                           Flag /*flag*/) {
  return std::nullopt;
}

MaybeString TarnelBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  completion(std::nullopt, std::nullopt);
  return std::nullopt;
}

bool TarnelBackend::uploadFileAtPath(const std::string& /*path*/, const std::string& /*extensionToken*/) {
  return false;
}

bool TarnelBackend::uploadLogData(const Array& /*logData*/) {
  return false;
}

void TarnelBackend::setSelfVersion(std::string_view version) {
  const auto dot = version.find('.');
  _selfVersionMajor = versionComponent(version.substr(0, dot));
  _selfVersionMinor = 0;
  if (dot == std::string_view::npos) return;
  const auto rest = version.substr(dot + 1);
  _selfVersionMinor = versionComponent(rest.substr(0, rest.find('.')));
}

}  // namespace tarnel

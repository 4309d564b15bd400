#include "util/device_facts.h"

#include <cstring>
#include <string_view>

#include "base/text_case.h"
#include "base/utf8.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

std::string loweredEntry(const MaybeDictionary& dictionary, std::string_view key) {
  const auto* text = dictionary ? findString(*dictionary, key) : nullptr;
  return text == nullptr ? std::string() : lowerCase(*text);
}

}  // namespace

MaybeString productVersion(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("ProductVersion");
}

MaybeString buildVersion(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("BuildVersion");
}

MaybeString productType(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("ProductType");
}

MaybeString deviceName(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("DeviceName");
}

MaybeString hardwareModel(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("HWModelStr");
}

MaybeString serialNumber(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("SerialNumber");
}

MaybeString releaseType(DeviceInformation& deviceInformation) {
  return deviceInformation.copyAnswer("ReleaseType");
}

void getUniqueDeviceID(DeviceInformation& deviceInformation, char* destination, size_t size) {
  if (destination == nullptr || size == 0) return;
  const auto answer = deviceInformation.copyAnswer("UniqueDeviceID");
  if (!answer) return;
  const std::string_view fitting = wholeCharacters(*answer, size - 1);
  std::memcpy(destination, fitting.data(), fitting.size());
  destination[fitting.size()] = '\0';
  destination[size - 1] = '\0';
}

std::string userInfoKey(const MaybeDictionary& userInfo) {
  return loweredEntry(userInfo, kTarnelUserInfoClientName) + ":" +
         loweredEntry(userInfo, kTarnelUserInfoServiceName);
}

}  // namespace tarnel

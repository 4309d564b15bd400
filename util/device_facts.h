#pragma once

#include <cstddef>

#include "base/value.h"
#include "platform/device_information.h"

// What the rest of the daemon asks about the device. Nothing means that the device has no answer.

namespace tarnel {

MaybeString productVersion(DeviceInformation& deviceInformation);  // "ProductVersion"
MaybeString buildVersion(DeviceInformation& deviceInformation);    // "BuildVersion"
MaybeString productType(DeviceInformation& deviceInformation);     // "ProductType"
MaybeString deviceName(DeviceInformation& deviceInformation);      // "DeviceName"
MaybeString hardwareModel(DeviceInformation& deviceInformation);   // "HWModelStr"
MaybeString serialNumber(DeviceInformation& deviceInformation);    // "SerialNumber"
MaybeString releaseType(DeviceInformation& deviceInformation);     // "ReleaseType"

// Copies the answer to "UniqueDeviceID" as UTF-8 with its terminator into the buffer of `size` bytes
// (41 for 40 characters). Without an answer the buffer stays as it is; an answer that does not fit is cut
// to whole characters that do.
void getUniqueDeviceID(DeviceInformation& deviceInformation, char* destination, size_t size);

// "%@:%@" of the client name and service name in small letters, as lowerCase gives them; a missing one is the
// empty text.
std::string userInfoKey(const MaybeDictionary& userInfo);

}  // namespace tarnel

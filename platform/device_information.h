#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// Facts about the device and its system, by key: "ProductVersion", "BuildVersion", "ProductType",
// "DeviceName", "HWModelStr", "SerialNumber", "ReleaseType", "UniqueDeviceID". Threads: any.
class DeviceInformation {
 public:
  DeviceInformation() = default;
  DeviceInformation(const DeviceInformation&) = delete;
  DeviceInformation& operator=(const DeviceInformation&) = delete;
  virtual ~DeviceInformation() = default;

  // Asked afresh on every call; nothing when the device has no answer.
  virtual std::optional<std::string> copyAnswer(std::string_view key) = 0;
};

}  // namespace tarnel

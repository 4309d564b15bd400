#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/log.h"
#include "platform/device_information.h"
#include "platform/linux/configuration/once_log.h"

namespace tarnel {

// Facts of this machine, read anew on every call; <configuration>/device.toml decides key by key first.
//
// "ProductVersion": VERSION_ID of os-release. "BuildVersion": BUILD_ID of os-release, else the kernel's
// release. "ProductType": model of the device tree, else DMI's product name. "DeviceName": PRETTY_HOSTNAME
// of machine-info, else the host name. "HWModelStr": first compatible name of the device tree, else DMI's
// board name. "SerialNumber": of the device tree, else of DMI, where they may be read. "ReleaseType": only
// from device.toml. "UniqueDeviceID": 40 lower-case hexadecimal digits that follow from the machine-id, which
// itself never leaves the machine. Where there is none (in containers, say), a warning names the remedies.
//
// A text in device.toml that is empty says that the device has no answer.
class LinuxDeviceInformation final : public DeviceInformation {
 public:
  // `rootDirectory` stands before every path of the system ("" outside tests).
  LinuxDeviceInformation(const std::string& configurationDirectory, std::string rootDirectory, Log& log);

  std::optional<std::string> copyAnswer(std::string_view key) override;

 private:
  // Nothing: device.toml does not speak of the key. An empty text: it says that there is no answer.
  std::optional<std::string> overridden(std::string_view key);
  std::optional<std::string> firmware(const char* deviceTreeName, const char* dmiName) const;

  std::optional<std::string> uniqueDeviceIDOfThisMachine();

  const std::string overrides_;
  const std::string root_;
  OnceLog problems_;
  OnceLog missing_;
};

// The device's identifier as it follows from the text of /etc/machine-id; nothing when that is no machine-id
// (32 hexadecimal digits, not all zero).
std::optional<std::string> uniqueDeviceID(std::string_view machineID);

}  // namespace tarnel

#pragma once

#include <atomic>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/client_bundle.h"
#include "platform/consent.h"
#include "platform/device_information.h"
#include "platform/keep_alive.h"
#include "platform/locale_information.h"

namespace tarnel::fake {

// Answers what the test put into `answers`. Set up before threads start.
class FakeDeviceInformation final : public DeviceInformation {
 public:
  std::map<std::string, std::string, std::less<>> answers{
      {"ProductVersion", "12.5"},
      {"BuildVersion", "24A100"},
      {"ProductType", "Slate7,1"},
      {"DeviceName", "Slate"},
      {"HWModelStr", "S7"},
      {"SerialNumber", "TN12345"},
      {"UniqueDeviceID", "0123456789abcdef0123456789abcdef01234567"}};
  // How often anything was asked.
  std::atomic<int> queries{0};

  std::optional<std::string> copyAnswer(std::string_view key) override {
    ++queries;
    const auto found = answers.find(key);
    return found == answers.end() ? std::nullopt : std::optional(found->second);
  }
};

class FakeConsent final : public Consent {
 public:
  std::atomic<bool> allowed{true};
  bool isDiagnosticSubmissionAllowed() override { return allowed; }
};

class FakeLocaleInformation final : public LocaleInformation {
 public:
  std::optional<std::string> country = "DE";
  std::atomic<int32_t> offset{3600};
  std::optional<std::string> countryCode() override { return country; }
  int32_t secondsFromGMT(int64_t /*time*/) override { return offset; }
};

class FakeClientBundle final : public ClientBundle {
 public:
  std::optional<std::string> versionText = "3.2";
  std::map<std::string, Data, std::less<>> resources;  // "name.type" to bytes
  std::optional<std::string> version() override { return versionText; }
  std::optional<Data> resource(std::string_view name, std::string_view type) override {
    const auto found = resources.find(std::string(name) + "." + std::string(type));
    return found == resources.end() ? std::nullopt : std::optional(found->second);
  }
};

class FakeKeepAlive final : public KeepAlive {
 public:
  std::atomic<int> begun{0};
  std::atomic<int> ended{0};
  // Begun while open, or ended while closed.
  std::atomic<bool> turnedTwice{false};
  void beginTransaction() override {
    if (isOpen_.exchange(true)) turnedTwice = true;
    ++begun;
  }
  void endTransaction() override {
    if (!isOpen_.exchange(false)) turnedTwice = true;
    ++ended;
  }

 private:
  std::atomic<bool> isOpen_{false};
};

}  // namespace tarnel::fake

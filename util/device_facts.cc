#include "util/device_facts.h"

#include <locale.h>
#include <wctype.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string_view>

#include "client/include/tarnel/keys.h"

namespace tarnel {
namespace {

// For lower-casing beyond ASCII. Made before main, because its data lies in files that the sandbox closes,
// and never freed, because threads may still use it while the process ends. Null where the system has no
// such locale; then only ASCII letters are lower-cased.
const locale_t kCaseLocale = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);

constexpr bool isAscii(char c) {
  return static_cast<unsigned char>(c) < 0x80;
}

constexpr bool isContinuation(char c) {
  return (static_cast<unsigned char>(c) & 0xC0U) == 0x80U;
}

// Length in bytes of the character that begins with this byte of well-formed UTF-8.
constexpr size_t characterLength(char first) {
  const auto byte = static_cast<unsigned char>(first);
  if (byte < 0x80) return 1;
  if (byte < 0xE0) return 2;
  return byte < 0xF0 ? 3 : 4;
}

char32_t decodeCharacter(std::string_view bytes) {
  constexpr std::array<uint32_t, 5> kLeadBits = {0, 0x7F, 0x1F, 0x0F, 0x07};
  auto code = static_cast<unsigned char>(bytes.front()) & kLeadBits[bytes.size()];
  for (const char c : bytes.substr(1)) code = (code << 6U) | (static_cast<unsigned char>(c) & 0x3FU);
  return static_cast<char32_t>(code);
}

void appendCharacter(std::string& out, char32_t code) {
  if (code < 0x80) {
    out += static_cast<char>(code);
    return;
  }
  const int continuations = code < 0x800 ? 1 : code < 0x10000 ? 2 : 3;
  constexpr std::array<uint32_t, 4> kLeads = {0, 0xC0, 0xE0, 0xF0};
  out += static_cast<char>(kLeads[static_cast<size_t>(continuations)] | (code >> (6 * continuations)));
  for (int i = continuations - 1; i >= 0; --i) out += static_cast<char>(0x80U | ((code >> (6 * i)) & 0x3FU));
}

char asciiLowerCased(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

std::string lowerCased(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  const bool asciiOnly =
      kCaseLocale == nullptr || std::all_of(text.begin(), text.end(), isAscii) || !isValidUtf8(text);
  if (asciiOnly) {
    for (const char c : text) out += asciiLowerCased(c);
    return out;
  }
  while (!text.empty()) {
    const auto character = text.substr(0, characterLength(text.front()));
    text.remove_prefix(character.size());
    const auto code = static_cast<wint_t>(decodeCharacter(character));
    appendCharacter(out, static_cast<char32_t>(towlower_l(code, kCaseLocale)));
  }
  return out;
}

std::string lowerCasedEntry(const MaybeDictionary& dictionary, std::string_view key) {
  const auto* text = dictionary ? findString(*dictionary, key) : nullptr;
  return text == nullptr ? std::string() : lowerCased(*text);
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
  size_t length = std::min(answer->size(), size - 1);
  while (length > 0 && length < answer->size() && isContinuation((*answer)[length])) --length;
  std::memcpy(destination, answer->data(), length);
  destination[length] = '\0';
  destination[size - 1] = '\0';
}

std::string userInfoKey(const MaybeDictionary& userInfo) {
  return lowerCasedEntry(userInfo, kTarnelUserInfoClientName) + ":" +
         lowerCasedEntry(userInfo, kTarnelUserInfoServiceName);
}

}  // namespace tarnel

// The query of an upload's URL: any bytes become text that a URL may hold and that reads back as it was.

#include "base/percent_encoding.h"
#include "tests/fuzz/fuzz_target.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"kept", "encoded", "above 127", "control character", "long"};

namespace {

constexpr std::string_view kKept = "-._~!$&'()*+,;=:@/?";

bool isLetterOrDigit(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  require(c >= 'A' && c <= 'F', "an escape has capital digits");
  return c - 'A' + 10;
}

std::string decoded(std::string_view text) {
  std::string bytes;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      require(isLetterOrDigit(text[i]) || kKept.find(text[i]) != kKept.npos, "nothing else stands unencoded");
      bytes.push_back(text[i]);
      continue;
    }
    require(i + 2 < text.size(), "an escape is whole");
    bytes.push_back(static_cast<char>(hexDigit(text[i + 1]) << 4 | hexDigit(text[i + 2])));
    require(!isLetterOrDigit(bytes.back()) && kKept.find(bytes.back()) == kKept.npos,
            "only what must be is encoded");
    i += 2;
  }
  return bytes;
}

}  // namespace

void runOne(std::span<const uint8_t> input) {
  const auto text = asText(input);
  const auto encoded = percentEncodedForQuery(text);
  require(decoded(encoded) == text, "it reads back as it was");
  for (const auto byte : input) {
    if (byte > 127) reached("above 127");
    if (byte < 32) reached("control character");
    reached(encoded.size() == text.size() ? "kept" : "encoded");
  }
  if (text.size() > 1000) reached("long");
}

}  // namespace tarnel::fuzz

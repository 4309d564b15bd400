#include "tests/fuzz/fuzz_target.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>

#include "tests/fuzz/milestones.h"

namespace tarnel::fuzz {

std::set<std::string, std::less<>>& reachedMilestones() {
  static std::set<std::string, std::less<>> names;
  return names;
}

void reached(std::string_view milestone) {
  require(kMilestones.contains(milestone), "a milestone stands in kMilestones");
  auto& names = reachedMilestones();
  if (!names.contains(milestone)) names.emplace(milestone);
}

void require(bool condition, const char* whatMustHold) {
  if (condition) return;
  std::fprintf(stderr, "must hold: %s\n", whatMustHold);
  std::abort();
}

uint8_t InputReader::byte() {
  if (rest_.empty()) return 0;
  const auto first = rest_.front();
  rest_ = rest_.subspan(1);
  return first;
}

uint32_t InputReader::below(uint32_t bound) {
  uint32_t value = byte();
  if (bound > 256) value = value << 8 | byte();
  return value % bound;
}

uint64_t InputReader::number() {
  uint64_t value = 0;
  for (int i = 0; i < 8; ++i) value = value << 8 | byte();
  return value;
}

std::string InputReader::line() {
  const auto text = asText(rest_);
  const auto end = std::min(text.find('\n'), text.size());
  rest_ = rest_.subspan(std::min(end + 1, rest_.size()));
  return std::string(text.substr(0, end));
}

std::string InputReader::shortText() {
  const size_t announced = byte();
  const size_t length = std::min(announced, rest_.size());
  const auto text = asText(rest_.first(length));
  rest_ = rest_.subspan(length);
  return std::string(text);
}

}  // namespace tarnel::fuzz

#pragma once

#include <cstdint>
#include <set>
#include <span>
#include <string>
#include <string_view>

// What every fuzz target is made of. A target is one source file that defines runOne() and kMilestones;
// tarnel_fuzz_target() in CMakeLists.txt makes two programs of it: a libFuzzer program (preset fuzz), and a
// test that replays the target's corpus in every other build.

namespace tarnel::fuzz {

// Takes one input through the code under test. Defined by the target. Nothing may be kept from one input to
// the next, or a finding could not be repeated.
void runOne(std::span<const uint8_t> input);

// What the inputs of the corpus reach between them, each marked by reached(). Defined by the target. The
// replay fails when one of them is not reached: that is how a target proves that it gets past the parser.
extern const std::set<std::string_view> kMilestones;

// Marks one of kMilestones; another name ends the program.
void reached(std::string_view milestone);

// Ends the program, as a finding, unless the condition holds.
void require(bool condition, const char* whatMustHold);

inline std::string_view asText(std::span<const uint8_t> bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

// Takes an input apart from the front. Once it is used up, numbers are 0 and texts empty.
class InputReader {
 public:
  explicit InputReader(std::span<const uint8_t> input) : rest_(input) {}

  bool atEnd() const { return rest_.empty(); }
  uint8_t byte();
  // Below the bound, which is 1 or more.
  uint32_t below(uint32_t bound);
  uint64_t number();  // 8 bytes
  // Up to a line feed, which is consumed; for inputs that a person can read and write.
  std::string line();
  // A length of one byte, then so many bytes.
  std::string shortText();
  std::string_view rest() const { return asText(rest_); }

 private:
  std::span<const uint8_t> rest_;
};

}  // namespace tarnel::fuzz

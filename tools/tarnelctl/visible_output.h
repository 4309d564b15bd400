#pragma once

#include <streambuf>

namespace tarnel::ctl {

// What clients and servers chose ends up on the terminal of an administrator, who must see it rather than
// have it obeyed: control characters but newline and tab come out as \x1b and the like; all else passes.
class VisibleOutput final : public std::streambuf {
 public:
  explicit VisibleOutput(std::streambuf& target) : target_(target) {}

 protected:
  int_type overflow(int_type character) override;
  int sync() override;

 private:
  bool put(unsigned char byte);
  bool putEscape(unsigned char byte);
  bool putHeld();

  std::streambuf& target_;
  bool holdsC2_ = false;  // the first byte of U+0080 to U+00BF; the next one tells which
};

}  // namespace tarnel::ctl

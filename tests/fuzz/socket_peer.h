#pragma once

#include <string>
#include <string_view>

#include "base/unique_fd.h"

namespace tarnel::fuzz {

// How many descriptors are open, of the low numbers that one input comes to.
int openDescriptors();

// One end of a socket pair, for the side that the fuzzer plays; nothing here waits.
class SocketPeer {
 public:
  SocketPeer();

  // The end of the code under test; once.
  UniqueFd takeOther() { return std::move(other_); }
  // Whole or not at all; with `descriptors` descriptors of a small regular file.
  void write(std::string_view bytes, unsigned descriptors = 0);
  void endWriting();
  // Takes what there is to what was read before.
  void drain();
  const std::string& received() const { return received_; }

 private:
  UniqueFd own_;
  UniqueFd other_;
  std::string received_;
};

}  // namespace tarnel::fuzz

#pragma once

#include <sys/types.h>

#include <string>

namespace tarnel::ctl {

// While it lives, a process of root acts as the owner of the directory, so that what it finds there is
// judged, and what it makes there belongs and leads, as if the owner had done it. Other processes stay what
// they are. Threads: for the process as a whole; while it has one.
class ActingAsOwner {
 public:
  explicit ActingAsOwner(const std::string& directory);
  ActingAsOwner(const ActingAsOwner&) = delete;
  ActingAsOwner& operator=(const ActingAsOwner&) = delete;
  ~ActingAsOwner();

 private:
  bool changed_ = false;
  gid_t group_ = 0;
};

}  // namespace tarnel::ctl

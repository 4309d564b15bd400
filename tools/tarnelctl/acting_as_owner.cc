#include "tools/tarnelctl/acting_as_owner.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>

namespace tarnel::ctl {

ActingAsOwner::ActingAsOwner(const std::string& directory) : group_(::getegid()) {
  struct stat status {};
  if (::geteuid() != 0 || ::stat(directory.c_str(), &status) != 0 || status.st_uid == 0) return;
  if (::setegid(status.st_gid) != 0) throw std::system_error(errno, std::generic_category(), directory);
  if (::seteuid(status.st_uid) != 0) {
    const int reason = errno;
    if (::setegid(group_) != 0) std::abort();
    throw std::system_error(reason, std::generic_category(), directory);
  }
  changed_ = true;
}

ActingAsOwner::~ActingAsOwner() {
  if (changed_ && (::seteuid(0) != 0 || ::setegid(group_) != 0)) std::abort();
}

}  // namespace tarnel::ctl

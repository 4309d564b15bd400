#pragma once

#include <cstdint>
#include <string>

namespace tarnel::lab {

// One answered request for a storebag.
struct ServedStorebag {
  double time = 0;  // seconds since 1970
  std::string sender;
  std::string name;
  std::string version;  // of the storebag; empty when none was served
  int status = 0;
  uint64_t bytes = 0;
  std::string remark;  // what was done on purpose, or why there was none; may be empty
};

// What the lab has to say beside arrivals. Threads: called on many at once.
class Notices {
 public:
  Notices() = default;
  Notices(const Notices&) = delete;
  Notices& operator=(const Notices&) = delete;
  virtual ~Notices() = default;

  virtual void storebagServed(const ServedStorebag& served) = 0;
  // Something that a person should look at.
  virtual void warning(const std::string& text) = 0;
};

}  // namespace tarnel::lab

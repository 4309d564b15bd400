#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "base/error.h"
#include "base/unique_fd.h"

namespace tarnel {

// A small process that says which executable another process runs.
//
// The kernel forbids a process in a Landlock sandbox to look at processes outside of it. Where a rule asks
// for executables, main starts a witness before it confines itself. The witness answers nothing else, can
// start nothing, opens no sockets, and ends with the process that started it.
//
// Threads: any; one question at a time.
class ProcessWitness {
 public:
  // To be called while the process has one thread.
  static Result<std::unique_ptr<ProcessWitness>> start();
  ProcessWitness(const ProcessWitness&) = delete;
  ProcessWitness& operator=(const ProcessWitness&) = delete;
  // Ends the witness and waits for its end.
  ~ProcessWitness();

  // Nothing when the witness may not look, there is no such process, or no answer comes within a second,
  // after which there are no more answers.
  std::optional<std::string> executable(int32_t pid);

 private:
  ProcessWitness(UniqueFd channel, int32_t pid) : channel_(std::move(channel)), pid_(pid) {}

  std::mutex mutex_;
  UniqueFd channel_;  // guarded by mutex_
  const int32_t pid_;
};

}  // namespace tarnel

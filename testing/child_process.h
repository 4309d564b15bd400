#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/unique_fd.h"
#include "testing/test_folder.h"
#include "testing/waiting.h"

namespace tarnel::test {

// How a process ended.
struct ProcessEnd {
  int status = -1;  // exit status, or -1 when a signal ended it
  int signal = 0;
};

struct ProcessOptions {
  std::string program;  // opened by this process, so that its folder may be closed to the account
  std::vector<std::string> arguments;
  // "NAME=VALUE". Of this process's own environment a program gets what it needs to run, nothing else.
  std::vector<std::string> environment;
  std::optional<Account> account;                // none: this process's own
  std::vector<gid_t> supplementaryGroups;        // with an account
  std::vector<int> descriptors;                  // become 3, 4, ...
  bool descriptorsAreForServiceManager = false;  // adds LISTEN_FDS and LISTEN_PID
};

// A program that runs as a child, its standard output and error captured, its standard input a pipe. It is
// killed when this object goes, and when the test dies.
// Threads: any, but for stopping and waiting.
class ChildProcess {
 public:
  explicit ChildProcess(const ProcessOptions& options);
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  ~ChildProcess();

  pid_t pid() const { return pid_; }
  // Becomes readable when it has ended.
  int endDescriptor() const { return pidfd_.get(); }
  bool isRunning() const;

  // All that it has written until now.
  std::string output() const;
  std::string errors() const;
  // Waits until the text stands in the output (or errors) behind the given position; false when it does not
  // come, also because the program ended.
  bool waitForOutput(std::string_view text, size_t from = 0, Deadline deadline = Deadline()) const;
  bool waitForErrors(std::string_view text, size_t from = 0, Deadline deadline = Deadline()) const;

  bool writeInput(std::string_view text) const;
  void closeInput() { input_.reset(); }
  void signal(int number) const;
  // Nothing when it does not end in time.
  std::optional<ProcessEnd> waitForEnd(Deadline deadline = Deadline());

 private:
  struct Stream {
    UniqueFd descriptor;
    std::string text;
    bool reading = false;
    bool ended = false;
  };

  void readStreams();
  std::string textOf(const Stream& stream) const;
  bool waitFor(const Stream& stream, std::string_view text, size_t from, Deadline deadline) const;

  pid_t pid_ = -1;
  UniqueFd pidfd_;
  UniqueFd input_;
  UniqueFd quit_;
  std::optional<ProcessEnd> end_;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  // Guarded by mutex_.
  Stream output_;
  Stream errors_;
  std::thread reader_;
};

// A program run to its end.
struct FinishedProcess {
  ProcessEnd end;
  std::string output;
  std::string errors;
};
FinishedProcess runProcess(const ProcessOptions& options, std::string_view input = {});

}  // namespace tarnel::test

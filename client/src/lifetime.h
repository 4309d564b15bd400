#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

// The sessions of the process, so that they end well when it forks or ends.

namespace tarnel::core {

class SessionCore;

// A descriptor that a forked child must close: without that, the daemon would take the child for the
// parent that died.
//
// Threads: change() from one; the rest of the process forks whenever it likes.
class ForkVisibleDescriptor {
 public:
  // Runs `change`, which opens or closes the descriptor and returns it (-1 for none), while no fork can
  // happen.
  void change(const std::function<int()>& change);
  // In the forked child only.
  void closeInChild();

 private:
  int fd_ = -1;
};

// The descriptors of files that wait to be uploaded: a forked child closes them, too. Threads: any.
inline constexpr int kTooManyUploads = -2;
// Runs `open`, which returns a descriptor or -1, while no fork can happen. kTooManyUploads when as many are
// open as may be.
int openForUpload(const std::function<int()>& open);
void closeForUpload(int descriptor);

// Makes the session known until it is forgotten, and sees to it that fork and exit are noticed.
void rememberSession(const std::shared_ptr<SessionCore>& session);
void forgetSession(const SessionCore* session);

// Changes in a forked child: what was made under another number belongs to the parent.
uint32_t forkGeneration() noexcept;

// What happens at the end of the process, as a named function: closes all sessions, and waits for them within
// their linger time and a little more.
void closeAllSessionsAtExit();

}  // namespace tarnel::core

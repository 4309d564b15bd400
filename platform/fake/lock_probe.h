#pragma once

#include <thread>

namespace tarnel::fake {

// Whether another thread could take the lock at this moment.
template <class Lock>
bool isFree(Lock& lock) {
  bool taken = false;
  std::thread([&lock, &taken] {
    if (lock.try_lock()) {
      taken = true;
      lock.unlock();
    }
  }).join();
  return taken;
}

}  // namespace tarnel::fake

#pragma once

#include <mutex>

// Clang's thread-safety analysis; nothing for other compilers.
#if defined(__clang__)
#define TARNEL_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define TARNEL_THREAD_ANNOTATION(x)
#endif

#define TARNEL_CAPABILITY(x) TARNEL_THREAD_ANNOTATION(capability(x))
#define TARNEL_SCOPED_CAPABILITY TARNEL_THREAD_ANNOTATION(scoped_lockable)
#define TARNEL_GUARDED_BY(x) TARNEL_THREAD_ANNOTATION(guarded_by(x))
#define TARNEL_REQUIRES(...) TARNEL_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define TARNEL_ACQUIRE(...) TARNEL_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define TARNEL_TRY_ACQUIRE(...) TARNEL_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define TARNEL_RELEASE(...) TARNEL_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define TARNEL_EXCLUDES(...) TARNEL_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define TARNEL_NO_THREAD_SAFETY_ANALYSIS TARNEL_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace tarnel {

// A recursive lock that the analysis knows. Each lock of the system is a type of its own derived from this
// one, so that a signature says which lock it wants.
class TARNEL_CAPABILITY("recursive mutex") RecursiveLock {
 public:
  void lock() TARNEL_ACQUIRE() { mutex_.lock(); }
  bool try_lock() TARNEL_TRY_ACQUIRE(true) { return mutex_.try_lock(); }
  void unlock() TARNEL_RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

template <class Lock>
class TARNEL_SCOPED_CAPABILITY LockGuard {
 public:
  explicit LockGuard(Lock& lock) TARNEL_ACQUIRE(lock) : lock_(lock) { lock_.lock(); }
  ~LockGuard() TARNEL_RELEASE() { lock_.unlock(); }
  LockGuard(const LockGuard&) = delete;
  LockGuard& operator=(const LockGuard&) = delete;

 private:
  Lock& lock_;
};

}  // namespace tarnel

// Lock annotations that clang checks (-Wthread-safety, on in every clang build), and the mutex
// and lock types they work with. Other compilers see plain code.
//
// A member written only under a mutex is SX_GUARDED_BY(mutex); a function that expects its
// caller to hold the mutex is SX_REQUIRES(mutex). Locks are taken with SXMutexLock, whose
// waits on a condition take a predicate; a predicate that reads guarded members says so with
// SX_REQUIRES on the lambda, which the wait calls with the lock held.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define SX_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define SX_THREAD_ANNOTATION(x)
#endif

#define SX_CAPABILITY(name) SX_THREAD_ANNOTATION(capability(name))
#define SX_SCOPED_CAPABILITY SX_THREAD_ANNOTATION(scoped_lockable)
#define SX_GUARDED_BY(mutex) SX_THREAD_ANNOTATION(guarded_by(mutex))
#define SX_REQUIRES(...) SX_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define SX_ACQUIRE(...) SX_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define SX_RELEASE(...) SX_THREAD_ANNOTATION(release_capability(__VA_ARGS__))

// std::mutex or std::recursive_mutex, as a capability the analysis knows.
template <typename Native>
class SX_CAPABILITY("mutex") SXBasicMutex {
 public:
  void lock() SX_ACQUIRE() { native_.lock(); }
  void unlock() SX_RELEASE() { native_.unlock(); }

 private:
  template <typename>
  friend class SXMutexLock;
  Native native_;
};
using SXMutex = SXBasicMutex<std::mutex>;
using SXRecursiveMutex = SXBasicMutex<std::recursive_mutex>;

// Holds a mutex from construction to destruction, with unlock() and lock() in between. The
// waits are for an SXMutex.
template <typename Native>
class SX_SCOPED_CAPABILITY SXMutexLock {
 public:
  explicit SXMutexLock(SXBasicMutex<Native>& mutex) SX_ACQUIRE(mutex) : lock_(mutex.native_) {}
  ~SXMutexLock() SX_RELEASE() {}
  SXMutexLock(const SXMutexLock&) = delete;
  SXMutexLock& operator=(const SXMutexLock&) = delete;

  void unlock() SX_RELEASE() { lock_.unlock(); }
  void lock() SX_ACQUIRE() { lock_.lock(); }

  void wait(std::condition_variable& condition) { condition.wait(lock_); }
  template <typename Ready>
  void wait(std::condition_variable& condition, Ready ready) {
    condition.wait(lock_, ready);
  }
  // Whether `ready` holds at the end.
  template <typename Rep, typename Period, typename Ready>
  bool waitFor(std::condition_variable& condition, std::chrono::duration<Rep, Period> timeout,
               Ready ready) {
    return condition.wait_for(lock_, timeout, ready);
  }
  template <typename Clock, typename Duration>
  std::cv_status waitUntil(std::condition_variable& condition,
                           std::chrono::time_point<Clock, Duration> due) {
    return condition.wait_until(lock_, due);
  }
  template <typename Clock, typename Duration, typename Ready>
  bool waitUntil(std::condition_variable& condition, std::chrono::time_point<Clock, Duration> due,
                 Ready ready) {
    return condition.wait_until(lock_, due, ready);
  }

 private:
  std::unique_lock<Native> lock_;
};
template <typename Native>
SXMutexLock(SXBasicMutex<Native>&) -> SXMutexLock<Native>;

// SPDX-License-Identifier: MIT
// The platform's mutex and its scoped lock, annotated for clang's thread-safety analysis, which
// the clang builds turn into errors: a member declared GUARDED_BY(m) is only touched holding m,
// a function declared REQUIRES(m) is only called holding m, one declared EXCLUDES(m) only
// without it. Other compilers see a plain std::mutex. Portable: standard library only.
//
// A condition variable is waited on through the lock (MutexLock::wait). The analysis takes the
// mutex as held across the wait, so the waiter tests its condition in a loop of its own, where
// the guarded reads are checked, rather than in a predicate, which would be checked apart from
// the lock.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define HALVEX_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define HALVEX_THREAD_ANNOTATION(x)
#endif

#define CAPABILITY(kind) HALVEX_THREAD_ANNOTATION(capability(kind))
#define SCOPED_CAPABILITY HALVEX_THREAD_ANNOTATION(scoped_lockable)
#define GUARDED_BY(m) HALVEX_THREAD_ANNOTATION(guarded_by(m))
#define REQUIRES(...) HALVEX_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) HALVEX_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define RELEASE(...) HALVEX_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) HALVEX_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define EXCLUDES(...) HALVEX_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))

namespace halvex {

class CAPABILITY("mutex") Mutex {
 public:
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

// Holds a Mutex from construction to destruction, or until unlock().
class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : lock_(mutex.mutex_) {}
  ~MutexLock() RELEASE() = default;
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  // Lets go early: a thread notified after this does not wake into a mutex still held.
  void unlock() RELEASE() { lock_.unlock(); }

  // Sleeps on cv with the mutex let go until notified, or woken for no reason.
  void wait(std::condition_variable& cv) { cv.wait(lock_); }
  // As wait(), but false once deadline has passed.
  template <typename Clock, typename Duration>
  bool waitUntil(std::condition_variable& cv,
                 const std::chrono::time_point<Clock, Duration>& deadline) {
    return cv.wait_until(lock_, deadline) == std::cv_status::no_timeout;
  }

 private:
  std::unique_lock<std::mutex> lock_;
};

}  // namespace halvex

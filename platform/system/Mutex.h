#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

// Clang checks these at compile time (-Wthread-safety); other compilers ignore them. A member
// that is read without its lock on purpose says why in a comment instead.
#if defined(__clang__)
#define LARDER_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define LARDER_THREAD_ANNOTATION(x)
#endif

#define CAPABILITY(x) LARDER_THREAD_ANNOTATION(capability(x))
#define SCOPED_CAPABILITY LARDER_THREAD_ANNOTATION(scoped_lockable)
#define GUARDED_BY(x) LARDER_THREAD_ANNOTATION(guarded_by(x))
#define PT_GUARDED_BY(x) LARDER_THREAD_ANNOTATION(pt_guarded_by(x))
#define REQUIRES(...) LARDER_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) LARDER_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define RELEASE(...) LARDER_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) LARDER_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define EXCLUDES(...) LARDER_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define RETURN_CAPABILITY(x) LARDER_THREAD_ANNOTATION(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS LARDER_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace larder {

// The one mutex of the code base: a std::mutex the analysis knows about. Functions whose name
// ends in `Locked` are the ones that REQUIRE a lock their class holds.
class CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

// Holds a Mutex for its scope. It can be let go and taken again inside the scope (to call out
// without the lock), and a ConditionVariable waits on it.
class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : lock_(mutex.mutex_) {}
  ~MutexLock() RELEASE() = default;
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  void unlock() RELEASE() { lock_.unlock(); }
  void lock() ACQUIRE() { lock_.lock(); }

 private:
  friend class ConditionVariable;
  std::unique_lock<std::mutex> lock_;
};

// A condition variable over a MutexLock. The lock is held again when a wait returns, so the
// analysis keeps treating the guarded members as safe to touch.
class ConditionVariable {
 public:
  void notify_one() noexcept { condition_.notify_one(); }
  void notify_all() noexcept { condition_.notify_all(); }

  void wait(MutexLock& lock) { condition_.wait(lock.lock_); }
  template <typename Predicate>
  void wait(MutexLock& lock, Predicate predicate) {
    condition_.wait(lock.lock_, std::move(predicate));
  }
  template <typename Rep, typename Period, typename Predicate>
  bool wait_for(MutexLock& lock, std::chrono::duration<Rep, Period> timeout, Predicate predicate) {
    return condition_.wait_for(lock.lock_, timeout, std::move(predicate));
  }
  template <typename Clock, typename Duration, typename Predicate>
  bool wait_until(MutexLock& lock, std::chrono::time_point<Clock, Duration> deadline,
                  Predicate predicate) {
    return condition_.wait_until(lock.lock_, deadline, std::move(predicate));
  }
  template <typename Rep, typename Period>
  std::cv_status wait_for(MutexLock& lock, std::chrono::duration<Rep, Period> timeout) {
    return condition_.wait_for(lock.lock_, timeout);
  }
  template <typename Clock, typename Duration>
  std::cv_status wait_until(MutexLock& lock, std::chrono::time_point<Clock, Duration> deadline) {
    return condition_.wait_until(lock.lock_, deadline);
  }

 private:
  std::condition_variable condition_;
};

}  // namespace larder

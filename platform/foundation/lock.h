#pragma once

#include <condition_variable>
#include <mutex>

// Clang's thread-safety attributes; the lint step compiles with -Wthread-safety -Werror.
#if defined(__clang__)
#define YOMBER_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define YOMBER_THREAD_ATTRIBUTE(x)
#endif
#define CAPABILITY(x) YOMBER_THREAD_ATTRIBUTE(capability(x))
#define SCOPED_CAPABILITY YOMBER_THREAD_ATTRIBUTE(scoped_lockable)
#define GUARDED_BY(x) YOMBER_THREAD_ATTRIBUTE(guarded_by(x))
#define PT_GUARDED_BY(x) YOMBER_THREAD_ATTRIBUTE(pt_guarded_by(x))
#define REQUIRES(...) YOMBER_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) YOMBER_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define RELEASE(...) YOMBER_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define EXCLUDES(...) YOMBER_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define NO_THREAD_SAFETY_ANALYSIS YOMBER_THREAD_ATTRIBUTE(no_thread_safety_analysis)

namespace yomber {

/// A plain mutual-exclusion lock.
class CAPABILITY("mutex") Mutex {
 public:
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  std::mutex& native() { return mutex_; }

 private:
  std::mutex mutex_;
};

/// "The lock of the object itself": may be taken again by the thread that holds it.
class CAPABILITY("mutex") RecursiveMutex {
 public:
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

/// Holds a lock for a scope.
template <typename M>
class SCOPED_CAPABILITY LockGuard {
 public:
  explicit LockGuard(M& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
  ~LockGuard() RELEASE() { mutex_.unlock(); }
  LockGuard(const LockGuard&) = delete;
  LockGuard& operator=(const LockGuard&) = delete;

 private:
  M& mutex_;
};

/// Waits for a state guarded by a Mutex. `wait` is called with the mutex held and holds it again
/// when it returns; spurious wake-ups happen, so it is called in a loop over the condition.
class Condition {
 public:
  void wait(Mutex& mutex) REQUIRES(mutex) {
    std::unique_lock<std::mutex> adopted(mutex.native(), std::adopt_lock);
    condition_.wait(adopted);
    adopted.release();
  }
  /// False once `deadline` has passed.
  template <typename TimePoint>
  bool waitUntil(Mutex& mutex, const TimePoint& deadline) REQUIRES(mutex) {
    std::unique_lock<std::mutex> adopted(mutex.native(), std::adopt_lock);
    const auto status = condition_.wait_until(adopted, deadline);
    adopted.release();
    return status == std::cv_status::no_timeout;
  }
  void notifyOne() { condition_.notify_one(); }
  void notifyAll() { condition_.notify_all(); }

 private:
  std::condition_variable condition_;
};

}  // namespace yomber

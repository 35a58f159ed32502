// A mutex and a scoped lock that Clang's thread-safety analysis understands: a member
// declared VIREO_GUARDED_BY(mu_) can only be read or written with mu_ held, and the
// Clang builds (-Wthread-safety, warnings as errors) refuse code that forgets it.
// Under GCC the annotations expand to nothing and these are plain Mutex wrappers.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define VIREO_TSA(x) __attribute__((x))
#else
#define VIREO_TSA(x)
#endif

#define VIREO_CAPABILITY(x) VIREO_TSA(capability(x))
#define VIREO_SCOPED_CAPABILITY VIREO_TSA(scoped_lockable)
#define VIREO_GUARDED_BY(x) VIREO_TSA(guarded_by(x))
#define VIREO_PT_GUARDED_BY(x) VIREO_TSA(pt_guarded_by(x))
#define VIREO_ACQUIRED_BEFORE(...) VIREO_TSA(acquired_before(__VA_ARGS__))
#define VIREO_REQUIRES(...) VIREO_TSA(requires_capability(__VA_ARGS__))
#define VIREO_ACQUIRE(...) VIREO_TSA(acquire_capability(__VA_ARGS__))
#define VIREO_RELEASE(...) VIREO_TSA(release_capability(__VA_ARGS__))
#define VIREO_TRY_ACQUIRE(...) VIREO_TSA(try_acquire_capability(__VA_ARGS__))
#define VIREO_EXCLUDES(...) VIREO_TSA(locks_excluded(__VA_ARGS__))
#define VIREO_NO_THREAD_SAFETY_ANALYSIS VIREO_TSA(no_thread_safety_analysis)

namespace vireo {

class VIREO_CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() VIREO_ACQUIRE() { mutex_.lock(); }
  void unlock() VIREO_RELEASE() { mutex_.unlock(); }
  bool try_lock() VIREO_TRY_ACQUIRE(true) { return mutex_.try_lock(); }

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

// Holds a Mutex for its scope. unlock()/lock() let a holder drop the lock around work
// that must not run under it (a callback, I/O) and take it back; the analysis follows.
// Condition waits go through the lock so that the analysis sees them as holding it:
// write them as `while (!ready) lock.wait(cv);`, the condition checked under the lock.
class VIREO_SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) VIREO_ACQUIRE(mutex) : lock_(mutex.mutex_) {}
  ~MutexLock() VIREO_RELEASE() = default;
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  void unlock() VIREO_RELEASE() { lock_.unlock(); }
  void lock() VIREO_ACQUIRE() { lock_.lock(); }

  void wait(std::condition_variable& cv) { cv.wait(lock_); }
  template <class Clock, class Duration>
  std::cv_status waitUntil(std::condition_variable& cv, const std::chrono::time_point<Clock, Duration>& when) {
    return cv.wait_until(lock_, when);
  }
  template <class Rep, class Period>
  std::cv_status waitFor(std::condition_variable& cv, const std::chrono::duration<Rep, Period>& howLong) {
    return cv.wait_for(lock_, howLong);
  }

 private:
  std::unique_lock<std::mutex> lock_;
};

// For a connection whose callbacks may call back into it on the same thread.
class VIREO_CAPABILITY("mutex") RecursiveMutex {
 public:
  RecursiveMutex() = default;
  RecursiveMutex(const RecursiveMutex&) = delete;
  RecursiveMutex& operator=(const RecursiveMutex&) = delete;

  void lock() VIREO_ACQUIRE() { mutex_.lock(); }
  void unlock() VIREO_RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

class VIREO_SCOPED_CAPABILITY RecursiveMutexLock {
 public:
  explicit RecursiveMutexLock(RecursiveMutex& mutex) VIREO_ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
  ~RecursiveMutexLock() VIREO_RELEASE() { mutex_.unlock(); }
  RecursiveMutexLock(const RecursiveMutexLock&) = delete;
  RecursiveMutexLock& operator=(const RecursiveMutexLock&) = delete;

 private:
  RecursiveMutex& mutex_;
};

}  // namespace vireo

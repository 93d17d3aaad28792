// Mutexes that clang's thread-safety analysis can follow (it does not see through libstdc++'s
// std::mutex).
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "base/ThreadAnnotations.h"

namespace vx {

class CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }
  std::mutex& native() { return mutex_; }

 private:
  std::mutex mutex_;
};

class CAPABILITY("mutex") RecursiveMutex {
 public:
  RecursiveMutex() = default;
  RecursiveMutex(const RecursiveMutex&) = delete;
  RecursiveMutex& operator=(const RecursiveMutex&) = delete;
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

template <class M>
class SCOPED_CAPABILITY BasicMutexLock {
 public:
  explicit BasicMutexLock(M& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
  ~BasicMutexLock() RELEASE() { mutex_.unlock(); }
  BasicMutexLock(const BasicMutexLock&) = delete;
  BasicMutexLock& operator=(const BasicMutexLock&) = delete;

 private:
  M& mutex_;
};
using MutexLock = BasicMutexLock<Mutex>;
using RecursiveMutexLock = BasicMutexLock<RecursiveMutex>;

// A condition variable that waits on a Mutex the caller already holds. A wait is a loop around its
// predicate.
class CondVar {
 public:
  void wait(Mutex& mutex) REQUIRES(mutex) NO_THREAD_SAFETY_ANALYSIS {
    std::unique_lock<std::mutex> held(mutex.native(), std::adopt_lock);
    condition_.wait(held);
    held.release();
  }
  // False when the deadline passed without a notification.
  bool waitUntil(Mutex& mutex, std::chrono::steady_clock::time_point deadline)
      REQUIRES(mutex) NO_THREAD_SAFETY_ANALYSIS {
    std::unique_lock<std::mutex> held(mutex.native(), std::adopt_lock);
    const bool notified = condition_.wait_until(held, deadline) == std::cv_status::no_timeout;
    held.release();
    return notified;
  }
  void notifyOne() { condition_.notify_one(); }
  void notifyAll() { condition_.notify_all(); }

 private:
  std::condition_variable condition_;
};

}  // namespace vx

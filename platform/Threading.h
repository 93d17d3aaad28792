// Threads, condition variables, run loops and one-shot timers, all on the platform's clock.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string_view>

#include "base/Clock.h"
#include "base/Function.h"

namespace vx {

// A condition variable with its own lock. Thread-safe.
class Condition {
 public:
  virtual ~Condition() = default;
  virtual void lock() = 0;
  virtual void unlock() = 0;
  // Caller holds the lock; it is released during the wait and held again after it. False: the
  // deadline passed without a signal. True: a signal arrived (or a spurious wake-up, which is
  // treated as one).
  virtual bool waitUntil(Monotonic deadline) = 0;
  virtual void signal() = 0;
};

// A timer that fires once on the run loop it is attached to. Thread-safe: its fire time may be
// moved from any thread, attached or not, also while it fires (which then changes nothing).
class OneShotTimer {
 public:
  virtual ~OneShotTimer() = default;
  virtual void setFireTime(Monotonic when) = 0;
  virtual void invalidate() = 0;  // never fires again; a run loop lets go of it
};

// The run loop of one thread.
class RunLoop {
 public:
  virtual ~RunLoop() = default;
  virtual void attach(std::shared_ptr<OneShotTimer> timer) = 0;
  // Fires attached timers as they fall due, in order of fire time, and returns when none is left.
  // An exception thrown by a timer's action leaves through here.
  virtual void runUntilEmpty() = 0;
};

// A running thread. Destroying the handle detaches it.
class Thread {
 public:
  virtual ~Thread() = default;
};

class Threading {
 public:
  virtual ~Threading() = default;
  virtual std::unique_ptr<Condition> makeCondition() = 0;
  // Not attached to a run loop yet; the fire time counts from now.
  virtual std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                                  Function<void()> action) = 0;
  virtual std::unique_ptr<RunLoop> makeRunLoop() = 0;
  virtual std::unique_ptr<Thread> startThread(std::string_view name, Function<void()> body) = 0;
  virtual void sleepFor(std::chrono::nanoseconds duration) = 0;
  // Says that the caller has just let go of about so much memory in small pieces, or is about to.
  // From any thread, at any rate; returns at once. Whether and when that is worth the time it takes
  // to give it back to the system is the platform's decision.
  virtual void memoryWasFreed(std::size_t approximateBytes) = 0;
};

}  // namespace vx

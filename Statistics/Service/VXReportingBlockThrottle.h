// A keyed, de-duplicating, delaying scheduler for blocks that deliver messages.
#pragma once

#include <atomic>
#include <cstddef>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "base/Function.h"
#include "base/Mutex.h"
#include "platform/Threading.h"

namespace vx {

// One pending delivery: the work, replaced by newer duplicates, and the timer that will run it.
// Thread-safe.
class VXReportingBlockThrottleTimerWrapper {
 public:
  using Block = Function<void()>;

  void setBlock(std::shared_ptr<Block> block);
  void setTimer(std::shared_ptr<OneShotTimer> timer);
  std::shared_ptr<OneShotTimer> timer() const;
  // The timer's next fire time becomes now plus `seconds`.
  void sleepFor(double seconds);
  // Runs the block of this moment; a block set meanwhile stays for nobody.
  void runBlock();

 private:
  mutable Mutex mutex_;
  std::shared_ptr<Block> block_ GUARDED_BY(mutex_);
  std::shared_ptr<OneShotTimer> timer_ GUARDED_BY(mutex_);
};

// A trailing-edge debounce per key: while a block for a key is pending, a newer block for the key
// takes its place and pushes the delivery out by its own delay. Thread-safe; the blocks run one at
// a time on a thread of the throttle's own, so a slow block delays every other delivery. Lives
// until the process ends: its thread holds it.
//
// A block that throws: its key is removed first, then the exception goes on through the run loop
// and out of the worker thread's body, where nothing catches it. An exception that leaves a thread
// ends the process (std::terminate), so a block must not throw unless that is what it wants.
// Deliveries still pending when the process ends do not happen.
//
// No other part of the service creates one; it is there for message routing to use.
class VXReportingBlockThrottle : public std::enable_shared_from_this<VXReportingBlockThrottle> {
 public:
  using Block = VXReportingBlockThrottleTimerWrapper::Block;

  static std::shared_ptr<VXReportingBlockThrottle> create();

  // Equal keys mean "the same message". Every key of the payload contributes itself and its value,
  // or "^" where the value must not count.
  static std::string buildMessageKey(const Payload& message, ReporterID reporter,
                                     MessageCategory category, MessageType type);
  // Seconds to hold a message back: its "_throttle_seconds" when that is a number below 5,
  // otherwise 0.5.
  static double determineSleepTime(const Payload& message);

  void addMessageBlock(Block block, ReporterID reporter, const Payload& message,
                       MessageCategory category, MessageType type);
  // Blocks the caller until nothing is pending, for at most 5 seconds.
  void waitForCompletion();

  bool shouldKeepRunning() const { return shouldKeepRunning_.load(); }
  void setShouldKeepRunning(bool keepRunning) { shouldKeepRunning_.store(keepRunning); }
  std::size_t timersInFlight() const;
  std::size_t unscheduledTimerKeys() const;

 private:
  using Wrapper = std::shared_ptr<VXReportingBlockThrottleTimerWrapper>;

  VXReportingBlockThrottle() = default;
  void runThread();
  void attachUnscheduled(RunLoop& runLoop);
  Wrapper addIfAbsent(const std::string& key, const Wrapper& wrapper);
  void fire(const Wrapper& wrapper, const std::string& key);
  void removeFired(const std::string& key);
  Wrapper pending(const std::string& key) const;

  std::atomic<bool> shouldKeepRunning_{true};
  // Two locks, never held together. The number of pending keys is bounded by those who add blocks.
  mutable Mutex timersMutex_;
  std::map<std::string, Wrapper> timersInFlight_ GUARDED_BY(timersMutex_);
  mutable Mutex unscheduledMutex_;
  // Each key with its wrapper, so that attaching needs no look at the map.
  std::vector<std::pair<std::string, Wrapper>> unscheduledTimerKeys_ GUARDED_BY(unscheduledMutex_);
  std::unique_ptr<Thread> queueThread_;
};

}  // namespace vx

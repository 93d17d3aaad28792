// The work queues of the process: serial queues served by one lane of threads per
// quality-of-service class.
//
// The interactive lane has no thread of its own: the event loop's thread (the one on which
// ServiceListener resume runs) drains it with runInteractive(). Utility and background lanes start
// threads when there is work, at a niceness fixed when the thread starts, and keep a few; a thread
// inside a Blocking scope is replaced as soon as other work of its lane waits with nobody to run
// it.
//
// A lane's thread that has run out of work lingers for a moment before it sleeps for good, and a
// producer wakes only sleeping threads: a lone item costs one wake-up, a burst one per moment
// rather than one per item.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>

#include "base/Clock.h"
#include "platform/WorkQueue.h"

namespace vx::lnx {

class Executor final : public WorkQueues {
 public:
  Executor();
  // stop() must have run.
  ~Executor() override;

  std::shared_ptr<WorkQueue> makeSerial(std::string_view label, QualityOfService quality) override;
  WorkQueue& background() override;
  void beginBlocking() override;
  void endBlocking() override;

  // --- the interactive lane, for the event loop ---
  // Names the calling thread the interactive one.
  void adoptInteractiveThread();
  bool isInteractiveThread() const;
  // Runs ready interactive work, including what it queues, until there is none or `maxItems` ran.
  // True: more is ready.
  bool runInteractive(std::size_t maxItems);
  // When the earliest delayed interactive work is due; none when there is none. Due work joins its
  // queue in runInteractive.
  std::optional<Monotonic> nextInteractiveDue() const;
  // Called, on the producer's thread, when interactive work is queued from another thread while the
  // loop may be asleep: once until the next prepareToSleep(). Set before any other thread exists.
  void setInteractiveWaker(Function<void()> wake);
  // The loop says that it is about to sleep. False: there is ready work after all, do not.
  bool prepareToSleep();

  // Items queued or running on the utility lane, delayed ones not counted: the relay work that
  // accepted messages have caused. Reading from clients pauses while it is too large.
  std::size_t utilityBacklog() const;
  // Called, on a lane's thread, when the backlog falls below `level` after having been at or above
  // it.
  void setUtilityLowWater(std::size_t level, Function<void()> reached);

  // Waits until the utility lane and the undelayed background work are idle, at most until the
  // deadline. True: idle.
  bool drain(Monotonic deadline);
  // Ends all threads; work not yet run is dropped. A thread that is blocked past the deadline is
  // left behind (the process is about to end).
  void stop(Monotonic deadline);

  struct Impl;

 private:
  std::shared_ptr<Impl> impl_;
};

}  // namespace vx::lnx

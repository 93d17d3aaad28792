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

#include <chrono>
#include <cstddef>
#include <memory>
#include <optional>
#include <string_view>

#include "base/Clock.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/ConcurrentQueue.h"
#include "platform/linux/execution/Lane.h"

namespace vx::lnx {

// Owned by LinuxPlatform. Thread-safe but for what is said to belong to the event loop's thread or
// to the time before there are others.
class Executor final : public WorkQueues {
 public:
  // `accounts` outlives it, and is told of the interactive thread.
  explicit Executor(UserAccounts& accounts);
  // stop() must have run.
  ~Executor() override = default;
  Executor(const Executor&) = delete;
  Executor& operator=(const Executor&) = delete;

  std::shared_ptr<WorkQueue> makeSerial(std::string_view label, QualityOfService quality) override;
  WorkQueue& background() override { return concurrent_; }
  std::unique_ptr<WorkCause> takeCause(std::size_t holds) override;
  std::optional<WorkOrigin> currentOrigin() override { return CauseScope::origin(); }
  void withoutCause(const Work& work) override;
  void beginBlocking() override { Lane::beginBlocking(); }
  void endBlocking() override { Lane::endBlocking(); }

  // Runs short work that a thread waits for a limited time for: on a thread that runs nothing else,
  // until stop(), and for no call's sake.
  void runPromptly(Work work);

  // There is nobody to whom relay work could give anything: calls do not wait for it, not even for
  // a set-up that waits itself. Before there are other threads.
  void setRelayUnrecorded() { utility_->setUnrecorded(); }

  // --- the interactive lane, for the event loop ---
  // Names the calling thread the interactive one.
  void adoptInteractiveThread() {
    interactive_->adoptThread();
    accounts_.adoptThread();
  }
  UserAccounts& accounts() { return accounts_; }
  bool isInteractiveThread() const { return interactive_->isThread(); }
  // Fails the process on any other thread once there is an interactive one (development builds).
  void assertInteractiveThread() const {
    VX_DCHECK(!interactive_->hasThread() || isInteractiveThread());
  }
  // Runs ready interactive work, including what it queues, until there is none or `maxItems` ran.
  // True: more is ready.
  bool runInteractive(std::size_t maxItems) { return interactive_->run(maxItems); }
  // When the earliest delayed interactive work is due; none when there is none. Due work joins its
  // queue in runInteractive.
  std::optional<Monotonic> nextInteractiveDue() const { return interactive_->nextDue(); }
  // Called, on the producer's thread, when interactive work is queued from another thread while the
  // loop may be asleep: once until the next prepareToSleep(). Set before any other thread exists.
  void setInteractiveWaker(Function<void()> wake);
  // Who runs the rest of work in steps that has begun: in the turns of whoever caused it.
  void setStepsTaker(Lane::StepsTaker taker) { interactive_->setStepsTaker(std::move(taker)); }
  // The loop says that it is about to sleep. False: there is ready work after all, do not.
  bool prepareToSleep() { return interactive_->prepareToSleep(); }

  // Items queued or running on the utility lane, delayed ones not counted: the relay work that
  // accepted messages have caused.
  std::size_t utilityBacklog() const { return utility_->backlog(); }
  // Items of all lanes for which there was no memory.
  uint64_t itemsGivenUp() const {
    return interactive_->itemsGivenUp() + utility_->itemsGivenUp() + background_->itemsGivenUp();
  }

  // Waits until the utility lane and the undelayed background work are idle, at most until the
  // deadline. True: idle.
  bool drain(Monotonic deadline);
  // Ends all threads; work not yet run is dropped. A thread that is blocked past the deadline is
  // left behind (the process is about to end).
  void stop(Monotonic deadline);

 private:
  const std::shared_ptr<Lane>& lane(QualityOfService quality) const;

  UserAccounts& accounts_;
  const std::shared_ptr<Lane> interactive_;
  const std::shared_ptr<Lane> utility_;
  const std::shared_ptr<Lane> background_;
  const std::shared_ptr<Lane> prompt_;
  ConcurrentQueue concurrent_;
};

}  // namespace vx::lnx

// The queues of one quality of service, and the threads that serve them.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "base/Clock.h"
#include "base/Mutex.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/SerialQueue.h"
#include "platform/linux/execution/WorkItem.h"

namespace vx::lnx {

class SteppedWork;

struct LaneOptions {
  const char* threadName;
  int niceness;
  std::size_t runnableThreads;  // 0: the interactive lane, whose thread comes from outside
};

// The queues that have work, and the threads that run it. Thread-safe. Kept alive by its threads
// and its queues. At most kMaxThreads threads; the items are on the accounts of those who caused
// them.
class Lane : public std::enable_shared_from_this<Lane> {
 public:
  static constexpr std::size_t kMaxThreads = 1024;

  Lane(const LaneOptions& options, UserAccounts& accounts)
      : options_(options), accounts_(accounts) {}

  // Whose item the calling thread is running, if any.
  static const WorkQueue* currentQueue();
  // While one lives, the calling thread runs an item of `queue`.
  class Current {
   public:
    explicit Current(const WorkQueue* queue);
    ~Current();
    Current(const Current&) = delete;
    Current& operator=(const Current&) = delete;

   private:
    const WorkQueue* const outer_;
  };

  // A queue has got work. Takes part in the running of it until it has none.
  void post(std::shared_ptr<SerialQueue> queue);
  // Both take the item; it is dropped once the lane is stopping. `queue`: null for the concurrent
  // one.
  void postConcurrent(WorkItem* item, std::size_t holds);
  void postDelayed(std::chrono::nanoseconds delay, std::shared_ptr<SerialQueue> queue,
                   WorkItem* item);
  // Both before any other thread knows the lane.
  // Nothing that its items do would be missed after a crash: no call waits for them.
  void setUnrecorded() { unrecorded_ = true; }
  void setConcurrentQueue(const WorkQueue* queue) { concurrentQueue_ = queue; }

  // Around a wait on the calling thread, which may be none of a lane's: then without effect.
  static void beginBlocking();
  static void endBlocking();

  // --- the interactive lane; see Executor ---
  void adoptThread() { interactiveThread_ = std::this_thread::get_id(); }
  bool isThread() const { return interactiveThread() == std::this_thread::get_id(); }
  bool hasThread() const { return interactiveThread() != std::thread::id(); }
  void setWaker(Function<void()> wake) { waker_ = std::move(wake); }
  // On its thread. Null: steps follow one another without anything in between.
  using StepsTaker = Function<void(std::unique_ptr<SteppedWork>)>;
  void setStepsTaker(StepsTaker taker) { stepsTaker_ = std::move(taker); }
  const StepsTaker& stepsTaker() const { return stepsTaker_; }
  bool run(std::size_t maxItems);
  bool prepareToSleep();
  std::optional<Monotonic> nextDue();

  bool drain(Monotonic deadline);
  void stop(Monotonic deadline);

  // Items of serial queues and concurrent ones that are queued or running.
  // Those of the interactive lane are on nobody's account: they are run in the pass in which they
  // come.
  void itemQueued(WorkItem& item, std::size_t holds);
  // Runs it; work for which there is no memory is given up, counted and logged. What was called is
  // over with that: it is not run again by a later process, which would have no more memory.
  void run(WorkItem& item);
  uint64_t itemsGivenUp() const { return givenUp_.load(std::memory_order_relaxed); }
  void itemsDone(std::size_t count) { backlog_.fetch_sub(count, std::memory_order_relaxed); }
  std::size_t backlog() const { return backlog_.load(std::memory_order_relaxed); }

 private:
  struct Delayed {
    Monotonic due;
    uint64_t order = 0;
    std::shared_ptr<SerialQueue> queue;  // null: concurrent
    WorkItem* item = nullptr;
    bool operator<(const Delayed& other) const {  // std heap functions keep the largest first
      return due != other.due ? due > other.due : order > other.order;
    }
  };

  bool isInteractive() const { return options_.runnableThreads == 0; }
  std::thread::id interactiveThread() const {
    return interactiveThread_.load(std::memory_order_relaxed);
  }
  bool hasWork() const REQUIRES(mutex_) { return !ready_.empty() || !concurrent_.empty(); }
  // True: the waker must be called, without the lock.
  bool arrived() REQUIRES(mutex_);
  void wakeOrStartThread() REQUIRES(mutex_);
  void startThread() REQUIRES(mutex_);
  void moveDue() REQUIRES(mutex_);
  void threadMain();
  // Runs one turn of one queue, or one concurrent item, with the lock released meanwhile. How many
  // items ran.
  std::size_t runOne(std::size_t maxItems) REQUIRES(mutex_);
  void giveUp(WorkItem& item, const char* why);
  void sleep(bool didWork) REQUIRES(mutex_);
  void waitForChange(Monotonic deadline) REQUIRES(mutex_);

  const LaneOptions options_;
  UserAccounts& accounts_;  // used by no thread after stop()
  const WorkQueue* concurrentQueue_ = nullptr;
  bool unrecorded_ = false;
  Function<void()> waker_;
  StepsTaker stepsTaker_;  // the interactive thread's
  std::atomic<std::thread::id> interactiveThread_{};
  std::atomic<std::size_t> backlog_{0};
  std::atomic<bool> hasDelayed_{false};  // delayed_ is not empty; set under the lock
  std::atomic<uint64_t> givenUp_{0};

  Mutex mutex_;
  CondVar wake_;     // for sleeping threads
  CondVar changed_;  // for drain and stop
  std::deque<std::shared_ptr<SerialQueue>> ready_ GUARDED_BY(mutex_);
  ItemList concurrent_ GUARDED_BY(mutex_);
  std::vector<Delayed> delayed_ GUARDED_BY(mutex_);  // a heap
  uint64_t nextOrder_ GUARDED_BY(mutex_) = 0;
  std::size_t threads_ GUARDED_BY(mutex_) = 0;
  std::size_t runnable_ GUARDED_BY(mutex_) = 0;  // threads not inside a Blocking scope
  std::size_t sleeping_ GUARDED_BY(mutex_) = 0;  // of these, waiting to be notified
  std::size_t running_ GUARDED_BY(mutex_) = 0;   // turns under way, blocked ones included
  bool asleep_ GUARDED_BY(mutex_) = false;       // the event loop, since prepareToSleep
  bool stopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace vx::lnx

#include "platform/linux/execution/Lane.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <new>
#include <stdexcept>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kItemsPerTurn = 64;  // of one queue before the next queue of the lane
constexpr std::size_t kStackBytes = 256 << 10;
constexpr std::chrono::milliseconds kLinger{5};

thread_local const WorkQueue* threadsQueue = nullptr;
thread_local Lane* threadsLane = nullptr;
thread_local int blockingDepth = 0;

Monotonic now() { return std::chrono::steady_clock::now(); }

std::chrono::steady_clock::time_point steadyPoint(Monotonic when) {
  return std::chrono::time_point_cast<std::chrono::steady_clock::duration>(when);
}

}  // namespace

const WorkQueue* Lane::currentQueue() { return threadsQueue; }

Lane::Current::Current(const WorkQueue* queue) : outer_(std::exchange(threadsQueue, queue)) {}
Lane::Current::~Current() { threadsQueue = outer_; }

// ---------------------------------------------------------------------------------------------------------------------
// Work that arrives

void Lane::post(std::shared_ptr<SerialQueue> queue) {
  bool mustWake = false;
  {
    MutexLock lock(mutex_);
    if (stopping_) return;
    ready_.push_back(std::move(queue));
    mustWake = arrived();
  }
  if (mustWake) waker_();
}

void Lane::postConcurrent(WorkItem* item, std::size_t holds) {
  std::unique_ptr<WorkItem> dropped;  // after the lock
  itemQueued(*item, holds);
  MutexLock lock(mutex_);
  if (stopping_) {
    dropped.reset(item);
    return;
  }
  concurrent_.push(item);
  wakeOrStartThread();
}

void Lane::postDelayed(std::chrono::nanoseconds delay, std::shared_ptr<SerialQueue> queue,
                       WorkItem* item) {
  std::unique_ptr<WorkItem> dropped;  // after the lock
  const Monotonic due = now() + delay;
  bool mustWake = false;
  {
    MutexLock lock(mutex_);
    if (stopping_) {
      dropped.reset(item);
      return;
    }
    hasDelayed_.store(true, std::memory_order_relaxed);
    const bool earliest = delayed_.empty() || due < delayed_.front().due;
    delayed_.push_back({due, nextOrder_++, std::move(queue), item});
    std::push_heap(delayed_.begin(), delayed_.end());
    // Somebody must wait until then.
    mustWake = earliest && arrived();
  }
  if (mustWake) waker_();
}

void Lane::itemQueued(WorkItem& item, std::size_t holds) {
  backlog_.fetch_add(1, std::memory_order_relaxed);
  if (unrecorded_) item.cause.ticket = {};
  if (isInteractive()) return;
  item.charged = static_cast<uint32_t>(std::min<std::size_t>(sizeof(WorkItem) + holds, UINT32_MAX));
  accounts_.add(item.cause.user, MemoryKind::Waiting, item.charged);
}

bool Lane::arrived() {
  if (isInteractive()) return !isThread() && std::exchange(asleep_, false) && waker_;
  wakeOrStartThread();
  return false;
}

// A thread that runs or lingers looks again by itself; only sleeping ones are told, and missing
// ones started.
void Lane::wakeOrStartThread() {
  if (sleeping_ > 0) {
    // While one of the lane's threads is awake, a lone item is left to it.
    if (runnable_ == sleeping_ || ready_.size() > 1) wake_.notifyOne();
  } else if (runnable_ < options_.runnableThreads) {
    startThread();
  }
}

// Where no thread is to be had, the work waits for one to come out of its Blocking scope.
void Lane::startThread() {
  if (threads_ >= kMaxThreads) return;
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setstacksize(&attributes, kStackBytes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  const SignalsBlocked blocked;
  auto self = std::make_unique<std::shared_ptr<Lane>>(shared_from_this());
  pthread_t thread{};
  const int failed = pthread_create(
      &thread, &attributes,
      [](void* context) -> void* {
        const std::unique_ptr<std::shared_ptr<Lane>> lane(
            static_cast<std::shared_ptr<Lane>*>(context));
        (*lane)->threadMain();
        return nullptr;
      },
      self.get());
  pthread_attr_destroy(&attributes);
  if (failed != 0) return;
  (void)self.release();  // the thread's
  ++threads_;
  ++runnable_;
}

void Lane::moveDue() {
  if (delayed_.empty()) return;
  const Monotonic time = now();
  while (!delayed_.empty() && delayed_.front().due <= time) {
    std::pop_heap(delayed_.begin(), delayed_.end());
    Delayed due = std::move(delayed_.back());
    delayed_.pop_back();
    if (due.queue == nullptr) {
      itemQueued(*due.item, 0);
      concurrent_.push(due.item);
    } else if (due.queue->enqueueDue(due.item)) {
      ready_.push_back(std::move(due.queue));
    }
  }
  hasDelayed_.store(!delayed_.empty(), std::memory_order_relaxed);
}

// ---------------------------------------------------------------------------------------------------------------------
// Running it

void Lane::run(WorkItem& item) {
  try {
    item.run();
  } catch (const std::bad_alloc& failure) {
    giveUp(item, failure.what());
  } catch (const std::length_error& failure) {
    giveUp(item, failure.what());
  }
  if (item.charged > 0) accounts_.remove(item.cause.user, MemoryKind::Waiting, item.charged);
}

void Lane::giveUp(WorkItem& item, const char* why) {
  givenUp_.fetch_add(1, std::memory_order_relaxed);
  item.work = nullptr;  // who waits for an answer is told
  VX_LOG(nullptr, Error, "%s: work was given up: %s", options_.threadName, why);
}

std::size_t Lane::runOne(std::size_t maxItems) {
  ++running_;
  std::size_t ran = 0;
  if (!ready_.empty()) {
    std::shared_ptr<SerialQueue> queue = std::move(ready_.front());
    ready_.pop_front();
    mutex_.unlock();
    const SerialQueue::Turn turn = queue->runTurn(std::min(maxItems, kItemsPerTurn));
    ran = turn.ran;
    if (!turn.hasMore) queue.reset();  // its destruction may run anything: not under the lock
    mutex_.lock();
    if (queue != nullptr) ready_.push_back(std::move(queue));
  } else {
    std::unique_ptr<WorkItem> item(concurrent_.pop());
    mutex_.unlock();
    {
      const Current current(concurrentQueue_);
      run(*item);
      item.reset();
    }
    itemsDone(1);
    ran = 1;
    mutex_.lock();
  }
  --running_;
  return ran;
}

void Lane::threadMain() {
  pthread_setname_np(pthread_self(), options_.threadName);
  setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), options_.niceness);
  threadsLane = this;
  MutexLock lock(mutex_);
  bool didWork = false;
  while (!stopping_) {
    moveDue();
    if (hasWork()) {
      didWork = true;
      runOne(kItemsPerTurn);
      continue;
    }
    changed_.notifyAll();
    if (runnable_ > options_.runnableThreads) break;  // a replacement that is no longer needed
    sleep(didWork);
    didWork = false;
  }
  --threads_;
  --runnable_;
  FreeList<WorkItem>::clearThread();
  changed_.notifyAll();
}

void Lane::sleep(bool didWork) {
  if (didWork && delayed_.empty()) {
    // More is likely to follow soon: look again in a moment instead of asking every producer for a
    // wake-up.
    mutex_.unlock();
    std::this_thread::sleep_for(kLinger);
    mutex_.lock();
    return;
  }
  ++sleeping_;
  if (delayed_.empty())
    wake_.wait(mutex_);
  else
    wake_.waitUntil(mutex_, steadyPoint(delayed_.front().due));
  --sleeping_;
}

void Lane::beginBlocking() {
  if (threadsLane == nullptr || blockingDepth++ != 0) return;
  Lane& lane = *threadsLane;
  MutexLock lock(lane.mutex_);
  --lane.runnable_;
  if (lane.hasWork() || !lane.delayed_.empty()) lane.wakeOrStartThread();
}

void Lane::endBlocking() {
  if (threadsLane == nullptr || --blockingDepth != 0) return;
  MutexLock lock(threadsLane->mutex_);
  ++threadsLane->runnable_;
}

// ---------------------------------------------------------------------------------------------------------------------
// The interactive lane

bool Lane::run(std::size_t maxItems) {
  // Asked several times a pass, mostly for nothing. What another thread is just about to queue is
  // seen by prepareToSleep.
  if (backlog() == 0 && !hasDelayed_.load(std::memory_order_relaxed)) return false;
  MutexLock lock(mutex_);
  moveDue();
  while (maxItems > 0 && hasWork()) {
    const std::size_t ran = runOne(maxItems);
    maxItems -= std::min(ran, maxItems);
    moveDue();
  }
  return hasWork();
}

bool Lane::prepareToSleep() {
  MutexLock lock(mutex_);
  asleep_ = !hasWork();
  return asleep_;
}

std::optional<Monotonic> Lane::nextDue() {
  if (!hasDelayed_.load(std::memory_order_relaxed)) return std::nullopt;
  MutexLock lock(mutex_);
  if (delayed_.empty()) return std::nullopt;
  return delayed_.front().due;
}

// ---------------------------------------------------------------------------------------------------------------------
// The end

bool Lane::drain(Monotonic deadline) {
  MutexLock lock(mutex_);
  while (hasWork() || running_ > 0) {
    if (now() >= deadline) return false;
    waitForChange(deadline);
  }
  return true;
}

void Lane::stop(Monotonic deadline) {
  std::deque<std::shared_ptr<SerialQueue>> dropped;
  std::vector<Delayed> delayed;
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    while (threads_ > 0 && now() < deadline) {
      wake_.notifyAll();
      waitForChange(deadline);
    }
    dropped.swap(ready_);
    delayed.swap(delayed_);
  }
  for (Delayed& entry : delayed) delete entry.item;
}

void Lane::waitForChange(Monotonic deadline) {
  changed_.waitUntil(
      mutex_, steadyPoint(std::min<Monotonic>(deadline, now() + std::chrono::milliseconds(50))));
}

}  // namespace vx::lnx

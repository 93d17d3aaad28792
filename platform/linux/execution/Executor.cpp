#include "platform/linux/execution/Executor.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <deque>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "platform/linux/execution/ItemRoom.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kItemsPerTurn = 64;  // of one queue before the next queue of the lane
constexpr std::size_t kMaxThreadsPerLane = 1024;
constexpr std::size_t kStackBytes = 256 << 10;
constexpr std::chrono::milliseconds kLinger{5};

Monotonic now() { return std::chrono::steady_clock::now(); }

// One submitted piece of work. Singly linked, so that a queue is two pointers.
struct Item {
  explicit Item(Work w) : work(std::move(w)) {}
  Item* next = nullptr;
  Work work;
#ifndef __SANITIZE_ADDRESS__  // which would not see a use of an item that is done with
  static void* operator new(std::size_t size) { return ItemRoom::take(size); }
  static void operator delete(void* place) { ItemRoom::give(place); }
#endif
};

class ItemList {
 public:
  ItemList() = default;
  ItemList(ItemList&& other) noexcept
      : head_(std::exchange(other.head_, nullptr)), tail_(std::exchange(other.tail_, nullptr)) {}
  ItemList& operator=(ItemList&&) = delete;
  ~ItemList() {
    while (!empty()) delete pop();
  }
  bool empty() const { return head_ == nullptr; }
  void push(Item* item) {
    if (tail_ != nullptr)
      tail_->next = item;
    else
      head_ = item;
    tail_ = item;
  }
  Item* pop() {
    Item* item = head_;
    head_ = item->next;
    if (head_ == nullptr) tail_ = nullptr;
    item->next = nullptr;
    return item;
  }
  // Puts `front`'s items before these.
  void prepend(ItemList& front) {
    if (front.empty()) return;
    front.tail_->next = head_;
    if (tail_ == nullptr) tail_ = front.tail_;
    head_ = front.head_;
    front.head_ = front.tail_ = nullptr;
  }

 private:
  Item* head_ = nullptr;
  Item* tail_ = nullptr;
};

class SerialQueue;
class Lane;

thread_local const WorkQueue* currentQueue = nullptr;
thread_local Lane* currentLane = nullptr;
thread_local int blockingDepth = 0;

struct LaneOptions {
  QualityOfService quality;
  const char* threadName;
  int niceness;
  std::size_t runnableThreads;  // 0: the interactive lane, whose thread comes from outside
};

// The queues of one quality of service that have work, and the threads that run it. Thread-safe.
// Kept alive by its threads and its queues.
class Lane : public std::enable_shared_from_this<Lane> {
 public:
  explicit Lane(const LaneOptions& options) : options_(options) {}

  void post(std::shared_ptr<SerialQueue> queue);
  void postConcurrent(Item* item);
  void postDelayed(Monotonic due, std::shared_ptr<SerialQueue> queue, Item* item);

  void beginBlocking();
  void endBlocking();

  // The interactive lane.
  bool run(std::size_t maxItems);
  bool prepareToSleep();
  std::optional<Monotonic> nextDue();

  bool drain(Monotonic deadline);
  void stop(Monotonic deadline);

  void itemQueued() { backlog_.fetch_add(1, std::memory_order_relaxed); }
  void itemsDone(std::size_t count);

  bool isInteractive() const { return options_.runnableThreads == 0; }
  std::size_t backlog() const { return backlog_.load(std::memory_order_relaxed); }

  Function<void()> waker;
  std::atomic<std::thread::id> interactiveThread{};
  std::size_t lowWaterLevel = 0;
  Function<void()> lowWaterReached;

 private:
  struct Delayed {
    Monotonic due;
    uint64_t order = 0;
    std::shared_ptr<SerialQueue> queue;  // null: concurrent
    Item* item = nullptr;
    bool operator<(const Delayed& other) const {  // std heap functions keep the largest first
      return due != other.due ? due > other.due : order > other.order;
    }
  };

  bool hasWork() const REQUIRES(mutex_) { return !ready_.empty() || !concurrent_.empty(); }
  void workArrived() REQUIRES(mutex_);
  void startThread() REQUIRES(mutex_);
  void moveDue() REQUIRES(mutex_);
  void threadMain();
  // Runs one turn of one queue, or one concurrent item, with the lock released meanwhile.
  std::size_t runOne(std::size_t maxItems) REQUIRES(mutex_) NO_THREAD_SAFETY_ANALYSIS;
  void sleep(bool didWork) REQUIRES(mutex_) NO_THREAD_SAFETY_ANALYSIS;

  const LaneOptions options_;
  std::atomic<std::size_t> backlog_{0};
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
  uint64_t refusedThreads_ GUARDED_BY(mutex_) = 0;
  bool asleep_ GUARDED_BY(mutex_) = false;  // the event loop, since prepareToSleep
  bool stopping_ GUARDED_BY(mutex_) = false;
};

// A serial queue: owned by whoever asked for it, and by its lane while it has work.
class SerialQueue final : public WorkQueue, public std::enable_shared_from_this<SerialQueue> {
 public:
  SerialQueue(std::shared_ptr<Lane> lane, std::string_view label)
      : lane_(std::move(lane)), label_(label) {}

  void async(Work work) override { enqueue(new Item(std::move(work))); }
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override {
    if (delay.count() <= 0) return async(std::move(work));
    lane_->postDelayed(now() + delay, shared_from_this(), new Item(std::move(work)));
  }
  bool isCurrent() const override { return currentQueue == this; }
  std::string_view label() const override { return label_; }

  void enqueue(Item* item) {
    lane_->itemQueued();
    {
      MutexLock lock(mutex_);
      items_.push(item);
      if (scheduled_) return;
      scheduled_ = true;
    }
    lane_->post(shared_from_this());
  }

  // For delayed work of the lane, which posts the queue itself. True: the queue must be posted.
  bool enqueueWithoutPosting(Item* item) {
    lane_->itemQueued();
    MutexLock lock(mutex_);
    items_.push(item);
    return !std::exchange(scheduled_, true);
  }

  // Runs at most `maxItems` items; how many ran, and whether the queue must be posted again.
  std::pair<std::size_t, bool> runTurn(std::size_t maxItems) {
    ItemList taken = take();
    std::size_t ran = 0;
    const WorkQueue* const outer = std::exchange(currentQueue, this);
    while (!taken.empty() && ran < maxItems) {
      const std::unique_ptr<Item> item(taken.pop());
      item->work();
      ++ran;
    }
    currentQueue = outer;
    lane_->itemsDone(ran);
    MutexLock lock(mutex_);
    items_.prepend(taken);
    scheduled_ = !items_.empty();
    return {ran, scheduled_};
  }

 private:
  ItemList take() {
    MutexLock lock(mutex_);
    return std::move(items_);
  }

  const std::shared_ptr<Lane> lane_;
  const std::string_view label_;
  Mutex mutex_;
  ItemList items_ GUARDED_BY(mutex_);
  bool scheduled_ GUARDED_BY(mutex_) = false;  // on the lane's list, or having its turn
};

class ConcurrentQueue final : public WorkQueue {
 public:
  ConcurrentQueue(std::shared_ptr<Lane> lane, std::string_view label)
      : lane_(std::move(lane)), label_(label) {}
  void async(Work work) override { lane_->postConcurrent(new Item(std::move(work))); }
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override {
    if (delay.count() <= 0) return async(std::move(work));
    lane_->postDelayed(now() + delay, nullptr, new Item(std::move(work)));
  }
  bool isCurrent() const override { return currentQueue == this; }
  std::string_view label() const override { return label_; }

 private:
  const std::shared_ptr<Lane> lane_;
  const std::string_view label_;
};

void Lane::itemsDone(std::size_t count) {
  const std::size_t before = backlog_.fetch_sub(count, std::memory_order_relaxed);
  if (lowWaterReached && before >= lowWaterLevel && before - count < lowWaterLevel)
    lowWaterReached();
}

void Lane::post(std::shared_ptr<SerialQueue> queue) {
  bool mustWake = false;
  {
    MutexLock lock(mutex_);
    if (stopping_) return;
    ready_.push_back(std::move(queue));
    if (!isInteractive()) return workArrived();
    mustWake =
        asleep_ && interactiveThread.load(std::memory_order_relaxed) != std::this_thread::get_id();
    if (mustWake) asleep_ = false;
  }
  if (mustWake && waker) waker();
}

void Lane::postConcurrent(Item* item) {
  itemQueued();
  MutexLock lock(mutex_);
  if (stopping_) {
    delete item;
    return;
  }
  concurrent_.push(item);
  workArrived();
}

void Lane::postDelayed(Monotonic due, std::shared_ptr<SerialQueue> queue, Item* item) {
  bool mustWake = false;
  {
    MutexLock lock(mutex_);
    if (stopping_) {
      delete item;
      return;
    }
    const bool earliest = delayed_.empty() || due < delayed_.front().due;
    delayed_.push_back({due, nextOrder_++, std::move(queue), item});
    std::push_heap(delayed_.begin(), delayed_.end());
    if (!earliest) return;
    if (!isInteractive()) return workArrived();  // somebody must wait until then
    mustWake =
        asleep_ && interactiveThread.load(std::memory_order_relaxed) != std::this_thread::get_id();
    if (mustWake) asleep_ = false;
  }
  if (mustWake && waker) waker();
}

// A thread that runs or lingers looks again by itself; only sleeping ones are told, and missing
// ones started.
void Lane::workArrived() {
  if (sleeping_ > 0) {
    // While one of the lane's threads is awake, a lone item is left to it.
    if (runnable_ == sleeping_ || ready_.size() > 1) wake_.notifyOne();
  } else if (runnable_ < options_.runnableThreads) {
    startThread();
  }
}

void Lane::startThread() {
  if (threads_ >= kMaxThreadsPerLane) {
    ++refusedThreads_;  // the work waits for a thread to come out of its Blocking scope
    return;
  }
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setstacksize(&attributes, kStackBytes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  const SignalsBlocked blocked;
  auto* self = new std::shared_ptr<Lane>(shared_from_this());
  pthread_t thread{};
  const int failed = pthread_create(
      &thread, &attributes,
      [](void* context) -> void* {
        const std::unique_ptr<std::shared_ptr<Lane>> lane(
            static_cast<std::shared_ptr<Lane>*>(context));
        (*lane)->threadMain();
        return nullptr;
      },
      self);
  pthread_attr_destroy(&attributes);
  if (failed != 0) {
    delete self;
    ++refusedThreads_;
    return;
  }
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
      itemQueued();
      concurrent_.push(due.item);
    } else if (due.queue->enqueueWithoutPosting(due.item)) {
      ready_.push_back(std::move(due.queue));
    }
  }
}

std::size_t Lane::runOne(std::size_t maxItems) {
  ++running_;
  std::size_t ran = 0;
  if (!ready_.empty()) {
    std::shared_ptr<SerialQueue> queue = std::move(ready_.front());
    ready_.pop_front();
    mutex_.unlock();
    const auto [count, more] = queue->runTurn(std::min(maxItems, kItemsPerTurn));
    ran = count;
    if (!more) queue.reset();  // its destruction may run anything: not under the lock
    mutex_.lock();
    if (more && !stopping_) ready_.push_back(std::move(queue));
  } else {
    std::unique_ptr<Item> item(concurrent_.pop());
    mutex_.unlock();
    item->work();
    item.reset();
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
  currentLane = this;
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
  ItemRoom::leave();
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
    wake_.waitUntil(mutex_, std::chrono::time_point_cast<std::chrono::steady_clock::duration>(
                                delayed_.front().due));
  --sleeping_;
}

void Lane::beginBlocking() {
  MutexLock lock(mutex_);
  --runnable_;
  if (hasWork() || !delayed_.empty()) workArrived();
}

void Lane::endBlocking() {
  MutexLock lock(mutex_);
  ++runnable_;
}

bool Lane::run(std::size_t maxItems) {
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
  MutexLock lock(mutex_);
  if (delayed_.empty()) return std::nullopt;
  return delayed_.front().due;
}

bool Lane::drain(Monotonic deadline) {
  MutexLock lock(mutex_);
  while (hasWork() || running_ > 0) {
    if (now() >= deadline) return false;
    changed_.waitUntil(mutex_,
                       std::min<Monotonic>(deadline, now() + std::chrono::milliseconds(50)));
  }
  return true;
}

void Lane::stop(Monotonic deadline) {
  std::deque<std::shared_ptr<SerialQueue>> dropped;
  std::vector<Delayed> delayed;
  MutexLock lock(mutex_);
  stopping_ = true;
  wake_.notifyAll();
  while (threads_ > 0 && now() < deadline) {
    wake_.notifyAll();
    changed_.waitUntil(mutex_,
                       std::min<Monotonic>(deadline, now() + std::chrono::milliseconds(50)));
  }
  dropped.swap(ready_);
  delayed.swap(delayed_);
  for (Delayed& entry : delayed) delete entry.item;
}

}  // namespace

struct Executor::Impl {
  std::shared_ptr<Lane> interactive = std::make_shared<Lane>(
      LaneOptions{QualityOfService::UserInteractive, "vx-interactive", 0, 0});
  std::shared_ptr<Lane> utility =
      std::make_shared<Lane>(LaneOptions{QualityOfService::Utility, "vx-utility", 5, 1});
  std::shared_ptr<Lane> background =
      std::make_shared<Lane>(LaneOptions{QualityOfService::Background, "vx-background", 10, 2});
  ConcurrentQueue concurrent{background, "com.quorvel.sonik.background"};

  std::shared_ptr<Lane>& lane(QualityOfService quality) {
    switch (quality) {
      case QualityOfService::UserInteractive:
        return interactive;
      case QualityOfService::Utility:
        return utility;
      case QualityOfService::Background:
        break;
    }
    return background;
  }
};

Executor::Executor() : impl_(std::make_shared<Impl>()) {}
Executor::~Executor() = default;

std::shared_ptr<WorkQueue> Executor::makeSerial(std::string_view label, QualityOfService quality) {
  return std::make_shared<SerialQueue>(impl_->lane(quality), label);
}

WorkQueue& Executor::background() { return impl_->concurrent; }

void Executor::beginBlocking() {
  if (currentLane != nullptr && blockingDepth++ == 0) currentLane->beginBlocking();
}

void Executor::endBlocking() {
  if (currentLane != nullptr && --blockingDepth == 0) currentLane->endBlocking();
}

void Executor::adoptInteractiveThread() {
  impl_->interactive->interactiveThread = std::this_thread::get_id();
}

bool Executor::isInteractiveThread() const {
  return impl_->interactive->interactiveThread.load(std::memory_order_relaxed) ==
         std::this_thread::get_id();
}

bool Executor::runInteractive(std::size_t maxItems) { return impl_->interactive->run(maxItems); }
std::optional<Monotonic> Executor::nextInteractiveDue() const {
  return impl_->interactive->nextDue();
}
void Executor::setInteractiveWaker(Function<void()> wake) {
  impl_->interactive->waker = std::move(wake);
}
bool Executor::prepareToSleep() { return impl_->interactive->prepareToSleep(); }
std::size_t Executor::utilityBacklog() const { return impl_->utility->backlog(); }

void Executor::setUtilityLowWater(std::size_t level, Function<void()> reached) {
  impl_->utility->lowWaterLevel = level;
  impl_->utility->lowWaterReached = std::move(reached);
}

bool Executor::drain(Monotonic deadline) {
  const bool utility = impl_->utility->drain(deadline);
  return impl_->background->drain(deadline) && utility;
}

void Executor::stop(Monotonic deadline) {
  impl_->utility->stop(deadline);
  impl_->background->stop(deadline);
  impl_->interactive->stop(deadline);
}

}  // namespace vx::lnx

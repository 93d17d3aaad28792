#include "platform/linux/execution/SystemThreading.h"

#include <malloc.h>

#include <ctime>
#include <thread>
#include <vector>

#include "base/Mutex.h"
#include "base/ThreadChecker.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

Monotonic steadyNow() { return std::chrono::steady_clock::now(); }

std::chrono::steady_clock::time_point steadyPoint(Monotonic when) {
  return std::chrono::time_point_cast<std::chrono::steady_clock::duration>(when);
}

class SystemCondition final : public Condition {
 public:
  void lock() override NO_THREAD_SAFETY_ANALYSIS { mutex_.lock(); }
  void unlock() override NO_THREAD_SAFETY_ANALYSIS { mutex_.unlock(); }
  bool waitUntil(Monotonic deadline) override NO_THREAD_SAFETY_ANALYSIS {
    return condition_.waitUntil(mutex_, steadyPoint(deadline));
  }
  void signal() override { condition_.notifyOne(); }

 private:
  Mutex mutex_;
  CondVar condition_;
};

// What a run loop and its timers share: the lock under which fire times move, and the condition
// that tells the loop.
struct LoopState {
  Mutex mutex;
  CondVar changed;
};

class SystemTimer final : public OneShotTimer {
 public:
  SystemTimer(Monotonic fireTime, Function<void()> action)
      : fireTime_(fireTime), action_(std::move(action)) {}

  void setFireTime(Monotonic when) override {
    std::shared_ptr<LoopState> loop;
    {
      MutexLock lock(mutex_);
      fireTime_ = when;
      loop = loop_.lock();
    }
    if (loop != nullptr) tell(*loop);
  }
  void invalidate() override {
    std::shared_ptr<LoopState> loop;
    {
      MutexLock lock(mutex_);
      valid_ = false;
      loop = loop_.lock();
    }
    if (loop != nullptr) tell(*loop);
  }
  void attachTo(const std::shared_ptr<LoopState>& loop) {
    MutexLock lock(mutex_);
    loop_ = loop;
  }
  bool isValid() const {
    MutexLock lock(mutex_);
    return valid_;
  }
  Monotonic fireTime() const {
    MutexLock lock(mutex_);
    return fireTime_;
  }
  // Marks it as fired: a later move changes nothing.
  bool beginFiring() {
    MutexLock lock(mutex_);
    return std::exchange(valid_, false);
  }
  void fire() { action_(); }

 private:
  // The loop reads fire times between taking its lock and waiting; taking it here closes the gap
  // between the two.
  static void tell(LoopState& loop) {
    MutexLock lock(loop.mutex);
    loop.changed.notifyOne();
  }

  mutable Mutex mutex_;
  Monotonic fireTime_ GUARDED_BY(mutex_);
  bool valid_ GUARDED_BY(mutex_) = true;
  std::weak_ptr<LoopState> loop_ GUARDED_BY(mutex_);
  const Function<void()> action_;
};

// Confined to the thread that runs it, but for the state it shares with its timers.
class SystemRunLoop final : public RunLoop {
 public:
  void attach(std::shared_ptr<OneShotTimer> timer) override {
    thread_.assertHere();
    auto systemTimer = std::static_pointer_cast<SystemTimer>(std::move(timer));
    systemTimer->attachTo(state_);
    timers_.push_back(std::move(systemTimer));
  }

  void runUntilEmpty() override {
    thread_.assertHere();
    for (;;) {
      std::shared_ptr<SystemTimer> due;
      {
        MutexLock lock(state_->mutex);
        std::erase_if(timers_, [](const auto& timer) { return !timer->isValid(); });
        if (timers_.empty()) return;
        auto earliest = timers_.begin();
        Monotonic fireTime = (*earliest)->fireTime();
        for (auto at = timers_.begin() + 1; at != timers_.end(); ++at) {
          const Monotonic other = (*at)->fireTime();
          if (other < fireTime) {
            earliest = at;
            fireTime = other;
          }
        }
        if (fireTime > steadyNow()) {
          state_->changed.waitUntil(state_->mutex, steadyPoint(fireTime));
          continue;
        }
        due = *earliest;
        timers_.erase(earliest);
      }
      if (due->beginFiring()) due->fire();
    }
  }

 private:
  const std::shared_ptr<LoopState> state_ = std::make_shared<LoopState>();
  ThreadChecker thread_;
  std::vector<std::shared_ptr<SystemTimer>> timers_
      GUARDED_BY(thread_);  // bounded by who attaches them
};

class SystemThread final : public Thread {};

}  // namespace

Date SystemClock::now() {
  return std::chrono::time_point_cast<std::chrono::nanoseconds>(std::chrono::system_clock::now());
}

Monotonic SystemClock::monotonic() { return steadyNow(); }

std::string SystemClock::formatLocal(Date date, const char* format) {
  const std::time_t seconds = std::chrono::system_clock::to_time_t(
      std::chrono::time_point_cast<std::chrono::system_clock::duration>(date));
  std::tm parts{};
  tzset();  // localtime_r alone would keep the time zone of the first call for ever
  localtime_r(&seconds, &parts);
  char text[128];
  const std::size_t length = std::strftime(text, sizeof text, format, &parts);
  return std::string(text, length);
}

SystemThreading::SystemThreading(WorkQueue& background, Function<void()> trim)
    : background_(background), trim_(std::move(trim)) {}

std::unique_ptr<Condition> SystemThreading::makeCondition() {
  return std::make_unique<SystemCondition>();
}

std::shared_ptr<OneShotTimer> SystemThreading::makeTimer(std::chrono::nanoseconds delay,
                                                         Function<void()> action) {
  return std::make_shared<SystemTimer>(steadyNow() + delay, std::move(action));
}

std::unique_ptr<RunLoop> SystemThreading::makeRunLoop() {
  return std::make_unique<SystemRunLoop>();
}

std::unique_ptr<Thread> SystemThreading::startThread(std::string_view name, Function<void()> body) {
  vx::lnx::startThread(name, std::move(body)).detach();
  return std::make_unique<SystemThread>();
}

// The allocator gives back only what lies at the end of its heap by itself.
void SystemThreading::trimHeap() { malloc_trim(0); }

void SystemThreading::memoryWasFreed(std::size_t approximateBytes) {
  if (approximateBytes < kWorthTrimmingBytes) return;
  {
    MutexLock lock(mutex_);
    freedMeanwhile_ = trimPending_;
    if (std::exchange(trimPending_, true)) return;
  }
  trimLater();
}

void SystemThreading::trimLater() {
  const NoCause own;
  background_.asyncAfter(kTrimDelay, [this] {
    trim_();
    {
      MutexLock lock(mutex_);
      trimPending_ = std::exchange(freedMeanwhile_, false);
      if (!trimPending_) return;
    }
    trimLater();
  });
}

void SystemThreading::sleepFor(std::chrono::nanoseconds duration) {
  std::this_thread::sleep_for(duration);
}

}  // namespace vx::lnx

// The clocks, threads, conditions, run loops and timers of this machine.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "base/Clock.h"
#include "base/Mutex.h"
#include "platform/Threading.h"
#include "platform/WorkQueue.h"

namespace vx::lnx {

// Thread-safe, stateless.
class SystemClock final : public Clock {
 public:
  Date now() override;
  Monotonic monotonic() override;
  std::string formatLocal(Date date, const char* format) override;
};

// Thread-safe. Threads are detached; an exception that leaves a thread's body ends the process.
// Memory is given back to the system kTrimDelay after kWorthTrimmingBytes of it or more were freed
// at once, on the background queue; what is freed during the delay is waited for in a second round,
// so that there is never more than one item on that queue.
class SystemThreading final : public Threading {
 public:
  static constexpr std::size_t kWorthTrimmingBytes = 1 << 20;
  static constexpr std::chrono::seconds kTrimDelay{2};

  // `background` must have stopped before this is destroyed. `trim` is what gives memory back.
  explicit SystemThreading(WorkQueue& background, Function<void()> trim = trimHeap);
  std::unique_ptr<Condition> makeCondition() override;
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Function<void()> action) override;
  std::unique_ptr<RunLoop> makeRunLoop() override;
  std::unique_ptr<Thread> startThread(std::string_view name, Function<void()> body) override;
  void sleepFor(std::chrono::nanoseconds duration) override;
  void memoryWasFreed(std::size_t approximateBytes) override;

 private:
  static void trimHeap();
  void trimLater();

  WorkQueue& background_;
  const Function<void()> trim_;
  Mutex mutex_;
  bool trimPending_ GUARDED_BY(mutex_) = false;
  bool freedMeanwhile_ GUARDED_BY(mutex_) = false;  // while one is pending
};

}  // namespace vx::lnx

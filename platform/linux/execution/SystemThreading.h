// The clocks, threads, conditions, run loops and timers of this machine.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "base/Clock.h"
#include "platform/Threading.h"

namespace vx::lnx {

// Thread-safe, stateless.
class SystemClock final : public Clock {
 public:
  Date now() override;
  Monotonic monotonic() override;
  std::string formatLocal(Date date, const char* format) override;
};

// Thread-safe, stateless. Threads are detached; an exception that leaves a thread's body ends the
// process.
class SystemThreading final : public Threading {
 public:
  std::unique_ptr<Condition> makeCondition() override;
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Function<void()> action) override;
  std::unique_ptr<RunLoop> makeRunLoop() override;
  std::unique_ptr<Thread> startThread(std::string_view name, Function<void()> body) override;
  void sleepFor(std::chrono::nanoseconds duration) override;
  void memoryWasFreed() override;
};

}  // namespace vx::lnx

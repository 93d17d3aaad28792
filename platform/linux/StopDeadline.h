// How long a stop may take.
#pragma once

#include <chrono>
#include <cstdint>

#include "base/Clock.h"
#include "base/Function.h"

namespace vx::lnx {

// A disk that works needs a moment; a slow one gets more for as long as something gets done. Owned
// by whoever stops; one thread's.
class StopDeadline {
 public:
  struct Limits {
    std::chrono::milliseconds first;  // from the beginning, whatever gets done
    std::chrono::milliseconds pause;  // beyond that: the longest time in which nothing does
    std::chrono::milliseconds most;   // from the beginning, in all
  };
  // `askForTime`: told, at most once a second, for how much longer it may take than `first`.
  StopDeadline(Clock& clock, Monotonic began, const Limits& limits,
               Function<void(std::chrono::milliseconds)> askForTime);

  // Asked again and again: false when time is up. `progress`: a number that changes whenever
  // something gets done.
  bool goOn(uint64_t progress);
  // Until when to wait before asking.
  Monotonic nextLook() const;

 private:
  Clock& clock_;
  const Limits limits_;
  const Monotonic last_;
  const Function<void(std::chrono::milliseconds)> askForTime_;
  Monotonic end_;
  Monotonic lastProgress_;
  Monotonic nextQuestion_{};
  uint64_t progress_ = 0;
};

}  // namespace vx::lnx

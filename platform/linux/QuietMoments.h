// When load is over, so that what it has left behind may be given back.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <utility>

#include "base/Clock.h"
#include "base/Function.h"

namespace vx::lnx {

// Compares a count of what is done: after a pass of the loop whether there was load at all, and
// then from time to time until there is next to none; then a few times more, because what waits for
// a commit or a snapshot is free a little later. So a device that idles, or has little to do, is
// never woken. Owned by the platform, on the interactive thread.
class QuietMoments {
 public:
  static constexpr uint64_t kLoad = 1000;  // connections and calls that are worth it
  static constexpr uint64_t kQuiet = 100;  // in kBetween
  static constexpr std::chrono::seconds kBetween{5};
  static constexpr int kTimes = 3;

  QuietMoments(Clock& clock, Function<void()> onQuiet)
      : clock_(clock), onQuiet_(std::move(onQuiet)) {}
  void afterPass(uint64_t done) {
    done_ = done;
    if (!next_ && done_ - seen_ >= kLoad) look();
  }
  std::optional<Monotonic> nextDue() const { return next_; }
  void onDue() {
    times_ = done_ - seen_ < kQuiet ? times_ + 1 : 0;
    look();
    if (times_ == 0) return;
    if (times_ == kTimes) next_.reset(), times_ = 0;
    onQuiet_();
  }

 private:
  void look() {
    seen_ = done_;
    next_ = clock_.monotonic() + kBetween;
  }

  Clock& clock_;
  const Function<void()> onQuiet_;
  uint64_t done_ = 0;
  uint64_t seen_ = 0;
  int times_ = 0;
  std::optional<Monotonic> next_;
};

}  // namespace vx::lnx

#include "platform/linux/StopDeadline.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kLookEvery{50};
constexpr std::chrono::seconds kAskEvery{1};

}  // namespace

StopDeadline::StopDeadline(Clock& clock, Monotonic began, const Limits& limits,
                           Function<void(std::chrono::milliseconds)> askForTime)
    : clock_(clock),
      limits_(limits),
      last_(began + limits.most),
      askForTime_(std::move(askForTime)),
      end_(began + limits.first),
      lastProgress_(began) {}

bool StopDeadline::goOn(uint64_t progress) {
  const Monotonic now = clock_.monotonic();
  if (std::exchange(progress_, progress) != progress) lastProgress_ = now;
  const Monotonic end = std::min(std::max(end_, lastProgress_ + limits_.pause), last_);
  if (now >= end) return false;
  if (now >= end_ && now >= nextQuestion_) {
    nextQuestion_ = now + kAskEvery;
    askForTime_(limits_.pause);
  }
  return true;
}

Monotonic StopDeadline::nextLook() const { return clock_.monotonic() + kLookEvery; }

}  // namespace vx::lnx

#include "platform/linux/execution/SerialQueue.h"

#include <utility>

#include "platform/linux/execution/Lane.h"
#include "platform/linux/execution/SteppedWork.h"

namespace vx::lnx {

SerialQueue::SerialQueue(std::shared_ptr<Lane> lane, std::string_view label)
    : lane_(std::move(lane)), label_(label) {}

void SerialQueue::async(Work work, std::size_t holds) {
  auto* const item = new WorkItem(std::move(work));
  lane_->itemQueued(*item, holds);
  {
    MutexLock lock(mutex_);
    items_.push(item);
    if (std::exchange(scheduled_, true)) return;
  }
  lane_->post(shared_from_this());
}

void SerialQueue::asyncAfter(std::chrono::nanoseconds delay, Work work) {
  if (delay.count() <= 0) return async(std::move(work), 0);
  lane_->postDelayed(delay, shared_from_this(), new WorkItem(std::move(work)));
}

void SerialQueue::asyncInSteps(Function<bool()> step) {
  async(
      [this, step = std::move(step)]() mutable {
        if (!step()) return;
        if (const Lane::StepsTaker& taker = lane_->stepsTaker())
          return taker(std::make_unique<SteppedWork>(shared_from_this(), std::move(step)));
        while (step()) {
        }
      },
      0);
}

bool SerialQueue::isCurrent() const { return Lane::currentQueue() == this; }

bool SerialQueue::enqueueDue(WorkItem* item) {
  lane_->itemQueued(*item, 0);
  MutexLock lock(mutex_);
  items_.push(item);
  return !std::exchange(scheduled_, true);
}

SerialQueue::Turn SerialQueue::runTurn(std::size_t maxItems) {
  ItemList taken = takeAll();
  std::size_t ran = 0;
  {
    const Lane::Current current(this);
    while (!taken.empty() && ran < maxItems) {
      const std::unique_ptr<WorkItem> item(taken.pop());
      lane_->run(*item);
      ++ran;
    }
  }
  lane_->itemsDone(ran);
  MutexLock lock(mutex_);
  items_.prepend(taken);
  scheduled_ = !items_.empty();
  return {ran, scheduled_};
}

ItemList SerialQueue::takeAll() {
  MutexLock lock(mutex_);
  return std::move(items_);
}

}  // namespace vx::lnx

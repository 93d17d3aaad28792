#include "platform/linux/execution/ConcurrentQueue.h"

#include <utility>

#include "platform/linux/execution/Lane.h"

namespace vx::lnx {

ConcurrentQueue::ConcurrentQueue(std::shared_ptr<Lane> lane, std::string_view label)
    : lane_(std::move(lane)), label_(label) {
  lane_->setConcurrentQueue(this);
}

void ConcurrentQueue::async(Work work, std::size_t holds) {
  lane_->postConcurrent(new WorkItem(std::move(work)), holds);
}

void ConcurrentQueue::asyncAfter(std::chrono::nanoseconds delay, Work work) {
  if (delay.count() <= 0) return async(std::move(work), 0);
  lane_->postDelayed(delay, nullptr, new WorkItem(std::move(work)));
}

bool ConcurrentQueue::isCurrent() const { return Lane::currentQueue() == this; }

}  // namespace vx::lnx

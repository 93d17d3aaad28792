// A queue whose items run side by side.
#pragma once

#include <memory>
#include <string_view>

#include "platform/WorkQueue.h"

namespace vx::lnx {

class Lane;

// Thread-safe. Keeps nothing itself: the items wait in the lane, whose threads are their bound.
class ConcurrentQueue final : public WorkQueue {
 public:
  // `label` must outlive it. The lane's one concurrent queue.
  ConcurrentQueue(std::shared_ptr<Lane> lane, std::string_view label);
  void async(Work work, std::size_t holds) override;
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override;
  bool isCurrent() const override;
  std::string_view label() const override { return label_; }

 private:
  const std::shared_ptr<Lane> lane_;
  const std::string_view label_;
};

}  // namespace vx::lnx

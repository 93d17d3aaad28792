// A serial work queue.
#pragma once

#include <memory>
#include <string_view>

#include "base/Mutex.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/WorkItem.h"

namespace vx::lnx {

class Lane;

// Owned by whoever asked for it, and by its lane while it has work. Thread-safe. Unbounded by
// itself: what waits is on the account of whoever caused it.
class SerialQueue final : public WorkQueue, public std::enable_shared_from_this<SerialQueue> {
 public:
  // `label` must outlive it.
  SerialQueue(std::shared_ptr<Lane> lane, std::string_view label);

  void async(Work work, std::size_t holds) override;
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override;
  // In one item, but for the interactive lane while somebody takes its steps.
  void asyncInSteps(Function<bool()> step) override;
  bool isCurrent() const override;
  std::string_view label() const override { return label_; }

  // --- for the lane ---
  // Delayed work that is due. True: the queue must be posted.
  bool enqueueDue(WorkItem* item);
  struct Turn {
    std::size_t ran;
    bool hasMore;  // the queue must be posted again
  };
  // Runs at most `maxItems` items.
  Turn runTurn(std::size_t maxItems);

 private:
  ItemList takeAll();

  const std::shared_ptr<Lane> lane_;
  const std::string_view label_;
  Mutex mutex_;
  ItemList items_ GUARDED_BY(mutex_);
  bool scheduled_ GUARDED_BY(mutex_) = false;  // on the lane's list, or having its turn
};

}  // namespace vx::lnx

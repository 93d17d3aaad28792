#include "platform/linux/recovery/JournalMove.h"

#include <chrono>

#include "platform/linux/execution/Threads.h"
#include "platform/linux/journal/JournalFolder.h"

namespace vx::lnx {

JournalMove::JournalMove(const std::string& from, const std::string& to, uint64_t mostBytes) {
  startThread("vx-journal", [shared = shared_, from, to, mostBytes] {
    const Status moved = JournalFolder::moveTo(
        from, to, [&] { ++shared->segments; }, mostBytes);
    MutexLock lock(shared->mutex);
    shared->outcome = moved;
    shared->changed.notifyAll();
  }).detach();
}

std::optional<Status> JournalMove::waitUntil(Monotonic until) {
  const auto limit = std::chrono::time_point_cast<std::chrono::steady_clock::duration>(until);
  MutexLock lock(shared_->mutex);
  while (!shared_->outcome && shared_->changed.waitUntil(shared_->mutex, limit)) {
  }
  return shared_->outcome;
}

}  // namespace vx::lnx

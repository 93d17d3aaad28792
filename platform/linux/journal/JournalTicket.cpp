#include "platform/linux/journal/JournalTicket.h"

#include <atomic>

#include "platform/linux/journal/JournalSegment.h"

namespace vx::lnx {

void JournalTicket::hold() const noexcept {
  if (entry_ == nullptr) return;
  std::atomic_ref<uint32_t>(entry_->waiting).fetch_add(1, std::memory_order_relaxed);
}

bool JournalTicket::wasDone() const {
  const uint32_t waiting =
      std::atomic_ref<uint32_t>(entry_->waiting).load(std::memory_order_relaxed);
  return (waiting & EntryHeader::kWasDone) != 0;
}

void JournalTicket::release() noexcept {
  std::atomic_ref<uint32_t> waiting(entry_->waiting);
  // The only holder needs no read-modify-write.
  if (waiting.load(std::memory_order_acquire) == 1)
    waiting.store(0, std::memory_order_release);
  else if ((waiting.fetch_sub(1, std::memory_order_acq_rel) & ~EntryHeader::kWasDone) != 1)
    return;
  JournalSegment::of(entry_)->callDone();
}

}  // namespace vx::lnx

#include "platform/linux/store/EventPairing.h"

#include <bit>
#include <utility>

namespace vx::lnx {

namespace {

constexpr std::size_t kKeptSlots = 4096;

}  // namespace

// The slot of a message, or the empty one where it would be.
uint32_t& EventPairing::slotOf(const StoreRecords& batch, const void* identity) {
  const auto bits = static_cast<uint64_t>(reinterpret_cast<uintptr_t>(identity));
  const std::size_t mask = slots_.size() - 1;
  std::size_t at = static_cast<std::size_t>((bits >> 4) * 0x9E3779B97F4A7C15u >> 32) & mask;
  while (slots_[at] != StoreRecord::kNone &&
         std::get<RelayMessageRecord>(batch[slots_[at]].what).payload.identity() != identity)
    at = (at + 1) & mask;
  return slots_[at];
}

void EventPairing::pair(StoreRecords& batch) {
  thread_.assertHere();
  std::size_t messages = 0;
  for (std::size_t i = 0; i < batch.size(); ++i)
    messages += std::holds_alternative<RelayMessageRecord>(batch[i].what) ? 1 : 0;
  if (messages == 0 || messages == batch.size()) return;
  slots_.assign(std::bit_ceil(2 * messages), StoreRecord::kNone);
  next_.assign(batch.size(), StoreRecord::kNone);
  for (std::size_t i = batch.size(); i-- > 0;) {
    const auto* message = std::get_if<RelayMessageRecord>(&batch[i].what);
    if (message == nullptr || message->payload.identity() == nullptr) continue;
    uint32_t& slot = slotOf(batch, message->payload.identity());
    next_[i] = std::exchange(slot, static_cast<uint32_t>(i));
  }
  for (std::size_t i = 0; i < batch.size(); ++i) {
    const auto* event = std::get_if<AnalyticsRecord>(&batch[i].what);
    if (event == nullptr || event->message.identity() == nullptr) continue;
    uint32_t& slot = slotOf(batch, event->message.identity());
    if (slot == StoreRecord::kNone || batch[slot].event != StoreRecord::kNone ||
        batch[slot].cause.ticket.call() != batch[i].cause.ticket.call())
      continue;
    batch[i].sharing = StoreRecord::Sharing::Shares;
    batch[slot].event = static_cast<uint32_t>(i);
    if (next_[slot] != StoreRecord::kNone) slot = next_[slot];
  }
  if (slots_.capacity() > kKeptSlots) {
    std::vector<uint32_t>().swap(slots_);
    std::vector<uint32_t>().swap(next_);
  }
}

void EventPairing::hold(StoreRecords& batch, double youngerThan, Monotonic now) {
  thread_.assertHere();
  for (std::size_t i = 0; i < batch.size(); ++i) {
    StoreRecord& record = batch[i];
    const auto* event = std::get_if<AnalyticsRecord>(&record.what);
    if (event == nullptr || event->message.identity() == nullptr ||
        record.sharing != StoreRecord::Sharing::No || record.time < youngerThan)
      continue;
    record.sharing = StoreRecord::Sharing::Held;  // once
    held_.push_back(std::exchange(record, StoreRecord{record.time, std::monostate()}));
  }
  if (!held_.empty()) heldSince_ = now;
}

void EventPairing::join(StoreRecords& batch) {
  thread_.assertHere();
  for (StoreRecord& event : held_) batch.push_back(std::move(event));
  held_.clear();
}

std::optional<Monotonic> EventPairing::heldSince() const {
  thread_.assertHere();
  return held_.empty() ? std::nullopt : std::optional<Monotonic>(heldSince_);
}

uint64_t EventPairing::markWritten(StoreRecords& batch, std::size_t first, std::size_t last) {
  uint64_t unrecorded = 0;
  for (std::size_t i = first; i < last; ++i) {
    StoreRecord& record = batch[i];
    if (record.sharing == StoreRecord::Sharing::Shares) continue;   // when its message is
    if (record.sharing == StoreRecord::Sharing::Written) continue;  // as its message was
    if (!record.cause.ticket && !record.makesNoRow()) ++unrecorded;
    record.cause = {};
    auto* message = std::get_if<RelayMessageRecord>(&record.what);
    if (message == nullptr) continue;
    message->payload = Payload();
    std::atomic<uint64_t>& committed = message->row->messagesCommitted;  // written here alone
    committed.store(committed.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    if (record.event == StoreRecord::kNone) continue;
    StoreRecord& event = batch[record.event];
    event.sharing = StoreRecord::Sharing::Written;
    if (!event.cause.ticket) ++unrecorded;
    event.cause = {};
  }
  return unrecorded;
}

EventPairing::Unwritten EventPairing::unwrittenRows(const StoreRecords& batch, std::size_t first) {
  Unwritten rows;
  for (std::size_t i = 0; i < batch.size(); ++i) {
    const StoreRecord& record = batch[i];
    if (record.makesNoRow()) continue;
    // An event before `first` may share the text of a message after it.
    if (record.sharing == StoreRecord::Sharing::Shares ||
        (i >= first && record.sharing != StoreRecord::Sharing::Written))
      ++(record.cause.ticket ? rows.recorded : rows.lost);
  }
  return rows;
}

void EventPairing::abandon(StoreRecords& batch, std::size_t first) {
  for (std::size_t i = 0; i < batch.size(); ++i) {
    if (i >= first || batch[i].sharing == StoreRecord::Sharing::Shares)
      batch[i].cause.ticket.abandon();
  }
}

}  // namespace vx::lnx

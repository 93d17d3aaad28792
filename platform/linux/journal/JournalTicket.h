// The right to say that a recorded call is done.
#pragma once

#include <utility>

#include "platform/linux/journal/JournalFormat.h"

namespace vx::lnx {

// Held by everything that still waits because of a call: when the last copy goes the call is done,
// also for whoever reads the journal after a crash. Thread-safe as a shared pointer is: each copy
// by one thread at a time. May outlive the journal. Eight bytes, allocates nothing.
class JournalTicket {
 public:
  JournalTicket() = default;  // of no call
  JournalTicket(const JournalTicket& other) noexcept : entry_(other.entry_) { hold(); }
  JournalTicket(JournalTicket&& other) noexcept : entry_(std::exchange(other.entry_, nullptr)) {}
  JournalTicket& operator=(JournalTicket other) noexcept {
    std::swap(entry_, other.entry_);
    return *this;
  }
  ~JournalTicket() {
    if (entry_ != nullptr) release();
  }

  // Lets go without saying that the call is done: it never will be in this process.
  void abandon() noexcept { entry_ = nullptr; }
  explicit operator bool() const { return entry_ != nullptr; }
  uint64_t call() const { return entry_ == nullptr ? 0 : entry_->call; }
  // The call that rows are named after: the entry's own, or the earlier one whose work it stands
  // for.
  uint64_t namedCall() const {
    if (entry_ == nullptr) return 0;
    return (entry_->flags & EntryHeader::kForEarlier) != 0 ? entry_->connection : entry_->call;
  }
  uint32_t user() const { return entry_ == nullptr ? kNoUser : entry_->user; }
  // When the call was accepted, seconds since 1970; and the kind of its record. Of a call only.
  double time() const { return entry_->time; }
  uint8_t kind() const { return entry_->kind; }
  // It is replayed, for the state that it leaves: its rows were written by an earlier process.
  bool wasDone() const;

 private:
  friend class Journal;
  // Adopts the one that the entry was made with.
  explicit JournalTicket(EntryHeader* entry) : entry_(entry) {}
  void hold() const noexcept;
  void release() noexcept;
  EntryHeader* entry_ = nullptr;
};

}  // namespace vx::lnx

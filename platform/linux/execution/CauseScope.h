// Which recorded call a piece of work goes back to.
#pragma once

#include <cstdint>
#include <optional>
#include <utility>

#include "platform/WorkQueue.h"
#include "platform/linux/execution/UserAccounts.h"
#include "platform/linux/journal/JournalTicket.h"

namespace vx::lnx {

// A call, and a place in what it causes.
//
// Work that is queued while a call's work runs belongs to that call, on whatever queue and however
// late, and so does each row appended to the store meanwhile. Each takes the next place, so the
// same call, run again from the same state, gives its rows the same places: a row is known by
// (epoch, call, place). The bits of a place, by depth:
//
//   | call itself 2 | work it queued 22 | work queued by that 4 | by that in turn 4 |
struct CausePosition {
  uint32_t place = 0;
  uint8_t depth = 0;
};
inline constexpr uint8_t kDeepestCause = 3;

// A row's name within an epoch; call 0 stands for none.
struct RowKey {
  uint64_t call = 0;
  uint32_t place = 0;
  bool operator==(const RowKey&) const = default;
};

// What queued work or a row to be written holds on to. Its call is not done before it is gone.
struct Cause {
  JournalTicket ticket{};
  [[no_unique_address]] CausePosition position{};
  UserIndex user = kServiceItself;  // who pays for it, also where nothing is recorded

  // For work that the caller queues now, or a row that it appends: takes a place. None outside of
  // a call, but for the user.
  static Cause take();
  RowKey key() const { return {ticket.namedCall(), ticket ? position.place : 0}; }
};
static_assert(sizeof(Cause) == 16, "one for each item and each row");

// While one lives, the calling thread works because of `cause`. Confined to its thread; scopes
// nest.
class CauseScope {
 public:
  // `taken`: the places that earlier scopes of the same work have taken.
  explicit CauseScope(const Cause& cause, uint32_t taken = 0);
  explicit CauseScope(Cause&&, uint32_t taken = 0) = delete;  // it must outlive the scope
  ~CauseScope();
  CauseScope(const CauseScope&) = delete;
  CauseScope& operator=(const CauseScope&) = delete;

  // Of the innermost scope; none outside of one.
  static const JournalTicket* current();
  static UserIndex currentUser();
  // The innermost scope's own cause, for work that goes on later as the same work: with taken().
  static Cause share();
  static uint32_t taken();
  // The place that Cause::take() would give next; 0 outside of a call.
  static uint32_t nextPlace();
  // Names the innermost scope's work; none outside of a call.
  static std::optional<WorkOrigin> origin();

 private:
  friend struct Cause;
  const JournalTicket& ticket_;
  const uint32_t place_;
  const uint8_t depth_;
  const UserIndex user_;
  uint32_t taken_;
  CauseScope* const outer_;
};

// A cause outside of the queues, of work that keeps `bytes`. Each by one thread at a time.
class HeldCause final : public WorkCause {
 public:
  HeldCause(Cause cause, UserAccounts& accounts, std::size_t bytes)
      : cause_(std::move(cause)), accounts_(accounts), bytes_(bytes) {
    accounts_.add(cause_.user, MemoryKind::Delayed, bytes_);
  }
  ~HeldCause() override {
    accounts_.remove(cause_.user, MemoryKind::Delayed, bytes_);
    cause_.ticket.abandon();
  }
  void run(const Work& work) override;
  const Cause& cause() const { return cause_; }
  // The work has been recorded anew: it waits for that record from here on.
  void moveTo(JournalTicket ticket) { cause_.ticket = std::move(ticket); }

 private:
  Cause cause_;
  UserAccounts& accounts_;
  const std::size_t bytes_;
};

// While one lives, the calling thread works because of no call: what is queued for the service's
// own sake (an answer that is on its way, memory to be given back) takes no place, because a call
// that is run again would not queue it.
class NoCause {
 private:
  static inline const Cause kNone;
  const CauseScope scope_{kNone};
};

}  // namespace vx::lnx

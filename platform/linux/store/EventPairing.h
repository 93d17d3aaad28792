// Which events of a batch say what a relay message says, and a little more.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

#include "base/Clock.h"
#include "base/ThreadChecker.h"
#include "platform/linux/store/StoreRecord.h"

namespace vx::lnx {

// A message goes to the relay and, with one entry more, to analytics: the text they have in common
// is written once, with the relay's row (see the view analytics_events). That is nearly half of
// what would reach the flash otherwise.
//
// Owned by the store's writer, confined to its thread. Knows nothing but the batch it is given;
// what it holds back is at most the events of one batch, and for one batch.
class EventPairing {
 public:
  // Gives each relay message of the batch the event that says what it says, if it is of the same
  // call. A message that goes to several sessions has as many events: the first one the first.
  void pair(StoreRecords& batch);
  // Takes the events out that have no message in the batch although they name one, if they are
  // younger than `time` (seconds since 1970) and were not held before: the message is likely to
  // come with the next batch. `now`: of the batch.
  void hold(StoreRecords& batch, double youngerThan, Monotonic now);
  // Appends what was held to the next batch.
  void join(StoreRecords& batch);
  // Since when events are held; none when there are none.
  std::optional<Monotonic> heldSince() const;

  // Records [first, last) and the events that share their text are committed. Lets go of their
  // messages and of their calls, which are done if nothing else waits. How many of their rows no
  // journal knows of.
  static uint64_t markWritten(StoreRecords& batch, std::size_t first, std::size_t last);
  // How many rows of the records from `first` on are not.
  struct Unwritten {
    uint64_t recorded = 0;  // of calls that can be run again
    uint64_t lost = 0;
  };
  static Unwritten unwrittenRows(const StoreRecords& batch, std::size_t first);
  // None of them will be: their calls are not done.
  static void abandon(StoreRecords& batch, std::size_t first);

 private:
  uint32_t& slotOf(const StoreRecords& batch, const void* identity);

  ThreadChecker thread_;
  std::vector<uint32_t> slots_;  // open addressing: index in the batch by a payload's identity
  std::vector<uint32_t> next_;   // of a relay message with the same payload, by index
  std::vector<StoreRecord> held_ GUARDED_BY(thread_);
  Monotonic heldSince_{};
};

}  // namespace vx::lnx

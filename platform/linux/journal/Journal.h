// Where every call is recorded before it runs, so that what was accepted survives the process.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/Mutex.h"
#include "base/Status.h"
#include "platform/linux/journal/JournalFolder.h"
#include "platform/linux/journal/JournalSegment.h"
#include "platform/linux/journal/JournalTicket.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

struct JournalOptions {
  std::string folder;  // made if missing; its parent is not
  JournalEpoch epoch{};
  // Beyond what the store has rows of, and what was moved elsewhere and is not replayed yet.
  JournalNumbers first = {};
  std::size_t maxBytes = std::size_t{64} << 20;
  // Segments that stay mapped for reuse: a fresh page costs more than what is written to it.
  std::size_t maxFree = 8;
};

// What is recorded of a call, or of the state that a snapshot is made of. Views.
struct JournalRecord {
  uint8_t kind = 0;  // the caller's
  double time = 0;   // seconds since 1970
  uint64_t connection = 0;
  std::span<const uint8_t> head = {};
  std::optional<Payload::Validated> dictionary = {};
  // It stands for work of an earlier call, whose number is `connection`.
  bool forEarlier = false;
  uint32_t user = kNoUser;
};

struct JournalAppended {
  uint64_t call = 0;
  JournalTicket ticket;  // none for a part of a snapshot
  Payload dictionary;    // lies in the journal
};

struct JournalCounters {
  uint64_t appended = 0;  // entries of every type
  uint64_t bytes = 0;     // of them
  uint64_t full = 0;      // refused because there was no space
  uint64_t recycled = 0;  // segments
  uint64_t aside = 0;     // files of another journal, set aside
  uint64_t segmentsInUse = 0;
};

// The writer. Owned by the platform; thread-safe. An entry is in the memory of the file system when
// append returns, so it survives the process, not the host.
//
// Entries fill one segment after the other. Segments are used again, oldest first, when a later
// generation's snapshot is complete, every call in them is done, and no payload lies in them.
//
// The first is allocated as it fills: most processes need little of it. All others are allocated
// whole.
//
// Bounds: maxBytes of files. Calls and notes may fill three quarters of them, so that there is
// always space for the snapshot that makes the rest free.
class Journal {
 public:
  // What an earlier process left (of the same epoch) stays, is counted in maxBytes and comes before
  // what is appended, as an earlier generation does; call numbers go on above its own. Foreign and
  // damaged files are set aside; `complaints` names them.
  static Result<std::unique_ptr<Journal>> open(JournalOptions options,
                                               std::vector<std::string>* complaints = nullptr);
  // Tickets and payloads may still be held, and may be let go of later.
  ~Journal();

  // ENOSPC when full, EMSGSIZE for an entry beyond kMaxEntryBytes: nothing was recorded.
  // Whoever appends is expected to stop while there is no capacity: what is left is for the ends of
  // what has begun, and for a snapshot.
  Result<JournalAppended> append(const JournalRecord& record);
  // Cheap; from any thread.
  bool hasCapacity() const { return !full_.load(std::memory_order_relaxed); }
  // Tries to find some where there was none.
  bool lookForCapacity();
  // Load is over: what it has left free goes back to the system, which takes its time; spares too,
  // where one segment is enough again.
  void giveBack();
  // Records an input of a call that is not done.
  Status note(const JournalTicket& ticket, uint8_t kind, std::span<const uint8_t> bytes);

  // From here on calls belong to a new generation, which the state of this moment begins: to be
  // appended by appendToSnapshot, in order. Until endSnapshot the generation before stays the base.
  Status beginGeneration();
  Result<JournalAppended> appendToSnapshot(const JournalRecord& record);
  Status endSnapshot();

  // A call of an earlier process is run again: it waits as long as there are copies of the ticket.
  // None when its segment is not here. The entry must have been read from this journal's files, and
  // is resumed once.
  JournalTicket resume(JournalPlace place);
  // As append(), for what cannot wait: also with space that calls may not fill, but for a
  // snapshot's last segment. So are notes.
  Result<JournalAppended> appendEnd(const JournalRecord& record);
  // Told, on whatever thread and under a lock, when the last call of a segment that is full is
  // done. One per process; null ends it.
  static void setCallsDoneHandler(void (*handler)(void*), void* with);
  // No call of an earlier generation waits any more.
  bool earlierCallsAreDone() const;
  // Nothing that was recorded is wanted any more: a stop that has committed everything. Appends
  // nothing afterwards.
  void discard();

  // Whether every call of this process is done.
  bool allDone() const;
  JournalCounters counters() const;
  // Of all entries so far. From any thread, without a lock.
  uint64_t bytesAppended() const { return bytesAppended_.load(std::memory_order_relaxed); }

 private:
  enum class Use { Calls, Ends, Snapshot };
  Journal(JournalOptions options, JournalFolder folder);
  Result<std::string> adopt(const std::string& name);
  void sortAdopted();

  Result<JournalAppended> write(const JournalRecord& record, EntryType type, Use use)
      REQUIRES(mutex_);
  EntryHeader* reserve(std::size_t length, Use use, Status& status) REQUIRES(mutex_);
  void publish(EntryHeader* entry, std::size_t length) REQUIRES(mutex_);
  Status roll(Use use) REQUIRES(mutex_);
  Result<JournalSegment::Pointer> acquire(Use use) REQUIRES(mutex_);
  Result<JournalSegment::Pointer> grow(std::size_t bytes) REQUIRES(mutex_);
  void recycle() REQUIRES(mutex_);
  void makeFree(JournalSegment::Pointer segment) REQUIRES(mutex_);
  std::size_t segmentsInUse() const REQUIRES(mutex_);
  Status full(std::string_view tried) REQUIRES(mutex_);
  bool isWithinShare(Use use) const REQUIRES(mutex_);
  void keepSpares() REQUIRES(mutex_);
  void updateCapacity() REQUIRES(mutex_);

  const JournalOptions options_;
  const JournalFolder folder_;
  std::atomic<bool> full_{false};
  std::atomic<uint64_t> bytesAppended_{0};
  mutable Mutex mutex_;
  JournalSegment::Pointer active_ GUARDED_BY(mutex_);
  std::size_t offset_ GUARDED_BY(mutex_) = kSegmentBytes;  // of the next entry
  uint32_t callsInActive_ GUARDED_BY(mutex_) = 0;
  uint32_t payloadsInActive_ GUARDED_BY(mutex_) = 0;
  std::deque<JournalSegment::Pointer> sealed_ GUARDED_BY(mutex_);      // by sequence
  std::vector<JournalSegment::Pointer> lingering_ GUARDED_BY(mutex_);  // done, with live payloads
  std::vector<JournalSegment::Pointer> free_ GUARDED_BY(mutex_);
  JournalNumbers next_ GUARDED_BY(mutex_);  // its generation is the one that is being written
  uint64_t nextFile_ GUARDED_BY(mutex_) = 1;
  uint32_t base_ GUARDED_BY(mutex_) = 0;  // the newest generation whose snapshot is complete
  bool severalNeeded_ GUARDED_BY(mutex_) = false;  // segments
  bool inSnapshot_ GUARDED_BY(mutex_) = false;
  bool discarded_ GUARDED_BY(mutex_) = false;
  uint32_t appendsUntilGrowth_ GUARDED_BY(mutex_) = 0;
  JournalCounters counters_ GUARDED_BY(mutex_);
};

}  // namespace vx::lnx

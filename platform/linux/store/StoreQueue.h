// The store's queue: what has been accepted and is not yet committed.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "base/Clock.h"
#include "base/Error.h"
#include "base/Function.h"
#include "base/Mutex.h"
#include "platform/linux/execution/UserAccounts.h"
#include "platform/linux/store/StoreOptions.h"
#include "platform/linux/store/StoreRecord.h"

namespace vx::lnx {

using FlushHandler = Function<void(std::optional<Error>)>;

// Somebody who waits until the first `records` records of a batch are committed, and with them all
// that was sent to the session.
struct StoreFlush {
  std::size_t records = 0;
  FlushHandler handler;
  std::shared_ptr<RelayRow> session;  // may be null
};

struct StoreBatch {
  struct Charge {
    UserIndex user = kServiceItself;
    std::size_t bytes = 0;
  };
  StoreRecords records;
  std::vector<StoreFlush> flushes;  // in order
  std::size_t bytes = 0;            // as taken
  Monotonic since;                  // when its first record was appended
  std::vector<Charge> charges;      // on whose accounts they are until release()
  bool urgent = false;              // somebody waits for its end

  void charge(UserIndex user, std::size_t more);
  void clear();
};

// Owned by the store's writer. Thread-safe; one thread takes. Appending never blocks and never
// drops: what waits is on the accounts of those who caused it, which bound it.
class StoreQueue {
 public:
  StoreQueue(const StoreOptions& options, Clock& clock) : options_(options), clock_(clock) {}
  ~StoreQueue() { abandonAll(); }
  StoreQueue(const StoreQueue&) = delete;
  StoreQueue& operator=(const StoreQueue&) = delete;

  // Outlives it. Before any traffic; without, nobody is charged.
  void setAccounts(UserAccounts& accounts) { accounts_ = &accounts; }
  // Of the calling thread's cause and the time of now. `bytes`: what the record holds besides
  // itself. False once closed: its call is not done.
  bool append(StoreRecord::What what, std::size_t bytes);
  // From now on a row that has a recorded call bears the time of that call.
  void setReplaying(bool replaying) { replaying_.store(replaying); }
  // False once closed; the handler is moved from only on success. It makes what waits due at once.
  bool appendFlush(FlushHandler& handler, std::shared_ptr<RelayRow> session = nullptr);
  // Work for the taking thread, before anything that waits to be written.
  void runSoon(Function<void()> job);
  // Nothing is accepted any more, and what waits is due. The first deadline counts, and giveUp().
  void close(Monotonic deadline);
  void giveUp();
  bool gaveUp() const { return gaveUp_.load(std::memory_order_relaxed); }
  struct Waiting {
    std::size_t records = 0;
    std::size_t bytes = 0;
    std::optional<Monotonic> since;  // the first of them
  };
  Waiting waiting() const;
  // Rows so far of which no journal knows.
  uint64_t unrecordedRows() const { return unrecorded_.load(std::memory_order_relaxed); }
  // Such rows that came after the close.
  uint64_t lostRows() const { return lost_.load(std::memory_order_relaxed); }

  enum class Turn : uint8_t {
    Nothing,  // not yet
    Jobs,     // takeJobs() has some
    Batch,    // `batch` is filled; it may be empty when only held events are due
    End,      // closed and empty
  };
  // `heldSince`: since when the taker holds events of an earlier batch back, which are due as if
  // they waited here.
  Turn tryTake(StoreBatch& batch, std::optional<Monotonic> heldSince);
  // The same, after waiting for it: never Nothing.
  Turn take(StoreBatch& batch, std::optional<Monotonic> heldSince);
  std::vector<Function<void()>> takeJobs();
  // `done` of the `left` records that a batch has still are committed or lost.
  void release(StoreBatch& batch, std::size_t done, std::size_t left);
  // Waits until `until`, or for a shorter while when closed. False: closed, and its deadline has
  // passed.
  bool waitBeforeRetry(Monotonic until);

 private:
  void abandonAll();
  bool isDue(std::optional<Monotonic> heldSince) const REQUIRES(mutex_);
  std::optional<Monotonic> dueTime(std::optional<Monotonic> heldSince) const REQUIRES(mutex_);
  Turn takeLocked(StoreBatch& batch, std::optional<Monotonic> heldSince) REQUIRES(mutex_);
  bool mustWake(bool urgent) REQUIRES(mutex_);

  double timeOf(const Cause& cause) const;

  const StoreOptions options_;
  Clock& clock_;
  UserAccounts* accounts_ = nullptr;
  std::atomic<bool> replaying_{false};
  mutable Mutex mutex_;
  CondVar wake_;
  StoreBatch pending_ GUARDED_BY(mutex_);
  Monotonic firstPending_ GUARDED_BY(mutex_);
  std::vector<Function<void()>> jobs_ GUARDED_BY(mutex_);
  enum class Sleep : uint8_t { Awake, UntilCommit, UntilWork };
  Sleep sleep_ GUARDED_BY(mutex_) = Sleep::Awake;
  bool closing_ GUARDED_BY(mutex_) = false;
  Monotonic closeDeadline_ GUARDED_BY(mutex_);
  std::atomic<bool> gaveUp_{false};
  std::atomic<uint64_t> unrecorded_{0};
  std::atomic<uint64_t> lost_{0};
};

}  // namespace vx::lnx

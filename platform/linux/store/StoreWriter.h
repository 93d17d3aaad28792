// The one thread that empties the store's queue into the database.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/Clock.h"
#include "base/Mutex.h"
#include "base/Status.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/Erasure.h"
#include "platform/linux/store/EventPairing.h"
#include "platform/linux/store/Retention.h"
#include "platform/linux/store/RowWriter.h"
#include "platform/linux/store/StoreBeginning.h"
#include "platform/linux/store/StoreIdentity.h"
#include "platform/linux/store/StoreOptions.h"
#include "platform/linux/store/StoreQueue.h"

namespace vx::lnx {

struct StoreCounters {
  uint64_t rowsCommitted = 0;
  uint64_t commits = 0;
  uint64_t writeFailures = 0;
  // Only at an end with a store that cannot be written: the journal has their calls, or not.
  uint64_t rowsLeft = 0;
  uint64_t rowsLost = 0;
  uint64_t unrecordedWaiting = 0;  // rows of which no journal knows, neither committed nor lost
};

// For whoever looks into the service.
struct StoreAccount {
  StoreCounters counters;
  std::string path;
  uint64_t maxBytes = 0;
  uint64_t fileBytes = 0;  // as of the last commit
  uint64_t logBytes = 0;
  std::optional<double> oldest;  // row: seconds since 1970
  bool failing = false;          // it cannot be written at the moment
  std::size_t waitingRecords = 0;
  std::size_t waitingBytes = 0;
  std::chrono::nanoseconds lag{0};             // since the oldest of them was accepted
  std::map<std::string, uint64_t> ledgerRows;  // that the ledger was told of, by cause
};

// Owned by the local store. The public functions are thread-safe; everything private belongs to the
// writer's thread. Bounded by its queue.
class StoreWriter {
 public:
  // Opens the store if that is possible now.
  StoreWriter(std::unique_ptr<StoreBeginning> beginning, const StoreOptions& options, Clock& clock);
  ~StoreWriter();
  StoreWriter(const StoreWriter&) = delete;
  StoreWriter& operator=(const StoreWriter&) = delete;

  // Before start(): something worth a row in the ledger.
  void noteAtStart(LedgerNote note) { notes_.push_back(std::move(note)); }
  void setEndWord(EndWord word) { endWord_ = word; }
  void start();
  // Nobody waits for it any more: from here on whoever has something to do goes first.
  void yieldToOthers();
  void giveBackMemory();
  // On the writer's thread; see LocalStore::beginReplay.
  void expectKnownRows(ReplayedCalls calls) { replayFrom_ = std::move(calls); }

  StoreQueue& queue() { return queue_; }
  const StoreQueue& queue() const { return queue_; }
  // See LocalStore.
  bool close(Monotonic deadline);
  void stopAccepting() { queue_.close(Monotonic::max()); }
  bool waitUntilEnded(Monotonic until);
  void giveUp() { queue_.giveUp(); }
  uint64_t bytesLeft() const;
  uint64_t progress() const { return progress_.load() + commits_.load(); }
  void note(LedgerNote note);
  StoreCounters counters() const;
  StoreAccount account() const;
  // Once what waits is committed; `done` is told on the writer's thread, or let go of without a
  // word when that does not come to pass. The summaries' folder must stay.
  using ErasureHandler = Function<void(const Result<Erased>&)>;
  void erase(ErasureSelection which, std::string summaries, ErasureHandler done);
  // As found by the constructor; see LocalStore.
  const JournalEpoch& epoch() const { return epoch_; }
  uint64_t lastCall() const { return lastCall_; }

 private:
  // What lives as long as one opened database.
  struct Open {
    Open(Database opened, const StoreBeginning& beginning, const StoreOptions& options,
         EndWord endWord, Clock& clock);
    Database database;
    StoreIdentity identity;
    RowWriter rows;
    Retention retention;
  };

  void threadMain();
  void runJobs();
  // Opens and checks the store unless that is done.
  Status begin();
  // Lets go of files that are no longer the store's: the next begin() makes others. False then.
  bool keepOpen(StoreLoss loss);
  void rememberFiles();
  // What was found while the store was begun, for the log and the ledger.
  void report(std::vector<LedgerNote> found);
  void writeBatch(StoreBatch& batch);
  // As many of the records as fit in one transaction.
  Result<RowWriter::Written> write(const StoreBatch& batch, std::size_t first, std::size_t last);
  // Writes the log back and empties it. SQLITE_OK or SQLite's extended error code.
  int checkpoint();
  // Keeps the log below its bound: false while a reader holds it there.
  Status boundLog();
  void makeRoomFor(std::size_t bytes);
  void onCommitted(StoreBatch& batch, std::size_t first, std::size_t last);
  void onLost(StoreBatch& batch, std::size_t first, const Status& why);
  // False: the store is closing and time is up.
  bool waitBeforeRetry(const Status& failure);
  void add(std::vector<LedgerNote> notes);
  Result<Erased> eraseNow(const ErasureSelection& which, const std::string& summaries);
  void measure();

  const StoreOptions options_;
  Clock& clock_;
  StoreQueue queue_;
  std::atomic<uint64_t> rowsCommitted_{0};
  std::atomic<uint64_t> commits_{0};
  std::atomic<uint64_t> writeFailures_{0};
  std::atomic<uint64_t> rowsLeft_{0};
  std::atomic<uint64_t> rowsLost_{0};
  std::atomic<uint64_t> unrecordedDone_{0};  // committed or lost
  std::atomic<uint64_t> progress_{0};        // besides commits
  Mutex mutex_;
  CondVar ended_;
  bool finished_ GUARDED_BY(mutex_) = false;
  // Written by the writer's thread, for account().
  std::atomic<uint64_t> fileBytes_{0};
  std::atomic<uint64_t> logBytes_{0};
  std::atomic<double> oldest_{0};  // 0: none known
  std::atomic<bool> failingNow_{false};
  std::atomic<std::size_t> batchRecords_{0};  // of the batch that is being written
  std::atomic<std::size_t> batchBytes_{0};
  std::atomic<Monotonic> batchSince_{Monotonic()};
  mutable Mutex ledgerMutex_;
  std::map<std::string, uint64_t> ledgerRows_ GUARDED_BY(ledgerMutex_);  // bounded by the causes

  // The writer's thread.
  const std::unique_ptr<StoreBeginning> beginning_;
  JournalEpoch epoch_;
  uint64_t lastCall_ = 0;
  uint64_t maxBytes_ = 0;          // without what lies beside the store
  std::vector<LedgerNote> found_;  // by the constructor
  EndWord endWord_ = nullptr;
  OpenedStore unchecked_;             // until the thread has checked it
  std::optional<Open> open_;          // none: not begun
  StoreLoss lost_ = StoreLoss::None;  // of what was open before
  EventPairing pairing_;
  std::optional<ReplayedCalls> replayFrom_;  // until what is replayed is committed
  std::vector<LedgerNote> notes_;            // for the next transaction
  std::optional<Error> lossError_;           // why rows were given up
  bool failing_ = false;
  bool logHeld_ = false;  // by a reader
  std::chrono::milliseconds backoff_{0};
  std::thread thread_;
};

}  // namespace vx::lnx

// The store's size and age: the oldest rows go first, and the ledger says so.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/Clock.h"
#include "base/ThreadChecker.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreOptions.h"
#include "platform/linux/store/StoreRecord.h"

namespace vx::lnx {

// Owned by the store's writer and confined to its thread. Refers to a database that outlives it.
// One application removes at most kRemovalsPerPass times kRowsPerRemoval rows, so that what waits
// to be written does not wait long.
class Retention {
 public:
  Retention(sqlite3* database, const StoreOptions& options, Clock& clock)
      : database_(database), options_(options), clock_(clock) {}
  Retention(const Retention&) = delete;
  Retention& operator=(const Retention&) = delete;

  // Removes rows that are too old (looked at every ten minutes) and, oldest first, what is above
  // the size. What the ledger is to say of it.
  std::vector<LedgerNote> apply();
  // Removes the oldest rows until so many bytes fit below the size.
  std::vector<LedgerNote> makeRoom(uint64_t bytes);
  // Gives what the file has beyond so many bytes and does not use back to the file system.
  void shrinkFile(uint64_t bytes);
  // To be called after each batch: applies it every kBatchesPerPass.
  std::vector<LedgerNote> onBatchWritten();

  static constexpr std::size_t kBatchesPerPass = 64;

 private:
  enum TableIndex : uint8_t { kMessages, kEvents, kPower, kSessions, kTableCount };
  using Counts = std::array<int64_t, kTableCount>;

  void removeForAge(Counts& removed);
  void removeForSize(Counts& removed, uint64_t limit);
  // Removes some of a table's oldest rows, those before a time if one is given. False: none.
  bool removeOldest(std::size_t table, std::optional<double> before, Counts& removed);
  bool removeOldestMessages(int64_t last, std::optional<double> before, Counts& removed);
  int64_t removeUpTo(std::size_t table, int64_t last, std::optional<double> before);
  int64_t lastOfOldest(std::size_t table);
  std::optional<double> oldestTime(std::size_t table);
  int64_t pragma(const char* sql);
  uint64_t fileBytes();
  uint64_t usedBytes();
  std::vector<LedgerNote> notesOfSize(const Counts& removed) const;

  sqlite3* const database_;
  const StoreOptions options_;
  Clock& clock_;
  ThreadChecker thread_;
  int removalsLeft_ = 0;  // of this pass
  std::optional<Monotonic> lastAgeCheck_;
  std::size_t batches_ = 0;  // since the last pass
};

}  // namespace vx::lnx

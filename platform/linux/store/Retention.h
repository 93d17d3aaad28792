// The store's size and age: the oldest rows go first, and the ledger says so. Above the size they
// are those of the user who has the most, so that a client that writes much removes nothing but its
// own.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/Clock.h"
#include "base/ThreadChecker.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreOptions.h"
#include "platform/linux/store/StoreRecord.h"
#include "platform/linux/store/UserBytes.h"

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
  // Whether the file was made shorter since this was asked.
  bool takeShrunk() { return std::exchange(shrunk_, false); }
  // Text that was written since.
  void noteWritten(const UserBytes& bytes);
  // Somebody else has removed rows.
  void forgetUsers() { measured_ = false; }
  // Of the rows that are there: seconds since 1970.
  std::optional<double> oldest();
  // To be called after each batch: applies it every kBatchesPerPass.
  std::vector<LedgerNote> onBatchWritten();

  static constexpr std::size_t kBatchesPerPass = 64;

 private:
  enum TableIndex : uint8_t { kMessages, kEvents, kPower, kSessions, kTableCount };
  using Counts = std::array<int64_t, kTableCount>;

  void removeForAge(Counts& removed);
  void removeForSize(Counts& removed, uint64_t limit);
  // Which of a table's rows are to go: the oldest, of a user or before a time.
  struct Selection {
    std::optional<uint32_t> user;  // none: of all users
    std::optional<double> before;
    int64_t last = 0;
  };
  // Removes some of a table's oldest rows. False: none.
  bool removeOldest(std::size_t table, Selection which, Counts& removed);
  bool removeOldestMessages(const Selection& which, Counts& removed);
  int64_t removeSelected(std::size_t table, const Selection& which);
  void bindSelection(Statement& statement, std::size_t table, const Selection& which);
  int64_t lastOfOldest(std::size_t table, std::optional<uint32_t> user);
  std::optional<double> oldestTime(std::size_t table, std::optional<uint32_t> user = {});
  // From here on the table has rows of a user.
  int64_t firstOf(std::size_t table, std::optional<uint32_t> user) const;
  // Removes the oldest rows of whoever has the most. False: there are none.
  bool removeOfGreatest(Counts& removed);
  void measureUsers();
  void removeOrphans(Counts& removed);
  int64_t pragma(const char* sql);
  uint64_t fileBytes();
  uint64_t usedBytes();
  std::vector<LedgerNote> notesOfSize(const Counts& removed) const;

  sqlite3* const database_;
  const StoreOptions options_;
  Clock& clock_;
  ThreadChecker thread_;
  int removalsLeft_ = 0;  // of this pass
  // Known once the size has been reached; the ids are per table and user.
  bool measured_ = false;
  UserBytes bytes_;
  std::map<std::pair<std::size_t, uint32_t>, int64_t> first_;
  int64_t messagesSinceOrphans_ = 0;  // removed
  bool shrunk_ = false;
  std::optional<Monotonic> lastAgeCheck_;
  std::size_t batches_ = 0;  // since the last pass
};

}  // namespace vx::lnx

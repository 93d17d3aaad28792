// The store's size and age: the oldest rows go first, and the ledger says so. The writer's thread.
#include <array>
#include <string>

#include "platform/linux/store/StoreWriter.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::minutes kAgeCheckInterval{10};
constexpr int64_t kRowsPerRemoval = 500;
constexpr int kRemovalsPerCheck = 64;

}  // namespace

// The identifier of the last of the kRowsPerRemoval oldest rows, or of the last there is.
int64_t StoreWriter::lastOfOldest(const std::string& table) {
  Statement query(database_.get(), "SELECT max(id) FROM (SELECT id FROM " + table +
                                       " ORDER BY id LIMIT " + std::to_string(kRowsPerRemoval) +
                                       ")");
  return query.row() ? query.integer(0) : 0;
}

// Removes rows up to an identifier, those before a time if one is given; how many.
int64_t StoreWriter::removeUpTo(const std::string& table, int64_t last,
                                std::optional<double> before) {
  Statement remove(database_.get(), "DELETE FROM " + table + " WHERE id <= ? AND time < ?");
  if (remove.bind(last).bind(before.value_or(1e18)).run() != SQLITE_OK) return 0;
  return sqlite3_changes64(database_.get());
}

// Removes messages, and with them the events that share their text. These lie at the beginning of
// their table: both tables name messages in the same order.
StoreWriter::Removed StoreWriter::removeMessagesUpTo(int64_t last, std::optional<double> before) {
  Removed removed;
  if (execute(database_.get(), "BEGIN IMMEDIATE") != SQLITE_OK) return removed;
  removed.rows = removeUpTo("relay_messages", last, before);
  Statement events(database_.get(),
                   "DELETE FROM analytics_entries AS e WHERE e.message <= ?1"
                   " AND e.id < ifnull((SELECT id FROM analytics_entries WHERE message > ?1"
                   " ORDER BY id LIMIT 1), 9e18)"
                   " AND NOT EXISTS (SELECT 1 FROM relay_messages m WHERE m.id = e.message)");
  int code = events.bind(last).run();
  if (code == SQLITE_OK) removed.sharers = sqlite3_changes64(database_.get());
  if (code == SQLITE_OK) code = execute(database_.get(), "COMMIT");
  if (code == SQLITE_OK) return removed;
  execute(database_.get(), "ROLLBACK");
  return {};
}

void StoreWriter::applyRetention() {
  commitsSinceRetention_ = 0;
  if (database_ == nullptr) return;
  struct Table {
    const char* name;
    const char* shownAs;
  };
  static constexpr Table kTables[] = {{"relay_messages", "relay_messages"},
                                      {"analytics_entries", "analytics_events"},
                                      {"power_records", "power_records"},
                                      {"relay_sessions", "relay_sessions"}};
  constexpr std::size_t kMessages = 0;
  constexpr std::size_t kEvents = 1;
  constexpr std::size_t kSessions = 3;
  auto oldest = [this](std::size_t table) -> std::optional<double> {
    Statement query(database_.get(), std::string("SELECT time FROM ") + kTables[table].name +
                                         " ORDER BY id LIMIT 1");
    if (!query.row()) return std::nullopt;
    return query.real(0);
  };
  auto usedBytes = [this] {
    auto pragma = [this](const char* sql) {
      Statement query(database_.get(), sql);
      return query.row() ? query.integer(0) : 0;
    };
    return static_cast<uint64_t>((pragma("PRAGMA page_count") - pragma("PRAGMA freelist_count")) *
                                 pragma("PRAGMA page_size"));
  };
  using Counts = std::array<int64_t, std::size(kTables)>;
  auto removeFrom = [this](std::size_t table, std::optional<double> before, Counts& removed) {
    const int64_t last = lastOfOldest(kTables[table].name);
    const Removed now = table == kMessages
                            ? removeMessagesUpTo(last, before)
                            : Removed{removeUpTo(kTables[table].name, last, before), 0};
    removed[table] += now.rows;
    removed[kEvents] += now.sharers;
    return now.rows > 0;
  };
  auto tell = [this](const char* event, const Counts& removed, const std::string& why) {
    for (std::size_t i = 0; i < removed.size(); ++i) {
      if (removed[i] > 0) note({event, kTables[i].shownAs, removed[i], why});
    }
  };

  int removals = kRemovalsPerCheck;
  if (options_.maxAgeDays != 0 &&
      (lastAgeCheck_ == Monotonic{} || clock_.monotonic() - lastAgeCheck_ >= kAgeCheckInterval)) {
    lastAgeCheck_ = clock_.monotonic();
    const double before = now() - options_.maxAgeDays * 86400.0;
    Counts removed{};
    for (std::size_t table = 0; table < std::size(kTables); ++table) {
      while (removals > 0 && oldest(table).value_or(before) < before) {
        if (!removeFrom(table, before, removed)) break;
        --removals;
      }
    }
    tell("removed_for_age", removed, "older than " + std::to_string(options_.maxAgeDays) + " days");
  }

  Counts removed{};
  while (removals-- > 0 && usedBytes() > options_.maxBytes) {
    std::size_t oldestTable = 0;
    std::optional<double> oldestTime;
    for (std::size_t i = 0; i < kSessions; ++i) {  // sessions go with their messages
      const std::optional<double> time = oldest(i);
      if (time && (!oldestTime || *time < *oldestTime)) {
        oldestTime = time;
        oldestTable = i;
      }
    }
    if (!oldestTime || !removeFrom(oldestTable, std::nullopt, removed)) break;
  }
  if (removed[kMessages] > 0) {
    // Sessions whose every message is gone, and that came before the oldest message left.
    Statement orphans(
        database_.get(),
        "DELETE FROM relay_sessions WHERE id < (SELECT min(relay_session) FROM relay_messages)");
    if (orphans.run() == SQLITE_OK) removed[kSessions] = sqlite3_changes64(database_.get());
  }
  tell("removed_for_size", removed, "above " + std::to_string(options_.maxBytes) + " bytes");
}

}  // namespace vx::lnx

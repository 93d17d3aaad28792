#include "platform/linux/store/Retention.h"

#include <algorithm>
#include <chrono>
#include <span>
#include <utility>

namespace vx::lnx {

namespace {

using Days = std::chrono::duration<double, std::ratio<86400>>;

constexpr std::chrono::minutes kAgeCheckInterval{10};
constexpr int64_t kRowsPerRemoval = 500;
constexpr int kRemovalsPerPass = 64;

struct RetainedTable {
  std::string name;
  std::string shownAs;
};
const RetainedTable kTables[] = {{"relay_messages", "relay_messages"},
                                 {"analytics_entries", "analytics_events"},
                                 {"power_records", "power_records"},
                                 {"relay_sessions", "relay_sessions"}};

}  // namespace

namespace {

void tell(std::vector<LedgerNote>& notes, const char* event, std::span<const int64_t> removed,
          const std::string& why) {
  for (std::size_t i = 0; i < removed.size(); ++i) {
    if (removed[i] > 0) notes.push_back({event, kTables[i].shownAs, removed[i], why});
  }
}

}  // namespace

std::vector<LedgerNote> Retention::apply() {
  thread_.assertHere();
  batches_ = 0;
  removalsLeft_ = kRemovalsPerPass;
  Counts old{};
  removeForAge(old);
  std::vector<LedgerNote> notes;
  tell(notes, "removed_for_age", old,
       "older than " + std::to_string(options_.maxAgeDays) + " days");
  Counts large{};
  removeForSize(large, options_.maxBytes);
  shrinkFile(options_.maxBytes);
  for (LedgerNote& note : notesOfSize(large)) notes.push_back(std::move(note));
  return notes;
}

std::vector<LedgerNote> Retention::makeRoom(uint64_t bytes) {
  thread_.assertHere();
  const uint64_t limit = options_.maxBytes - std::min(bytes, options_.maxBytes);
  Counts removed{};
  for (uint64_t before = UINT64_MAX, used = usedBytes(); used > limit && used < before;) {
    before = used;
    removalsLeft_ = kRemovalsPerPass;
    removeForSize(removed, limit);
    used = usedBytes();
  }
  return notesOfSize(removed);
}

void Retention::shrinkFile(uint64_t bytes) {
  const int64_t pageSize = pragma("PRAGMA page_size");
  if (pageSize <= 0 || fileBytes() <= bytes) return;
  if (pragma("PRAGMA auto_vacuum") == 0) {
    // Begun before files could shrink: written anew, once.
    if (usedBytes() > bytes) return;
    for (const char* sql : {"PRAGMA temp_store = FILE", "PRAGMA auto_vacuum = INCREMENTAL",
                            "VACUUM", "PRAGMA temp_store = MEMORY"})
      execute(database_, sql);
  }
  // In steps, so that the log of each is short.
  for (uint64_t before = UINT64_MAX, now = fileBytes(); now > bytes && now < before;) {
    before = now;
    execute(database_, "PRAGMA incremental_vacuum(256)");
    now = fileBytes();
  }
  sqlite3_wal_checkpoint_v2(database_, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
}

std::vector<LedgerNote> Retention::notesOfSize(const Counts& removed) const {
  std::vector<LedgerNote> notes;
  tell(notes, "removed_for_size", removed, "above " + std::to_string(options_.maxBytes) + " bytes");
  return notes;
}

std::vector<LedgerNote> Retention::onBatchWritten() {
  return ++batches_ >= kBatchesPerPass ? apply() : std::vector<LedgerNote>();
}

void Retention::removeForAge(Counts& removed) {
  if (options_.maxAgeDays == 0) return;
  if (lastAgeCheck_ && clock_.monotonic() - *lastAgeCheck_ < kAgeCheckInterval) return;
  lastAgeCheck_ = clock_.monotonic();
  const auto now = std::chrono::duration<double>(clock_.now().time_since_epoch());
  const double before = (now - std::chrono::duration<double>(Days(options_.maxAgeDays))).count();
  for (std::size_t table = 0; table < kTableCount; ++table) {
    while (removalsLeft_ > 0 && oldestTime(table).value_or(before) < before) {
      if (!removeOldest(table, before, removed)) break;
      --removalsLeft_;
    }
  }
}

void Retention::removeForSize(Counts& removed, uint64_t limit) {
  while (removalsLeft_-- > 0 && usedBytes() > limit) {
    std::optional<double> oldest;
    std::size_t oldestTable = 0;
    for (std::size_t table = 0; table < kSessions; ++table) {  // sessions go with their messages
      const std::optional<double> time = oldestTime(table);
      if (time && (!oldest || *time < *oldest)) {
        oldest = time;
        oldestTable = table;
      }
    }
    if (!oldest || !removeOldest(oldestTable, std::nullopt, removed)) break;
  }
  if (removed[kMessages] == 0) return;
  // Sessions whose every message is gone, and that came before the oldest message left.
  Statement orphans(
      database_,
      "DELETE FROM relay_sessions WHERE id < (SELECT min(relay_session) FROM relay_messages)");
  if (orphans.run() == SQLITE_OK) removed[kSessions] += sqlite3_changes64(database_);
}

bool Retention::removeOldest(std::size_t table, std::optional<double> before, Counts& removed) {
  const int64_t last = lastOfOldest(table);
  if (table == kMessages) return removeOldestMessages(last, before, removed);
  const int64_t rows = removeUpTo(table, last, before);
  removed[table] += rows;
  return rows > 0;
}

// Removes messages, and with them the events that share their text. Those of the second schema lie
// at the beginning of a table of their own: both tables name messages in the same order.
bool Retention::removeOldestMessages(int64_t last, std::optional<double> before, Counts& removed) {
  if (execute(database_, "BEGIN IMMEDIATE") != SQLITE_OK) return false;
  Statement events(database_,
                   "SELECT count(event_name) FROM relay_messages WHERE id <= ? AND time < ?");
  const int64_t within =
      events.bind(last).bind(before.value_or(1e18)).row() ? events.integer(0) : 0;
  events.reset();
  const int64_t rows = removeUpTo(kMessages, last, before);
  Statement sharers(database_,
                    "DELETE FROM analytics_entries AS e WHERE e.message <= ?1"
                    " AND e.id < ifnull((SELECT id FROM analytics_entries WHERE message > ?1"
                    " ORDER BY id LIMIT 1), 9e18)"
                    " AND NOT EXISTS (SELECT 1 FROM relay_messages m WHERE m.id = e.message)");
  int code = sharers.bind(last).run();
  const int64_t sharing = sqlite3_changes64(database_);
  if (code == SQLITE_OK) code = execute(database_, "COMMIT");
  if (code != SQLITE_OK) {
    execute(database_, "ROLLBACK");
    return false;
  }
  removed[kMessages] += rows;
  removed[kEvents] += within + sharing;
  return rows > 0;
}

// Removes rows up to an identifier, those before a time if one is given; how many.
int64_t Retention::removeUpTo(std::size_t table, int64_t last, std::optional<double> before) {
  Statement remove(database_, "DELETE FROM " + kTables[table].name + " WHERE id <= ? AND time < ?");
  if (remove.bind(last).bind(before.value_or(1e18)).run() != SQLITE_OK) return 0;
  return sqlite3_changes64(database_);
}

// The identifier of the last of the kRowsPerRemoval oldest rows, or of the last there is.
int64_t Retention::lastOfOldest(std::size_t table) {
  Statement query(database_, "SELECT max(id) FROM (SELECT id FROM " + kTables[table].name +
                                 " ORDER BY id LIMIT " + std::to_string(kRowsPerRemoval) + ")");
  return query.row() ? query.integer(0) : 0;
}

std::optional<double> Retention::oldestTime(std::size_t table) {
  Statement query(database_, "SELECT time FROM " + kTables[table].name + " ORDER BY id LIMIT 1");
  return query.row() ? std::optional<double>(query.real(0)) : std::nullopt;
}

int64_t Retention::pragma(const char* sql) {
  Statement query(database_, sql);
  return query.row() ? query.integer(0) : 0;
}

uint64_t Retention::fileBytes() {
  return static_cast<uint64_t>(pragma("PRAGMA page_count") * pragma("PRAGMA page_size"));
}

uint64_t Retention::usedBytes() {
  return static_cast<uint64_t>((pragma("PRAGMA page_count") - pragma("PRAGMA freelist_count")) *
                               pragma("PRAGMA page_size"));
}

}  // namespace vx::lnx

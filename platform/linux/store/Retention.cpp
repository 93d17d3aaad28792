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

constexpr int64_t kMessagesPerOrphans = 50000;
// Rows from ?1 to ?2 before the time ?3, of the user ?4 or of all.
const std::string kSelected =
    " WHERE id BETWEEN ?1 AND ?2 AND time < ?3 AND (?4 IS NULL OR ifnull(uid, " +
    std::to_string(kNoUser) + ") = ?4)";

struct RetainedTable {
  std::string name;
  std::string shownAs;
  std::string text;  // the column
};
const RetainedTable kTables[] = {{"relay_messages", "relay_messages", "payload"},
                                 {"analytics_entries", "analytics_events", "payload"},
                                 {"power_records", "power_records", "record"},
                                 {"relay_sessions", "relay_sessions", "user_info"}};

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
  if (messagesSinceOrphans_ > 0) removeOrphans(large);
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
  shrunk_ = true;
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

void Retention::noteWritten(const UserBytes& bytes) {
  for (const auto& [user, some] : bytes) {
    if (measured_) addTo(bytes_, user, some);
  }
}

std::optional<double> Retention::oldest() {
  thread_.assertHere();
  std::optional<double> oldest;
  for (std::size_t table = 0; table < kTableCount; ++table) {
    const std::optional<double> time = oldestTime(table);
    if (time && (!oldest || *time < *oldest)) oldest = time;
  }
  return oldest;
}

void Retention::removeForAge(Counts& removed) {
  if (options_.maxAgeDays == 0) return;
  if (lastAgeCheck_ && clock_.monotonic() - *lastAgeCheck_ < kAgeCheckInterval) return;
  lastAgeCheck_ = clock_.monotonic();
  const auto now = std::chrono::duration<double>(clock_.now().time_since_epoch());
  const double before = (now - std::chrono::duration<double>(Days(options_.maxAgeDays))).count();
  for (std::size_t table = 0; table < kTableCount; ++table) {
    while (removalsLeft_ > 0 && oldestTime(table).value_or(before) < before) {
      if (!removeOldest(table, {.user = {}, .before = before}, removed)) break;
      --removalsLeft_;
    }
  }
}

void Retention::removeForSize(Counts& removed, uint64_t limit) {
  while (removalsLeft_-- > 0 && usedBytes() > limit) {
    if (!measured_) measureUsers();
    if (!removeOfGreatest(removed)) break;
  }
  // Looked for where that is worth reading all messages' sessions.
  if (messagesSinceOrphans_ >= kMessagesPerOrphans) removeOrphans(removed);
}

bool Retention::removeOfGreatest(Counts& removed) {
  while (!bytes_.empty()) {
    const auto greatest =
        std::ranges::max_element(bytes_, {}, [](const auto& e) { return e.second; });
    const uint32_t user = greatest->first;
    std::optional<double> oldest;
    std::size_t oldestTable = 0;
    for (std::size_t table = 0; table < kSessions; ++table) {  // sessions go with their messages
      const std::optional<double> time = oldestTime(table, user);
      if (time && (!oldest || *time < *oldest)) {
        oldest = time;
        oldestTable = table;
      }
    }
    if (oldest) return removeOldest(oldestTable, {.user = user, .before = {}}, removed);
    bytes_.erase(greatest);  // has nothing left
  }
  measured_ = false;
  return false;
}

void Retention::measureUsers() {
  bytes_.clear();
  first_.clear();
  for (std::size_t table = 0; table < kSessions; ++table) {
    // Not grouped by the database, which would sort all rows for that, in memory.
    Statement rows(database_, "SELECT ifnull(uid, " + std::to_string(kNoUser) + "), length(" +
                                  kTables[table].text + "), id FROM " + kTables[table].name +
                                  " ORDER BY id");
    while (rows.row()) {
      const auto user = static_cast<uint32_t>(rows.integer(0));
      const bool first = first_.try_emplace({table, user}, rows.integer(2)).second;
      addTo(bytes_, user, rows.integer(1) + (first ? 1 : 0));
    }
  }
  measured_ = true;
}

// Sessions whose every message is gone. One that may still get messages stays while an older one
// has some.
void Retention::removeOrphans(Counts& removed) {
  messagesSinceOrphans_ = 0;
  Statement orphans(database_,
                    "DELETE FROM relay_sessions WHERE id NOT IN"
                    " (SELECT relay_session FROM relay_messages) AND (ended_at IS NOT NULL"
                    " OR id < (SELECT min(relay_session) FROM relay_messages))");
  if (orphans.run() == SQLITE_OK) removed[kSessions] += sqlite3_changes64(database_);
}

bool Retention::removeOldest(std::size_t table, Selection which, Counts& removed) {
  which.last = lastOfOldest(table, which.user);
  if (table == kMessages) return removeOldestMessages(which, removed);
  const int64_t rows = removeSelected(table, which);
  removed[table] += rows;
  return rows > 0;
}

// Removes messages, and with them the events that share their text. Those of the second schema lie
// at the beginning of a table of their own: both tables name messages in the same order.
bool Retention::removeOldestMessages(const Selection& which, Counts& removed) {
  if (execute(database_, "BEGIN IMMEDIATE") != SQLITE_OK) return false;
  Statement events(database_,
                   std::string("SELECT count(event_name) FROM relay_messages") + kSelected);
  bindSelection(events, kMessages, which);
  const int64_t within = events.row() ? events.integer(0) : 0;
  events.reset();
  const int64_t rows = removeSelected(kMessages, which);
  Statement sharers(database_,
                    "DELETE FROM analytics_entries AS e WHERE e.message <= ?1"
                    " AND e.id < ifnull((SELECT id FROM analytics_entries WHERE message > ?1"
                    " ORDER BY id LIMIT 1), 9e18)"
                    " AND NOT EXISTS (SELECT 1 FROM relay_messages m WHERE m.id = e.message)");
  int code = sharers.bind(which.last).run();
  const int64_t sharing = sqlite3_changes64(database_);
  if (code == SQLITE_OK) code = execute(database_, "COMMIT");
  if (code != SQLITE_OK) {
    execute(database_, "ROLLBACK");
    measured_ = false;
    return false;
  }
  removed[kMessages] += rows;
  removed[kEvents] += within + sharing;
  messagesSinceOrphans_ += rows;
  return rows > 0;
}

void Retention::bindSelection(Statement& statement, std::size_t table, const Selection& which) {
  statement.bind(firstOf(table, which.user)).bind(which.last).bind(which.before.value_or(1e18));
  statement.bind(which.user ? std::optional<int64_t>(*which.user) : std::nullopt);
}

// How many.
int64_t Retention::removeSelected(std::size_t table, const Selection& which) {
  if (measured_ && table != kSessions) {
    Statement text(database_, "SELECT ifnull(uid, " + std::to_string(kNoUser) + "), sum(length(" +
                                  kTables[table].text + ")) FROM " + kTables[table].name +
                                  kSelected + " GROUP BY 1");
    bindSelection(text, table, which);
    while (text.row()) addTo(bytes_, static_cast<uint32_t>(text.integer(0)), -text.integer(1));
  }
  Statement remove(database_, "DELETE FROM " + kTables[table].name + kSelected);
  bindSelection(remove, table, which);
  if (remove.run() != SQLITE_OK) return 0;
  if (which.user) first_[{table, *which.user}] = which.last + 1;
  return sqlite3_changes64(database_);
}

// The identifier of the last of the kRowsPerRemoval oldest rows, or of the last there is.
int64_t Retention::lastOfOldest(std::size_t table, std::optional<uint32_t> user) {
  Statement query(database_, "SELECT max(id) FROM (SELECT id FROM " + kTables[table].name +
                                 kSelected + " ORDER BY id LIMIT " +
                                 std::to_string(kRowsPerRemoval) + ")");
  bindSelection(query, table, {.user = user, .before = {}, .last = INT64_MAX});
  return query.row() ? query.integer(0) : 0;
}

std::optional<double> Retention::oldestTime(std::size_t table, std::optional<uint32_t> user) {
  Statement query(database_,
                  "SELECT time FROM " + kTables[table].name + kSelected + " ORDER BY id LIMIT 1");
  bindSelection(query, table, {.user = user, .before = {}, .last = INT64_MAX});
  return query.row() ? std::optional<double>(query.real(0)) : std::nullopt;
}

int64_t Retention::firstOf(std::size_t table, std::optional<uint32_t> user) const {
  if (!user) return 0;
  const auto found = first_.find({table, *user});
  return found == first_.end() ? 0 : found->second;
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

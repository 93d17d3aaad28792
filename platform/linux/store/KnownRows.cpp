#include "platform/linux/store/KnownRows.h"

#include <algorithm>
#include <unordered_set>

#include "platform/linux/store/Database.h"

namespace vx::lnx {

namespace {

// Rows up to the last mark before the call are of earlier calls: messages and events, which are
// many, are read from there on.
constexpr const char* kLastMark =
    "SELECT max(after_row, ifnull((SELECT max(last_row) FROM store_marks WHERE call < ?), 0))"
    " FROM store_epochs ORDER BY id DESC LIMIT 1";
constexpr const char* kReads[] = {
    "SELECT call, place, id FROM relay_messages WHERE id > ?2 AND call >= ?1 AND call < ?3",
    "SELECT call, event_place, id FROM relay_messages"
    " WHERE id > ?2 AND call >= ?1 AND call < ?3 AND event_place IS NOT NULL",
    "SELECT call, place, id FROM analytics_entries WHERE id > ?2 AND call >= ?1 AND call < ?3",
    "SELECT call, place, id FROM power_records WHERE call >= ?1 AND call < ?3 AND ?2 >= 0"
    " AND id > (SELECT after_power FROM store_epochs ORDER BY id DESC)",
    "SELECT call, place, id FROM relay_sessions WHERE call >= ?1 AND call < ?3 AND ?2 >= 0"
    " AND id > (SELECT after_session FROM store_epochs ORDER BY id DESC)",
};

// Rows of calls are written nearly in the calls' order.
constexpr const char* kLastCall =
    "SELECT ifnull(max(call), 0) FROM ("
    "SELECT call FROM store_marks UNION ALL "
    "SELECT * FROM (SELECT call FROM relay_sessions ORDER BY id DESC LIMIT 1000) UNION ALL "
    "SELECT * FROM (SELECT call FROM relay_messages ORDER BY id DESC LIMIT 1000) UNION ALL "
    "SELECT * FROM (SELECT call FROM analytics_entries ORDER BY id DESC LIMIT 1000) UNION ALL "
    "SELECT * FROM (SELECT call FROM power_records ORDER BY id DESC LIMIT 1000))";

}  // namespace

Result<uint64_t> KnownRows::lastCall(sqlite3* database) {
  Statement last(database, kLastCall);
  if (!last.row()) return Status::failure(sqlite3_errmsg(database));
  return static_cast<uint64_t>(last.integer(0));
}

Result<KnownRows> KnownRows::load(sqlite3* database, const ReplayedCalls& calls) {
  const uint64_t firstCall = calls.first;
  KnownRows known;
  known.firstCall_ = firstCall;
  known.endCall_ = calls.end;
  Statement mark(database, kLastMark);
  if (!mark.bind(static_cast<int64_t>(firstCall)).row())
    return Status::failure(sqlite3_errmsg(database));
  const int64_t after = mark.integer(0);
  for (const char* sql : kReads) {
    if (known.read(database, sql, after) != SQLITE_DONE)
      return Status::failure(sqlite3_errmsg(database));
  }
  if (known.readSessions(database, calls) != SQLITE_DONE)
    return Status::failure(sqlite3_errmsg(database));
  return known;
}

// There is no order of calls to search by: one pass for all of them.
int KnownRows::readSessions(sqlite3* database, const ReplayedCalls& calls) {
  const std::unordered_set<uint64_t> single(calls.earlierSessions.begin(),
                                            calls.earlierSessions.end());
  uint64_t lowest = calls.sessionsFrom;
  for (const uint64_t call : single) lowest = std::min(lowest, call);
  Statement rows(database,
                 "SELECT call, place, id FROM relay_sessions WHERE call >= ? AND call < ?"
                 " AND id > (SELECT after_session FROM store_epochs ORDER BY id DESC)");
  rows.bind(static_cast<int64_t>(lowest)).bind(static_cast<int64_t>(calls.first));
  while (rows.row()) {
    const RowKey key{static_cast<uint64_t>(rows.integer(0)),
                     static_cast<uint32_t>(rows.integer(1))};
    if (key.call >= calls.sessionsFrom || single.contains(key.call))
      rows_.insert_or_assign(key, Known{rows.integer(2)});
  }
  return rows.code();
}

int KnownRows::read(sqlite3* database, const char* sql, int64_t after) {
  Statement rows(database, sql);
  rows.bind(static_cast<int64_t>(firstCall_)).bind(after).bind(static_cast<int64_t>(endCall_));
  while (rows.row()) {
    rows_.insert_or_assign(
        RowKey{static_cast<uint64_t>(rows.integer(0)), static_cast<uint32_t>(rows.integer(1))},
        Known{rows.integer(2)});
  }
  return rows.code();
}

std::optional<int64_t> KnownRows::find(const RowKey& key) {
  if (key.call == 0) return std::nullopt;
  const auto found = rows_.find(key);
  if (found == rows_.end()) return std::nullopt;
  found->second.asked = true;
  return found->second.id;
}

void KnownRows::keepUnasked() {
  std::unordered_map<RowKey, Known, Hash> unasked;
  for (const auto& [key, known] : rows_)
    if (!known.asked) unasked.emplace(key, known);
  rows_.swap(unasked);
}

std::optional<int64_t> KnownRows::sessionOf(sqlite3* database, const RowKey& key) {
  if (key.call == 0) return std::nullopt;
  Statement query(database,
                  "SELECT id FROM relay_sessions WHERE call = ? AND place = ?"
                  " AND id > (SELECT after_session FROM store_epochs ORDER BY id DESC)");
  query.bind(static_cast<int64_t>(key.call)).bind(int64_t{key.place});
  return query.row() ? std::optional<int64_t>(query.integer(0)) : std::nullopt;
}

}  // namespace vx::lnx

#include "platform/linux/store/Erasure.h"

#include <dirent.h>
#include <unistd.h>

#include <cmath>
#include <ctime>
#include <memory>
#include <string_view>
#include <vector>

#include "platform/linux/store/Database.h"
#include "propertylist/FileNames.h"

namespace vx::lnx {

namespace {

constexpr int64_t kRowsPerStep = 5000;
constexpr std::string_view kSummaryMark = "-sonik-";
constexpr std::string_view kSummaryEnd = ".json";
// Between a session's end in the store and the date of its file.
constexpr double kSummarySlackSeconds = 2;

// Of a column that may be no JSON.
std::string entry(const char* column, const char* key) {
  return std::string("CASE WHEN json_valid(") + column + ") THEN json_extract(" + column + ", '$." +
         key + "') END";
}

// What is to go of each table; ?1 is what was asked for. A session without an application is
// "Unknown", as in the views.
struct Conditions {
  std::string session;
  std::string message;
  std::string event;
  std::string power;
};

Conditions conditionsOf(const ErasureSelection& which) {
  if (which.before) return {"time < ?1", "time < ?1", "time < ?1", "time < ?1"};
  if (which.user) return {"uid = ?1", "uid = ?1", "uid = ?1", "uid = ?1"};
  const std::string session =
      "ifnull(" + entry("user_info", "HostApplicationDisplayID") + ", 'Unknown') = ?1";
  return {session, "relay_session IN (SELECT id FROM relay_sessions WHERE " + session + ")",
          "(relay_session IN (SELECT id FROM relay_sessions WHERE " + session + ") OR " +
              entry("payload", "HostApplicationDisplayID") +
              " = ?1 OR (SELECT m.relay_session FROM relay_messages m WHERE m.id = message) IN"
              " (SELECT id FROM relay_sessions WHERE " +
              session + "))",
          entry("record", "ApplicationName") + " = ?1"};
}

void bindSelection(Statement& statement, const ErasureSelection& which) {
  if (which.before)
    statement.bind(*which.before);
  else if (which.user)
    statement.bind(int64_t{*which.user});
  else
    statement.bind(std::string_view(*which.application));
}

// A summary file: <date>-sonik-<application>-<service type>.json.
struct SummaryName {
  double date = 0;
  std::string application;  // as it stands in the name
  std::string serviceType;
};

std::optional<SummaryName> parseSummaryName(const std::string& name) {
  const std::size_t mark = name.find(kSummaryMark);
  if (mark == std::string::npos || !name.ends_with(kSummaryEnd)) return std::nullopt;
  const std::string rest = name.substr(
      mark + kSummaryMark.size(), name.size() - mark - kSummaryMark.size() - kSummaryEnd.size());
  const std::size_t type = rest.rfind('-');
  std::tm date{};
  const char* const end = strptime(name.c_str(), "%Y%m%d-%H%M%S%z", &date);
  if (type == std::string::npos || end != name.c_str() + mark) return std::nullopt;
  const long offset = date.tm_gmtoff;  // which timegm sets anew
  return SummaryName{static_cast<double>(timegm(&date) - offset), rest.substr(0, type),
                     rest.substr(type + 1)};
}

struct SummaryOfUser {
  double ended;
  std::string application;
  std::string serviceType;
};

std::vector<SummaryOfUser> summariesOfUser(sqlite3* database, uint32_t user) {
  std::vector<SummaryOfUser> all;
  Statement rows(database,
                 "SELECT ended_at, ifnull(" + entry("user_info", "HostApplicationDisplayID") +
                     ", 'unknown'), replace(service_name, '_session', '') FROM relay_sessions"
                     " WHERE uid = ? AND ended_at IS NOT NULL");
  rows.bind(int64_t{user});
  while (rows.row())
    all.push_back({rows.real(0), encodeFileNameComponent(rows.text(1)), rows.text(2)});
  return all;
}

int64_t removeSummaries(const std::string& folder, const Function<bool(const SummaryName&)>& goes) {
  struct Closer {
    void operator()(DIR* open) const { closedir(open); }
  };
  const std::unique_ptr<DIR, Closer> open(opendir(folder.c_str()));
  if (open == nullptr) return 0;
  std::vector<std::string> names;
  while (const dirent* file = readdir(open.get())) names.emplace_back(file->d_name);
  int64_t removed = 0;
  for (const std::string& name : names) {
    const std::optional<SummaryName> parsed = parseSummaryName(name);
    if (parsed && goes(*parsed) && unlink((folder + "/" + name).c_str()) == 0) ++removed;
  }
  return removed;
}

int64_t pragma(sqlite3* database, const char* sql) {
  Statement query(database, sql);
  return query.row() ? query.integer(0) : 0;
}

class Removal {
 public:
  Removal(sqlite3* database, const ErasureSelection& which, const Function<bool()>& betweenSteps)
      : database_(database), which_(which), betweenSteps_(betweenSteps) {}

  // False: the database has refused, or whoever is asked between the steps.
  bool remove(const std::string& table, const std::string& condition, int64_t& removed) {
    Statement range(database_, "SELECT max(id) FROM (SELECT id FROM " + table +
                                   " WHERE id > ? ORDER BY id LIMIT ?)");
    Statement step(database_,
                   "DELETE FROM " + table + " WHERE " + condition + " AND id > ?2 AND id <= ?3");
    for (int64_t done = INT64_MIN;;) {
      range.bind(done).bind(kRowsPerStep);
      if (!range.row()) return false;
      const bool isEnd = range.isNull(0);
      const int64_t last = range.integer(0);
      range.reset();
      if (isEnd) return true;
      bindSelection(step, which_);
      if (step.bind(done).bind(last).run() != SQLITE_OK) return false;
      removed += sqlite3_changes64(database_);
      done = last;
      if (betweenSteps_ && !betweenSteps_()) {
        stopped_ = true;
        return false;
      }
    }
  }
  Status whyNot() const {
    return Status::failure(stopped_ ? "somebody reads the store, whose log may not grow meanwhile;"
                                      " a part is removed: ask again later"
                                    : sqlite3_errmsg(database_));
  }

 private:
  sqlite3* const database_;
  const ErasureSelection& which_;
  const Function<bool()>& betweenSteps_;
  bool stopped_ = false;
};

}  // namespace

std::string ErasureSelection::text() const {
  if (application) return "of one application";  // its name is what was to go
  if (user) return "of user " + std::to_string(*user);
  return "before " + std::to_string(std::llround(before.value_or(0))) + " (seconds since 1970)";
}

Result<Erased> eraseFromStore(sqlite3* database, const ErasureSelection& which,
                              const std::string& summaries, double now,
                              const Function<bool()>& betweenSteps) {
  const std::vector<SummaryOfUser> ofUser =
      which.user ? summariesOfUser(database, *which.user) : std::vector<SummaryOfUser>();
  Erased erased;
  const Conditions go = conditionsOf(which);
  Removal removal(database, which, betweenSteps);
  const bool overwritesAnyway = pragma(database, "PRAGMA secure_delete") != 0;
  execute(database, "PRAGMA secure_delete = ON");
  // What refers to others goes first.
  const bool finished =
      removal.remove("analytics_entries", go.event, erased.events) &&
      removal.remove("relay_messages", go.message, erased.messages) &&
      removal.remove("power_records", go.power, erased.powerRecords) &&
      removal.remove("relay_sessions",
                     go.session +
                         " AND (ended_at IS NOT NULL OR batch_event IS NULL) AND id NOT IN"
                         " (SELECT relay_session FROM relay_messages)",
                     erased.sessions);
  const Status failure = finished ? Status() : removal.whyNot();
  if (which.application) {
    const std::string name = encodeFileNameComponent(*which.application);
    erased.files = removeSummaries(
        summaries, [&](const SummaryName& file) { return file.application == name; });
  } else if (which.before) {
    erased.files = removeSummaries(
        summaries, [&](const SummaryName& file) { return file.date < *which.before; });
  } else {
    erased.files = removeSummaries(summaries, [&](const SummaryName& file) {
      for (const SummaryOfUser& known : ofUser) {
        if (file.application == known.application && file.serviceType == known.serviceType &&
            std::abs(file.date - known.ended) <= kSummarySlackSeconds)
          return true;
      }
      return false;
    });
  }
  const int64_t rows = erased.messages + erased.events + erased.powerRecords + erased.sessions;
  const std::string detail =
      "asked for: " + which.text() + "; messages " + std::to_string(erased.messages) + ", events " +
      std::to_string(erased.events) + ", power records " + std::to_string(erased.powerRecords) +
      ", sessions " + std::to_string(erased.sessions) + ", summary files " +
      std::to_string(erased.files) + (finished ? "" : "; not finished");
  Statement note(database,
                 "INSERT INTO store_ledger(time, event, table_name, rows, detail)"
                 " VALUES(?, 'erased', NULL, ?, ?)");
  const bool noted = note.bind(now).bind(rows).bind(std::string_view(detail)).run() == SQLITE_OK;
  if (!overwritesAnyway) execute(database, "PRAGMA secure_delete = OFF");
  // The log has what was removed, until it is written back and emptied.
  const int code =
      sqlite3_wal_checkpoint_v2(database, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
  if (!finished) return failure;
  if (!noted) return Status::failure("it is removed, but the ledger could not be told");
  if (code != SQLITE_OK) {
    return Status::failure(
        "it is removed, but the log still has it, because somebody reads the store: ask again "
        "later");
  }
  return erased;
}

}  // namespace vx::lnx
